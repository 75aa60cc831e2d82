// Lock domains, spinlocks and mutexes: real exclusion, and an abort naming
// the locks for every misuse a kernel would only survive by luck.
#include "host_unit.h"

#include <gmock/gmock.h>

#include <functional>
#include <thread>

using ::testing::HasSubstr;

namespace swsec::testing {
namespace {

using LockTest = HostUnitTest;

TEST_F(LockTest, SpinlocksExcludeAcrossThreads)
{
   orr_LockDomainID domain = makeDomain();
   orr_Spinlock plain = makeLock(domain, "test.plain", 2);
   orr_Spinlock rw = makeLock(domain, "test.rw", 3, ORR_SPINLOCK_RW);
   constexpr int kRounds = 20000;
   // Plain increments, not atomic ones: only the lock keeps them whole.
   long underPlain = 0;
   long underWrite = 0;
   auto work = [&] {
      for (int i = 0; i < kRounds; ++i) {
         orr_SpinlockLock(plain);
         ++underPlain;
         orr_SpinlockUnlock(plain);
         orr_SpinlockWriteLock(rw);
         ++underWrite;
         orr_SpinlockWriteUnlock(rw);
         orr_SpinlockReadLock(rw);
         long seen = underWrite;
         orr_SpinlockReadUnlock(rw);
         ASSERT_GT(seen, 0);
      }
   };
   std::thread other(work);
   work();
   other.join();
   EXPECT_EQ(underPlain, 2 * kRounds);
   EXPECT_EQ(underWrite, 2 * kRounds);
   auto live = host.locks().live();
   ASSERT_EQ(live.size(), 2u);
   EXPECT_EQ(live[0].acquisitions, uint64_t{2 * kRounds});
   EXPECT_EQ(live[1].acquisitions, uint64_t{4 * kRounds});
   orr_SpinlockDestroy(plain);
   orr_SpinlockDestroy(rw);
   orr_LockDomainDestroy(domain);
}

TEST_F(LockTest, IncreasingRanksMayBeTakenAndReleasedInAnyOrder)
{
   orr_LockDomainID domain = makeDomain();
   orr_Spinlock low = makeLock(domain, "test.low", 2);
   orr_Spinlock high = makeLock(domain, "test.high", 3, ORR_SPINLOCK_RW);
   orr_SpinlockLock(low);
   orr_SpinlockReadLock(high);
   orr_SpinlockUnlock(low);
   orr_SpinlockReadUnlock(high);
   // Each lock again on its own: nothing is still recorded as held.
   orr_SpinlockWriteLock(high);
   orr_SpinlockWriteUnlock(high);
   orr_SpinlockLock(low);
   orr_SpinlockUnlock(low);
   orr_SpinlockDestroy(low);
   orr_SpinlockDestroy(high);
   orr_LockDomainDestroy(domain);
}

TEST_F(LockTest, LiveLocksAndDomainsAreListedInCreationOrder)
{
   orr_LockDomainID first = makeDomain("first");
   orr_LockDomainID second = makeDomain("second");
   orr_Spinlock a = makeLock(second, "lock.a", 4, ORR_SPINLOCK_RW);
   orr_Spinlock b = makeLock(first, "lock.b", 1);
   auto live = host.locks().live();
   ASSERT_EQ(live.size(), 2u);
   EXPECT_EQ(live[0].name, "lock.a");
   EXPECT_EQ(live[0].type, uint32_t{ORR_SPINLOCK_RW});
   EXPECT_EQ(live[0].rank, 4u);
   EXPECT_EQ(live[1].name, "lock.b");
   EXPECT_EQ(host.locks().domains(), (std::vector<std::string>{"first", "second"}));
   orr_SpinlockDestroy(a);
   orr_SpinlockDestroy(b);
   orr_LockDomainDestroy(first);
   orr_LockDomainDestroy(second);
   EXPECT_TRUE(host.locks().live().empty());
   EXPECT_TRUE(host.locks().domains().empty());
}

TEST_F(LockTest, CreationRefusesUnknownDomainsAndTypes)
{
   orr_LockDomainID domain = makeDomain();
   orr_SpinlockProps props{};
   props.type = ORR_SPINLOCK_PLAIN;
   props.domain = domain + 1000;
   orr_Spinlock lock = nullptr;
   EXPECT_EQ(orr_SpinlockCreate(&props, &lock), ORR_INVALID_HANDLE);
   props.domain = domain;
   props.type = static_cast<orr_SpinlockType>(2);
   EXPECT_EQ(orr_SpinlockCreate(&props, &lock), ORR_BAD_PARAM);
   EXPECT_EQ(lock, nullptr);
   orr_LockDomainDestroy(domain);
}

TEST_F(LockTest, DestroyingADomainWithLiveLocksIsAViolation)
{
   orr_LockDomainID domain = makeDomain("busy.domain");
   orr_Spinlock lock = makeLock(domain, "still.here", 1);
   orr_LockDomainDestroy(domain);
   auto violations = takeViolations();
   ASSERT_EQ(violations.size(), 1u);
   EXPECT_THAT(violations[0], HasSubstr("'busy.domain' still has 1 live spinlock"));
   orr_SpinlockDestroy(lock);
}

TEST_F(LockTest, ZeroFilledMutexExcludesAcrossThreads)
{
   orr_Mutex mutex{};
   long counter = 0;
   auto work = [&] {
      for (int i = 0; i < 20000; ++i) {
         orr_MutexLock(&mutex);
         ++counter;
         orr_MutexUnlock(&mutex);
      }
   };
   std::thread other(work);
   work();
   other.join();
   EXPECT_EQ(counter, 40000);
}

TEST_F(LockTest, SpinlocksMayBeTakenUnderAMutex)
{
   orr_Mutex mutex = ORR_MUTEX_INITIALIZER("test.mutex");
   orr_LockDomainID domain = makeDomain();
   orr_Spinlock lock = makeLock(domain, "test.spin", 1);
   orr_MutexLock(&mutex);
   orr_SpinlockLock(lock);
   orr_SpinlockUnlock(lock);
   orr_MutexUnlock(&mutex);
   orr_SpinlockDestroy(lock);
   orr_LockDomainDestroy(domain);
}

// ---------------------------------------------------------------- misuse

struct Misuse {
   const char *name;
   std::function<void(HostUnitTest &, orr_LockDomainID)> act;
   const char *message;   // a regular expression
};

class LockMisuseDeathTest : public HostUnitTest, public ::testing::WithParamInterface<Misuse> {};

void rankOneTimerTakesRankOne(void *lock)
{
   orr_SpinlockLock(static_cast<orr_Spinlock>(lock));
}

void timerSleeps(void *)
{
   orr_WorldSleep(10);
}

void timerKeepsLock(void *lock)
{
   orr_SpinlockLock(static_cast<orr_Spinlock>(lock));
}

const Misuse misuses[] = {
   {"TakingALowerRank",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock fastpath = f.makeLock(d, "sifg.fastpath", 2);
       orr_Spinlock filter = f.makeLock(d, "sifg.filter", 3);
       orr_SpinlockLock(filter);
       orr_SpinlockLock(fastpath);
    },
    "lock rank violation: taking 'sifg.fastpath' \\(rank 2\\) while holding 'sifg.filter' \\(rank 3\\)"},
   {"TakingAnEqualRank",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock tx = f.makeLock(d, "sifg.sec.txratelimit", 6);
       orr_Spinlock rx = f.makeLock(d, "sifg.sec.rxratelimit", 6);
       orr_SpinlockLock(tx);
       orr_SpinlockLock(rx);
    },
    "taking 'sifg.sec.rxratelimit' \\(rank 6\\) while holding 'sifg.sec.txratelimit' \\(rank 6\\)"},
   {"RanksSpanDomains",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock high = f.makeLock(d, "first.high", 5);
       orr_Spinlock low = f.makeLock(f.makeDomain("other"), "second.low", 4);
       orr_SpinlockLock(high);
       orr_SpinlockLock(low);
    },
    "taking 'second.low' \\(rank 4\\) while holding 'first.high' \\(rank 5\\)"},
   {"NamingTheHighestConflictingLock",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock a = f.makeLock(d, "rank.three", 3);
       orr_Spinlock b = f.makeLock(d, "rank.five", 5);
       orr_Spinlock c = f.makeLock(d, "rank.four", 4);
       orr_SpinlockLock(a);
       orr_SpinlockLock(b);
       orr_SpinlockLock(c);
    },
    "taking 'rank.four' \\(rank 4\\) while holding 'rank.five' \\(rank 5\\)"},
   {"TakingALockTwice",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock lock = f.makeLock(d, "once.only", 1);
       orr_SpinlockLock(lock);
       orr_SpinlockLock(lock);
    },
    "'once.only' \\(rank 1\\) is already held by this thread"},
   {"ReadLockingTwice",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock lock = f.makeLock(d, "sifg.sec.config", 4, ORR_SPINLOCK_RW);
       orr_SpinlockReadLock(lock);
       orr_SpinlockReadLock(lock);
    },
    "'sifg.sec.config' \\(rank 4\\) is already held by this thread"},
   {"UnlockingALockNotHeld",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock lock = f.makeLock(d, "not.mine", 1);
       orr_SpinlockUnlock(lock);
    },
    "orr_SpinlockUnlock: 'not.mine' is not held by this thread"},
   {"UnlockingALockHeldByAnotherThread",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock lock = f.makeLock(d, "theirs", 1);
       std::thread([lock] { orr_SpinlockLock(lock); }).join();
       orr_SpinlockUnlock(lock);
    },
    "orr_SpinlockUnlock: 'theirs' is not held by this thread"},
   {"DestroyingAHeldLock",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock lock = f.makeLock(d, "held.lock", 1);
       orr_SpinlockLock(lock);
       orr_SpinlockDestroy(lock);
    },
    "'held.lock' \\(rank 1\\) is destroyed while held"},
   {"ReadUnlockingAWriteHold",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock lock = f.makeLock(d, "rw.lock", 1, ORR_SPINLOCK_RW);
       orr_SpinlockWriteLock(lock);
       orr_SpinlockReadUnlock(lock);
    },
    "orr_SpinlockReadUnlock: 'rw.lock' is held for writing"},
   {"WriteUnlockingAReadHold",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock lock = f.makeLock(d, "rw.lock", 1, ORR_SPINLOCK_RW);
       orr_SpinlockReadLock(lock);
       orr_SpinlockWriteUnlock(lock);
    },
    "orr_SpinlockWriteUnlock: 'rw.lock' is held for reading"},
   {"PlainLockOnAReaderWriterLock",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock lock = f.makeLock(d, "rw.lock", 1, ORR_SPINLOCK_RW);
       orr_SpinlockLock(lock);
    },
    "orr_SpinlockLock on reader-writer spinlock 'rw.lock'"},
   {"ReadLockOnAPlainLock",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock lock = f.makeLock(d, "plain.lock", 1);
       orr_SpinlockReadLock(lock);
    },
    "orr_SpinlockReadLock on plain spinlock 'plain.lock'"},
   {"SleepingUnderASpinlock",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock lock = f.makeLock(d, "sifg.filter", 3);
       orr_SpinlockLock(lock);
       orr_WorldSleep(10000);
    },
    "orr_WorldSleep while holding spinlock 'sifg.filter' \\(rank 3\\)"},
   {"TakingAMutexUnderASpinlock",
    [](HostUnitTest &f, orr_LockDomainID d) {
       static orr_Mutex mutex = ORR_MUTEX_INITIALIZER("test.mutex");
       orr_Spinlock lock = f.makeLock(d, "sifg.fastpath", 2);
       orr_SpinlockLock(lock);
       orr_MutexLock(&mutex);
    },
    "orr_MutexLock while holding spinlock 'sifg.fastpath' \\(rank 2\\)"},
   {"UnlockingAMutexNotHeld",
    [](HostUnitTest &, orr_LockDomainID) {
       static orr_Mutex mutex = ORR_MUTEX_INITIALIZER("test.mutex");
       orr_MutexUnlock(&mutex);
    },
    "orr_MutexUnlock: mutex 'test.mutex' is not held by this thread"},
   {"TimerCallbackTakingItsOwnRank",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock lock = f.makeLock(d, "rank.one", 1);
       orr_Timer timer = 0;
       (void)orr_TimerSchedule(f.makeQueue(), rankOneTimerTakesRankOne, lock, 0, ORR_TIMER_ONE_SHOT, 0, d, 1, &timer);
       f.host.clock().runDue();
    },
    "taking 'rank.one' \\(rank 1\\) while holding 'timer' \\(rank 1\\)"},
   {"TimerCallbackSleeping",
    [](HostUnitTest &f, orr_LockDomainID) {
       orr_Timer timer = 0;
       (void)orr_TimerAdd(timerSleeps, nullptr, 5, false, 0, &timer);
       f.host.clock().advance(std::chrono::microseconds(5));
    },
    "orr_WorldSleep inside a callback run as 'timer'"},
   {"TimerCallbackReturningWithALock",
    [](HostUnitTest &f, orr_LockDomainID d) {
       orr_Spinlock lock = f.makeLock(d, "kept.lock", 5);
       orr_Timer timer = 0;
       (void)orr_TimerSchedule(f.makeQueue(), timerKeepsLock, lock, 0, ORR_TIMER_ONE_SHOT, 0, d, 1, &timer);
       f.host.clock().runDue();
    },
    "callback run as 'timer' returned holding 'kept.lock'"},
};

TEST_P(LockMisuseDeathTest, AbortsNamingTheLocks)
{
   GTEST_FLAG_SET(death_test_style, "threadsafe");
   orr_LockDomainID domain = makeDomain();
   EXPECT_DEATH(GetParam().act(*this, domain), GetParam().message);
}

INSTANTIATE_TEST_SUITE_P(Misuse, LockMisuseDeathTest, ::testing::ValuesIn(misuses),
                         [](const auto &param) { return std::string(param.param.name); });

}  // namespace
}  // namespace swsec::testing
