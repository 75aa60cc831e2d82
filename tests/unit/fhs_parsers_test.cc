// The IPv6 header chain walker and the DHCPv6 parser on crafted packets.
#include "fhs/fhs_dhcpv6.h"
#include "fhs/fhs_ipv6_chain.h"
#include "fhs/fhs_nexo.h"
#include "support/ipv6_frames.h"

#include <gtest/gtest.h>

namespace swsec::testing {
namespace {

struct ChainCase {
   const char *name;
   Bytes packet;             // from the fixed header on
   FhsChainVerdict verdict;
   uint32_t upperOffset = 0;
   uint32_t cut = 0;         // bytes of the packet left out of the view
};

Bytes packet(uint8_t next, const Bytes &payload) { return ipv6({.nextHeader = next}, payload); }

Bytes chainOf(int count, uint8_t units)
{
   Bytes chain;
   for (int i = 0; i < count; i++) {
      chain = cat(chain, ext(i + 1 == count ? 17 : 60, units));
   }
   return cat(chain, Bytes(8, 0));
}

TEST(FhsChainTest, walks_within_its_limits)
{
   const Bytes shortVersion = [] { Bytes p = packet(17, Bytes(8, 0)); p[0] = 0x40; return p; }();
   const Bytes longer = [] { Bytes p = packet(17, Bytes(8, 0)); p[5] += 1; return p; }();
   const std::vector<ChainCase> cases = {
      {"plain_udp", packet(17, Bytes(8, 0)), FhsChainOk, 40},
      {"hop_by_hop_then_dest_opts_then_icmp", packet(0, cat(ext(60), cat(ext(58, 1), icmp6(134)))), FhsChainOk, 64},
      {"ah_in_four_byte_units", packet(51, cat(ext(58, 1, true), icmp6(128))), FhsChainOk, 52},
      {"eight_headers", packet(60, chainOf(8, 0)), FhsChainOk, 104},
      {"nine_headers", packet(60, chainOf(9, 0)), FhsChainOverLimit},
      {"over_256_bytes", packet(60, chainOf(1, 32)), FhsChainOverLimit},
      {"hop_by_hop_not_first", packet(60, cat(ext(0), cat(ext(17), Bytes(8, 0)))), FhsChainMalformed},
      {"header_past_the_packet", packet(60, Bytes{17, 2, 0, 0}), FhsChainMalformed},
      {"udp_header_cut", packet(17, Bytes(7, 0)), FhsChainMalformed},
      {"payload_length_past_frame", longer, FhsChainMalformed},
      {"not_version_6", shortVersion, FhsChainMalformed},
      {"two_fragment_headers", packet(44, cat(frag(44, 0, true), cat(frag(58, 0, true), icmp6(135)))), FhsChainMalformed},
      {"first_fragment_cut_in_chain", packet(44, cat(frag(60, 0, true), Bytes{58, 1, 0, 0})), FhsChainNotInFirstFragment},
      {"first_fragment_cut_before_icmp", packet(44, cat(frag(60, 0, true), ext(58))), FhsChainNotInFirstFragment},
      {"later_fragment", packet(44, cat(frag(58, 5, false), Bytes(16, 0))), FhsChainOk, 48},
      {"view_shorter_than_chain", packet(0, cat(ext(17, 3), Bytes(8, 0))), FhsChainNeedView, 0, 20},
   };
   for (const ChainCase &c : cases) {
      SCOPED_TRACE(c.name);
      FhsIpv6Chain chain{};
      const uint32_t l3Len = uint32_t(c.packet.size());
      ASSERT_EQ(FhsWalkIpv6Chain(c.packet.data(), l3Len - c.cut, l3Len, &chain), c.verdict);
      if (c.verdict == FhsChainOk) {
         EXPECT_EQ(chain.upperOffset, c.upperOffset);
      }
   }
}

TEST(FhsDhcpv6Test, reads_client_id_and_ia_addresses)
{
   const Bytes duid{0, 1, 2, 3, 4};
   std::vector<std::pair<Addr6, uint32_t>> nine;
   for (uint8_t i = 0; i < 9; i++) {
      nine.push_back({a6("2001:db8::" + std::to_string(i + 1)), 100u + i});
   }
   FhsDhcpv6Msg msg{};
   Bytes reply = dhcp6(7, 0xabcdef, duid, nine);
   ASSERT_EQ(FhsDhcpv6Parse(reply.data(), uint32_t(reply.size()), &msg), 0);
   EXPECT_EQ(msg.xid, 0xabcdefu);
   ASSERT_EQ(msg.clientIdLen, duid.size());
   EXPECT_EQ(Bytes(msg.clientId, msg.clientId + msg.clientIdLen), duid);
   EXPECT_EQ(msg.numAddrs, FHS_DHCPV6_MAX_ADDRS);
   EXPECT_EQ(msg.numAddrsSkipped, 1u);
   EXPECT_EQ(msg.addrs[7].validLifetime, 107u);
   EXPECT_EQ(Addr6(std::to_array(msg.addrs[7].addr)), a6("2001:db8::8"));

   const struct {
      const char *name;
      Bytes bytes;
   } refused[] = {
      {"option_past_the_end", Bytes(reply.begin(), reply.end() - 1)},
      {"short_ia_address", cat(dhcp6(7, 1, duid), Bytes{0, 3, 0, 16, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 0, 0, 5, 0, 0})},
      {"two_client_ids", cat(dhcp6(7, 1, duid), Bytes{0, 1, 0, 1, 9})},
      {"client_id_longer_than_a_duid", dhcp6(7, 1, Bytes(131, 1))},
      {"relay_reply", Bytes{13, 0, 0, 0}},
      {"no_header", Bytes{7, 0, 0}},
   };
   for (const auto &c : refused) {
      EXPECT_EQ(FhsDhcpv6Parse(c.bytes.data(), uint32_t(c.bytes.size()), &msg), -1) << c.name;
   }
}

TEST(FhsTextTest, reads_ipv6_addresses_in_full_and_short_forms)
{
   uint8_t addr[16];
   for (const char *text : {"2001:db8::1", "::", "::1", "fe80::", "1:2:3:4:5:6:7:8", "1::8", "1:2:3:4:5:6::8", "FFFF::a"}) {
      ASSERT_TRUE(FhsParseIpv6(text, addr)) << text;
      EXPECT_EQ(Addr6(std::to_array(addr)), a6(text)) << text;
   }
   for (const char *text : {"", ":", ":::", "1:2", "1::2::3", "1:2:3:4:5:6:7:8:9", "1:2:3:4:5:6:7::8", "12345::", "1:",
                            "g::", "::1.2.3.4", ":1::"}) {
      EXPECT_FALSE(FhsParseIpv6(text, addr)) << text;
   }
}

}  // namespace
}  // namespace swsec::testing
