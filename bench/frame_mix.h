// The benchmark's traffic: frames a VM sends, drawn from a fixed seed so
// that every run and every contender sees the same bytes.
#pragma once

#include "support/frames.h"

#include <cstdint>
#include <vector>

namespace swsec::bench {

struct Binding {
   testing::Mac mac;
   testing::Ip4 ip;
};

// `count` distinct (MAC, IPv4) pairs of the VM's port, VLAN 0.
std::vector<Binding> bindingsFor(uint32_t count);

enum class FrameKind : uint8_t {
   Ipv4Bound,     // UDP/IPv4 from a bound source: the common path
   Ipv4Spoofed,   // UDP/IPv4 from an address the port does not hold
   Arp,           // an ARP request from a bound source
   Dhcp,          // a DHCPDISCOVER
   Bpdu,          // a configuration BPDU
   Ipv6,          // UDP/IPv6
};

struct MixFrame {
   FrameKind kind;
   testing::Bytes bytes;
};

// Shares of the mix, in per cent; IPv4 from bound sources takes the rest.
struct MixShares {
   uint32_t spoofed = 10;
   uint32_t arp = 6;
   uint32_t dhcp = 2;
   uint32_t bpdu = 2;
   uint32_t ipv6 = 2;
};

std::vector<MixFrame> makeMix(uint32_t seed, uint32_t count, const std::vector<Binding> &bindings,
                              const MixShares &shares = {});

// Only the frames of one kind.
std::vector<MixFrame> onlyKind(const std::vector<MixFrame> &mix, FrameKind kind);

}  // namespace swsec::bench
