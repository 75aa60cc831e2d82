// Virtual time and timers: one time base for uptime and cycles, timers
// fired in due-time order, periodic re-arming, removal (also from inside a
// callback), sleeps that move time.
#include "host_unit.h"

#include <gmock/gmock.h>

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using namespace std::chrono_literals;

namespace swsec::testing {
namespace {

int64_t uptimeUs()
{
   orr_TimeVal now{};
   orr_GetUptime(&now);
   return now.sec * 1'000'000 + now.usec;
}

// What a timer callback saw: which timer it was and when it ran.
struct Firing {
   int id;
   int64_t uptimeUs;
   bool operator==(const Firing &) const = default;
};

// What timer callbacks saw, in order; a timer's data is its number.
std::vector<Firing> firings;

void record(void *data)
{
   firings.push_back({static_cast<int>(reinterpret_cast<intptr_t>(data)), uptimeUs()});
}

void *tag(int id)
{
   return reinterpret_cast<void *>(static_cast<intptr_t>(id));
}

class TimerTest : public HostUnitTest {
public:
   TimerTest() : domain(makeDomain()), queue(makeQueue()), start(uptimeUs()) { firings.clear(); }

   orr_Timer schedule(void *data, int64_t timeoutUs, int64_t periodUs = ORR_TIMER_ONE_SHOT,
                      orr_TimerCallback callback = record)
   {
      orr_Timer timer = 0;
      EXPECT_EQ(orr_TimerSchedule(queue, callback, data, timeoutUs, periodUs, 0, domain, 1, &timer), ORR_OK);
      EXPECT_NE(timer, 0u);
      return timer;
   }

   orr_LockDomainID domain;
   orr_TimerQueue queue;
   int64_t start;
};

TEST_F(TimerTest, DueTimersFireInDueOrderThenInAddingOrderAtTheirDueTimes)
{
   schedule(tag(3), 251);
   schedule(tag(1), 50, 50);
   schedule(tag(2), 100);
   orr_Timer system = 0;
   ASSERT_EQ(orr_TimerAdd(record, tag(4), 100, false, 0, &system), ORR_OK);
   host.clock().advance(250us);
   EXPECT_THAT(firings, ElementsAre(Firing{1, start + 50}, Firing{1, start + 100}, Firing{2, start + 100},
                                    Firing{4, start + 100}, Firing{1, start + 150}, Firing{1, start + 200},
                                    Firing{1, start + 250}));
   EXPECT_EQ(uptimeUs(), start + 250);
   EXPECT_EQ(host.clock().pendingTimers(), 2u);
   firings.clear();
   host.clock().advance(50us);
   EXPECT_THAT(firings, ElementsAre(Firing{3, start + 251}, Firing{1, start + 300}));
}

TEST_F(TimerTest, SkippingIdleTimeSkipsPeriodicTicksKeepsTheirPhaseAndFiresOneShots)
{
   orr_Timer periodic = 0;
   ASSERT_EQ(orr_TimerAdd(record, tag(7), 10'000'000, true, 0x2001, &periodic), ORR_OK);
   schedule(tag(1), 45'000'000);
   host.clock().advance(25s);
   host.clock().skipIdle(1'000'000'000s);
   EXPECT_THAT(firings, ElementsAre(Firing{7, start + 10'000'000}, Firing{7, start + 20'000'000},
                                    Firing{1, start + 45'000'000}));
   EXPECT_EQ(uptimeUs(), start + 1'000'000'025'000'000);
   // The next tick keeps the phase of the ticks skipped.
   host.clock().advance(5s);
   EXPECT_EQ(firings.back(), (Firing{7, start + 1'000'000'030'000'000}));
   EXPECT_EQ(firings.size(), 4u);
   EXPECT_TRUE(orr_TimerRemoveSync(periodic));
}

// Runs the callable a timer's data points to.
template <typename Fn>
void invoke(void *data)
{
   (*static_cast<Fn *>(data))();
}

TEST_F(TimerTest, ZeroTimeoutFiresOnlyWhenAskedAndSleepMovesTime)
{
   const orr_Spinlock lock = makeLock(domain, "sifg.fastpath", 2);
   auto callback = [&] {
      orr_SpinlockLock(lock);   // above the callback's own rank
      record(tag(1));
      orr_SpinlockUnlock(lock);
   };
   schedule(&callback, 0, ORR_TIMER_ONE_SHOT, invoke<decltype(callback)>);
   schedule(tag(2), 5000);
   schedule(tag(3), 20000);
   EXPECT_TRUE(firings.empty()) << "never inside the scheduling call";
   host.clock().runDue();
   EXPECT_THAT(firings, ElementsAre(Firing{1, start}));
   EXPECT_EQ(host.clock().now(), 0us);
   orr_WorldSleep(10000);
   EXPECT_THAT(firings, ElementsAre(Firing{1, start}, Firing{2, start + 5000}));
   EXPECT_EQ(uptimeUs(), start + 10000);
   EXPECT_EQ(host.clock().sleeps(), 1u);
   orr_SpinlockDestroy(lock);
}
TEST_F(TimerTest, RemoveSyncTellsWhetherTheTimerWasPendingAlsoFromItsOwnCallback)
{
   orr_Timer self = 0;
   int calls = 0;
   bool removed = false;
   auto callback = [&] {
      if (++calls == 2) {
         removed = orr_TimerRemoveSync(self);   // must not wait for itself
      }
   };
   self = schedule(&callback, 10, 10, invoke<decltype(callback)>);
   orr_Timer pending = schedule(tag(1), 100);
   orr_Timer fired = schedule(tag(2), 10);
   host.clock().advance(50us);
   EXPECT_EQ(calls, 2);
   EXPECT_TRUE(removed);
   EXPECT_TRUE(orr_TimerRemoveSync(pending));
   EXPECT_FALSE(orr_TimerRemoveSync(fired)) << "a one-shot timer that fired is gone";
   EXPECT_FALSE(orr_TimerRemoveSync(0));
   host.clock().advance(100us);
   EXPECT_THAT(firings, ElementsAre(Firing{2, start + 10}));
   EXPECT_EQ(host.clock().pendingTimers(), 0u);
}

TEST_F(TimerTest, BadSchedulesAreRefusedAndAQueueGoesWithoutPendingTimers)
{
   orr_Timer timer = 0;
   EXPECT_EQ(orr_TimerSchedule(queue, record, nullptr, -1, ORR_TIMER_ONE_SHOT, 0, domain, 1, &timer), ORR_BAD_PARAM);
   EXPECT_EQ(orr_TimerSchedule(queue, record, nullptr, 0, 0, 0, domain, 1, &timer), ORR_BAD_PARAM)
      << "a period of 0 would fire for ever";
   EXPECT_EQ(orr_TimerSchedule(queue, record, nullptr, 0, ORR_TIMER_ONE_SHOT, 0, domain + 99, 1, &timer),
             ORR_INVALID_HANDLE);
   EXPECT_EQ(orr_TimerAdd(record, nullptr, 0, true, 0, &timer), ORR_BAD_PARAM);
   EXPECT_EQ(timer, 0u);
   EXPECT_EQ(host.clock().pendingTimers(), 0u);
   orr_TimerQueue other = makeQueue("doomed.queue");
   ASSERT_EQ(orr_TimerSchedule(other, record, tag(1), 10, ORR_TIMER_ONE_SHOT, 0, domain, 1, &timer), ORR_OK);
   orr_TimerQueueDestroy(other);
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("'doomed.queue' destroyed with 1 pending timer")));
   host.clock().advance(100us);
   EXPECT_TRUE(firings.empty());
}

}  // namespace
}  // namespace swsec::testing
