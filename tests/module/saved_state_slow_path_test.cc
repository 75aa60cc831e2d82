// The slow path's part of a saved state: fetched from the slow path the
// filter is attached to before the save, handed back to it after the
// restore, with the host's replies delivered when each scenario chooses,
// and every reference dropped on every path.
#include "slow_path_fixture.h"

#include <gmock/gmock.h>

#include <functional>
#include <string>
#include <vector>

namespace swsec::testing {
namespace {

using Kind = host::SlowPathStateRequest::Kind;

const Bytes kSlowState = {0xde, 0xad, 0xbe, 0xef, 0x01};

class SavedStateSlowPathTest : public SlowPathTest {
public:
   // For the scenario tables' steps.
   host::Host &hostOf() { return host(); }
   uint32_t attachStateOf(host::FilterId id) { return state(id); }
   uint32_t phase(host::FilterId id) { return record(id)->migrationState; }
   uint32_t refCountOf(host::FilterId id) { return record(id)->refCount; }

protected:
   host::Migration &migration() { return host().migration(); }

   // A port attached to slow path 1 (its set request replied to).
   host::FilterId attachedPort(const char *name = "vm")
   {
      registerSlowPath(1);
      const host::FilterId id = create({.name = name});
      deliver();
      EXPECT_EQ(state(id), SifraGenericAttachAttached);
      return id;
   }

   uint64_t length(host::FilterId id, orr_Status expected = ORR_OK)
   {
      uint64_t total = 0;
      EXPECT_EQ(migration().length(id, &total), expected);
      return total;
   }

   Bytes saveOf(host::FilterId id)
   {
      Bytes blob;
      EXPECT_EQ(migration().save(id, length(id), &blob), ORR_OK);
      return blob;
   }

   static uint64_t field(const Bytes &blob, size_t offset)
   {
      uint64_t value = 0;
      for (size_t i = 0; i < 8; ++i) {
         value |= static_cast<uint64_t>(blob[offset + i]) << (8 * i);
      }
      return value;
   }
};

// ---------------------------------------------------------------- the save

TEST_F(SavedStateSlowPathTest, the_save_waits_for_the_slow_paths_state_and_carries_it_unchanged)
{
   const host::FilterId id = attachedPort();
   migration().scriptRetrieve({.state = kSlowState});
   migration().prefetch(id);
   EXPECT_EQ(phase(id), SifraGenericMigrationFetching);
   EXPECT_EQ(record(id)->refCount, 2u) << "the reply's reference";
   ASSERT_EQ(migration().requests().size(), 1u);
   const host::SlowPathStateRequest request = migration().requests()[0];
   EXPECT_EQ(request.kind, Kind::retrieve);
   EXPECT_EQ(request.timeoutMs, 2000u);
   EXPECT_EQ(request.cookie, record(id)->slowPath);

   (void)length(id, ORR_NOT_READY);
   EXPECT_TRUE(loggedWithPrefix(host(), "vm: Slow path agent state is not yet available", 1));
   EXPECT_EQ(migration().deliverReplies(), 1u);
   EXPECT_EQ(record(id)->refCount, 1u);
   EXPECT_EQ(record(id)->slowPathStateLen, kSlowState.size());

   const Bytes blob = saveOf(id);
   const uint64_t agentLen = field(blob, 24);
   EXPECT_EQ(blob.size(), 48 + agentLen + kSlowState.size());
   EXPECT_EQ(field(blob, 32), 48 + agentLen);
   EXPECT_EQ(field(blob, 40), kSlowState.size());
   EXPECT_EQ(Bytes(blob.end() - static_cast<std::ptrdiff_t>(kSlowState.size()), blob.end()), kSlowState);
   EXPECT_EQ(record(id)->slowPathState, nullptr) << "freed by the save";
   EXPECT_EQ(phase(id), SifraGenericMigrationIdle);
}

// How a fetch ends, and what the filter is left with.
struct FetchCase {
   const char *name;
   std::function<void(SavedStateSlowPathTest &, host::FilterId)> act;
   uint32_t phase;            // after the reply, if any, was delivered
   const char *message;       // "" none
};

class FetchOutcomeTest : public SavedStateSlowPathTest, public ::testing::WithParamInterface<FetchCase> {};

TEST_P(FetchOutcomeTest, each_fetch_outcome_leaves_its_phase_and_no_reference)
{
   const host::FilterId id = attachedPort();
   GetParam().act(*this, id);
   (void)migration().deliverReplies();
   EXPECT_EQ(phase(id), GetParam().phase);
   if (*GetParam().message != '\0') {
      EXPECT_TRUE(logged(GetParam().message)) << ::testing::PrintToString(logTexts());
   }
   EXPECT_EQ(record(id)->refCount, 1u);
   EXPECT_EQ(migration().pendingReplies(), 0u);
   expectConsistent();
}

INSTANTIATE_TEST_SUITE_P(
   Outcomes, FetchOutcomeTest,
   ::testing::Values(
      FetchCase{"an_empty_state_makes_the_save_ready_without_a_part",
                [](SavedStateSlowPathTest &port, host::FilterId id) {
                   port.hostOf().migration().scriptRetrieve({});
                   port.hostOf().migration().prefetch(id);
                },
                SifraGenericMigrationReady, ""},
      FetchCase{"a_failed_reply_returns_to_idle",
                [](SavedStateSlowPathTest &port, host::FilterId id) {
                   port.hostOf().migration().scriptRetrieve({.replyStatus = ORR_TRY_AGAIN});
                   port.hostOf().migration().prefetch(id);
                },
                SifraGenericMigrationIdle, "vm: Failed to retrieve slow path state (0xbad0006): "},
      FetchCase{"a_refused_request_returns_to_idle",
                [](SavedStateSlowPathTest &port, host::FilterId id) {
                   port.hostOf().migration().scriptRetrieve({.refusal = ORR_NO_MEMORY});
                   port.hostOf().migration().prefetch(id);
                },
                SifraGenericMigrationIdle, "vm: Requesting slow path state failed (0xbad0014): "},
      FetchCase{"no_memory_for_the_copy_returns_to_idle",
                [](SavedStateSlowPathTest &port, host::FilterId id) {
                   port.hostOf().migration().scriptRetrieve({.state = kSlowState});
                   port.hostOf().migration().prefetch(id);
                   port.hostOf().faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY);
                },
                SifraGenericMigrationIdle, "vm: Failed to alloc 5 bytes for state buffer"},
      FetchCase{"a_reply_after_a_cancel_is_ignored",
                [](SavedStateSlowPathTest &port, host::FilterId id) {
                   port.hostOf().migration().scriptRetrieve({.state = kSlowState});
                   port.hostOf().migration().prefetch(id);
                   EXPECT_EQ(port.hostOf().migration().length(id, nullptr), ORR_OK);
                },
                SifraGenericMigrationIdle, "vm: Ignoring slow path state reply; wrong state (1)"},
      FetchCase{"a_detach_makes_the_save_ready_and_the_late_reply_is_ignored",
                [](SavedStateSlowPathTest &port, host::FilterId id) {
                   port.hostOf().migration().scriptRetrieve({.state = kSlowState});
                   port.hostOf().migration().prefetch(id);
                   EXPECT_EQ(port.hostOf().sifra().slowPaths().unregisterSlowPath(1), ORR_OK);
                   EXPECT_EQ(port.attachStateOf(id), SifraGenericAttachDetached);
                   EXPECT_EQ(port.phase(id), SifraGenericMigrationReady);
                   uint64_t total = 0;
                   EXPECT_EQ(port.hostOf().migration().length(id, &total), ORR_OK) << "at once, without the part";
                },
                SifraGenericMigrationReady, "vm: Ignoring slow path state reply; wrong state (3)"}),
   [](const auto &testInfo) { return std::string(testInfo.param.name); });

TEST_F(SavedStateSlowPathTest, a_filter_with_a_fetch_pending_is_not_destroyed_before_its_reply)
{
   const host::FilterId id = attachedPort();
   migration().prefetch(id);
   EXPECT_EQ(host().sifra().destroyFilter(id), ORR_BUSY);
   EXPECT_EQ(migration().deliverReplies(), 1u);
   EXPECT_EQ(host().sifra().destroyFilterAsHypervisor(id).status, ORR_OK);
}

// ---------------------------------------------------------------- the restore

struct RestoreCase {
   const char *name;
   std::function<void(SavedStateSlowPathTest &, host::FilterId)> script;   // before the restore
   orr_Status status;
   std::function<void(SavedStateSlowPathTest &, host::FilterId)> between;  // before the reply
   const char *message;
};

class SlowPathRestoreTest : public SavedStateSlowPathTest, public ::testing::WithParamInterface<RestoreCase> {};

TEST_P(SlowPathRestoreTest, the_slow_paths_part_goes_back_to_its_slow_path)
{
   // A blob with a slow path part, from a port that learned one binding.
   const host::FilterId source = attachedPort("source");
   ASSERT_TRUE(passes(source, kTx, arpRequest(Mac::parse("02:00:00:00:00:01"), Ip4::parse("10.0.0.5"))));
   migration().scriptRetrieve({.state = kSlowState});
   Bytes blob;
   ASSERT_EQ(migration().saveAsHypervisor(source, &blob), ORR_OK);

   const host::FilterId id = create({.name = "dest"}, kOtherPort);
   deliver();
   ASSERT_EQ(state(id), SifraGenericAttachAttached);
   GetParam().script(*this, id);
   EXPECT_EQ(migration().restore(id, blob), GetParam().status);
   EXPECT_EQ(record(id)->agentData != nullptr, true);
   GetParam().between(*this, id);
   (void)migration().deliverReplies();
   EXPECT_TRUE(logged(GetParam().message)) << ::testing::PrintToString(logTexts());
   EXPECT_EQ(phase(id), SifraGenericMigrationIdle);
   EXPECT_EQ(record(id)->refCount, 1u);
   // The agent's part stays restored whatever became of the slow path's.
   host::NexoRecord summary;
   ASSERT_EQ(host().nexo().get("/security/" + std::to_string(kOtherPort) + "/featureSummary", &summary), ORR_OK);
   EXPECT_EQ(summary.value("numVmiEntries"), "1");
   const auto requests = migration().requests();
   ASSERT_EQ(requests.size(), 2u);
   EXPECT_EQ(requests[1].kind, Kind::restore);
   EXPECT_EQ(requests[1].state, kSlowState);
   EXPECT_EQ(requests[1].timeoutMs, 2000u);
}

void nothing(SavedStateSlowPathTest &, host::FilterId) {}

INSTANTIATE_TEST_SUITE_P(
   Outcomes, SlowPathRestoreTest,
   ::testing::Values(
      RestoreCase{"a_successful_reply_finishes_the_restore", nothing, ORR_OK,
                  [](SavedStateSlowPathTest &port, host::FilterId id) {
                     EXPECT_EQ(port.phase(id), SifraGenericMigrationRestoring);
                     EXPECT_EQ(port.refCountOf(id), 2u);
                  },
                  "dest: Finished restoring slow path state"},
      RestoreCase{"a_failed_reply_keeps_the_agents_part",
                  [](SavedStateSlowPathTest &port, host::FilterId) {
                     port.hostOf().migration().scriptRestore({.replyStatus = ORR_FAILURE});
                  },
                  ORR_OK, nothing, "dest: Failed to restore slow path state (0xbad0001): "},
      RestoreCase{"a_refused_request_returns_its_status",
                  [](SavedStateSlowPathTest &port, host::FilterId) {
                     port.hostOf().migration().scriptRestore({.refusal = ORR_BUSY});
                  },
                  ORR_BUSY, nothing, "dest: Couldn't request slow path state restore (0xbad0004): "},
      RestoreCase{"a_reply_after_a_cancel_is_unexpected", nothing, ORR_OK,
                  [](SavedStateSlowPathTest &port, host::FilterId id) {
                     EXPECT_EQ(port.hostOf().migration().length(id, nullptr), ORR_OK);
                  },
                  "dest: Unexpected restore slow path state reply"}),
   [](const auto &testInfo) { return std::string(testInfo.param.name); });

}  // namespace
}  // namespace swsec::testing
