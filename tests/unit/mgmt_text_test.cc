// The texts of management requests and summaries: the VLAN and IPv4
// parsers that stand in for the C library's, and the feature list.
#include "mgmt/swsec_nexo.h"
#include "mgmt/swsec_nexo_text.h"

#include <gtest/gtest.h>

#include <cstring>
#include <optional>
#include <string>

namespace swsec::testing {
namespace {

std::optional<uint16_t> vlan(const char *text)
{
   uint16_t value = 0xdead;
   if (!SwSecNexoParseU16(text, &value)) {
      return std::nullopt;
   }
   return value;
}

// The parsed address as dotted text, bytes in memory order.
std::optional<std::string> address(const char *text)
{
   uint32_t raw = 0;
   if (!SwSecNexoParseIpv4(text, &raw)) {
      return std::nullopt;
   }
   uint8_t b[4];
   std::memcpy(b, &raw, 4);
   return std::to_string(b[0]) + "." + std::to_string(b[1]) + "." + std::to_string(b[2]) + "." + std::to_string(b[3]);
}

TEST(MgmtVlanText, reads_like_scanf_hu)
{
   struct Case {
      const char *text;
      std::optional<uint16_t> expected;
   };
   const Case cases[] = {
      {"100", 100},     {"  7", 7},       {"+12", 12},      {"4094x", 4094},  {"0", 0},
      {"65535", 65535}, {"65536", 0},     {"70000", 4464},  {"-1", 65535},    {"", std::nullopt},
      {"x1", std::nullopt}, {"-", std::nullopt}, {"  ", std::nullopt},
   };
   for (const Case &c : cases) {
      EXPECT_EQ(vlan(c.text), c.expected) << '"' << c.text << '"';
   }
}

TEST(MgmtVlanText, stops_at_the_bound_of_an_unterminated_text)
{
   char digits[SWSEC_NEXO_TEXT_MAX + 8];
   std::memset(digits, '1', sizeof digits);   // no terminator within reach
   uint16_t value = 0;
   EXPECT_TRUE(SwSecNexoParseU16(digits, &value));
}

TEST(MgmtIpText, reads_like_inet_aton)
{
   struct Case {
      const char *text;
      std::optional<std::string> expected;
   };
   const Case cases[] = {
      {"10.0.0.5", "10.0.0.5"},
      {"10.5", "10.0.0.5"},                   // last part fills three bytes
      {"10.1.260", "10.1.1.4"},               // last part fills two bytes
      {"167772165", "10.0.0.5"},              // one 32-bit number
      {"0x0a.0.0.010", "10.0.0.8"},           // hex and octal parts
      {"10.0.0.5 trailing", "10.0.0.5"},      // white space ends the address
      {"10.0.0.256", std::nullopt},
      {"256.0.0.1", std::nullopt},
      {"10.0.0.", std::nullopt},
      {"10..0.1", std::nullopt},
      {"08.0.0.1", std::nullopt},             // 8 is no octal digit
      {"10.0.0.5x", std::nullopt},
      {"4294967296", std::nullopt},
      {" 10.0.0.5", std::nullopt},
   };
   for (const Case &c : cases) {
      EXPECT_EQ(address(c.text), c.expected) << '"' << c.text << '"';
   }
}

TEST(MgmtFeatureText, names_the_enabled_features_in_bit_order_and_a_small_field_is_cut_and_stays_terminated)
{
   struct Case {
      uint32_t features;
      const char *expected;
      size_t size = 1024;
   };
   const Case cases[] = {
      {0x09, "BPDU Filter,DAI"},
      {0x00, "None"},
      {0x1f, "BPDU Filter,Block DHCP server functionality,IP Discovery,DAI,IP source guard"},
      {0x14, "IP Discovery,IP source guard"},
      {0x20, ""},                              // only unnamed bits: nothing written, nothing cut
      {0x22, "Block DHCP server functionality"},
      {0x1f, "BPDU F", 8},
   };
   for (const Case &c : cases) {
      char text[1024];
      std::memset(text, 'Z', sizeof text);
      SwSecNexoFormatFeatures(text, c.size, c.features);
      EXPECT_STREQ(text, c.expected) << std::hex << c.features;
   }
}

}  // namespace
}  // namespace swsec::testing
