#include "frames.h"

#include <charconv>
#include <cstring>
#include <stdexcept>
#include <string>

namespace swsec::testing {

namespace {

void put16(Bytes &out, uint16_t v)
{
   out.push_back(static_cast<uint8_t>(v >> 8));
   out.push_back(static_cast<uint8_t>(v));
}

void put32(Bytes &out, uint32_t v)
{
   put16(out, static_cast<uint16_t>(v >> 16));
   put16(out, static_cast<uint16_t>(v));
}

template <size_t N>
void putArray(Bytes &out, const std::array<uint8_t, N> &bytes)
{
   out.insert(out.end(), bytes.begin(), bytes.end());
}

void append(Bytes &out, const Bytes &tail)
{
   out.insert(out.end(), tail.begin(), tail.end());
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

template <size_t N>
std::array<uint8_t, N> parseParts(std::string_view text, char separator, int base,
                                   std::string_view what)
{
   std::array<uint8_t, N> out{};
   size_t pos = 0;
   for (size_t i = 0; i < N; ++i) {
      size_t end = text.find(separator, pos);
      if ((i + 1 < N) == (end == std::string_view::npos)) {
         throw std::invalid_argument("bad " + std::string(what) + ": " + std::string(text));
      }
      std::string_view part = text.substr(pos, end == std::string_view::npos ? text.npos : end - pos);
      unsigned value = 0;
      auto [p, ec] = std::from_chars(part.data(), part.data() + part.size(), value, base);
      if (ec != std::errc{} || p != part.data() + part.size() || part.empty() || value > 255) {
         throw std::invalid_argument("bad " + std::string(what) + ": " + std::string(text));
      }
      out[i] = static_cast<uint8_t>(value);
      pos = end + 1;
   }
   return out;
}

}  // namespace

Mac Mac::parse(std::string_view text)
{
   return Mac{parseParts<6>(text, ':', 16, "MAC")};
}

Ip4 Ip4::parse(std::string_view text)
{
   return Ip4{parseParts<4>(text, '.', 10, "IPv4 address")};
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
   putArray(out, header.dst.bytes);
   putArray(out, header.src.bytes);
   if (header.vlanTag) {
      put16(out, kEtherVlan);
      put16(out, static_cast<uint16_t>(*header.vlanTag & 0x0fff));
   }
   put16(out, header.etherType);
   append(out, payload);
   return out;
}

static Bytes arpPayload(const Arp &arp)
{
   Bytes out;
   put16(out, arp.hardwareType);
   put16(out, arp.protocolType);
   out.push_back(arp.hardwareLength);
   out.push_back(arp.protocolLength);
   put16(out, arp.op);
   putArray(out, arp.senderMac.bytes);
   putArray(out, arp.senderIp.bytes);
   putArray(out, arp.targetMac.bytes);
   putArray(out, arp.targetIp.bytes);
   return out;
}

Bytes ipv4(const Ipv4Header &header, const Bytes &payload)
{
   Bytes out;
   out.push_back(0x45);
   out.push_back(0);
   put16(out, static_cast<uint16_t>(20 + payload.size()));
   put16(out, header.id);
   put16(out, static_cast<uint16_t>(header.fragmentOffset & 0x1fff));
   out.push_back(64);   // TTL
   out.push_back(header.protocol);
   put16(out, 0);
   putArray(out, header.src.bytes);
   putArray(out, header.dst.bytes);
   uint16_t sum = checksum(out.data(), 20);
   out[10] = static_cast<uint8_t>(sum >> 8);
   out[11] = static_cast<uint8_t>(sum);
   append(out, payload);
   return out;
}

Bytes ipv6(const Ipv6Header &header, const Bytes &payload)
{
   Bytes out;
   put32(out, 0x60000000u);
   put16(out, static_cast<uint16_t>(payload.size()));
   out.push_back(header.nextHeader);
   out.push_back(header.hopLimit);
   putArray(out, header.src);
   putArray(out, header.dst);
   append(out, payload);
   return out;
}

Bytes udp(const UdpHeader &header, const Bytes &payload)
{
   Bytes out;
   put16(out, header.srcPort);
   put16(out, header.dstPort);
   put16(out, static_cast<uint16_t>(8 + payload.size()));
   put16(out, 0);  // no checksum, as IPv4 allows
   append(out, payload);
   return out;
}

static Bytes dhcpPayload(const Dhcp &dhcp)
{
   Bytes out;
   out.push_back(dhcp.op);
   out.push_back(dhcp.htype);
   out.push_back(dhcp.hlen);
   out.push_back(0);
   put32(out, dhcp.xid);
   put16(out, 0);
   put16(out, 0);
   putArray(out, dhcp.ciaddr.bytes);
   putArray(out, dhcp.yiaddr.bytes);
   putArray(out, dhcp.siaddr.bytes);
   putArray(out, dhcp.giaddr.bytes);
   putArray(out, dhcp.chaddr.bytes);
   out.resize(out.size() + 10 + 64 + 128, 0);  // rest of chaddr, sname, file
   putArray(out, dhcp.cookie);
   auto option = [&out](uint8_t code, const Bytes &value) {
      out.push_back(code);
      out.push_back(static_cast<uint8_t>(value.size()));
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
      put32(lease, *dhcp.leaseTime);
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
   Bytes payload = dhcpPayload(frame.dhcp);
   UdpHeader udpHeader{.srcPort = static_cast<uint16_t>(frame.fromServer ? 67 : 68),
                       .dstPort = static_cast<uint16_t>(frame.fromServer ? 68 : 67)};
   Bytes l3 = ipv4({.src = frame.ipSrc, .dst = frame.ipDst, .protocol = 17}, udp(udpHeader, payload));
   return ethernet({.dst = frame.dst, .src = frame.src, .etherType = kEtherIpv4,
                    .vlanTag = frame.vlanTag},
                   l3);
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
   return ethernet({.dst = dst, .src = src, .etherType = kEtherArp, .vlanTag = vlanTag},
                   arpPayload(arp));
}

Bytes udpFrame(const UdpFrame &frame)
{
   Bytes l4 = udp({.srcPort = frame.srcPort, .dstPort = frame.dstPort}, frame.payload);
   return ethernet({.dst = frame.dst, .src = frame.src, .etherType = kEtherIpv4,
                    .vlanTag = frame.vlanTag},
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
   Bytes out;
   putArray(out, dst.bytes);
   putArray(out, src.bytes);
   put16(out, 38);   // an 802.3 length, not an ethertype: LLC, then a configuration BPDU of zeros
   append(out, {0x42, 0x42, 0x03});
   out.resize(out.size() + 35, 0);
   return out;
}

}  // namespace swsec::testing
