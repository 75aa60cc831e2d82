// Slow paths registered, attached, retried and withdrawn, and their part of
// a saved state: the filters of the built-in agent kept on the least loaded
// slow path while the host accepts, refuses and answers the module's
// requests as each test scripts. After every step the module's records must
// agree with each other and with the host (expectConsistent).
#include "port_fixture.h"

#include "framework/sifra_generic_agent.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_saved_state.h"
#include "framework/sifra_generic_slow_path.h"

#include <gmock/gmock.h>

#include <algorithm>
#include <functional>
#include <map>
#include <optional>

using ::testing::ElementsAre;

namespace swsec::testing {
namespace {

using host::SlowPathRequestKind;

class SlowPathTest : public PortTest {
protected:
   host::SlowPaths &slowPaths() { return host().sifra().slowPaths(); }
   host::Migration &migration() { return host().migration(); }
   SifraGenericFastPathAgent *agent() { return SifraGenericAgentFromHandle(host().sifra().fastPath(kAgent)->agent); }
   void registerSlowPath(uint32_t id) { EXPECT_EQ(slowPaths().registerSlowPath(kAgent, id), ORR_OK); }
   uint32_t state(host::FilterId id) { return record(id)->attachState; }
   uint32_t phase(host::FilterId id) { return record(id)->migrationState; }
   void runAttach() { host().clock().runDue(); }
   size_t deliver() { return slowPaths().deliverReplies(); }
   // The slow path ID the module has the filter on; nothing when detached.
   std::optional<uint32_t> moduleSlowPath(host::FilterId id)
   {
      const SifraGenericSlowPath *slowPath = record(id)->slowPath;
      return slowPath == nullptr ? std::nullopt : std::optional<uint32_t>(slowPath->slowPathID);
   }
   // Set requests made so far, as "filter->slow path".
   std::vector<std::string> setRequests()
   {
      std::vector<std::string> texts;
      for (const auto &request : slowPaths().requests()) {
         if (request.kind == SlowPathRequestKind::Set) {
            texts.push_back(std::to_string(request.filter) + "->" + std::to_string(request.slowPathID));
         }
      }
      return texts;
   }
   host::FilterId attachedPort(const char *name = "vm")
   {
      registerSlowPath(1);
      const host::FilterId id = create({.name = name});
      deliver();
      EXPECT_EQ(state(id), SifraGenericAttachAttached);
      return id;
   }

   // Every slow path counts exactly the filters on it; a filter holds one
   // reference more than its creation's for each reply owed to it; a filter
   // is on a slow path exactly when its state says so, and the host pairs
   // it with that slow path exactly when it is attached.
   void expectConsistent()
   {
      std::map<const SifraGenericSlowPath *, uint32_t> onSlowPath;
      std::map<host::FilterId, uint32_t> owed;
      for (const auto &reply : slowPaths().pendingReplies()) {
         ++owed[reply.filter];
      }
      for (const auto &filter : host().sifra().filters()) {
         const auto *rec = static_cast<const SifraGenericFilter *>(filter.record);
         SCOPED_TRACE("filter " + filter.config.name);
         EXPECT_EQ(rec->refCount, 1u + owed[filter.id]);
         EXPECT_EQ(rec->slowPath == nullptr, rec->attachState == SifraGenericAttachDetached);
         onSlowPath[rec->slowPath] += rec->slowPath != nullptr;
         if (rec->attachState == SifraGenericAttachAttached) {
            EXPECT_EQ(filter.slowPathID, rec->slowPath->slowPathID);
         }
         if (rec->attachState == SifraGenericAttachAttaching) {
            EXPECT_EQ(owed[filter.id], 1u) << "an attaching filter is owed its reply";
         }
      }
      for (const auto &info : slowPaths().registered()) {
         const auto *rec = static_cast<const SifraGenericSlowPath *>(info.record);
         SCOPED_TRACE("slow path " + std::to_string(info.id));
         EXPECT_EQ(rec->magic, SIFRAGENERIC_SLOWPATH_MAGIC);
         EXPECT_EQ(rec->numFilters, onSlowPath[rec]);
         EXPECT_EQ(rec->useCount, 1u + rec->numFilters);
         EXPECT_EQ(SifraGenericListIsLinked(&rec->links), !info.withdrawing);
      }
   }
};

// ---------------------------------------------------------------- attaching

// The walks of the filter list release both locks around each request:
// meanwhile a filter after the current one may be destroyed (its record
// freed and poisoned), so the walk reads its successor only afterwards, and
// a slow path may register, which makes the running walk scan again.
TEST_F(SlowPathTest, a_walk_goes_past_a_filter_destroyed_meanwhile_and_scans_again_for_a_registration_meanwhile)
{
   const host::FilterId a = create({.name = "a"});
   const host::FilterId b = create({.name = "b"});
   const host::FilterId c = create({.name = "c"});
   registerSlowPath(1);
   // c's first request is refused: only a second scan can attach it.
   host().faults().failOnce("orr_SifraSetSlowPath", ORR_NO_MEMORY, 2);
   slowPaths().onRequest([&](const host::SlowPathRequest &request) {
      EXPECT_NE(agent()->attachTimer, 0u) << "attachTimer stays set until the last scan ends";
      if (request.filter == a) {
         EXPECT_EQ(host().sifra().destroyFilter(b), ORR_OK);
         registerSlowPath(2);
      }
   });
   const size_t timers = host().clock().pendingTimers();
   runAttach();
   slowPaths().onRequest(nullptr);
   EXPECT_THAT(setRequests(),
               ElementsAre(std::to_string(a) + "->1", std::to_string(c) + "->2", std::to_string(c) + "->2"));
   EXPECT_EQ(host().clock().pendingTimers(), timers - 2) << "b's timer and the attach callback gone, none added";
   deliver();
   EXPECT_EQ(moduleSlowPath(c), 2u);
   expectConsistent();
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
   slowPaths().scriptReplies(SlowPathRequestKind::Set, {ORR_TIMEOUT, ORR_FAILURE});
   ASSERT_EQ(slowPaths().unregisterSlowPath(1), ORR_OK);
   ASSERT_EQ(deliver(), 1u);
   EXPECT_EQ(record(id)->attachRetries, 1u);
   EXPECT_TRUE(loggedWithPrefix(host(), "vm: Retry (#1) to attach slow path #2", 1));
   // A retry the host refuses detaches the filter.
   host().faults().failOnce("orr_SifraSetSlowPath", ORR_NO_MEMORY);
   EXPECT_EQ(deliver(), 1u);
   EXPECT_EQ(state(id), SifraGenericAttachDetached);
   expectConsistent();
}

// ---------------------------------------------------------------- unregistering and destroying

TEST_F(SlowPathTest, unregistering_moves_only_its_own_filters_to_another_slow_path_or_detaches_them)
{
   // The filter waits through a refused scheduling; the next registration's
   // callback puts it on the oldest of two equally loaded slow paths.
   const host::FilterId a = create({.name = "a"});
   host().faults().failOnce("orr_TimerSchedule", ORR_NO_MEMORY);
   registerSlowPath(1);
   EXPECT_EQ(agent()->attachTimer, 0u);
   registerSlowPath(2);
   runAttach();
   deliver();
   EXPECT_EQ(moduleSlowPath(a), 1u) << "the least loaded, the oldest on a tie";
   const host::FilterId b = create({.name = "b"});   // the least loaded: 2
   deliver();
   slowPaths().clearRequests();
   const uint64_t blocks = host().heap().liveBlocks();

   EXPECT_EQ(slowPaths().unregisterSlowPath(1), ORR_OK);
   EXPECT_EQ(host().heap().liveBlocks(), blocks - 1) << "the record is freed";
   EXPECT_EQ(state(a), SifraGenericAttachAttaching);
   EXPECT_EQ(host().sifra().filter(a)->slowPathID, std::nullopt) << "the host was asked to clear it";
   for (const auto &request : slowPaths().requests()) {
      EXPECT_EQ(request.filter, a) << "b was not on slow path 1";
   }
   deliver();
   EXPECT_EQ(moduleSlowPath(a), 2u);
   expectConsistent();

   // The last slow path leaves its filters detached.
   EXPECT_EQ(slowPaths().unregisterSlowPath(2), ORR_OK);
   for (const host::FilterId id : {a, b}) {
      EXPECT_EQ(state(id), SifraGenericAttachDetached);
      EXPECT_EQ(host().sifra().filter(id)->slowPathID, std::nullopt);
   }
   expectConsistent();
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

// ---------------------------------------------------------------- every host failure of a life cycle

struct SweepCase {
   const char *name;
   const char *point;       // fault point, or null: the n-th set reply fails
   orr_Status status;
   const char *message;     // logged once the failure is hit; null: none of its own
};

class SlowPathSweepTest : public SlowPathTest, public ::testing::WithParamInterface<SweepCase> {
protected:
   std::vector<orr_Status> failures_;

   void step(const char *what, const std::function<orr_Status()> &action)
   {
      SCOPED_TRACE(what);
      const orr_Status status = action();
      if (status != ORR_OK) {
         failures_.push_back(status);
      }
      expectConsistent();
   }
   host::FilterId createNamed(const char *name)
   {
      host::FilterId id = 0;
      step(name, [&] { return host().sifra().createFilter(kAgent, kPort, {.name = name}, &id); });
      return id;
   }
   void withdraw(uint32_t id)
   {
      step("unregister", [&] {
         const bool known =
            std::ranges::any_of(slowPaths().registered(), [&](const auto &info) { return info.id == id; });
         orr_Status status = known ? slowPaths().unregisterSlowPath(id) : ORR_OK;   // else its registration failed
         for (int round = 0; status == ORR_BUSY && round < 10; ++round) {
            deliver();
            status = slowPaths().retryWithdrawals() == 0 ? ORR_OK : ORR_BUSY;
         }
         return status;
      });
   }
   void destroy(host::FilterId id)
   {
      if (id != 0) {
         step("destroy", [&] { return host().sifra().destroyFilterAsHypervisor(id).status; });
      }
   }
   // A filter before any slow path, one attached at creation, a second slow
   // path taking the next filter, the first slow path withdrawn with its
   // filters moving, filters destroyed attached and detached.
   void lifeCycle()
   {
      const host::FilterId a = createNamed("a");
      step("register 1", [&] { return slowPaths().registerSlowPath(kAgent, 1); });
      runAttach();
      deliver();
      const host::FilterId b = createNamed("b");
      step("register 2", [&] { return slowPaths().registerSlowPath(kAgent, 2); });
      runAttach();
      const host::FilterId c = createNamed("c");
      deliver();
      expectConsistent();
      withdraw(1);
      deliver();
      expectConsistent();
      destroy(b);
      withdraw(2);
      destroy(a);
      destroy(c);
   }
};

// The n-th call of each kind failed, for every n until the cycle runs
// clean: each failure is reported where it happens and nothing is left.
TEST_P(SlowPathSweepTest, each_failure_in_turn_is_reported_and_undone)
{
   const SweepCase &c = GetParam();
   uint64_t n = 1;
   for (;; ++n) {
      SCOPED_TRACE("failing call " + std::to_string(n));
      if (!host().loaded()) {
         ASSERT_EQ(host().load(), 0);
      }
      failures_.clear();
      const uint64_t callsBefore = c.point != nullptr ? host().faults().calls(c.point) : 0;
      if (c.point != nullptr) {
         host().faults().failOnce(c.point, c.status, n);
      } else {
         std::vector<orr_Status> replies(n, ORR_OK);
         replies.back() = c.status;
         slowPaths().scriptReplies(SlowPathRequestKind::Set, replies);
      }
      host().log().clear();
      slowPaths().clearRequests();

      lifeCycle();

      bool hit = false;
      if (c.point != nullptr) {
         hit = host().faults().calls(c.point) - callsBefore >= n;
      } else {
         hit = std::ranges::count_if(slowPaths().requests(), [](const auto &request) {
                  return request.kind == SlowPathRequestKind::Set && request.result == ORR_OK;
               }) >= static_cast<std::ptrdiff_t>(n);
      }
      host().faults().clear();
      if (hit) {
         if (c.message != nullptr) {
            EXPECT_TRUE(logged(c.message)) << c.message;
         }
         if (std::string(c.name) == "allocation") {
            EXPECT_EQ(failures_, std::vector<orr_Status>{ORR_NO_MEMORY}) << "one creation or registration refused";
         } else {
            EXPECT_TRUE(failures_.empty()) << "the host's failures do not fail the host's calls";
         }
      }
      EXPECT_TRUE(slowPaths().registered().empty());
      EXPECT_TRUE(host().sifra().filters().empty());
      ASSERT_EQ(host().unload(), ORR_OK);
      expectNothingLeft(host());
      if (!hit) {
         break;
      }
   }
   EXPECT_GE(n, 3u) << "the cycle makes at least two such calls";
}

INSTANTIATE_TEST_SUITE_P(
   Failures, SlowPathSweepTest,
   ::testing::Values(
      SweepCase{"allocation", "orr_HeapAllocWithRA", ORR_NO_MEMORY, nullptr},
      SweepCase{"set_refused", "orr_SifraSetSlowPath", ORR_NO_MEMORY,
                "Request to set slow path failed (0xbad0014): Out of memory"},
      SweepCase{"set_reply_failed", nullptr, ORR_TIMEOUT, "Retry (#1) to attach slow path"},
      SweepCase{"clear_transient", "orr_SifraClearSlowPath", ORR_TRY_AGAIN,
                "Transient failure in clearing slow path (0xbad0006): Try again"},
      SweepCase{"clear_failed", "orr_SifraClearSlowPath", ORR_FAILURE,
                "Request to clear slow path failed (0xbad0001): Failure"},
      SweepCase{"schedule_failed", "orr_TimerSchedule", ORR_NO_MEMORY,
                "Could not schedule callback (0xbad0014): Out of memory"}),
   [](const auto &param) { return std::string(param.param.name); });

// ---------------------------------------------------------------- the slow path's part of a saved state

const Bytes kSlowState = {0xde, 0xad, 0xbe, 0xef, 0x01};

TEST_F(SlowPathTest, a_save_waits_for_the_slow_paths_state_and_carries_it_unchanged)
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
   EXPECT_EQ(Bytes(blob.begin() + static_cast<std::ptrdiff_t>(header.slowPathOffset), blob.end()), kSlowState);
   EXPECT_EQ(record(id)->slowPathState, nullptr) << "freed by the save";
   migration().prefetch(id);
   EXPECT_EQ(host().sifra().destroyFilter(id), ORR_BUSY) << "not before the fetch's reply";
   EXPECT_EQ(migration().deliverReplies(), 1u);

   // A prefetch while a filter is still attaching asks no slow path.
   const host::FilterId attaching = create({.name = "attaching"}, kOtherPort);
   migration().prefetch(attaching);
   EXPECT_EQ(phase(attaching), SifraGenericMigrationReady);
   EXPECT_EQ(migration().requests().size(), 2u) << "the two fetches for the attached port alone";
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

class FetchOutcomeTest : public SlowPathTest, public ::testing::WithParamInterface<FetchCase> {};

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

}  // namespace
}  // namespace swsec::testing
