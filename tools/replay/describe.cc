// Frame descriptions for the verbose report. Every read is checked against
// the frame's length; a frame too short for a layer says so.
#include "replay/describe.h"

#include "contract/frame_walk.h"
#include "host/header_lookup.h"

#include <algorithm>
#include <array>
#include <cstdio>

namespace swsec::replay {

namespace {

constexpr uint16_t kEtherIpv4 = 0x0800;
constexpr uint16_t kEtherArp = 0x0806;
constexpr uint16_t kEtherIpv6 = 0x86dd;

uint16_t be16(std::span<const uint8_t> b, size_t at)
{
   return static_cast<uint16_t>(b[at] << 8 | b[at + 1]);
}

const char *dhcpTypeName(uint8_t type)
{
   static constexpr std::array<const char *, 9> kNames = {
      "DHCP", "DHCPDISCOVER", "DHCPOFFER", "DHCPREQUEST", "DHCPDECLINE",
      "DHCPACK", "DHCPNAK", "DHCPRELEASE", "DHCPINFORM"};
   return type < kNames.size() ? kNames[type] : "DHCP";
}

// The DHCP message type (option 53) of a BOOTP payload, 0 when it has none.
uint8_t dhcpMessageType(std::span<const uint8_t> bootp)
{
   constexpr size_t kOptions = 240;
   if (bootp.size() < kOptions || be16(bootp, 236) != 0x6382 || be16(bootp, 238) != 0x5363) {
      return 0;
   }
   size_t at = kOptions;
   while (at < bootp.size()) {
      const uint8_t code = bootp[at];
      if (code == 255) {
         break;
      }
      if (code == 0) {
         ++at;
         continue;
      }
      if (at + 1 >= bootp.size() || at + 2 + bootp[at + 1] > bootp.size()) {
         break;
      }
      if (code == 53 && bootp[at + 1] == 1) {
         return bootp[at + 2];
      }
      at += 2u + bootp[at + 1];
   }
   return 0;
}

std::string describeIpv4(std::span<const uint8_t> ip)
{
   if (ip.size() < 20 || (ip[0] >> 4) != 4) {
      return "IPv4 (truncated)";
   }
   const size_t headerLength = size_t{ip[0] & 0x0fu} * 4;
   const uint8_t protocol = ip[9];
   const std::string addresses = ipText(&ip[12]) + " > " + ipText(&ip[16]);
   const bool fragment = (be16(ip, 6) & 0x3fffu) != 0;
   if (fragment) {
      return "IPv4 fragment " + addresses + " proto " + std::to_string(protocol);
   }
   if (protocol == 1) {
      return "ICMP " + addresses;
   }
   if (protocol == 17 && headerLength >= 20 && ip.size() >= headerLength + 8) {
      const uint16_t src = be16(ip, headerLength);
      const uint16_t dst = be16(ip, headerLength + 2);
      if ((src == 67 || src == 68) && (dst == 67 || dst == 68)) {
         const auto bootp = ip.subspan(headerLength + 8);
         return std::string(dhcpTypeName(dhcpMessageType(bootp))) + " " + addresses;
      }
      return "UDP " + addresses + " " + std::to_string(src) + " > " + std::to_string(dst);
   }
   if (protocol == 6) {
      return "TCP " + addresses;
   }
   return "IPv4 " + addresses + " proto " + std::to_string(protocol);
}

const char *dhcpv6TypeName(uint8_t type)
{
   static constexpr std::array<const char *, 14> kNames = {
      "DHCPv6",  "DHCPv6 Solicit", "DHCPv6 Advertise",   "DHCPv6 Request",     "DHCPv6 Confirm",
      "DHCPv6 Renew", "DHCPv6 Rebind", "DHCPv6 Reply", "DHCPv6 Release", "DHCPv6 Decline",
      "DHCPv6 Reconfigure", "DHCPv6 Information-request", "DHCPv6 Relay-forward", "DHCPv6 Relay-reply"};
   return type < kNames.size() ? kNames[type] : "DHCPv6";
}

std::string icmpv6Text(std::span<const uint8_t> icmp)
{
   if (icmp.size() < 4) {
      return "ICMPv6 (truncated)";
   }
   const bool nd = icmp[0] == 135 || icmp[0] == 136;
   const std::string target = nd && icmp.size() >= 24 ? " for " + session::ipv6Text(&icmp[8]) : "";
   switch (icmp[0]) {
   case 133: return "ICMPv6 router solicitation";
   case 134: return "ICMPv6 router advertisement";
   case 135: return "ICMPv6 neighbour solicitation" + target;
   case 136: return "ICMPv6 neighbour advertisement" + target;
   case 137: return "ICMPv6 redirect";
   case 143: return "ICMPv6 MLDv2 report";
   default: return "ICMPv6 type " + std::to_string(icmp[0]);
   }
}

// The fixed header, then up to eight extension headers walked within the
// bytes given, as the port walks them; what follows them named.
std::string describeIpv6(std::span<const uint8_t> ip)
{
   if (ip.size() < 40 || (ip[0] >> 4) != 6) {
      return "IPv6 (truncated)";
   }
   const std::string addresses = session::ipv6Text(&ip[8]) + " > " + session::ipv6Text(&ip[24]);
   uint8_t next = ip[6];
   size_t at = 40;
   std::string chain;   // the extension headers, ", "-separated
   for (int headers = 0; headers < 8 && (next == 0 || next == 43 || next == 44 || next == 60); ++headers) {
      if (ip.size() < at + 8) {
         return "IPv6 " + addresses + " [" + chain + "] (truncated)";
      }
      if (next == 44) {
         const uint16_t offset = be16(ip, at + 2) >> 3;
         const bool more = (ip[at + 3] & 1) != 0;
         chain += (chain.empty() ? "" : ", ") +
                  (offset != 0 ? "fragment at " + std::to_string(offset * 8) : more ? "first fragment" : "atomic fragment");
         if (offset != 0) {
            return "IPv6 " + addresses + " [" + chain + "]";
         }
         next = ip[at];
         at += 8;
         continue;
      }
      chain += std::string(chain.empty() ? "" : ", ") + (next == 0 ? "hop-by-hop" : next == 43 ? "routing" : "destination options");
      next = ip[at];
      at += (size_t{ip[at + 1]} + 1) * 8;
   }
   const auto rest = ip.size() > at ? ip.subspan(at) : std::span<const uint8_t>{};
   std::string what;
   if (next == 58) {
      what = icmpv6Text(rest);
   } else if (next == 17 && rest.size() >= 8) {
      const uint16_t src = be16(rest, 0);
      const uint16_t dst = be16(rest, 2);
      what = (src == 546 || src == 547) && (dst == 546 || dst == 547) && rest.size() > 8
                ? dhcpv6TypeName(rest[8])
                : "UDP " + std::to_string(src) + " > " + std::to_string(dst);
   } else if (next == 6) {
      what = "TCP";
   } else {
      what = "next header " + std::to_string(next);
   }
   return "IPv6 " + addresses + (chain.empty() ? "" : " [" + chain + "]") + " " + what;
}

std::string describeArp(std::span<const uint8_t> arp)
{
   if (arp.size() < 28) {
      return "ARP (truncated)";
   }
   const uint16_t op = be16(arp, 6);
   const std::string senderIp = ipText(&arp[14]);
   const std::string targetIp = ipText(&arp[24]);
   if (op == 1) {
      return "ARP request who has " + targetIp + " tell " + senderIp + " (" + macText(&arp[8]) + ")";
   }
   if (op == 2) {
      return "ARP reply " + senderIp + " is at " + macText(&arp[8]);
   }
   return "ARP op " + std::to_string(op);
}

}  // namespace

uint16_t frameVlan(std::span<const uint8_t> bytes)
{
   return host::outerTagVlan(bytes).value_or(0);
}

FrameFacts frameFacts(std::span<const uint8_t> bytes)
{
   FrameFacts facts;
   if (bytes.size() < 14) {
      return facts;
   }
   static constexpr uint8_t kBpdu[6] = {0x01, 0x80, 0xc2, 0, 0, 0};
   static constexpr uint8_t kPvst[6] = {0x01, 0x00, 0x0c, 0xcc, 0xcc, 0xcd};
   facts.bpduDestination = std::equal(kBpdu, kBpdu + 6, bytes.begin()) || std::equal(kPvst, kPvst + 6, bytes.begin());
   size_t at = 12;
   uint16_t type = be16(bytes, at);
   if (SwSecIsTagTpid(type) && bytes.size() >= 18) {
      at = 16;
      type = be16(bytes, at);
   }
   const auto payload = bytes.subspan(at + 2);
   std::span<const uint8_t> udp;
   if (type == kEtherIpv4 && payload.size() >= 20 && (payload[0] >> 4) == 4 && payload[9] == 17 &&
       (be16(payload, 6) & 0x1fffu) == 0) {
      const size_t headerLength = size_t{payload[0] & 0x0fu} * 4;
      if (headerLength >= 20 && payload.size() >= headerLength + 8) {
         udp = payload.subspan(headerLength);
      }
   } else if (type == kEtherIpv6 && payload.size() >= 48 && payload[6] == 17) {
      udp = payload.subspan(40);
   }
   if (!udp.empty()) {
      facts.udpSourcePort = be16(udp, 0);
      const uint16_t destination = be16(udp, 2);
      if ((facts.udpSourcePort == 67 || facts.udpSourcePort == 68) && (destination == 67 || destination == 68)) {
         facts.dhcpMessageType = dhcpMessageType(udp.subspan(8));
      }
   }
   return facts;
}

std::string describeFrame(std::span<const uint8_t> bytes)
{
   if (bytes.size() < 14) {
      return "runt frame (" + std::to_string(bytes.size()) + " bytes)";
   }
   std::string prefix = macText(&bytes[6]) + " > " + macText(&bytes[0]) + " ";
   size_t at = 12;
   uint16_t type = be16(bytes, at);
   // Every tag, as far as the port's walk goes.
   for (uint32_t tags = 0; SwSecIsTagTpid(type) && tags < SWSEC_MAX_TAGS && bytes.size() >= at + 6; ++tags) {
      prefix += "vlan " + std::to_string(be16(bytes, at + 2) & 0x0fffu) + " ";
      at += 4;
      type = be16(bytes, at);
   }
   const auto payload = bytes.subspan(at + 2);
   if (bytes[0] == 0x01 && bytes[1] == 0x80 && bytes[2] == 0xc2 && bytes[3] == 0 && bytes[4] == 0 &&
       bytes[5] == 0) {
      return prefix + "BPDU";
   }
   switch (type) {
   case kEtherIpv4: return prefix + describeIpv4(payload);
   case kEtherArp: return prefix + describeArp(payload);
   case kEtherIpv6: return prefix + describeIpv6(payload);
   default: break;
   }
   std::array<char, 24> text{};
   std::snprintf(text.data(), text.size(), "ethertype 0x%04x", type);
   return prefix + text.data();
}

}  // namespace swsec::replay
