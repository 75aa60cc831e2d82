// Text helpers and status texts.
#include "host_unit.h"

#include <cstring>

namespace swsec::testing {
namespace {

TEST(StatusText, KnownStatusesHaveTheirTextAndOthersAreUnknown)
{
   const std::pair<uint32_t, const char *> cases[] = {
      {0x00000000u, "Success"},       {0x0bad0001u, "Failure"},         {0x0bad0004u, "Busy"},
      {0x0bad0014u, "Out of memory"}, {0x0bad0031u, "No VM UUID"},      {0x0bad0088u, "Not ready"},
      {0x0bad00dbu, "Buffer too small"}, {0x0bad0008u, "Unknown status"}, {0xffffffffu, "Unknown status"},
   };
   for (const auto &[value, text] : cases) {
      EXPECT_STREQ(orr_StatusToString(static_cast<orr_Status>(value)), text) << std::hex << value;
   }
}

TEST(Names, InitializeCutsTo31BytesAndTerminates)
{
   orr_Name name;
   std::memset(&name, 'x', sizeof name);
   orr_NameInitialize(&name, "0123456789012345678901234567890123456789");
   EXPECT_STREQ(name.name, "0123456789012345678901234567890");
   orr_NameInitialize(&name, "short");
   EXPECT_STREQ(name.name, "short");
   for (size_t i = 5; i < sizeof name.name; ++i) {
      EXPECT_EQ(name.name[i], '\0') << "no stale bytes after the text, at " << i;
   }
   orr_NameInitialize(&name, nullptr);
   EXPECT_STREQ(name.name, "");
}

TEST(Names, CopyTerminatesEvenAnUnterminatedSource)
{
   orr_Name source;
   std::memset(&source, 'y', sizeof source);
   orr_Name copy;
   orr_NameCopy(&copy, &source);
   EXPECT_EQ(std::strlen(copy.name), 31u);
}

TEST(Sprintf, ReturnsWhatWasWrittenNotWhatWouldHaveBeen)
{
   char buffer[8];
   EXPECT_EQ(orr_Sprintf(buffer, sizeof buffer, "%d", 1234), 4);
   EXPECT_STREQ(buffer, "1234");
   EXPECT_EQ(orr_Sprintf(buffer, sizeof buffer, "%s", "0123456789"), 7);
   EXPECT_STREQ(buffer, "0123456");
   buffer[0] = 'z';
   EXPECT_EQ(orr_Sprintf(buffer, 0, "%d", 5), 0);
   EXPECT_EQ(buffer[0], 'z') << "nothing is written into no room";
}

TEST(StringFormat, ReportsACutAndRefusesFlags)
{
   host::Host host;
   char buffer[6];
   EXPECT_EQ(orr_StringFormat(buffer, sizeof buffer, 0, "%s", "vnic"), ORR_OK);
   EXPECT_STREQ(buffer, "vnic");
   EXPECT_EQ(orr_StringFormat(buffer, sizeof buffer, 0, "%s.%d", "port", 12), ORR_BUFFER_TOO_SMALL);
   EXPECT_STREQ(buffer, "port.");
   EXPECT_EQ(orr_StringFormat(buffer, sizeof buffer, 1, "x"), ORR_BAD_PARAM);
}

TEST(NoHostDeathTest, PlatformCallsWithoutAHostAbort)
{
   GTEST_FLAG_SET(death_test_style, "threadsafe");
   orr_HeapProps props{};
   orr_HeapID heap = nullptr;
   EXPECT_DEATH((void)orr_HeapCreate(&props, &heap), "orr_HeapCreate called with no Host alive");
}

}  // namespace
}  // namespace swsec::testing
