// Log components and the records the host keeps of what was written.
#include "host_unit.h"

#include <gmock/gmock.h>

using ::testing::ElementsAre;
using ::testing::Field;
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

TEST_F(LogTest, ComponentMessageIsFormattedAndCarriesTheComponentName)
{
   orr_LogHandle log = makeLog("swsec");
   orr_LogLevel(ORR_LOG_ERROR, log, orr_LogGetCurrentLogLevel(log), "%s: value %d (%#x)\n", orr_LogGetName(log), 42,
                0x0bad0014u);
   // severity, viaNoLevel, hasComponent, component, text
   EXPECT_THAT(host.log().records(), ElementsAre(FieldsAre(2u, false, true, "swsec", "swsec: value 42 (0xbad0014)\n")));
   orr_LogUnregister(log);
}

TEST_F(LogTest, MessageAboveTheComponentLevelIsNotWritten)
{
   orr_LogHandle log = makeLog("quiet", 1);
   EXPECT_EQ(orr_LogGetCurrentLogLevel(log), 1);
   orr_LogLevel(ORR_LOG_INFO, log, 2, "too detailed\n");
   orr_LogLevel(ORR_LOG_INFO, log, 1, "at the level\n");
   orr_LogLevel(ORR_LOG_INFO, log, 0, "below the level\n");
   EXPECT_FALSE(host.log().contains("too detailed"));
   EXPECT_TRUE(host.log().contains("at the level"));
   EXPECT_TRUE(host.log().contains("below the level"));
   orr_LogUnregister(log);
}

TEST_F(LogTest, MessagesWithoutAComponentAreKeptAndMarkedAndNeedASeverityOfOneOrTwo)
{
   orr_LogLevel(ORR_LOG_INFO, nullptr, 0, "before the log exists\n");
   orr_LogNoLevel(ORR_LOG_ERROR, "Registration failed (%#x): %s\n", 0x0bad0001u, "Failure");
   // The first went nowhere a user would see.
   EXPECT_THAT(host.log().records(), ElementsAre(FieldsAre(1u, false, false, "", "before the log exists\n"),
                                                 FieldsAre(2u, true, false, "", "Registration failed (0xbad0001): Failure\n")));
   orr_LogNoLevel(3, "what kind\n");
   EXPECT_EQ(takeViolations().size(), 1u) << "severity outside 1 and 2";
}

TEST_F(LogTest, LongMessagesAreKeptWhole)
{
   const std::string long_text(5000, 'x');
   orr_LogNoLevel(ORR_LOG_ERROR, "%s|\n", long_text.c_str());
   EXPECT_THAT(host.log().records(), ElementsAre(Field(&host::LogRecord::text, long_text + "|\n")));
}

TEST_F(LogTest, RegistrationRefusesASecondComponentOfTheSameNameAnExtraSettingAndAnUnknownHeap)
{
   orr_LogHandle log = makeLog("twice");
   orr_LogProps props{};
   orr_NameInitialize(&props.name, "twice");
   orr_LogHandle second = nullptr;
   EXPECT_EQ(orr_LogRegister(&props, &second), ORR_EXISTS);
   EXPECT_EQ(second, nullptr);
   orr_LogUnregister(log);

   int extra = 0;
   props.extra = &extra;
   EXPECT_EQ(orr_LogRegister(&props, &second), ORR_BAD_PARAM);
   props.extra = nullptr;
   orr_HeapID heap = makeHeap("gone");
   orr_HeapDestroy(heap);
   props.heap = heap;
   EXPECT_EQ(orr_LogRegister(&props, &second), ORR_INVALID_HANDLE);
   props.heap = nullptr;
   EXPECT_EQ(orr_LogRegister(&props, &second), ORR_OK) << "the name is free again";
   orr_LogUnregister(second);
}

TEST_F(LogTest, WritingThroughAnUnregisteredHandleIsAViolation)
{
   orr_LogHandle log = makeLog("stale");
   orr_LogUnregister(log);
   orr_LogLevel(ORR_LOG_ERROR, log, 0, "into freed memory\n");
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("orr_LogLevel: unknown log handle")));
   EXPECT_FALSE(host.log().contains("into freed memory"));
}

}  // namespace
}  // namespace swsec::testing
