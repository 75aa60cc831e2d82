// Slow paths registered, attached, retried and withdrawn: the filters of
// the built-in agent kept on the least loaded slow path while the host
// accepts, refuses and answers the module's requests as each test scripts.
#include "slow_path_fixture.h"

#include <gmock/gmock.h>

using ::testing::ElementsAre;
using ::testing::IsEmpty;

namespace swsec::testing {
namespace {

using host::SlowPathRequestKind;

// ---------------------------------------------------------------- attaching

TEST_F(SlowPathTest, filters_before_a_registration_wait_for_its_callback_and_later_ones_attach_at_creation)
{
   const host::FilterId early = create({.name = "early"});
   EXPECT_EQ(state(early), SifraGenericAttachDetached);
   const size_t timers = host().clock().pendingTimers();

   registerSlowPath(1);
   EXPECT_THAT(setRequests(), IsEmpty()) << "the registration itself asks for nothing";
   EXPECT_NE(agent()->attachTimer, 0u);
   EXPECT_EQ(host().clock().pendingTimers(), timers + 1);
   EXPECT_EQ(state(early), SifraGenericAttachDetached);

   runAttach();
   EXPECT_EQ(agent()->attachTimer, 0u);
   EXPECT_EQ(state(early), SifraGenericAttachAttaching);
   EXPECT_EQ(record(early)->refCount, 2u) << "the reply's reference";
   EXPECT_EQ(slowPath(1)->numFilters, 1u);
   EXPECT_EQ(slowPath(1)->useCount, 2u);
   ASSERT_EQ(slowPaths().requests().size(), 1u);
   EXPECT_EQ(slowPaths().requests()[0].timeoutMs, 2000) << "the module parameter's default";
   EXPECT_TRUE(loggedWithPrefix(host(), "early: Attaching to slow path #1", 1));
   expectConsistent();

   EXPECT_EQ(deliver(), 1u);
   EXPECT_EQ(state(early), SifraGenericAttachAttached);
   EXPECT_EQ(host().sifra().filter(early)->slowPathID, 1u);
   EXPECT_TRUE(loggedWithPrefix(host(), "early: Successfully set slow path #1", 1));

   const host::FilterId late = create({.name = "late"});
   EXPECT_EQ(state(late), SifraGenericAttachAttaching) << "attached at creation, without a callback";
   EXPECT_EQ(host().clock().pendingTimers(), timers + 1) << "the new port's own timer alone";
   EXPECT_EQ(deliver(), 1u);
   EXPECT_EQ(moduleSlowPath(late), 1u);
   EXPECT_EQ(slowPath(1)->useCount, 3u);
   expectConsistent();
}

struct LoadCase {
   const char *name;
   int onFirst;         // filters created while only slow path 1 is registered
   int onSecond;        // filters created after slow path 2 registered (they go there)
   uint32_t expected;   // where the next filter goes
};

class LeastLoadedTest : public SlowPathTest, public ::testing::WithParamInterface<LoadCase> {};

TEST_P(LeastLoadedTest, a_new_filter_goes_to_the_least_loaded_slow_path_ties_to_the_oldest)
{
   const LoadCase &c = GetParam();
   registerSlowPath(1);
   for (int i = 0; i < c.onFirst; ++i) {
      create({.name = "first" + std::to_string(i)});
   }
   registerSlowPath(2);
   runAttach();
   for (int i = 0; i < c.onSecond; ++i) {
      EXPECT_EQ(moduleSlowPath(create({.name = "second" + std::to_string(i)})), 2u);
   }
   deliver();
   EXPECT_EQ(slowPath(1)->numFilters, static_cast<uint32_t>(c.onFirst));
   EXPECT_EQ(slowPath(2)->numFilters, static_cast<uint32_t>(c.onSecond));

   EXPECT_EQ(moduleSlowPath(create({.name = "new"})), c.expected);
   deliver();
   expectConsistent();
}

INSTANTIATE_TEST_SUITE_P(Loads, LeastLoadedTest,
                         ::testing::Values(LoadCase{"three_and_one", 3, 1, 2}, LoadCase{"two_and_two", 2, 2, 1},
                                           LoadCase{"none_yet", 0, 0, 1}, LoadCase{"one_and_none", 1, 0, 2}),
                         [](const auto &param) { return std::string(param.param.name); });

TEST_F(SlowPathTest, a_registration_while_the_callback_has_its_locks_released_makes_it_scan_again)
{
   const host::FilterId first = create({.name = "a"});
   const host::FilterId second = create({.name = "b"});
   registerSlowPath(1);

   // The first scan: a's request lets slow path 2 register meanwhile; b's
   // request is refused, so only a second scan can attach b.
   host().faults().failOnce("orr_SifraSetSlowPath", ORR_NO_MEMORY, 2);
   std::vector<std::pair<orr_Timer, uint8_t>> seen;
   slowPaths().onRequest([&](const host::SlowPathRequest &request) {
      seen.emplace_back(agent()->attachTimer, agent()->attachRescan);
      if (request.filter == first) {
         registerSlowPath(2);
         EXPECT_EQ(agent()->attachRescan, 1) << "the running callback is asked to scan again";
      }
   });
   const size_t timers = host().clock().pendingTimers();
   runAttach();
   slowPaths().onRequest(nullptr);

   EXPECT_THAT(setRequests(), ElementsAre(std::to_string(first) + "->1", std::to_string(second) + "->2",
                                          std::to_string(second) + "->2"));
   ASSERT_EQ(seen.size(), 3u);
   for (const auto &[timer, rescan] : seen) {
      EXPECT_NE(timer, 0u) << "attachTimer stays set until the last scan ends";
   }
   EXPECT_EQ(agent()->attachTimer, 0u);
   EXPECT_EQ(host().clock().pendingTimers(), timers - 1) << "the second registration scheduled no callback";
   EXPECT_EQ(state(second), SifraGenericAttachAttaching);
   deliver();
   EXPECT_EQ(moduleSlowPath(first), 1u);
   EXPECT_EQ(moduleSlowPath(second), 2u);
   expectConsistent();
}

// The walks of the filter list release both locks around each request; a
// filter after the current one may be destroyed meanwhile (its record
// freed and poisoned), so the walk must read its successor only afterwards.
TEST_F(SlowPathTest, a_walk_goes_on_past_a_filter_destroyed_while_its_locks_were_released)
{
   for (const bool unregistering : {false, true}) {
      SCOPED_TRACE(unregistering ? "unregistration's walk" : "attach callback's walk");
      if (unregistering) {
         registerSlowPath(1);
      }
      const host::FilterId a = create({.name = "a"});
      const host::FilterId b = create({.name = "b"});
      const host::FilterId c = create({.name = "c"});
      if (unregistering) {
         deliver();
      } else {
         registerSlowPath(1);
      }
      bool destroyed = false;
      slowPaths().onRequest([&](const host::SlowPathRequest &request) {
         if (request.filter == a && !destroyed) {
            destroyed = true;
            EXPECT_EQ(host().sifra().destroyFilter(b), ORR_OK);
         }
      });
      slowPaths().clearRequests();
      if (unregistering) {
         EXPECT_EQ(slowPaths().unregisterSlowPath(1), ORR_OK);
      } else {
         runAttach();
      }
      slowPaths().onRequest(nullptr);
      EXPECT_TRUE(destroyed);
      EXPECT_FALSE(host().sifra().filter(b));
      std::vector<host::FilterId> asked;
      for (const auto &request : slowPaths().requests()) {
         if (request.filter != b) {
            asked.push_back(request.filter);
         }
      }
      EXPECT_THAT(asked, ElementsAre(a, c));
      deliver();
      expectConsistent();
      EXPECT_EQ(host().sifra().destroyFilter(a), ORR_OK);
      EXPECT_EQ(host().sifra().destroyFilter(c), ORR_OK);
      if (!unregistering) {
         EXPECT_EQ(slowPaths().unregisterSlowPath(1), ORR_OK);
      }
   }
}

TEST_F(SlowPathTest, a_failed_scheduling_leaves_filters_for_the_next_registration)
{
   const host::FilterId id = create({.name = "a"});
   host().faults().failOnce("orr_TimerSchedule", ORR_NO_MEMORY);
   registerSlowPath(1);
   EXPECT_TRUE(loggedWithPrefix(host(), std::string(kAgent) + ": Could not schedule callback " +
                                           statusText(ORR_NO_MEMORY), 2));
   EXPECT_EQ(agent()->attachTimer, 0u);
   runAttach();
   EXPECT_EQ(state(id), SifraGenericAttachDetached);

   registerSlowPath(2);
   runAttach();
   deliver();
   EXPECT_EQ(moduleSlowPath(id), 1u) << "the least loaded, the oldest on a tie";
   expectConsistent();
}

// ---------------------------------------------------------------- set requests and replies

TEST_F(SlowPathTest, a_set_request_refused_at_once_leaves_everything_as_before)
{
   registerSlowPath(1);
   runAttach();
   const host::FilterId attached = create({.name = "a"});
   deliver();
   const uint32_t useCount = slowPath(1)->useCount;

   host().faults().failOnce("orr_SifraSetSlowPath", ORR_TRY_AGAIN);
   const host::FilterId refused = create({.name = "b"});
   EXPECT_EQ(state(refused), SifraGenericAttachDetached);
   EXPECT_EQ(record(refused)->refCount, 1u);
   EXPECT_EQ(record(refused)->slowPath, nullptr);
   EXPECT_EQ(slowPath(1)->numFilters, 1u);
   EXPECT_EQ(slowPath(1)->useCount, useCount);
   EXPECT_TRUE(loggedWithPrefix(host(), "b: Request to set slow path failed " + statusText(ORR_TRY_AGAIN), 1));
   EXPECT_THAT(slowPaths().pendingReplies(), IsEmpty()) << "no reply comes for a refused request";
   EXPECT_EQ(state(attached), SifraGenericAttachAttached);
   expectConsistent();
}

TEST_F(SlowPathTest, a_slow_path_that_keeps_failing_is_asked_again_at_once_without_end)
{
   constexpr int kFailures = 40;
   registerSlowPath(3);
   slowPaths().scriptReplies(SlowPathRequestKind::Set, std::vector<orr_Status>(kFailures, ORR_TIMEOUT));
   const host::FilterId id = create({.name = "vm"});
   for (int retry = 1; retry <= kFailures; ++retry) {
      ASSERT_EQ(deliver(), 1u);
      EXPECT_EQ(state(id), SifraGenericAttachAttaching);
      EXPECT_EQ(record(id)->attachRetries, static_cast<uint32_t>(retry));
      EXPECT_EQ(record(id)->refCount, 2u) << "one reference, passed from reply to reply";
   }
   EXPECT_EQ(host().log().count("vm: Couldn't set slow path " + statusText(ORR_TIMEOUT)), size_t{kFailures});
   EXPECT_TRUE(loggedWithPrefix(host(), "vm: Retry (#1) to attach slow path #3", 1));
   EXPECT_TRUE(loggedWithPrefix(host(), "vm: Retry (#40) to attach slow path #3", 1));
   const auto requests = slowPaths().requests();
   ASSERT_EQ(requests.size(), size_t{kFailures + 1});
   for (const auto &request : requests) {
      EXPECT_EQ(request.slowPathID, 3u);
      EXPECT_EQ(request.timeoutMs, 2000);
   }
   ASSERT_EQ(deliver(), 1u);
   EXPECT_EQ(state(id), SifraGenericAttachAttached);
   expectConsistent();
}

TEST_F(SlowPathTest, requests_carry_the_timeout_module_parameter)
{
   ASSERT_EQ(host().unload(), ORR_OK);
   ASSERT_EQ(host().load({.parameters = {{"SIFRAGENERIC_SLOWPATH_TIMEOUT", 350}}}), 0);
   host().portsets().addPortset("vs1");
   host().portsets().addPort("vs1", 21);
   registerSlowPath(1);
   slowPaths().scriptReplies(SlowPathRequestKind::Set, {ORR_FAILURE});
   const host::FilterId id = create({}, 21);
   deliver();
   deliver();
   EXPECT_EQ(state(id), SifraGenericAttachAttached);
   ASSERT_EQ(slowPaths().requests().size(), 2u);
   EXPECT_EQ(slowPaths().requests()[0].timeoutMs, 350);
   EXPECT_EQ(slowPaths().requests()[1].timeoutMs, 350);
}

TEST_F(SlowPathTest, a_refused_retry_detaches_the_filter)
{
   registerSlowPath(1);
   slowPaths().scriptReplies(SlowPathRequestKind::Set, {ORR_FAILURE});
   const host::FilterId id = create({.name = "vm"});
   host().faults().failOnce("orr_SifraSetSlowPath", ORR_NO_MEMORY);
   EXPECT_EQ(deliver(), 1u);
   EXPECT_EQ(state(id), SifraGenericAttachDetached);
   EXPECT_EQ(record(id)->refCount, 1u);
   EXPECT_EQ(slowPath(1)->useCount, 1u);
   EXPECT_TRUE(loggedWithPrefix(host(), "vm: Request to set slow path failed " + statusText(ORR_NO_MEMORY), 1));
   expectConsistent();
}

// ---------------------------------------------------------------- detaching and unregistering

TEST_F(SlowPathTest, unregistering_moves_attached_filters_to_another_slow_path_or_detaches_them)
{
   for (const bool another : {true, false}) {
      SCOPED_TRACE(another ? "another slow path" : "no other slow path");
      registerSlowPath(1);
      const host::FilterId a = create({.name = "a"});
      const host::FilterId b = create({.name = "b"});
      deliver();
      if (another) {
         registerSlowPath(2);
         runAttach();
      }
      const uint64_t blocks = host().heap().liveBlocks();

      EXPECT_EQ(slowPaths().unregisterSlowPath(1), ORR_OK);
      EXPECT_EQ(slowPath(1), nullptr);
      EXPECT_EQ(host().heap().liveBlocks(), blocks - 1) << "the record is freed";
      for (const host::FilterId id : {a, b}) {
         EXPECT_EQ(state(id), another ? SifraGenericAttachAttaching : SifraGenericAttachDetached);
         EXPECT_EQ(host().sifra().filter(id)->slowPathID, std::nullopt) << "the host was asked to clear it";
      }
      deliver();
      for (const host::FilterId id : {a, b}) {
         EXPECT_EQ(moduleSlowPath(id), another ? std::optional<uint32_t>(2) : std::nullopt);
      }
      expectConsistent();
      for (const host::FilterId id : {a, b}) {
         EXPECT_EQ(host().sifra().destroyFilter(id), ORR_OK);
      }
      if (another) {
         EXPECT_EQ(slowPaths().unregisterSlowPath(2), ORR_OK);
      }
      EXPECT_TRUE(slowPaths().registered().empty());
   }
}

TEST_F(SlowPathTest, a_transient_clear_failure_keeps_the_unregistration_busy_until_a_later_call)
{
   for (const orr_Status transient : {ORR_NO_MEMORY, ORR_BUSY, ORR_TRY_AGAIN}) {
      SCOPED_TRACE(orr_StatusToString(transient));
      registerSlowPath(1);
      const host::FilterId id = create({.name = "vm"});
      deliver();
      SifraGenericSlowPath *record1 = slowPath(1);

      host().faults().failOnce("orr_SifraClearSlowPath", transient);
      EXPECT_EQ(slowPaths().unregisterSlowPath(1), ORR_BUSY);
      EXPECT_TRUE(loggedWithPrefix(host(), "vm: Transient failure in clearing slow path " + statusText(transient), 2));
      EXPECT_TRUE(loggedWithPrefix(host(), "Could not unregister slow path, use count = 2", 1));
      EXPECT_EQ(state(id), SifraGenericAttachAttached);
      EXPECT_EQ(record(id)->slowPath, record1) << "still on the record being unregistered";
      ASSERT_EQ(slowPaths().registered().size(), 1u);
      EXPECT_TRUE(slowPaths().registered()[0].withdrawing);
      expectConsistent();

      EXPECT_EQ(slowPaths().retryWithdrawals(), 0u);
      EXPECT_TRUE(slowPaths().registered().empty());
      EXPECT_EQ(state(id), SifraGenericAttachDetached);
      EXPECT_EQ(host().sifra().destroyFilter(id), ORR_OK);
      host().log().clear();
   }
}

TEST_F(SlowPathTest, a_pending_set_request_keeps_the_unregistration_busy_until_its_reply)
{
   struct Case {
      const char *name;
      orr_Status reply;
      bool otherSlowPath;
      std::optional<uint32_t> endsOn;
   };
   // A failed reply for a slow path being unregistered is not retried: the
   // filter moves on at once (see the reply's comment).
   for (const Case &c : {Case{"success", ORR_OK, false, std::nullopt}, Case{"failure", ORR_FAILURE, false, std::nullopt},
                         Case{"failure, another slow path", ORR_FAILURE, true, 2u}}) {
      SCOPED_TRACE(c.name);
      registerSlowPath(1);
      slowPaths().scriptReplies(SlowPathRequestKind::Set, {c.reply});
      const host::FilterId id = create({.name = "vm"});
      if (c.otherSlowPath) {
         registerSlowPath(2);
         runAttach();
      }
      EXPECT_EQ(slowPaths().unregisterSlowPath(1), ORR_BUSY);
      EXPECT_EQ(slowPaths().retryWithdrawals(), 1u) << "no reply yet";
      EXPECT_EQ(host().sifra().destroyFilter(id), ORR_BUSY) << "nor can the filter go";
      EXPECT_EQ(state(id), SifraGenericAttachAttaching);
      expectConsistent();

      EXPECT_EQ(deliver(), 1u);
      EXPECT_EQ(slowPaths().retryWithdrawals(), 0u);
      EXPECT_EQ(slowPath(1), nullptr);
      EXPECT_EQ(moduleSlowPath(id), c.endsOn);
      if (c.otherSlowPath) {
         EXPECT_TRUE(logged("vm: Slow path #1 is being unregistered; not retrying it"));
         EXPECT_EQ(deliver(), 1u);
         EXPECT_EQ(state(id), SifraGenericAttachAttached);
      }
      expectConsistent();
      EXPECT_EQ(host().sifra().destroyFilterAsHypervisor(id).status, ORR_OK);
      if (c.otherSlowPath) {
         EXPECT_EQ(slowPaths().unregisterSlowPath(2), ORR_OK);
      }
   }
}

// ---------------------------------------------------------------- destroying filters

TEST_F(SlowPathTest, destroying_a_filter_clears_its_slow_path_first_and_waits_for_a_pending_reply)
{
   registerSlowPath(1);
   const host::FilterId attaching = create({.name = "attaching"});
   for (int call = 0; call < 3; ++call) {
      EXPECT_EQ(host().sifra().destroyFilter(attaching), ORR_BUSY);
   }
   EXPECT_EQ(slowPaths().requests().size(), 1u) << "no clear for a filter still attaching";
   deliver();
   slowPaths().clearRequests();
   EXPECT_EQ(host().sifra().destroyFilter(attaching), ORR_OK);
   ASSERT_EQ(slowPaths().requests().size(), 1u);
   EXPECT_EQ(slowPaths().requests()[0].kind, SlowPathRequestKind::Clear);
   EXPECT_TRUE(loggedWithPrefix(host(), "attaching: Detaching from slow path #1", 1));
   EXPECT_EQ(slowPath(1)->useCount, 1u);

   // A clear that fails for a while keeps the filter, still counted.
   const host::FilterId attached = create({.name = "attached"});
   deliver();
   host().faults().failOnce("orr_SifraClearSlowPath", ORR_BUSY);
   EXPECT_EQ(host().sifra().destroyFilter(attached), ORR_BUSY);
   EXPECT_EQ(state(attached), SifraGenericAttachAttached);
   EXPECT_EQ(slowPath(1)->useCount, 2u);
   expectConsistent();
   EXPECT_EQ(host().sifra().destroyFilter(attached), ORR_OK);
   EXPECT_EQ(slowPaths().unregisterSlowPath(1), ORR_OK) << "nothing left counted on it";
}

// ---------------------------------------------------------------- agent callback and records

// The agent's attachStateChanged sees every change, in order.
std::vector<uint32_t> seenStates;
orr_Status recordState(SifraGenericFilter *, uint32_t attachState)
{
   seenStates.push_back(attachState);
   return ORR_OK;
}

TEST_F(SlowPathTest, the_agent_hears_every_attach_state_change)
{
   SifraGenericAgentOps ops = *agent()->ops;
   ops.attachStateChanged = recordState;
   const SifraGenericAgentOps *original = agent()->ops;
   agent()->ops = &ops;
   seenStates.clear();

   registerSlowPath(1);
   slowPaths().scriptReplies(SlowPathRequestKind::Set, {ORR_FAILURE, ORR_OK});
   const host::FilterId id = create();
   deliver();
   deliver();
   host().faults().failOnce("orr_SifraClearSlowPath", ORR_TRY_AGAIN);
   EXPECT_EQ(host().sifra().destroyFilter(id), ORR_BUSY);
   EXPECT_EQ(host().sifra().destroyFilter(id), ORR_OK);
   agent()->ops = original;
   EXPECT_THAT(seenStates, ElementsAre(3u, 4u, 1u, 4u, 1u, 2u));
}

TEST_F(SlowPathTest, records_with_a_bad_magic_are_refused)
{
   const auto fastPath = *host().sifra().fastPath(kAgent);
   uint64_t notAnAgent = ~SIFRAGENERIC_AGENT_MAGIC;
   orr_SifraSlowPath out = nullptr;
   EXPECT_EQ(fastPath.ops->registerSlowPath(&notAnAgent, 1, &out), ORR_BAD_PARAM);
   EXPECT_TRUE(loggedWithPrefix(host(), "Bad magic for fastPath", 2));
   uint64_t notASlowPath[6] = {~SIFRAGENERIC_SLOWPATH_MAGIC};
   EXPECT_EQ(fastPath.ops->unregisterSlowPath(notASlowPath), ORR_OK);
   EXPECT_TRUE(loggedWithPrefix(host(), "Bad magic for slowPath", 2));

   // A reply for a record that is no filter touches nothing.
   registerSlowPath(1);
   const host::FilterId id = create();
   SifraGenericFilter *filter = record(id);
   filter->magic = ~SIFRAGENERIC_FILTER_MAGIC;
   EXPECT_EQ(deliver(), 1u);
   filter->magic = SIFRAGENERIC_FILTER_MAGIC;
   EXPECT_TRUE(loggedWithPrefix(host(), "Bad magic for filter", 2));
   EXPECT_EQ(state(id), SifraGenericAttachAttaching);
   filter->refCount = 1;   // the reply that would have dropped it went to no filter
   filter->attachState = SifraGenericAttachDetached;
   filter->slowPath = nullptr;
   slowPath(1)->numFilters = 0;
   slowPath(1)->useCount = 1;
}

TEST_F(SlowPathTest, unloading_with_the_attach_callback_still_scheduled_cancels_it)
{
   create();
   registerSlowPath(1);
   EXPECT_NE(agent()->attachTimer, 0u);
   // TearDown destroys the filter and unloads: the withdrawal finds the
   // callback pending, and the timer queue must go without it.
}

}  // namespace
}  // namespace swsec::testing
