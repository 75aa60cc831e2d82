// Slow paths driven as the hypervisor drives them, against a fast path made
// here: registration and busy withdrawals, scripted replies delivered on
// request, the host's pairing of filters, and the contract checks.
#include "host_unit.h"

#include <gmock/gmock.h>

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

namespace swsec::testing {
namespace {

using host::SlowPathRequestKind;

// What the fast path saw and how it answers.
struct Reply {
   orr_SifraFilter record;
   void *cookie;
   orr_Status status;
};
struct SlowPathAgent {
   orr_SifraFilterHandle handle = nullptr;
   int busyUnregisters = 0;
   int unregisterCalls = 0;
   int slowPathRecords[4] = {};
   std::vector<Reply> replies;
   bool resendOnFailure = false;
};
SlowPathAgent spAgent;
int filterRecord = 0;

void onReply(orr_SifraFilter record, void *cookie, orr_Status status)
{
   spAgent.replies.push_back({record, cookie, status});
   if (status != ORR_OK && spAgent.resendOnFailure) {
      EXPECT_EQ(orr_SifraSetSlowPath(spAgent.handle, 9, onReply, cookie, 100), ORR_OK);
   }
}

orr_Status registerSlowPath(orr_SifraAgentHandle, uint32_t id, orr_SifraSlowPath *slowPath)
{
   *slowPath = &spAgent.slowPathRecords[id % 4];
   return ORR_OK;
}

orr_Status unregisterSlowPath(orr_SifraSlowPath)
{
   ++spAgent.unregisterCalls;
   if (spAgent.busyUnregisters > 0) {
      --spAgent.busyUnregisters;
      return ORR_BUSY;
   }
   return ORR_OK;
}

orr_Status createFilter(orr_SifraAgentHandle, orr_SifraFilterHandle handle, orr_SifraFilter *filter, uint8_t)
{
   spAgent.handle = handle;
   *filter = &filterRecord;
   return ORR_OK;
}

orr_Status destroyFilter(orr_SifraFilter)
{
   return ORR_OK;
}

const orr_SifraFastPathOps ops = {.registerSlowPath = registerSlowPath,
                                  .unregisterSlowPath = unregisterSlowPath,
                                  .createFilter = createFilter,
                                  .destroyFilter = destroyFilter};

class SifraSlowPathsTest : public HostUnitTest {
public:
   SifraSlowPathsTest()
   {
      spAgent = SlowPathAgent{};
      host.portsets().addPortset("vswitch0");
      host.portsets().addPort("vswitch0", 10);
      EXPECT_EQ(orr_SifraRegisterFastPath("test-agent", ORR_SIFRA_FASTPATH_REVISION, ORR_SIFRA_FASTPATH_REVISION, 7,
                                          &ops, nullptr, &fastPath),
                ORR_OK);
      EXPECT_EQ(host.sifra().createFilter("test-agent", 10, {}, &filter), ORR_OK);
   }

   ~SifraSlowPathsTest() override
   {
      if (fastPath != nullptr) {
         orr_SifraUnregisterFastPath(fastPath);
      }
   }

   host::SlowPaths &slowPaths() { return host.sifra().slowPaths(); }

   orr_SifraFastPath fastPath = nullptr;
   host::FilterId filter = 0;
   int cookie = 0;
};

TEST_F(SifraSlowPathsTest, RepliesWaitForTheTestAndCarryTheScriptedOutcomes)
{
   slowPaths().scriptReplies(SlowPathRequestKind::Set, {ORR_TIMEOUT});
   EXPECT_EQ(orr_SifraSetSlowPath(spAgent.handle, 9, onReply, &cookie, 2000), ORR_OK);
   ASSERT_EQ(slowPaths().pendingReplies().size(), 1u);
   EXPECT_EQ(slowPaths().pendingReplies()[0].status, ORR_TIMEOUT);
   EXPECT_THAT(spAgent.replies, IsEmpty());

   spAgent.resendOnFailure = true;
   EXPECT_EQ(slowPaths().deliverReplies(), 1u) << "the reply's own request waits for the next call";
   ASSERT_EQ(spAgent.replies.size(), 1u);
   EXPECT_EQ(spAgent.replies[0].record, &filterRecord);
   EXPECT_EQ(spAgent.replies[0].cookie, &cookie);
   EXPECT_EQ(spAgent.replies[0].status, ORR_TIMEOUT);
   EXPECT_FALSE(host.sifra().filter(filter)->slowPathID);

   EXPECT_EQ(slowPaths().deliverReplies(filter), 1u);
   EXPECT_EQ(spAgent.replies.back().status, ORR_OK) << "the default once the script is used up";
   EXPECT_EQ(host.sifra().filter(filter)->slowPathID, 9u);
   const auto requests = slowPaths().requests();
   ASSERT_EQ(requests.size(), 2u);
   EXPECT_EQ(requests[0].timeoutMs, 2000);
   EXPECT_EQ(requests[1].timeoutMs, 100);

   host.faults().failOnce("orr_SifraClearSlowPath", ORR_BUSY);
   EXPECT_EQ(orr_SifraClearSlowPath(spAgent.handle), ORR_BUSY);
   EXPECT_EQ(host.sifra().filter(filter)->slowPathID, 9u) << "a failed clear changes nothing";
   EXPECT_EQ(orr_SifraClearSlowPath(spAgent.handle), ORR_OK);
   EXPECT_FALSE(host.sifra().filter(filter)->slowPathID);
}

TEST_F(SifraSlowPathsTest, AutoDeliveryRepliesAfterEachCallIntoTheModule)
{
   slowPaths().setAutoDeliver(true);
   EXPECT_EQ(orr_SifraSetSlowPath(spAgent.handle, 9, onReply, &cookie, 10), ORR_OK);
   EXPECT_EQ(slowPaths().pendingReplies().size(), 1u) << "a request outside a module call waits";
   EXPECT_EQ(slowPaths().registerSlowPath("test-agent", 1), ORR_OK);
   EXPECT_THAT(slowPaths().pendingReplies(), IsEmpty());
   ASSERT_EQ(spAgent.replies.size(), 1u);
   EXPECT_EQ(host.sifra().filter(filter)->slowPathID, 9u);
}

TEST_F(SifraSlowPathsTest, BusyWithdrawalsAreCalledAgainUntilTheyGo)
{
   EXPECT_EQ(slowPaths().registerSlowPath("test-agent", 1), ORR_OK);
   EXPECT_EQ(slowPaths().registerSlowPath("test-agent", 2), ORR_OK);
   EXPECT_THROW((void)slowPaths().registerSlowPath("test-agent", 1), std::invalid_argument);
   EXPECT_THROW((void)slowPaths().registerSlowPath("other", 3), std::invalid_argument);

   spAgent.busyUnregisters = 2;
   EXPECT_EQ(slowPaths().unregisterSlowPath(1), ORR_BUSY);
   ASSERT_EQ(slowPaths().registered().size(), 2u);
   EXPECT_TRUE(slowPaths().registered()[0].withdrawing);
   EXPECT_FALSE(slowPaths().registered()[1].withdrawing);
   EXPECT_EQ(slowPaths().retryWithdrawals(), 1u);
   EXPECT_EQ(slowPaths().retryWithdrawals(), 0u);
   ASSERT_EQ(slowPaths().registered().size(), 1u);
   EXPECT_EQ(slowPaths().registered()[0].id, 2u);

   // The fast path's withdrawal takes its slow paths along, however busy.
   spAgent.busyUnregisters = 5;
   orr_SifraUnregisterFastPath(std::exchange(fastPath, nullptr));
   EXPECT_TRUE(slowPaths().registered().empty());
   EXPECT_EQ(spAgent.unregisterCalls, 3 + 6);
}

TEST_F(SifraSlowPathsTest, ContractBreachesAreViolations)
{
   struct Case {
      const char *name;
      std::function<void(SifraSlowPathsTest &)> breach;
      const char *violation;
   };
   const Case cases[] = {
      {"request under a spinlock",
       [](SifraSlowPathsTest &t) {
          const orr_Spinlock lock = t.makeLock(t.makeDomain(), "test.lock", 2);
          orr_SpinlockLock(lock);
          EXPECT_EQ(orr_SifraClearSlowPath(spAgent.handle), ORR_OK);
          orr_SpinlockUnlock(lock);
       },
       "orr_SifraClearSlowPath: request made while holding spinlock 'test.lock'"},
      {"second reply owed",
       [](SifraSlowPathsTest &t) {
          EXPECT_EQ(orr_SifraSetSlowPath(spAgent.handle, 9, onReply, &t.cookie, 10), ORR_OK);
          EXPECT_EQ(orr_SifraSetSlowPath(spAgent.handle, 9, onReply, &t.cookie, 10), ORR_OK);
          EXPECT_EQ(t.slowPaths().deliverReplies(), 2u);
       },
       "a second set request for filter 1 while its reply is owed"},
      {"delivery under a lock",
       [](SifraSlowPathsTest &t) {
          EXPECT_EQ(orr_SifraSetSlowPath(spAgent.handle, 9, onReply, &t.cookie, 10), ORR_OK);
          const orr_Spinlock lock = t.makeLock(t.makeDomain("test.other"), "test.lock", 2);
          orr_SpinlockLock(lock);
          EXPECT_EQ(t.slowPaths().deliverReplies(), 0u);
          orr_SpinlockUnlock(lock);
          EXPECT_EQ(t.slowPaths().deliverReplies(), 1u);
       },
       "slow path replies delivered from a context that holds a spinlock"},
      {"unknown filter",
       [](SifraSlowPathsTest &) { EXPECT_EQ(orr_SifraClearSlowPath(nullptr), ORR_INVALID_HANDLE); },
       "orr_SifraClearSlowPath: unknown filter handle"},
      // Last: the filter goes.
      {"reply lost with its filter",
       [](SifraSlowPathsTest &t) {
          EXPECT_EQ(orr_SifraSetSlowPath(spAgent.handle, 9, onReply, &t.cookie, 10), ORR_OK);
          EXPECT_EQ(t.host.sifra().destroyFilter(t.filter), ORR_OK);
          EXPECT_THAT(t.slowPaths().pendingReplies(), IsEmpty());
       },
       "filter 1 destroyed while 1 slow path reply(s) were owed to it"},
   };
   for (const Case &c : cases) {
      SCOPED_TRACE(c.name);
      c.breach(*this);
      EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr(c.violation)));
   }
}

}  // namespace
}  // namespace swsec::testing
