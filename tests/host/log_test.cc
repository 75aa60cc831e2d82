// Log components, the records the host keeps of what was written, and the
// text helpers modules format with.
#include "host_unit.h"

#include <gmock/gmock.h>

#include <cstring>

using ::testing::ElementsAre;
using ::testing::FieldsAre;
using ::testing::HasSubstr;

namespace swsec::testing {
namespace {

class LogTest : public HostUnitTest {
protected:
   orr_LogHandle makeLog(const char *name, int32_t level = 0)
   {
      orr_LogProps props{};
      orr_NameInitialize(&props.name, name);
      props.level = level;
      orr_LogHandle log = nullptr;
      EXPECT_EQ(orr_LogRegister(&props, &log), ORR_OK);
      return log;
   }
};

TEST_F(LogTest, RecordsKeepSeverityComponentAndWholeTextUpToTheComponentLevel)
{
   orr_LogHandle log = makeLog("swsec", 1);
   orr_LogLevel(ORR_LOG_ERROR, log, orr_LogGetCurrentLogLevel(log), "%s: value %d (%#x)\n", orr_LogGetName(log), 42,
                0x0bad0014u);
   orr_LogLevel(ORR_LOG_INFO, log, 2, "too detailed\n");
   orr_LogLevel(ORR_LOG_INFO, log, 0, "below the level\n");
   orr_LogLevel(ORR_LOG_INFO, nullptr, 0, "before the log exists\n");
   const std::string longText(5000, 'x');
   orr_LogNoLevel(ORR_LOG_ERROR, "%s|\n", longText.c_str());
   // severity, viaNoLevel, hasComponent, component, text
   EXPECT_THAT(host.log().records(), ElementsAre(FieldsAre(2u, false, true, "swsec", "swsec: value 42 (0xbad0014)\n"),
                                                 FieldsAre(1u, false, true, "swsec", "below the level\n"),
                                                 FieldsAre(1u, false, false, "", "before the log exists\n"),
                                                 FieldsAre(2u, true, false, "", longText + "|\n")));
   orr_LogNoLevel(3, "what kind\n");
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("severity"))) << "severity outside 1 and 2";
   orr_LogUnregister(log);
   orr_LogLevel(ORR_LOG_ERROR, log, 0, "into freed memory\n");
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("orr_LogLevel: unknown log handle")));
   EXPECT_FALSE(host.log().contains("into freed memory"));
}

TEST_F(LogTest, TextHelpersCutToTheirBufferAndSayWhatTheyWrote)
{
   char buffer[8];
   EXPECT_EQ(orr_Sprintf(buffer, sizeof buffer, "%s", "0123456789"), 7) << "what was written, not what would have been";
   EXPECT_STREQ(buffer, "0123456");
   buffer[0] = 'z';
   EXPECT_EQ(orr_Sprintf(buffer, 0, "%d", 5), 0);
   EXPECT_EQ(buffer[0], 'z') << "nothing is written into no room";
   EXPECT_EQ(orr_StringFormat(buffer, 6, 0, "%s", "vnic"), ORR_OK);
   EXPECT_EQ(orr_StringFormat(buffer, 6, 0, "%s.%d", "port", 12), ORR_BUFFER_TOO_SMALL);
   EXPECT_STREQ(buffer, "port.");
   EXPECT_EQ(orr_StringFormat(buffer, 6, 1, "x"), ORR_BAD_PARAM);
   orr_Name name;
   std::memset(&name, 'x', sizeof name);
   orr_NameInitialize(&name, "0123456789012345678901234567890123456789");
   EXPECT_STREQ(name.name, "0123456789012345678901234567890");
   orr_Name copy;
   orr_NameCopy(&copy, &name);
   EXPECT_STREQ(copy.name, name.name);
   EXPECT_STREQ(orr_StatusToString(ORR_NO_MEMORY), "Out of memory");
   EXPECT_STREQ(orr_StatusToString(static_cast<orr_Status>(0x0bad0008u)), "Unknown status");
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
