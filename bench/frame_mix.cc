#include "frame_mix.h"

#include <random>

namespace swsec::bench {

using testing::Bytes;
using testing::Ip4;
using testing::Mac;

namespace {

const Mac kGatewayMac = Mac::parse("02:00:00:00:00:fe");
const Ip4 kGatewayIp = Ip4::parse("10.1.0.254");

Bytes payloadOf(std::mt19937 &random)
{
   // 18 to 1000 bytes of UDP payload: small frames dominate, as in real traffic.
   std::uniform_int_distribution<uint32_t> size(18, 1000);
   std::uniform_int_distribution<uint32_t> value(0, 255);
   Bytes payload(size(random) % 3 == 0 ? size(random) : 18);
   for (auto &byte : payload) {
      byte = static_cast<uint8_t>(value(random));
   }
   return payload;
}

}  // namespace

std::vector<Binding> bindingsFor(uint32_t count)
{
   std::vector<Binding> bindings;
   for (uint32_t i = 0; i < count; ++i) {
      const auto low = static_cast<uint8_t>(i + 1);
      bindings.push_back({Mac{{0x02, 0x00, 0x00, 0x01, 0x00, low}}, Ip4{{10, 1, 0, low}}});
   }
   return bindings;
}

std::vector<MixFrame> makeMix(uint32_t seed, uint32_t count, const std::vector<Binding> &bindings,
                              const MixShares &shares)
{
   std::mt19937 random(seed);
   std::uniform_int_distribution<uint32_t> percent(0, 99);
   std::uniform_int_distribution<size_t> pick(0, bindings.size() - 1);
   std::vector<MixFrame> mix;
   mix.reserve(count);
   for (uint32_t i = 0; i < count; ++i) {
      const Binding &source = bindings[pick(random)];
      uint32_t roll = percent(random);
      auto within = [&roll](uint32_t share) {
         if (roll < share) {
            return true;
         }
         roll -= share;
         return false;
      };
      if (within(shares.spoofed)) {
         // The VM's MAC with an address it was never given.
         const Ip4 spoofed{{10, 9, static_cast<uint8_t>(i >> 8), static_cast<uint8_t>(i)}};
         mix.push_back({FrameKind::Ipv4Spoofed,
                        testing::udpFrame({.src = source.mac, .dst = kGatewayMac, .ipSrc = spoofed,
                                           .ipDst = kGatewayIp, .payload = payloadOf(random)})});
      } else if (within(shares.arp)) {
         testing::Arp arp{.op = 1, .senderMac = source.mac, .senderIp = source.ip, .targetIp = kGatewayIp};
         mix.push_back({FrameKind::Arp, testing::arpFrame(source.mac, testing::kBroadcastMac, arp)});
      } else if (within(shares.dhcp)) {
         testing::Dhcp dhcp{.xid = 0x1000u + i, .chaddr = source.mac, .type = testing::kDhcpDiscover};
         mix.push_back({FrameKind::Dhcp, testing::dhcpFrame({.src = source.mac, .dhcp = dhcp})});
      } else if (within(shares.bpdu)) {
         mix.push_back({FrameKind::Bpdu, testing::bpduFrame(source.mac)});
      } else if (within(shares.ipv6)) {
         mix.push_back({FrameKind::Ipv6, testing::udp6Frame({.src = source.mac, .dst = kGatewayMac})});
      } else {
         mix.push_back({FrameKind::Ipv4Bound,
                        testing::udpFrame({.src = source.mac, .dst = kGatewayMac, .ipSrc = source.ip,
                                           .ipDst = kGatewayIp, .payload = payloadOf(random)})});
      }
   }
   return mix;
}

std::vector<MixFrame> onlyKind(const std::vector<MixFrame> &mix, FrameKind kind)
{
   std::vector<MixFrame> out;
   for (const auto &frame : mix) {
      if (frame.kind == kind) {
         out.push_back(frame);
      }
   }
   return out;
}

}  // namespace swsec::bench
