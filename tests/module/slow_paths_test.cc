// Slow paths registered, attached, retried and withdrawn, and their part of
// a saved state: the filters of the built-in agent kept on the least loaded
// slow path while the host accepts, refuses and answers the module's
// requests as each test scripts.
#include "slow_path_fixture.h"

#include "framework/sifra_generic_saved_state.h"

#include <gmock/gmock.h>

#include <cstring>

using ::testing::ElementsAre;
using ::testing::IsEmpty;

namespace swsec::testing {
namespace {

using host::SlowPathRequestKind;
using Kind = host::SlowPathStateRequest::Kind;

// ---------------------------------------------------------------- attaching

TEST_F(SlowPathTest, filters_before_a_registration_wait_for_its_callback_and_later_ones_attach_at_creation)
{
   const host::FilterId early = create({.name = "early"});
   registerSlowPath(1);
   EXPECT_THAT(setRequests(), IsEmpty()) << "the registration itself asks for nothing";
   EXPECT_EQ(state(early), SifraGenericAttachDetached);

   runAttach();
   EXPECT_EQ(agent()->attachTimer, 0u);
   EXPECT_EQ(state(early), SifraGenericAttachAttaching);
   ASSERT_EQ(slowPaths().requests().size(), 1u);
   EXPECT_EQ(slowPaths().requests()[0].timeoutMs, 2000) << "the module parameter's default";
   expectConsistent();
   EXPECT_EQ(deliver(), 1u);
   EXPECT_EQ(state(early), SifraGenericAttachAttached);
   EXPECT_EQ(host().sifra().filter(early)->slowPathID, 1u);

   const size_t timers = host().clock().pendingTimers();
   const host::FilterId late = create({.name = "late"});
   EXPECT_EQ(state(late), SifraGenericAttachAttaching) << "attached at creation, without a callback";
   EXPECT_EQ(host().clock().pendingTimers(), timers + 1) << "the new port's own timer alone";
   EXPECT_EQ(deliver(), 1u);
   expectConsistent();
}

TEST_F(SlowPathTest, a_new_filter_goes_to_the_least_loaded_slow_path_ties_to_the_oldest)
{
   registerSlowPath(1);
   registerSlowPath(2);
   runAttach();
   std::vector<std::optional<uint32_t>> chosen;
   for (int i = 0; i < 4; ++i) {
      chosen.push_back(moduleSlowPath(create({.name = "f" + std::to_string(i)})));
   }
   EXPECT_THAT(chosen, ElementsAre(1u, 2u, 1u, 2u));
   deliver();
   expectConsistent();
}

TEST_F(SlowPathTest, a_registration_while_the_callback_has_its_locks_released_makes_it_scan_again)
{
   const host::FilterId first = create({.name = "a"});
   const host::FilterId second = create({.name = "b"});
   registerSlowPath(1);
   // a's request lets slow path 2 register meanwhile; b's is refused, so
   // only a second scan can attach b.
   host().faults().failOnce("orr_SifraSetSlowPath", ORR_NO_MEMORY, 2);
   slowPaths().onRequest([&](const host::SlowPathRequest &request) {
      EXPECT_NE(agent()->attachTimer, 0u) << "attachTimer stays set until the last scan ends";
      if (request.filter == first) {
         registerSlowPath(2);
      }
   });
   const size_t timers = host().clock().pendingTimers();
   runAttach();
   slowPaths().onRequest(nullptr);

   EXPECT_THAT(setRequests(), ElementsAre(std::to_string(first) + "->1", std::to_string(second) + "->2",
                                          std::to_string(second) + "->2"));
   EXPECT_EQ(host().clock().pendingTimers(), timers - 1) << "the second registration scheduled no callback";
   deliver();
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
      unregistering ? (void)deliver() : registerSlowPath(1);
      slowPaths().onRequest([&](const host::SlowPathRequest &request) {
         if (request.filter == a && host().sifra().filter(b)) {
            EXPECT_EQ(host().sifra().destroyFilter(b), ORR_OK);
         }
      });
      slowPaths().clearRequests();
      unregistering ? (void)slowPaths().unregisterSlowPath(1) : runAttach();
      slowPaths().onRequest(nullptr);
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
   EXPECT_EQ(agent()->attachTimer, 0u);
   registerSlowPath(2);
   runAttach();
   deliver();
   EXPECT_EQ(moduleSlowPath(id), 1u) << "the least loaded, the oldest on a tie";
}

TEST_F(SlowPathTest, requests_carry_the_timeout_module_parameter)
{
   ASSERT_EQ(host().unload(), ORR_OK);
   ASSERT_EQ(host().load({.parameters = {{"SIFRAGENERIC_SLOWPATH_TIMEOUT", 350}}}), 0);
   host().portsets().addPortset("vs1");
   host().portsets().addPort("vs1", 21);
   registerSlowPath(1);
   slowPaths().scriptReplies(SlowPathRequestKind::Set, {ORR_FAILURE});
   create({}, 21);
   deliver();
   deliver();
   ASSERT_EQ(slowPaths().requests().size(), 2u);
   EXPECT_EQ(slowPaths().requests()[0].timeoutMs, 350);
   EXPECT_EQ(slowPaths().requests()[1].timeoutMs, 350);
}

// ---------------------------------------------------------------- replies and retries

TEST_F(SlowPathTest, failed_replies_are_retried_at_once_numbered_from_each_new_attach)
{
   registerSlowPath(1);
   slowPaths().scriptReplies(SlowPathRequestKind::Set, {ORR_TIMEOUT, ORR_TIMEOUT, ORR_OK});
   const host::FilterId id = create({.name = "vm"});
   for (uint32_t retry = 1; retry <= 2; ++retry) {
      ASSERT_EQ(deliver(), 1u);
      EXPECT_EQ(state(id), SifraGenericAttachAttaching);
      EXPECT_EQ(record(id)->attachRetries, retry);
      EXPECT_EQ(record(id)->refCount, 2u) << "one reference, passed from reply to reply";
   }
   EXPECT_TRUE(loggedWithPrefix(host(), "vm: Retry (#2) to attach slow path #1", 1));
   ASSERT_EQ(deliver(), 1u);
   EXPECT_EQ(state(id), SifraGenericAttachAttached);

   // Moved to slow path 2 by the first one's withdrawal: a new attach counts from one.
   registerSlowPath(2);
   runAttach();
   slowPaths().scriptReplies(SlowPathRequestKind::Set, {ORR_TIMEOUT});
   ASSERT_EQ(slowPaths().unregisterSlowPath(1), ORR_OK);
   ASSERT_EQ(deliver(), 1u);
   EXPECT_EQ(record(id)->attachRetries, 1u);
   EXPECT_TRUE(loggedWithPrefix(host(), "vm: Retry (#1) to attach slow path #2", 1));
   deliver();
   expectConsistent();
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
   expectConsistent();
}

TEST_F(SlowPathTest, a_reply_for_a_record_that_is_no_filter_touches_nothing)
{
   registerSlowPath(1);
   const host::FilterId id = create();
   SifraGenericFilter *filter = record(id);
   filter->magic = ~SIFRAGENERIC_FILTER_MAGIC;
   EXPECT_EQ(deliver(), 1u);
   filter->magic = SIFRAGENERIC_FILTER_MAGIC;
   EXPECT_TRUE(loggedWithPrefix(host(), "Bad magic for filter", 2));
   EXPECT_EQ(state(id), SifraGenericAttachAttaching);
   // Undo what the lost reply would have undone, for the teardown.
   filter->refCount = 1;
   filter->attachState = SifraGenericAttachDetached;
   filter->slowPath = nullptr;
   slowPath(1)->numFilters = 0;
   slowPath(1)->useCount = 1;
}

// ---------------------------------------------------------------- unregistering and destroying

TEST_F(SlowPathTest, unregistering_moves_only_its_own_filters_to_another_slow_path_or_detaches_them)
{
   for (const bool another : {true, false}) {
      SCOPED_TRACE(another ? "another slow path" : "no other slow path");
      registerSlowPath(1);
      const host::FilterId a = create({.name = "a"});
      host::FilterId b = 0;
      deliver();
      if (another) {
         registerSlowPath(2);
         runAttach();
         b = create({.name = "b"});   // the least loaded: 2
         deliver();
      }
      slowPaths().clearRequests();
      const uint64_t blocks = host().heap().liveBlocks();

      EXPECT_EQ(slowPaths().unregisterSlowPath(1), ORR_OK);
      EXPECT_EQ(host().heap().liveBlocks(), blocks - 1) << "the record is freed";
      EXPECT_EQ(state(a), another ? SifraGenericAttachAttaching : SifraGenericAttachDetached);
      EXPECT_EQ(host().sifra().filter(a)->slowPathID, std::nullopt) << "the host was asked to clear it";
      for (const auto &request : slowPaths().requests()) {
         EXPECT_EQ(request.filter, a) << "b was not on slow path 1";
      }
      deliver();
      EXPECT_EQ(moduleSlowPath(a), another ? std::optional<uint32_t>(2) : std::nullopt);
      expectConsistent();
      for (const host::FilterId id : {a, b}) {
         if (id != 0) {
            EXPECT_EQ(host().sifra().destroyFilter(id), ORR_OK);
         }
      }
      if (another) {
         EXPECT_EQ(slowPaths().unregisterSlowPath(2), ORR_OK);
      }
   }
}

TEST_F(SlowPathTest, a_failed_reply_for_a_slow_path_being_unregistered_moves_the_filter_on)
{
   registerSlowPath(1);
   slowPaths().scriptReplies(SlowPathRequestKind::Set, {ORR_FAILURE});
   const host::FilterId id = create({.name = "vm"});
   registerSlowPath(2);
   runAttach();
   EXPECT_EQ(slowPaths().unregisterSlowPath(1), ORR_BUSY);
   EXPECT_EQ(host().sifra().destroyFilter(id), ORR_BUSY) << "nor can the filter go before its reply";
   expectConsistent();
   EXPECT_EQ(deliver(), 1u);
   EXPECT_EQ(slowPaths().retryWithdrawals(), 0u);
   EXPECT_TRUE(logged("vm: Slow path #1 is being unregistered; not retrying it"));
   EXPECT_EQ(deliver(), 1u);
   EXPECT_EQ(moduleSlowPath(id), 2u);
   EXPECT_EQ(state(id), SifraGenericAttachAttached);
   expectConsistent();
}

TEST_F(SlowPathTest, destroying_a_filter_clears_its_slow_path_first_and_waits_for_a_pending_reply)
{
   registerSlowPath(1);
   const host::FilterId attaching = create({.name = "attaching"});
   EXPECT_EQ(host().sifra().destroyFilter(attaching), ORR_BUSY);
   EXPECT_EQ(slowPaths().requests().size(), 1u) << "no clear for a filter still attaching";
   deliver();
   slowPaths().clearRequests();
   EXPECT_EQ(host().sifra().destroyFilter(attaching), ORR_OK);
   ASSERT_EQ(slowPaths().requests().size(), 1u);
   EXPECT_EQ(slowPaths().requests()[0].kind, SlowPathRequestKind::Clear);

   // A clear that fails for a while keeps the filter, still counted.
   const host::FilterId attached = create({.name = "attached"});
   deliver();
   host().faults().failOnce("orr_SifraClearSlowPath", ORR_BUSY);
   EXPECT_EQ(host().sifra().destroyFilter(attached), ORR_BUSY);
   EXPECT_EQ(state(attached), SifraGenericAttachAttached);
   expectConsistent();
   EXPECT_EQ(host().sifra().destroyFilter(attached), ORR_OK);
   EXPECT_EQ(slowPaths().unregisterSlowPath(1), ORR_OK) << "nothing left counted on it";
}

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

TEST_F(SlowPathTest, unloading_with_the_attach_callback_still_scheduled_cancels_it)
{
   create();
   registerSlowPath(1);
   EXPECT_NE(agent()->attachTimer, 0u);
   // TearDown destroys the filter and unloads: the withdrawal finds the
   // callback pending, and the timer queue must go without it.
}

// ---------------------------------------------------------------- the slow path's part of a saved state

const Bytes kSlowState = {0xde, 0xad, 0xbe, 0xef, 0x01};

class SavedSlowPathTest : public SlowPathTest {
protected:
   uint32_t phase(host::FilterId id) { return record(id)->migrationState; }
   host::Migration &migration() { return host().migration(); }

   host::FilterId attachedPort(const char *name = "vm")
   {
      registerSlowPath(1);
      const host::FilterId id = create({.name = name});
      deliver();
      EXPECT_EQ(state(id), SifraGenericAttachAttached);
      return id;
   }
};

TEST_F(SavedSlowPathTest, the_save_waits_for_the_slow_paths_state_and_carries_it_unchanged)
{
   const host::FilterId id = attachedPort();
   migration().scriptRetrieve({.state = kSlowState});
   migration().prefetch(id);
   EXPECT_EQ(phase(id), SifraGenericMigrationFetching);
   ASSERT_EQ(migration().requests().size(), 1u);
   EXPECT_EQ(migration().requests()[0].cookie, record(id)->slowPath);
   uint64_t length = 0;
   EXPECT_EQ(migration().length(id, &length), ORR_NOT_READY);
   EXPECT_EQ(migration().deliverReplies(), 1u);
   EXPECT_EQ(record(id)->refCount, 1u);

   ASSERT_EQ(migration().length(id, &length), ORR_OK);
   Bytes blob;
   ASSERT_EQ(migration().save(id, length, &blob), ORR_OK);
   SifraGenericStateHeader header{};
   std::memcpy(&header, blob.data(), sizeof header);
   EXPECT_EQ(header.slowPathOffset, 48 + header.agentLen);
   EXPECT_EQ(header.slowPathLen, kSlowState.size());
   EXPECT_EQ(Bytes(blob.begin() + static_cast<std::ptrdiff_t>(header.slowPathOffset), blob.end()), kSlowState);
   EXPECT_EQ(record(id)->slowPathState, nullptr) << "freed by the save";
}

TEST_F(SavedSlowPathTest, a_prefetch_while_the_filter_is_still_attaching_asks_no_slow_path)
{
   registerSlowPath(1);
   const host::FilterId id = create({.name = "vm"});
   ASSERT_EQ(state(id), SifraGenericAttachAttaching);
   migration().prefetch(id);
   EXPECT_EQ(phase(id), SifraGenericMigrationReady);
   EXPECT_TRUE(migration().requests().empty());
   deliver();
}

// How a fetch ends, and what the filter is left with. Before the reply:
// 'a' the copy's allocation fails, 'c' the save is cancelled, 'u' the slow
// path is withdrawn.
struct FetchCase {
   const char *name;
   host::SlowPathStateOutcome outcome;
   char before;
   uint32_t phase;            // after the reply, if any, was delivered
   const char *message;       // null: none
};

class FetchOutcomeTest : public SavedSlowPathTest, public ::testing::WithParamInterface<FetchCase> {};

TEST_P(FetchOutcomeTest, each_fetch_outcome_leaves_its_phase_and_no_reference)
{
   const FetchCase &c = GetParam();
   const host::FilterId id = attachedPort();
   migration().scriptRetrieve(c.outcome);
   migration().prefetch(id);
   if (c.before == 'a') {
      host().faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY);
   } else if (c.before == 'c') {
      EXPECT_EQ(migration().length(id, nullptr), ORR_OK);
   } else if (c.before == 'u') {
      EXPECT_EQ(slowPaths().unregisterSlowPath(1), ORR_OK);
      EXPECT_EQ(phase(id), SifraGenericMigrationReady) << "at once, without the part";
   }
   (void)migration().deliverReplies();
   EXPECT_EQ(phase(id), c.phase);
   if (c.message != nullptr) {
      EXPECT_TRUE(logged(c.message)) << ::testing::PrintToString(logTexts());
   }
   EXPECT_EQ(record(id)->refCount, 1u);
   expectConsistent();
}

INSTANTIATE_TEST_SUITE_P(
   Outcomes, FetchOutcomeTest,
   ::testing::Values(
      FetchCase{"an_empty_state_makes_the_save_ready_without_a_part", {}, 0, SifraGenericMigrationReady, nullptr},
      FetchCase{"a_failed_reply_returns_to_idle", {.replyStatus = ORR_TRY_AGAIN}, 0, SifraGenericMigrationIdle,
                "vm: Failed to retrieve slow path state (0xbad0006): "},
      FetchCase{"a_refused_request_returns_to_idle", {.refusal = ORR_NO_MEMORY}, 0, SifraGenericMigrationIdle,
                "vm: Requesting slow path state failed (0xbad0014): "},
      FetchCase{"no_memory_for_the_copy_returns_to_idle", {.state = kSlowState}, 'a', SifraGenericMigrationIdle,
                "vm: Failed to alloc 5 bytes for state buffer"},
      FetchCase{"a_reply_after_a_cancel_is_ignored", {.state = kSlowState}, 'c', SifraGenericMigrationIdle,
                "vm: Ignoring slow path state reply; wrong state (1)"},
      FetchCase{"a_detach_makes_the_save_ready_and_the_late_reply_is_ignored", {.state = kSlowState}, 'u',
                SifraGenericMigrationReady, "vm: Ignoring slow path state reply; wrong state (3)"}),
   [](const auto &testInfo) { return std::string(testInfo.param.name); });

TEST_F(SavedSlowPathTest, a_filter_with_a_fetch_pending_is_not_destroyed_before_its_reply)
{
   const host::FilterId id = attachedPort();
   migration().prefetch(id);
   EXPECT_EQ(host().sifra().destroyFilter(id), ORR_BUSY);
   EXPECT_EQ(migration().deliverReplies(), 1u);
   EXPECT_EQ(host().sifra().destroyFilterAsHypervisor(id).status, ORR_OK);
}

struct RestoreCase {
   const char *name;
   host::SlowPathStateOutcome outcome;
   orr_Status status;
   bool cancelBeforeReply;
   const char *message;
};

class SlowPathRestoreTest : public SavedSlowPathTest, public ::testing::WithParamInterface<RestoreCase> {};

TEST_P(SlowPathRestoreTest, the_slow_paths_part_goes_back_to_its_slow_path)
{
   const RestoreCase &c = GetParam();
   const host::FilterId source = attachedPort("source");
   ASSERT_TRUE(passes(source, kTx, arpRequest(kVmMac, kVmIp)));
   migration().scriptRetrieve({.state = kSlowState});
   Bytes blob;
   ASSERT_EQ(migration().saveAsHypervisor(source, &blob), ORR_OK);

   const host::FilterId id = create({.name = "dest"}, kOtherPort);
   deliver();
   migration().scriptRestore(c.outcome);
   EXPECT_EQ(migration().restore(id, blob), c.status);
   if (c.status == ORR_OK && c.outcome.replyStatus == ORR_OK) {
      EXPECT_EQ(phase(id), SifraGenericMigrationRestoring);
      EXPECT_EQ(record(id)->refCount, 2u);
   }
   if (c.cancelBeforeReply) {
      EXPECT_EQ(migration().length(id, nullptr), ORR_OK);
   }
   (void)migration().deliverReplies();
   EXPECT_TRUE(logged(c.message)) << ::testing::PrintToString(logTexts());
   EXPECT_EQ(phase(id), SifraGenericMigrationIdle);
   EXPECT_EQ(record(id)->refCount, 1u);
   // The agent's part stays restored whatever became of the slow path's.
   EXPECT_EQ(context(id)->numVmiEntries, 1u);
   const auto requests = migration().requests();
   ASSERT_EQ(requests.size(), 2u);
   EXPECT_EQ(requests[1].kind, Kind::restore);
   EXPECT_EQ(requests[1].state, kSlowState);
}

INSTANTIATE_TEST_SUITE_P(
   Outcomes, SlowPathRestoreTest,
   ::testing::Values(
      RestoreCase{"a_successful_reply_finishes_the_restore", {}, ORR_OK, false,
                  "dest: Finished restoring slow path state"},
      RestoreCase{"a_failed_reply_keeps_the_agents_part", {.replyStatus = ORR_FAILURE}, ORR_OK, false,
                  "dest: Failed to restore slow path state (0xbad0001): "},
      RestoreCase{"a_refused_request_returns_its_status", {.refusal = ORR_BUSY}, ORR_BUSY, false,
                  "dest: Couldn't request slow path state restore (0xbad0004): "},
      RestoreCase{"a_reply_after_a_cancel_is_unexpected", {}, ORR_OK, true,
                  "dest: Unexpected restore slow path state reply"}),
   [](const auto &testInfo) { return std::string(testInfo.param.name); });

}  // namespace
}  // namespace swsec::testing
