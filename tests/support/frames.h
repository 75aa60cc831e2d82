// Builds frames for tests from what they are, not from their bytes:
// Ethernet (optionally 802.1Q-tagged), ARP, IPv4, IPv6, UDP and DHCP with
// its options. Every builder returns the whole frame's bytes.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string_view>
#include <utility>
#include <vector>

namespace swsec::testing {

using Bytes = std::vector<uint8_t>;

// Big-endian writers and concatenation, for the builders here and in ipv6_frames.h.
inline void put16be(Bytes &out, uint32_t v) { out.insert(out.end(), {uint8_t(v >> 8), uint8_t(v)}); }
inline void put32be(Bytes &out, uint32_t v) { put16be(out, v >> 16), put16be(out, v); }
inline Bytes cat(Bytes a, const Bytes &b) { return a.insert(a.end(), b.begin(), b.end()), a; }

struct Mac {
   std::array<uint8_t, 6> bytes{};
   static Mac parse(std::string_view text);  // "02:00:00:00:00:01"
   bool operator==(const Mac &) const = default;
};

// An IPv4 address kept in network byte order, as frames carry it.
struct Ip4 {
   std::array<uint8_t, 4> bytes{};
   static Ip4 parse(std::string_view text);  // "10.0.0.1"
   // The address as a u32 loaded from its bytes (network order in memory).
   uint32_t raw() const;
   bool operator==(const Ip4 &) const = default;
};

inline const Mac kBroadcastMac = Mac{{0xff, 0xff, 0xff, 0xff, 0xff, 0xff}};
inline const Mac kStpMac = Mac{{0x01, 0x80, 0xc2, 0x00, 0x00, 0x00}};
inline const Mac kPvstMac = Mac{{0x01, 0x00, 0x0c, 0xcc, 0xcc, 0xcd}};

enum EtherType : uint16_t {
   kEtherIpv4 = 0x0800,
   kEtherArp = 0x0806,
   kEtherVlan = 0x8100,
   kEtherIpv6 = 0x86dd,
};

struct EthernetHeader {
   Mac dst;
   Mac src;
   uint16_t etherType = kEtherIpv4;
   std::optional<uint16_t> vlanTag;  // an 802.1Q tag in the bytes (VLAN ID)
};
Bytes ethernet(const EthernetHeader &header, const Bytes &payload);

struct Arp {
   uint16_t op = 1;                  // 1 request, 2 reply
   Mac senderMac;
   Ip4 senderIp;
   Mac targetMac;
   Ip4 targetIp;
   uint16_t protocolType = kEtherIpv4;
};

struct Ipv4Header {
   Ip4 src;
   Ip4 dst;
   uint8_t protocol = 17;
   uint16_t fragmentOffset = 0;      // in 8-byte units
   uint16_t id = 1;
};
Bytes ipv4(const Ipv4Header &header, const Bytes &payload);

struct Ipv6Header {
   std::array<uint8_t, 16> src{};
   std::array<uint8_t, 16> dst{};
   uint8_t nextHeader = 17;
};
Bytes ipv6(const Ipv6Header &header, const Bytes &payload);

struct UdpHeader {
   uint16_t srcPort = 0;
   uint16_t dstPort = 0;
};
Bytes udp(const UdpHeader &header, const Bytes &payload);

enum DhcpType : uint8_t {
   kDhcpDiscover = 1,
   kDhcpRequest = 3,
   kDhcpDecline = 4,
   kDhcpAck = 5,
   kDhcpNak = 6,
   kDhcpRelease = 7,
};

struct DhcpOption {
   uint8_t code = 0;
   Bytes value;
};

// A DHCP message. Options are written in order; `type`, `clientId` and
// `leaseTime`, when set, are written first as options 53, 61 and 51.
struct Dhcp {
   uint8_t op = 1;                   // 1 request, 2 reply
   uint8_t htype = 1;
   uint8_t hlen = 6;
   uint32_t xid = 0;                 // written in network order
   Ip4 ciaddr;
   Ip4 yiaddr;
   Ip4 siaddr;
   Mac chaddr;
   std::optional<uint8_t> type;
   std::optional<Bytes> clientId;
   std::optional<uint32_t> leaseTime;
   std::vector<DhcpOption> options;
   bool end = true;                  // write option 255
   std::array<uint8_t, 4> cookie{99, 130, 83, 99};
};

// Whole frames for the common cases.

// A DHCP frame over UDP/IPv4: from a client (port 68 to 67) or a server (67 to 68).
struct DhcpFrame {
   Mac src;
   Mac dst = kBroadcastMac;
   Ip4 ipSrc;                        // 0.0.0.0 by default
   Ip4 ipDst = Ip4{{255, 255, 255, 255}};
   bool fromServer = false;
   Dhcp dhcp;
   std::optional<uint16_t> vlanTag;
};
Bytes dhcpFrame(const DhcpFrame &frame);

Bytes arpFrame(const Mac &src, const Mac &dst, const Arp &arp,
               std::optional<uint16_t> vlanTag = std::nullopt);
// The frame with `count` tags of `tpid` pushed outside any it has.
Bytes pushTag(Bytes frame, uint16_t tpid, uint16_t vlanId = 0, int count = 1);

struct UdpFrame {
   Mac src;
   Mac dst;
   Ip4 ipSrc;
   Ip4 ipDst;
   uint16_t srcPort = 1024;
   uint16_t dstPort = 80;
   Bytes payload = Bytes(18, 0);
   std::optional<uint16_t> vlanTag;
};
Bytes udpFrame(const UdpFrame &frame);

struct Udp6Frame {
   Mac src;
   Mac dst;
   uint16_t srcPort = 546;
   uint16_t dstPort = 547;
   Bytes payload = Bytes(8, 0);
};
Bytes udp6Frame(const Udp6Frame &frame);

// An IEEE 802.3 frame with an LLC header and a configuration BPDU.
Bytes bpduFrame(const Mac &src, const Mac &dst = kStpMac);

}  // namespace swsec::testing
