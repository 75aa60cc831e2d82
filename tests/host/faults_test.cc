// Fault points: rules by call number, and every host operation that can
// fail consults them and then makes nothing.
#include "host_unit.h"

#include <gmock/gmock.h>

#include <functional>
#include <vector>

using ::testing::ElementsAre;
using ::testing::IsNull;
using ::testing::NotNull;

namespace swsec::testing {
namespace {

using FaultTest = HostUnitTest;

const void *site()
{
   return reinterpret_cast<const void *>(&site);
}

TEST_F(FaultTest, RulesFailTheNthCallFromTheirMakingOnceOrUntilCleared)
{
   orr_HeapID heap = makeHeap("faults");
   orr_HeapFree(heap, orr_HeapAllocWithRA(heap, 8, site()));   // a call before the rule is not counted by it
   host.faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY, 3);
   void *blocks[4];
   for (auto &block : blocks) {
      block = orr_HeapAllocWithRA(heap, 8, site());
   }
   EXPECT_THAT(blocks, ElementsAre(NotNull(), NotNull(), IsNull(), NotNull()));
   EXPECT_EQ(host.faults().calls("orr_HeapAllocWithRA"), 5u);
   for (auto *block : {blocks[0], blocks[1], blocks[3]}) {
      orr_HeapFree(heap, block);
   }
   orr_HeapDestroy(heap);

   host.faults().failFrom("orr_HeapCreate", ORR_LIMIT_EXCEEDED, 2);
   orr_HeapProps props{};
   props.maximumSize = 64;
   orr_HeapID made[4] = {};
   EXPECT_EQ(orr_HeapCreate(&props, &made[0]), ORR_OK);
   EXPECT_EQ(orr_HeapCreate(&props, &made[1]), ORR_LIMIT_EXCEEDED);
   EXPECT_EQ(orr_HeapCreate(&props, &made[2]), ORR_LIMIT_EXCEEDED);
   EXPECT_EQ(made[1], nullptr) << "a failed call leaves its out-parameter alone";
   host.faults().clear();
   EXPECT_EQ(orr_HeapCreate(&props, &made[3]), ORR_OK);
   EXPECT_EQ(host.faults().calls("orr_HeapCreate"), 5u) << "clearing rules keeps the counts";
   orr_HeapDestroy(made[0]);
   orr_HeapDestroy(made[3]);
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
   std::function<orr_Status()> call;
};

TEST_F(FaultTest, EveryOperationThatCanFailObeysItsRule)
{
   orr_LockDomainID domain = makeDomain();
   orr_TimerQueue queue = makeQueue();
   orr_HeapID hashHeap = makeHeap("hash");
   orr_HeapProps heapProps{};
   heapProps.maximumSize = 64;
   orr_LogProps logProps{};
   orr_NameInitialize(&logProps.name, "fault.log");
   orr_Name domainName;
   orr_NameInitialize(&domainName, "fault.domain");
   orr_SpinlockProps lockProps{};
   lockProps.type = ORR_SPINLOCK_RW;
   lockProps.domain = domain;
   const orr_TimerQueueProps queueProps{};
   // Made objects are left to the host: only what a failed call makes counts.
   orr_HeapID heap = nullptr;
   orr_LogHandle log = nullptr;
   orr_LockDomainID madeDomain = ORR_INVALID_LOCK_DOMAIN;
   orr_Spinlock lock = nullptr;
   orr_TimerQueue madeQueue = nullptr;
   orr_Timer timer = 0;
   orr_PlexClientPortHandle port = nullptr;
   orr_SifraFastPath fastPath = nullptr;
   orr_SifraPropertyHandle property = nullptr;
   orr_PortsetMessageCBHandle listenerHandle = 0;
   char buffer[8];
   const FaultPoint points[] = {
      {"orr_HeapCreate", [&] { return orr_HeapCreate(&heapProps, &heap); }},
      {"orr_LogRegister", [&] { return orr_LogRegister(&logProps, &log); }},
      {"orr_LockDomainCreate", [&] { return orr_LockDomainCreate(7, nullptr, &domainName, &madeDomain); }},
      {"orr_SpinlockCreate", [&] { return orr_SpinlockCreate(&lockProps, &lock); }},
      {"orr_TimerQueueCreate", [&] { return orr_TimerQueueCreate(&queueProps, &madeQueue); }},
      {"orr_TimerSchedule",
       [&] { return orr_TimerSchedule(queue, timerCallback, nullptr, 10, ORR_TIMER_ONE_SHOT, 0, domain, 1, &timer); }},
      {"orr_TimerAdd", [&] { return orr_TimerAdd(timerCallback, nullptr, 10, false, 0, &timer); }},
      {"orr_PlexClientPortRegister", [&] { return orr_PlexClientPortRegister(&port, 0, "fault.port", &plexOps); }},
      {"orr_SifraRegisterFastPath",
       [&] {
          return orr_SifraRegisterFastPath("fault.fastpath", ORR_SIFRA_FASTPATH_REVISION, ORR_SIFRA_FASTPATH_REVISION,
                                           7, &fastPathOps, nullptr, &fastPath);
       }},
      {"orr_SifraPropertyRegister",
       [&] { return orr_SifraPropertyRegister(&property, "fault.property", &propertyOps); }},
      {"orr_PortsetRegisterMessageCB",
       [&] { return orr_PortsetRegisterMessageCB(nullptr, 0, 1, listener, nullptr, &listenerHandle); }},
      {"orr_StringFormat", [&] { return orr_StringFormat(buffer, sizeof buffer, 0, "%d", 1); }},
      {"Hash_Alloc",
       [&] {
          Hash_Table *table = Hash_Alloc(hashHeap, 4);
          if (table == nullptr) {
             return ORR_TRY_AGAIN;
          }
          Hash_Free(table);
          return ORR_OK;
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
      EXPECT_EQ(point.call(), ORR_TRY_AGAIN);
      EXPECT_EQ(holdings(), before);
      EXPECT_EQ(host.faults().calls(point.op), callsBefore + 1);
      EXPECT_EQ(point.call(), ORR_OK) << "the rule fired once";
   }
}

}  // namespace
}  // namespace swsec::testing
