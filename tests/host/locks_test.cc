// Lock domains and spinlocks: an abort naming the locks for every misuse a
// kernel would only survive by luck.
#include "host_unit.h"

#include <gmock/gmock.h>

#include <utility>
#include <vector>
#include <thread>

using ::testing::ElementsAre;
using ::testing::HasSubstr;

namespace swsec::testing {
namespace {

using LockTest = HostUnitTest;

TEST_F(LockTest, CreationRefusesUnknownDomainsAndTypesAndADomainGoesLast)
{
   orr_LockDomainID domain = makeDomain("busy.domain");
   orr_SpinlockProps props{};
   props.type = ORR_SPINLOCK_PLAIN;
   props.domain = domain + 1000;
   orr_Spinlock lock = nullptr;
   EXPECT_EQ(orr_SpinlockCreate(&props, &lock), ORR_INVALID_HANDLE);
   props.domain = domain;
   props.type = static_cast<orr_SpinlockType>(2);
   EXPECT_EQ(orr_SpinlockCreate(&props, &lock), ORR_BAD_PARAM);
   EXPECT_EQ(lock, nullptr);
   lock = makeLock(domain, "still.here", 1);
   orr_LockDomainDestroy(domain);
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("'busy.domain' still has 1 live spinlock")));
   orr_SpinlockDestroy(lock);
}

// ---------------------------------------------------------------- misuse

// A misuse as data: the locks it makes (in one domain unless said
// otherwise) and the steps it takes on them, by index.
enum class Op { Lock, ReadLock, WriteLock, Unlock, ReadUnlock, WriteUnlock, Destroy, Sleep, MutexLock, MutexUnlock,
                LockOnAnotherThread, TimerLocks, TimerSleeps };
using enum Op;

struct LockSpec {
   const char *name;
   uint32_t rank;
   orr_SpinlockType type = ORR_SPINLOCK_PLAIN;
   bool otherDomain = false;
};

struct Misuse {
   const char *name;
   std::vector<LockSpec> locks;
   std::vector<std::pair<Op, size_t>> steps;
   const char *message;   // a regular expression
};

constexpr auto kRw = ORR_SPINLOCK_RW;

const Misuse misuses[] = {
   {"TakingALowerRank", {{"sifg.fastpath", 2}, {"sifg.filter", 3}}, {{Lock, 1}, {Lock, 0}},
    "lock rank violation: taking 'sifg.fastpath' \\(rank 2\\) while holding 'sifg.filter' \\(rank 3\\)"},
   {"TakingAnEqualRank", {{"sifg.sec.txratelimit", 6}, {"sifg.sec.rxratelimit", 6}}, {{Lock, 0}, {Lock, 1}},
    "taking 'sifg.sec.rxratelimit' \\(rank 6\\) while holding 'sifg.sec.txratelimit' \\(rank 6\\)"},
   {"RanksSpanDomains", {{"first.high", 5}, {"second.low", 4, ORR_SPINLOCK_PLAIN, true}}, {{Lock, 0}, {Lock, 1}},
    "taking 'second.low' \\(rank 4\\) while holding 'first.high' \\(rank 5\\)"},
   {"TakingALockTwice", {{"once.only", 1}}, {{Lock, 0}, {Lock, 0}},
    "'once.only' \\(rank 1\\) is already held by this thread"},
   {"UnlockingALockNotHeld", {{"not.mine", 1}}, {{Unlock, 0}},
    "orr_SpinlockUnlock: 'not.mine' is not held by this thread"},
   {"UnlockingALockHeldByAnotherThread", {{"theirs", 1}}, {{LockOnAnotherThread, 0}, {Unlock, 0}},
    "orr_SpinlockUnlock: 'theirs' is not held by this thread"},
   {"DestroyingAHeldLock", {{"held.lock", 1}}, {{Lock, 0}, {Destroy, 0}},
    "'held.lock' \\(rank 1\\) is destroyed while held"},
   {"ReadUnlockingAWriteHold", {{"rw.lock", 1, kRw}}, {{WriteLock, 0}, {ReadUnlock, 0}},
    "orr_SpinlockReadUnlock: 'rw.lock' is held for writing"},
   {"PlainLockOnAReaderWriterLock", {{"rw.lock", 1, kRw}}, {{Lock, 0}},
    "orr_SpinlockLock on reader-writer spinlock 'rw.lock'"},
   {"SleepingUnderASpinlock", {{"sifg.filter", 3}}, {{Lock, 0}, {Sleep, 0}},
    "orr_WorldSleep while holding spinlock 'sifg.filter' \\(rank 3\\)"},
   {"TakingAMutexUnderASpinlock", {{"sifg.fastpath", 2}}, {{Lock, 0}, {MutexLock, 0}},
    "orr_MutexLock while holding spinlock 'sifg.fastpath' \\(rank 2\\)"},
   {"UnlockingAMutexNotHeld", {}, {{MutexUnlock, 0}}, "orr_MutexUnlock: mutex 'test.mutex' is not held by this thread"},
   {"TimerCallbackTakingItsOwnRank", {{"rank.one", 1}}, {{TimerLocks, 0}},
    "taking 'rank.one' \\(rank 1\\) while holding 'timer' \\(rank 1\\)"},
   {"TimerCallbackSleeping", {}, {{TimerSleeps, 0}}, "orr_WorldSleep inside a callback run as 'timer'"},
   {"TimerCallbackReturningWithALock", {{"kept.lock", 5}}, {{TimerLocks, 0}},
    "callback run as 'timer' returned holding 'kept.lock'"},
};

void takeLock(void *lock)
{
   orr_SpinlockLock(static_cast<orr_Spinlock>(lock));
}

void timerSleeps(void *)
{
   orr_WorldSleep(10);
}

class LockMisuseDeathTest : public HostUnitTest, public ::testing::WithParamInterface<Misuse> {
protected:
   void act(const Misuse &misuse)
   {
      static orr_Mutex mutex = ORR_MUTEX_INITIALIZER("test.mutex");
      const orr_LockDomainID domain = makeDomain();
      std::vector<orr_Spinlock> locks;
      for (const LockSpec &l : misuse.locks) {
         locks.push_back(makeLock(l.otherDomain ? makeDomain("other") : domain, l.name, l.rank, l.type));
      }
      for (const auto &[op, index] : misuse.steps) {
         orr_Spinlock lock = index < locks.size() ? locks[index] : nullptr;
         orr_Timer timer = 0;
         switch (op) {
         case Lock: orr_SpinlockLock(lock); break;
         case ReadLock: orr_SpinlockReadLock(lock); break;
         case WriteLock: orr_SpinlockWriteLock(lock); break;
         case Unlock: orr_SpinlockUnlock(lock); break;
         case ReadUnlock: orr_SpinlockReadUnlock(lock); break;
         case WriteUnlock: orr_SpinlockWriteUnlock(lock); break;
         case Destroy: orr_SpinlockDestroy(lock); break;
         case Sleep: orr_WorldSleep(10000); break;
         case MutexLock: orr_MutexLock(&mutex); break;
         case MutexUnlock: orr_MutexUnlock(&mutex); break;
         case LockOnAnotherThread: std::thread([lock] { orr_SpinlockLock(lock); }).join(); break;
         case TimerLocks:
            (void)orr_TimerSchedule(makeQueue(), takeLock, lock, 0, ORR_TIMER_ONE_SHOT, 0, domain, 1, &timer);
            host.clock().runDue();
            break;
         case TimerSleeps:
            (void)orr_TimerAdd(timerSleeps, nullptr, 5, false, 0, &timer);
            host.clock().advance(std::chrono::microseconds(5));
            break;
         }
      }
   }
};

TEST_P(LockMisuseDeathTest, AbortsNamingTheLocks)
{
   GTEST_FLAG_SET(death_test_style, "threadsafe");
   EXPECT_DEATH(act(GetParam()), GetParam().message);
}

INSTANTIATE_TEST_SUITE_P(Misuse, LockMisuseDeathTest, ::testing::ValuesIn(misuses),
                         [](const auto &param) { return std::string(param.param.name); });

}  // namespace
}  // namespace swsec::testing
