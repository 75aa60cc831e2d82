// IPv6 frames for the first-hop security tests: extension headers,
// ICMPv6 and neighbour discovery, DHCPv6 messages, and the agent's
// configuration as the tests write it (every feature, untrusted).
#pragma once

#include "contract/fhs_config_encode.h"
#include "support/frames.h"

#include <arpa/inet.h>

#include <cstring>
#include <string>

namespace swsec::testing {

using Addr6 = std::array<uint8_t, 16>;

inline Addr6 a6(const std::string &text)
{
   Addr6 addr{};
   inet_pton(AF_INET6, text.c_str(), addr.data());
   return addr;
}


// An extension header of (units + 1) * 8 bytes (AH: (units + 2) * 4) before `next`.
inline Bytes ext(uint8_t next, uint8_t units = 0, bool ah = false)
{
   Bytes out{next, units};
   out.resize(ah ? (units + 2u) * 4u : (units + 1u) * 8u, 0);
   return out;
}
inline Bytes frag(uint8_t next, uint16_t offsetUnits, bool more)
{
   Bytes out{next, 0};
   put16be(out, offsetUnits << 3 | (more ? 1 : 0));
   put32be(out, 0x1234);
   return out;
}
inline Bytes icmp6(uint8_t type, const Bytes &body = Bytes(4, 0)) { return cat({type, 0, 0, 0}, body); }
// A neighbour solicitation (135) or advertisement (136) with an optional link-layer address option.
inline Bytes nd(uint8_t type, const Addr6 &target, std::optional<Mac> lla = {})
{
   Bytes body(4, 0);
   body.insert(body.end(), target.begin(), target.end());
   if (lla) {
      body.insert(body.end(), {uint8_t(type == 135 ? 1 : 2), 1});
      body.insert(body.end(), lla->bytes.begin(), lla->bytes.end());
   }
   return icmp6(type, body);
}
// An IPv6 frame whose first header after the fixed one is `next`.
inline Bytes frame6(const Mac &src, const Addr6 &s, const Addr6 &d, uint8_t next, const Bytes &payload)
{
   return ethernet({.dst = Mac{{0x33, 0x33, 0, 0, 0, 1}}, .src = src, .etherType = kEtherIpv6},
                   ipv6({.src = s, .dst = d, .nextHeader = next}, payload));
}
// A DHCPv6 message: client ID, then one IA_NA holding the addresses with their valid lifetimes.
inline Bytes dhcp6(uint8_t type, uint32_t xid, const Bytes &duid, const std::vector<std::pair<Addr6, uint32_t>> &addrs = {})
{
   Bytes out{type, uint8_t(xid >> 16), uint8_t(xid >> 8), uint8_t(xid)};
   put16be(out, 1), put16be(out, uint32_t(duid.size()));
   out = cat(out, duid);
   if (!addrs.empty()) {
      put16be(out, 3), put16be(out, uint32_t(12 + 28 * addrs.size()));
      out.resize(out.size() + 12, 0);
      for (const auto &[addr, valid] : addrs) {
         put16be(out, 5), put16be(out, 24);
         out.insert(out.end(), addr.begin(), addr.end());
         put32be(out, valid), put32be(out, valid);
      }
   }
   return out;
}
inline Bytes udp6(uint16_t sport, uint16_t dport, const Bytes &payload) { return udp({.srcPort = sport, .dstPort = dport}, payload); }

struct FhsPortConfig {
   uint32_t features = FhsFeaturesKnown;
   uint8_t trusted = 0;
   uint32_t bindingLimit = 0;
   uint32_t ndRateLimit = 0, errRateLimit = 0, errRateLimitPeriod = 0;
   std::vector<FhsBindingKey> statics;
};
inline Bytes fhsConfigBytes(const FhsPortConfig &c)
{
   return contract::fhsConfigRecord({.features = c.features, .trusted = c.trusted != 0, .bindingLimit = c.bindingLimit,
                                     .ndRateLimit = c.ndRateLimit, .errRateLimit = c.errRateLimit,
                                     .errRateLimitPeriod = c.errRateLimitPeriod, .statics = c.statics});
}

}  // namespace swsec::testing
