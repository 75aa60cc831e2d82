// Fault points: rules by call number, and every host operation that can
// fail consults them and then makes nothing.
#include "host_unit.h"

#include <functional>
#include <thread>
#include <vector>
#include <stdexcept>

namespace swsec::testing {
namespace {

using FaultTest = HostUnitTest;

const void *site()
{
   return reinterpret_cast<const void *>(&site);
}

TEST_F(FaultTest, FailOnceFailsOnlyTheNthCallFromNow)
{
   orr_HeapID heap = makeHeap("faults");
   host.faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY, 3);
   void *blocks[4];
   for (auto &block : blocks) {
      block = orr_HeapAllocWithRA(heap, 8, site());
   }
   EXPECT_NE(blocks[0], nullptr);
   EXPECT_NE(blocks[1], nullptr);
   EXPECT_EQ(blocks[2], nullptr);
   EXPECT_NE(blocks[3], nullptr);
   EXPECT_EQ(host.faults().calls("orr_HeapAllocWithRA"), 4u);
   for (auto *block : blocks) {
      if (block != nullptr) {
         orr_HeapFree(heap, block);
      }
   }
   orr_HeapDestroy(heap);
}

TEST_F(FaultTest, NthCountsFromWhenTheRuleIsMade)
{
   orr_HeapID heap = makeHeap("one");
   host.faults().failOnce("orr_HeapCreate", ORR_LIMIT_EXCEEDED);
   orr_HeapProps props{};
   props.maximumSize = 64;
   orr_HeapID other = nullptr;
   EXPECT_EQ(orr_HeapCreate(&props, &other), ORR_LIMIT_EXCEEDED);
   EXPECT_EQ(other, nullptr) << "a failed call leaves its out-parameter alone";
   EXPECT_EQ(orr_HeapCreate(&props, &other), ORR_OK);
   orr_HeapDestroy(other);
   orr_HeapDestroy(heap);
}

TEST_F(FaultTest, FailFromFailsEveryCallUntilCleared)
{
   host.faults().failFrom("orr_SpinlockCreate", ORR_NO_MEMORY, 2);
   orr_LockDomainID domain = makeDomain();
   orr_SpinlockProps props{};
   props.type = ORR_SPINLOCK_PLAIN;
   props.domain = domain;
   orr_Spinlock locks[4] = {};
   EXPECT_EQ(orr_SpinlockCreate(&props, &locks[0]), ORR_OK);
   EXPECT_EQ(orr_SpinlockCreate(&props, &locks[1]), ORR_NO_MEMORY);
   EXPECT_EQ(orr_SpinlockCreate(&props, &locks[2]), ORR_NO_MEMORY);
   host.faults().clear();
   EXPECT_EQ(orr_SpinlockCreate(&props, &locks[3]), ORR_OK);
   EXPECT_EQ(host.locks().live().size(), 2u);
   EXPECT_EQ(host.faults().calls("orr_SpinlockCreate"), 4u) << "clearing rules keeps the counts";
   orr_SpinlockDestroy(locks[0]);
   orr_SpinlockDestroy(locks[3]);
   orr_LockDomainDestroy(domain);
}

// Each thread counts in a shard of its own while it lives; threads beyond
// the shards share one, and a shard given back keeps what was counted.
TEST_F(FaultTest, CallsFromManyThreadsAtOnceAreCountedExactly)
{
   constexpr int kThreads = 24;
   constexpr int kCallsEach = 2000;
   for (int wave = 0; wave < 2; ++wave) {
      std::vector<std::thread> threads;
      for (int thread = 0; thread < kThreads; ++thread) {
         threads.emplace_back([] {
            uint8_t mac[6];
            for (int call = 0; call < kCallsEach; ++call) {
               (void)Net_StrToMac("02:00:00:00:00:01", mac);
            }
         });
      }
      for (auto &thread : threads) {
         thread.join();
      }
   }
   EXPECT_EQ(host.faults().calls("Net_StrToMac"), 2u * kThreads * kCallsEach);
   host.faults().failOnce("Net_StrToMac", ORR_FAILURE, 2);
   uint8_t mac[6];
   EXPECT_EQ(Net_StrToMac("02:00:00:00:00:01", mac), ORR_OK);
   EXPECT_EQ(Net_StrToMac("02:00:00:00:00:01", mac), ORR_FAILURE) << "rules count on from the exact total";
}

TEST_F(FaultTest, RulesForUnknownOperationsAreRefused)
{
   EXPECT_THROW(host.faults().failOnce("orr_HeapAlloc", ORR_NO_MEMORY), std::invalid_argument);
   EXPECT_THROW(host.faults().failFrom("orr_HeapCreate", ORR_NO_MEMORY, 0), std::invalid_argument);
   EXPECT_THROW((void)host.faults().calls("orr_Nothing"), std::invalid_argument);
}

orr_Status noPlexWrite(void *, void *, void *, const char *, int32_t)
{
   return ORR_OK;
}
const orr_PlexClientPortOps plexOps = {.write = noPlexWrite, .read = nullptr, .poll = nullptr, .cleanup = nullptr};
const orr_SifraFastPathOps fastPathOps = {};
const orr_SifraPropertyOps propertyOps = {};
void timerCallback(void *) {}
void listener(uint32_t, uint64_t, const orr_PortsetMessageHeader *) {}

// Each operation that returns a status, called the way a module would. A
// failed call must report the injected status and make nothing that the
// host would then find left over.
struct FaultPoint {
   const char *op;
   std::function<orr_Status(orr_LockDomainID, orr_TimerQueue)> call;
};

TEST_F(FaultTest, EveryOperationThatCanFailObeysItsRule)
{
   orr_LockDomainID domain = makeDomain();
   orr_TimerQueue queue = makeQueue();
   const FaultPoint points[] = {
      {"orr_HeapCreate",
       [](auto, auto) {
          orr_HeapProps props{};
          props.maximumSize = 64;
          orr_HeapID heap = nullptr;
          return orr_HeapCreate(&props, &heap);
       }},
      {"orr_LogRegister",
       [](auto, auto) {
          orr_LogProps props{};
          orr_NameInitialize(&props.name, "fault.log");
          orr_LogHandle log = nullptr;
          return orr_LogRegister(&props, &log);
       }},
      {"orr_LockDomainCreate",
       [](auto, auto) {
          orr_Name name;
          orr_NameInitialize(&name, "fault.domain");
          orr_LockDomainID made = ORR_INVALID_LOCK_DOMAIN;
          return orr_LockDomainCreate(7, nullptr, &name, &made);
       }},
      {"orr_SpinlockCreate",
       [](orr_LockDomainID d, auto) {
          orr_SpinlockProps props{};
          props.type = ORR_SPINLOCK_RW;
          props.domain = d;
          orr_Spinlock lock = nullptr;
          return orr_SpinlockCreate(&props, &lock);
       }},
      {"orr_TimerQueueCreate",
       [](auto, auto) {
          orr_TimerQueueProps props{};
          orr_TimerQueue made = nullptr;
          return orr_TimerQueueCreate(&props, &made);
       }},
      {"orr_TimerSchedule",
       [](orr_LockDomainID d, orr_TimerQueue q) {
          orr_Timer timer = 0;
          return orr_TimerSchedule(q, timerCallback, nullptr, 10, ORR_TIMER_ONE_SHOT, 0, d, 1, &timer);
       }},
      {"orr_TimerAdd",
       [](auto, auto) {
          orr_Timer timer = 0;
          return orr_TimerAdd(timerCallback, nullptr, 10, false, 0, &timer);
       }},
      {"orr_PlexClientPortRegister",
       [](auto, auto) {
          orr_PlexClientPortHandle handle = nullptr;
          return orr_PlexClientPortRegister(&handle, 0, "fault.port", &plexOps);
       }},
      {"orr_SifraRegisterFastPath",
       [](auto, auto) {
          orr_SifraFastPath fastPath = nullptr;
          return orr_SifraRegisterFastPath("fault.fastpath", ORR_SIFRA_FASTPATH_REVISION,
                                           ORR_SIFRA_FASTPATH_REVISION, 7, &fastPathOps, nullptr, &fastPath);
       }},
      {"orr_SifraPropertyRegister",
       [](auto, auto) {
          orr_SifraPropertyHandle handle = nullptr;
          return orr_SifraPropertyRegister(&handle, "fault.property", &propertyOps);
       }},
      {"orr_PortsetRegisterMessageCB",
       [](auto, auto) {
          orr_PortsetMessageCBHandle handle = 0;
          return orr_PortsetRegisterMessageCB(nullptr, 0, 1, listener, nullptr, &handle);
       }},
      {"orr_StringFormat",
       [](auto, auto) {
          char buffer[8];
          return orr_StringFormat(buffer, sizeof buffer, 0, "%d", 1);
       }},
   };
   // What the host holds, as far as its facade shows it.
   auto holdings = [&] {
      return std::vector<size_t>{host.locks().live().size(),        host.locks().domains().size(),
                                 host.clock().pendingTimers(),      host.plex().clientPorts().size(),
                                 host.sifra().fastPaths().size(),   host.sifra().properties().size(),
                                 host.portsets().listeners().size(), host.heap().liveBlocks()};
   };
   for (const auto &point : points) {
      SCOPED_TRACE(point.op);
      const auto before = holdings();
      const auto callsBefore = host.faults().calls(point.op);
      host.faults().failOnce(point.op, ORR_TRY_AGAIN);
      EXPECT_EQ(point.call(domain, queue), ORR_TRY_AGAIN);
      EXPECT_EQ(holdings(), before);
      EXPECT_EQ(host.faults().calls(point.op), callsBefore + 1);
      EXPECT_EQ(point.call(domain, queue), ORR_OK) << "the rule fired once";
   }
}

TEST_F(FaultTest, HashAllocFailsByReturningNull)
{
   orr_HeapID heap = makeHeap("hash");
   host.faults().failOnce("Hash_Alloc", ORR_NO_MEMORY);
   EXPECT_EQ(Hash_Alloc(heap, 4), nullptr);
   EXPECT_EQ(host.heap().liveBlocks(), 0u);
   Hash_Table *table = Hash_Alloc(heap, 4);
   ASSERT_NE(table, nullptr);
   Hash_Free(table);
   orr_HeapDestroy(heap);
}

}  // namespace
}  // namespace swsec::testing
