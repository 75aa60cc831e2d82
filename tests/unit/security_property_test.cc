// The checks of a security property access that come before the port.
#include "support/host_fixture.h"
#include "support/security_config.h"

#include "framework/sifra_generic_filter.h"
#include "swsec/swsec_security_property.h"

#include <cstddef>
#include <cstring>
#include <string>
#include <vector>

namespace swsec::testing {
namespace {

using Bytes = std::vector<uint8_t>;

// `length` bytes of a configuration record with `version` and `numStatic`.
Bytes record(uint8_t version, uint32_t numStatic, size_t length)
{
   Bytes bytes = configRecord({});
   bytes[0] = version;
   std::memcpy(&bytes[offsetof(SwSecConfig, numStatic)], &numStatic, sizeof numStatic);
   bytes.resize(length);
   return bytes;
}

struct WriteCase {
   const char *name;
   Bytes bytes;
   std::string message;
};

class SecurityPropertyWriteTest : public HostTest, public ::testing::WithParamInterface<WriteCase> {};

TEST_P(SecurityPropertyWriteTest, malformed_records_are_refused_before_the_port)
{
   const WriteCase &c = GetParam();
   SifraGenericFilter filter{};
   filter.magic = SIFRAGENERIC_FILTER_MAGIC;

   EXPECT_EQ(SWSecPropWrite(&filter, nullptr, c.bytes.data(), static_cast<uint32_t>(c.bytes.size())),
             ORR_BAD_PARAM);
   const auto records = host().log().records();
   ASSERT_EQ(records.size(), 1u);
   EXPECT_EQ(records[0].severity, ORR_LOG_ERROR);
   EXPECT_EQ(records[0].text, c.message + "\n");
}

const std::string kLength = "Invalid security config length for version 1. ";

INSTANTIATE_TEST_SUITE_P(
   Records, SecurityPropertyWriteTest,
   ::testing::Values(
      WriteCase{"empty", {}, "Invalid security config"},
      WriteCase{"one_byte", {1}, kLength + "Got 1, expecting 26"},
      WriteCase{"version_3", record(3, 0, 44), "Invalid version. Got 3, expecting 2"},
      WriteCase{"version_2_without_frame_guard", record(2, 0, 26),
                "Invalid security config length for version 2. Got 26, expecting 44"},
      WriteCase{"one_byte_too_many", record(1, 0, 27), kLength + "Got 27, expecting 26"},
      WriteCase{"one_byte_short", record(1, 2, 49), kLength + "Got 49, expecting 50"},
      WriteCase{"one_entry_too_many", record(1, 2, 62), kLength + "Got 62, expecting 50"},
      WriteCase{"cut_before_numStatic", record(1, 0, 5), kLength + "Got 5, expecting 26"},
      WriteCase{"numStatic_without_overflow", record(1, 0xffffffffu, 26),
                kLength + "Got 26, expecting 51539607566"}),
   [](const auto &test) { return std::string(test.param.name); });

}  // namespace
}  // namespace swsec::testing
