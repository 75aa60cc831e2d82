// The kernel fast path against the module alone: generated frames (outer and
// inner tags, IPv4 fragments and options, DHCP and DHCPv6 ports, ARP, BPDU
// destinations, any ethertype, IPv6 extension headers, fragments, ND, RA and
// MLD, truncations) through both, with the clock moved between them; the
// first frame whose verdict or drop counters differ aborts.
// Needs root and BPF (scripts/fuzz.sh runs it only as root).
//
// Input: [config] [config6 when config bit 7] then frames, each [clock] [shape] [choices] [cut] ...
//   config  bits 0-4 features, bit 5 trusted, bit 6 ARP rate limit (3/s, 1/s, 10 s),
//           bit 7 the IPv6 agent too
//   config6 bits 0-6 the IPv6 agent's features (ND rate limit 3/s, 1/s, 10 s)
//   shape   bit 0 to the VM, bits 1-2 outer tag, bits 3-4 inner tag (none,
//           802.1Q, 802.1ad, 0x9100), bits 5-7 kind: IPv4 UDP, TCP, ICMP,
//           ARP, IPv6, any ethertype (2 bytes)
//   choices bits 0-1 source, 2-3 destination MAC, 4-5 addresses, 6-7 ports,
//           with a raw byte for the IPv4 flags and fragment offset, and IHL;
//           for IPv6 a byte: bits 0-2 next header, 3 upper layer behind an
//           extension header, 4 a later fragment, 5-7 ICMPv6 type; and a
//           byte whose bit 0 makes the payload length overrun the frame
#include "fuzz_input.h"
#include "session/config_file.h"
#include "twin.h"
#include "tests/support/frames.h"

#include <cstdio>
#include <cstdlib>

namespace {

using swsec::fuzz::FuzzInput;
using swsec::testing::Bytes;
using swsec::testing::put16be;

constexpr std::array<uint8_t, 6> kMacs[4] = {{0x02, 0x00, 0x5e, 0xc0, 0x00, 0x01}, {0x02, 0x00, 0x5e, 0xc0, 0x00, 0x99},
                                             {0xff, 0xff, 0xff, 0xff, 0xff, 0xff}, {0x01, 0x80, 0xc2, 0x00, 0x00, 0x00}};
constexpr std::array<uint8_t, 4> kIps[4] = {{192, 0, 2, 101}, {192, 0, 2, 66}, {0, 0, 0, 0}, {192, 0, 2, 60}};
constexpr uint16_t kPorts[4] = {67, 68, 547, 1024};
constexpr uint16_t kTpids[4] = {0, 0x8100, 0x88a8, 0x9100};
// Bound (static), unbound, unspecified, link-local.
constexpr std::array<uint8_t, 16> kIp6s[4] = {{0x20, 0x01, 0x0d, 0xb8, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0x65},
                                              {0x20, 0x01, 0x0d, 0xb8, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0x66},
                                              {},
                                              {0xfe, 0x80, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1}};
// UDP, TCP, ICMPv6, hop-by-hop, fragment, destination options, no next header, routing.
constexpr uint8_t kNextHeaders[8] = {17, 6, 58, 0, 44, 60, 59, 43};
// Echo request, router solicitation and advertisement, neighbour solicitation and advertisement, MLDv2 report, an error, redirect.
constexpr uint8_t kIcmp6Types[8] = {128, 133, 134, 135, 136, 143, 1, 137};
constexpr uint16_t kPorts6[4] = {546, 547, 53, 1024};

// Two static bindings of the VM, on VLAN 0 and 100, of each family.
swsec::session::PortSecurityConfig config(FuzzInput &in)
{
   const uint8_t bits = in.byte();
   swsec::session::PortSecurityConfig out;
   static_cast<swsec::contract::PortSecurityConfig &>(out) = {
      .features = bits & 0x1fu, .trusted = (bits & 0x20u) != 0, .arpRateLimit = (bits & 0x40u) != 0 ? 3u : 0u,
      .errRateLimit = 1, .errRateLimitPeriod = 10, .statics = {{0, kMacs[0], kIps[0]}, {100, kMacs[0], kIps[0]}}};
   if ((bits & 0x80u) != 0) {
      const uint8_t features = in.byte() & 0x7fu;
      out.ipv6 = swsec::contract::Ipv6SecurityConfig{.features = features, .trusted = out.trusted, .ndRateLimit = 3,
                                                     .errRateLimit = 1, .errRateLimitPeriod = 10};
      for (const uint16_t vlan : {uint16_t{0}, uint16_t{100}}) {
         FhsBindingKey key{.vlanId = vlan, .mac = {}, .addr = {}};
         std::copy(kMacs[0].begin(), kMacs[0].end(), key.mac);
         std::copy(kIp6s[0].begin(), kIp6s[0].end(), key.addr);
         out.ipv6->statics.push_back(key);
      }
   }
   return out;
}

// An IPv6 packet from `src`: at most one extension header, then the upper layer.
void ipv6(FuzzInput &in, Bytes &out, uint8_t choices, const std::array<uint8_t, 16> &src)
{
   const uint8_t shape = in.byte();
   const bool overrun = (in.byte() & 1u) != 0;
   const uint8_t first = kNextHeaders[shape & 7u];
   const bool extension = first == 0 || first == 44 || first == 60 || first == 43;
   const uint8_t upper = extension ? ((shape & 8u) != 0 ? 58 : 17) : first;
   Bytes payload;
   if (extension) {
      // A fragment header: offset 0 (more to come) or a later fragment.
      const uint8_t fragment = (shape & 0x10u) != 0 ? 0x08 : 0x01;
      payload.insert(payload.end(), {upper, 0, first == 44 ? uint8_t{0} : uint8_t{1}, first == 44 ? fragment : uint8_t{4}, 0, 0, 0, 1});
   }
   if (upper == 58) {
      const uint8_t type = kIcmp6Types[shape >> 5];
      payload.insert(payload.end(), {type, 0, 0, 0, 0, 0, 0, 0});
      if (type == 135 || type == 136) {
         payload.insert(payload.end(), kIp6s[choices >> 6].begin(), kIp6s[choices >> 6].end());
         payload.insert(payload.end(), {static_cast<uint8_t>(type == 135 ? 1 : 2), 1});
         payload.insert(payload.end(), kMacs[choices & 3u].begin(), kMacs[choices & 3u].end());
      }
   } else if (upper == 17 || upper == 6) {
      put16be(payload, kPorts6[(choices >> 6) & 3u]);
      put16be(payload, kPorts6[(choices >> 2) & 3u]);
      payload.resize(payload.size() + (upper == 17 ? 4 : 16), 0);
      if (upper == 17) {
         payload.push_back(static_cast<uint8_t>(1 + (choices & 0x0fu)));   // a DHCPv6 message type
      }
   }
   put16be(out, 0x86dd);
   out.insert(out.end(), {0x60, 0, 0, 0});
   put16be(out, static_cast<uint16_t>(payload.size() + (overrun ? 64 : 0)));
   out.insert(out.end(), {first, 255});
   out.insert(out.end(), src.begin(), src.end());
   const std::array<uint8_t, 16> to = {0xff, 0x02, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1};
   out.insert(out.end(), to.begin(), to.end());
   out.insert(out.end(), payload.begin(), payload.end());
}

Bytes frame(FuzzInput &in, uint32_t &direction)
{
   const uint8_t shape = in.byte();
   const uint8_t choices = in.byte();
   const uint8_t cut = in.byte();
   direction = (shape & 1u) != 0 ? SWSEC_FP_DIR_TO_VM : SWSEC_FP_DIR_FROM_VM;
   const auto &src = kMacs[choices & 3u];
   const auto &ip = kIps[(choices >> 4) & 3u];
   Bytes out(kMacs[(choices >> 2) & 3u].begin(), kMacs[(choices >> 2) & 3u].end());
   out.insert(out.end(), src.begin(), src.end());
   for (const uint16_t tpid : {kTpids[(shape >> 1) & 3u], kTpids[(shape >> 3) & 3u]}) {
      if (tpid != 0) {
         put16be(out, tpid);
         put16be(out, (choices & 0x40u) != 0 ? 100 : 0);
      }
   }
   switch (const unsigned kind = shape >> 5) {
   case 0: case 1: case 2: {
      const uint8_t flags = in.byte();
      const uint8_t words = 5 + (in.byte() & 1u);
      put16be(out, 0x0800);
      out.insert(out.end(), {static_cast<uint8_t>(0x40 | words), 0, 0, 60, 0, 1, flags, in.byte(), 64,
                static_cast<uint8_t>(kind == 0 ? 17 : kind == 1 ? 6 : 1), 0, 0});
      out.insert(out.end(), ip.begin(), ip.end());
      out.insert(out.end(), kIps[2].begin(), kIps[2].end());
      out.resize(out.size() + (words - 5u) * 4u, 1);
      break;
   }
   case 3:
      put16be(out, 0x0806);
      out.insert(out.end(), {0, 1, 8, 0, 6, 4, 0, static_cast<uint8_t>(1 + (choices >> 7))});
      out.insert(out.end(), src.begin(), src.end());
      out.insert(out.end(), ip.begin(), ip.end());
      out.resize(out.size() + 6, 0);
      out.insert(out.end(), kIps[choices >> 6].begin(), kIps[choices >> 6].end());
      break;
   case 4:
      ipv6(in, out, choices, kIp6s[(choices >> 4) & 3u]);
      break;
   default:
      put16be(out, in.u16());
   }
   if ((shape >> 5) != 4) {
      put16be(out, kPorts[(choices >> 6) & 3u]);
      put16be(out, kPorts[(choices >> 4) & 3u]);
   }
   out.resize(std::max<size_t>(out.size(), 60), 0);
   if (cut >= 14 && cut < out.size()) {
      out.resize(cut);
   }
   return out;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
   // Made on first use and kept until exit; a host violation aborts.
   static auto *host = new swsec::host::Host;
   static auto *twin = host->load() == 0 ? new swsec::testing::Twin(*host, 1) : (std::abort(), nullptr);
   FuzzInput in(data, size);
   // Each input configures the ports anew (counters, limiters and the
   // error state restart; learned bindings stay as the module keeps them).
   if (!twin->configure(config(in))) {
      return 0;   // a configuration the module refuses changes nothing
   }
   for (int frames = 0; frames < 64 && in.remaining() != 0; ++frames) {
      twin->advance(std::chrono::milliseconds(100 * in.byte()));
      uint32_t direction = 0;
      const Bytes bytes = frame(in, direction);
      const std::string difference = twin->judge(bytes, direction);
      if (!difference.empty()) {
         std::fprintf(stderr, "fast path and module disagree on frame %d: %s\n", frames, difference.c_str());
         std::abort();
      }
   }
   host->log().clear();
   return 0;
}
