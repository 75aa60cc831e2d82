// Lock domains, spinlocks and mutexes: real exclusion, and an abort naming
// the locks for every misuse a kernel would only survive by luck.
#include "host_unit.h"

#include <gmock/gmock.h>

#include <utility>
#include <vector>
#include <thread>

using ::testing::ElementsAre;
using ::testing::FieldsAre;
using ::testing::HasSubstr;

namespace swsec::testing {
namespace {

using LockTest = HostUnitTest;

TEST_F(LockTest, SpinlocksAndAZeroFilledMutexExcludeAcrossThreads)
{
   orr_Mutex mutex{};
   orr_LockDomainID domain = makeDomain("second");
   orr_LockDomainID first = makeDomain("first");
   orr_Spinlock rw = makeLock(domain, "test.rw", 3, ORR_SPINLOCK_RW);
   orr_Spinlock plain = makeLock(first, "test.plain", 2);
   constexpr int kRounds = 20000;
   // Plain increments, not atomic ones: only the lock keeps them whole.
   long underPlain = 0;
   long underWrite = 0;
   long underMutex = 0;
   auto work = [&] {
      for (int i = 0; i < kRounds; ++i) {
         orr_MutexLock(&mutex);
         ++underMutex;
         orr_MutexUnlock(&mutex);
         orr_SpinlockLock(plain);
         ++underPlain;
         orr_SpinlockWriteLock(rw);   // ranks rising, across domains
         ++underWrite;
         orr_SpinlockUnlock(plain);   // given back in any order
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
   EXPECT_EQ(underPlain + underWrite + underMutex, 6 * kRounds);
   orr_MutexLock(&mutex);   // spinlocks may be taken under a mutex
   orr_SpinlockLock(plain);
   orr_SpinlockUnlock(plain);
   orr_MutexUnlock(&mutex);
   // name, type, rank, acquisitions; in creation order
   EXPECT_THAT(host.locks().live(), ElementsAre(FieldsAre("test.rw", ORR_SPINLOCK_RW, 3u, 4u * kRounds),
                                                FieldsAre("test.plain", ORR_SPINLOCK_PLAIN, 2u, 2u * kRounds + 1)));
   EXPECT_EQ(host.locks().domains(), (std::vector<std::string>{"second", "first"}));
   orr_SpinlockDestroy(plain);
   orr_SpinlockDestroy(rw);
   orr_LockDomainDestroy(domain);
   orr_LockDomainDestroy(first);
   EXPECT_TRUE(host.locks().live().empty());
   EXPECT_TRUE(host.locks().domains().empty());
}

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
   {"NamingTheHighestConflictingLock", {{"rank.three", 3}, {"rank.five", 5}, {"rank.four", 4}},
    {{Lock, 0}, {Lock, 1}, {Lock, 2}}, "taking 'rank.four' \\(rank 4\\) while holding 'rank.five' \\(rank 5\\)"},
   {"TakingALockTwice", {{"once.only", 1}}, {{Lock, 0}, {Lock, 0}},
    "'once.only' \\(rank 1\\) is already held by this thread"},
   {"ReadLockingTwice", {{"sifg.sec.config", 4, kRw}}, {{ReadLock, 0}, {ReadLock, 0}},
    "'sifg.sec.config' \\(rank 4\\) is already held by this thread"},
   {"UnlockingALockNotHeld", {{"not.mine", 1}}, {{Unlock, 0}},
    "orr_SpinlockUnlock: 'not.mine' is not held by this thread"},
   {"UnlockingALockHeldByAnotherThread", {{"theirs", 1}}, {{LockOnAnotherThread, 0}, {Unlock, 0}},
    "orr_SpinlockUnlock: 'theirs' is not held by this thread"},
   {"DestroyingAHeldLock", {{"held.lock", 1}}, {{Lock, 0}, {Destroy, 0}},
    "'held.lock' \\(rank 1\\) is destroyed while held"},
   {"ReadUnlockingAWriteHold", {{"rw.lock", 1, kRw}}, {{WriteLock, 0}, {ReadUnlock, 0}},
    "orr_SpinlockReadUnlock: 'rw.lock' is held for writing"},
   {"WriteUnlockingAReadHold", {{"rw.lock", 1, kRw}}, {{ReadLock, 0}, {WriteUnlock, 0}},
    "orr_SpinlockWriteUnlock: 'rw.lock' is held for reading"},
   {"PlainLockOnAReaderWriterLock", {{"rw.lock", 1, kRw}}, {{Lock, 0}},
    "orr_SpinlockLock on reader-writer spinlock 'rw.lock'"},
   {"ReadLockOnAPlainLock", {{"plain.lock", 1}}, {{ReadLock, 0}},
    "orr_SpinlockReadLock on plain spinlock 'plain.lock'"},
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
