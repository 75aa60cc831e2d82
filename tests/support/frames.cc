#include "frames.h"

#include <arpa/inet.h>

#include <cstdio>
#include <cstring>
#include <stdexcept>
#include <string>

namespace swsec::testing {

namespace {

// Appends bytes: an address's array or a payload.
template <typename Range>
void append(Bytes &out, const Range &bytes)
{
   out.insert(out.end(), bytes.begin(), bytes.end());
}

uint16_t checksum(const uint8_t *data, size_t length)
{
   uint32_t sum = 0;   // over an even length (the IPv4 header)
   for (size_t i = 0; i + 1 < length; i += 2) {
      sum += static_cast<uint32_t>(data[i] << 8 | data[i + 1]);
   }
   while (sum >> 16) {
      sum = (sum & 0xffff) + (sum >> 16);
   }
   return static_cast<uint16_t>(~sum);
}

}  // namespace

Mac Mac::parse(std::string_view text)
{
   Mac mac;
   auto &b = mac.bytes;
   int end = 0;
   if (std::sscanf(std::string(text).c_str(), "%2hhx:%2hhx:%2hhx:%2hhx:%2hhx:%2hhx%n", &b[0], &b[1], &b[2], &b[3], &b[4],
                   &b[5], &end) != 6 || size_t(end) != text.size()) {
      throw std::invalid_argument("bad MAC: " + std::string(text));
   }
   return mac;
}

Ip4 Ip4::parse(std::string_view text)
{
   Ip4 ip;
   if (inet_pton(AF_INET, std::string(text).c_str(), ip.bytes.data()) != 1) {
      throw std::invalid_argument("bad IPv4 address: " + std::string(text));
   }
   return ip;
}

uint32_t Ip4::raw() const
{
   uint32_t v;
   std::memcpy(&v, bytes.data(), 4);
   return v;
}

Bytes ethernet(const EthernetHeader &header, const Bytes &payload)
{
   Bytes out;
   append(out, header.dst.bytes);
   append(out, header.src.bytes);
   if (header.vlanTag) {
      put16be(out, kEtherVlan);
      put16be(out, static_cast<uint16_t>(*header.vlanTag & 0x0fff));
   }
   put16be(out, header.etherType);
   append(out, payload);
   return out;
}

static Bytes arpPayload(const Arp &arp)
{
   Bytes out;
   put16be(out, 1);   // Ethernet
   put16be(out, arp.protocolType);
   out.insert(out.end(), {6, 4});
   put16be(out, arp.op);
   append(out, arp.senderMac.bytes);
   append(out, arp.senderIp.bytes);
   append(out, arp.targetMac.bytes);
   append(out, arp.targetIp.bytes);
   return out;
}

Bytes ipv4(const Ipv4Header &header, const Bytes &payload)
{
   Bytes out;
   out.insert(out.end(), {0x45, 0});
   put16be(out, static_cast<uint16_t>(20 + payload.size()));
   put16be(out, header.id);
   put16be(out, static_cast<uint16_t>(header.fragmentOffset & 0x1fff));
   out.insert(out.end(), {64, header.protocol, 0, 0});   // TTL, protocol, checksum
   append(out, header.src.bytes);
   append(out, header.dst.bytes);
   uint16_t sum = checksum(out.data(), 20);
   out[10] = static_cast<uint8_t>(sum >> 8);
   out[11] = static_cast<uint8_t>(sum);
   append(out, payload);
   return out;
}

Bytes ipv6(const Ipv6Header &header, const Bytes &payload)
{
   Bytes out;
   put32be(out, 0x60000000u);
   put16be(out, static_cast<uint16_t>(payload.size()));
   out.insert(out.end(), {header.nextHeader, 64});
   append(out, header.src);
   append(out, header.dst);
   append(out, payload);
   return out;
}

Bytes udp(const UdpHeader &header, const Bytes &payload)
{
   Bytes out;
   put16be(out, header.srcPort);
   put16be(out, header.dstPort);
   put16be(out, static_cast<uint16_t>(8 + payload.size()));
   put16be(out, 0);  // no checksum, as IPv4 allows
   append(out, payload);
   return out;
}

static Bytes dhcpPayload(const Dhcp &dhcp)
{
   Bytes out;
   out.insert(out.end(), {dhcp.op, dhcp.htype, dhcp.hlen, 0});
   put32be(out, dhcp.xid);
   put32be(out, 0);   // secs, flags
   append(out, dhcp.ciaddr.bytes);
   append(out, dhcp.yiaddr.bytes);
   append(out, dhcp.siaddr.bytes);
   out.resize(out.size() + 4, 0);              // giaddr
   append(out, dhcp.chaddr.bytes);
   out.resize(out.size() + 10 + 64 + 128, 0);  // rest of chaddr, sname, file
   append(out, dhcp.cookie);
   auto option = [&out](uint8_t code, const Bytes &value) {
      out.insert(out.end(), {code, static_cast<uint8_t>(value.size())});
      append(out, value);
   };
   if (dhcp.type) {
      option(53, Bytes{*dhcp.type});
   }
   if (dhcp.clientId) {
      option(61, *dhcp.clientId);
   }
   if (dhcp.leaseTime) {
      Bytes lease;
      put32be(lease, *dhcp.leaseTime);
      option(51, lease);
   }
   for (const auto &o : dhcp.options) {
      if (o.code == 0 || o.code == 255) {
         out.push_back(o.code);
      } else {
         option(o.code, o.value);
      }
   }
   if (dhcp.end) {
      out.push_back(255);
   }
   return out;
}

Bytes dhcpFrame(const DhcpFrame &frame)
{
   const uint16_t client = 68, server = 67;
   return udpFrame({.src = frame.src, .dst = frame.dst, .ipSrc = frame.ipSrc, .ipDst = frame.ipDst,
                    .srcPort = frame.fromServer ? server : client, .dstPort = frame.fromServer ? client : server,
                    .payload = dhcpPayload(frame.dhcp), .vlanTag = frame.vlanTag});
}

Bytes pushTag(Bytes frame, uint16_t tpid, uint16_t vlanId, int count)
{
   const uint8_t tag[] = {uint8_t(tpid >> 8), uint8_t(tpid), uint8_t(vlanId >> 8), uint8_t(vlanId)};
   for (int i = 0; i < count; i++) {
      frame.insert(frame.begin() + 12, std::begin(tag), std::end(tag));
   }
   return frame;
}

Bytes arpFrame(const Mac &src, const Mac &dst, const Arp &arp, std::optional<uint16_t> vlanTag)
{
   return ethernet({.dst = dst, .src = src, .etherType = kEtherArp, .vlanTag = vlanTag}, arpPayload(arp));
}

Bytes udpFrame(const UdpFrame &frame)
{
   Bytes l4 = udp({.srcPort = frame.srcPort, .dstPort = frame.dstPort}, frame.payload);
   return ethernet({.dst = frame.dst, .src = frame.src, .etherType = kEtherIpv4, .vlanTag = frame.vlanTag},
                   ipv4({.src = frame.ipSrc, .dst = frame.ipDst, .protocol = 17}, l4));
}

Bytes udp6Frame(const Udp6Frame &frame)
{
   Ipv6Header header;
   header.src[0] = 0xfe;
   header.src[1] = 0x80;
   header.dst = {0xff, 0x02, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1, 0, 2};
   Bytes l4 = udp({.srcPort = frame.srcPort, .dstPort = frame.dstPort}, frame.payload);
   return ethernet({.dst = frame.dst, .src = frame.src, .etherType = kEtherIpv6}, ipv6(header, l4));
}

Bytes bpduFrame(const Mac &src, const Mac &dst)
{
   // An 802.3 length, not an ethertype: LLC, then a configuration BPDU of zeros.
   Bytes llc{0x42, 0x42, 0x03};
   llc.resize(38, 0);
   return ethernet({.dst = dst, .src = src, .etherType = 38}, llc);
}

}  // namespace swsec::testing
