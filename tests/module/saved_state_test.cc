// A port's state carried across a migration, driven as the hypervisor
// drives it: prefetch, length and save on the source, create and restore
// on the destination. Blobs are read with the tool's decoder; a restored
// port is judged by saving it again.
#include "port_fixture.h"

#include "framework/sifra_generic_agent.h"
#include "session/saved_state_format.h"

#include <atomic>
#include <chrono>
#include <functional>
#include <thread>

using namespace std::chrono_literals;

namespace swsec::testing {
namespace {

const Mac kStaticMac = Mac::parse("02:00:00:00:00:0a");
const Ip4 kStaticIp = Ip4::parse("10.0.0.10");
constexpr uint32_t kDai = SwSecFeatureIpDiscovery | SwSecFeatureDai;

Mac macOf(uint8_t last) { return Mac{{0x02, 0, 0, 0, 0, last}}; }
Ip4 ipOf(uint8_t last) { return Ip4{{10, 0, 0, last}}; }

class SavedStateTest : public PortTest {
protected:
   void learnDhcp(host::FilterId id, uint8_t host, uint32_t lease, std::optional<Bytes> clientId = std::nullopt)
   {
      bindByDhcp(id, {.mac = macOf(host), .ip = ipOf(host), .server = kServerIp, .lease = lease, .clientId = clientId});
   }

   Bytes save(host::FilterId id)
   {
      Bytes blob;
      EXPECT_EQ(host().migration().saveAsHypervisor(id, &blob), ORR_OK);
      return blob;
   }

   orr_Status restore(host::FilterId id, const Bytes &blob) { return host().migration().restore(id, blob); }

   const SifraGenericAgentOps &ops(host::FilterId id) { return *record(id)->agent->ops; }
};

void putLe(Bytes &blob, size_t offset, uint64_t value, size_t size = 8)
{
   for (size_t i = 0; i < size; ++i) {
      blob[offset + i] = static_cast<uint8_t>(value >> (8 * i));
   }
}

// ---------------------------------------------------------------- the blob

TEST_F(SavedStateTest, the_blob_carries_the_configuration_counters_and_each_entry_with_its_time_left)
{
   const host::FilterId id = create();
   const PortConfig config{.features = SwSecFeatureIpDiscovery | SwSecFeatureIpSrcGuard,
                           .trusted = 0,
                           .portDbSize = 8,
                           .statics = {binding(5, kStaticMac, kStaticIp)}};
   ASSERT_EQ(writeConfig(id, config), ORR_OK);
   learnDhcp(id, 1, 100, Bytes{0x01, 0xaa, 0xbb});
   host().clock().advance(40s);
   EXPECT_FALSE(passes(id, kTx, udpFrame({.src = macOf(1), .dst = kServerMac, .ipSrc = ipOf(66), .ipDst = kServerIp})));

   const Bytes blob = save(id);
   const session::SavedPortState d = session::decodeSavedState(blob);
   EXPECT_EQ(d.agentOffset, 48u);
   EXPECT_EQ(d.agentLen, 96u + 2 * 48 + 3 + 40);
   EXPECT_EQ(blob.size(), 48 + d.agentLen) << "no slow path part";
   const Bytes header = configRecord(config);
   EXPECT_EQ(Bytes(blob.begin() + 48, blob.begin() + 48 + 26), Bytes(header.begin(), header.begin() + 26));
   EXPECT_FALSE(d.txRateLimitErr);
   EXPECT_EQ(d.counters, (std::array<uint64_t, 6>{0, 0, 0, 0, 0, 1})) << "one source guard drop";
   ASSERT_EQ(d.bindings.size(), 2u);
   const session::SavedBinding &fixed = d.bindings[0];
   EXPECT_EQ(std::tie(fixed.vlan, fixed.method, fixed.timeRemaining, fixed.ip, fixed.clientId, fixed.leaseTime),
             std::make_tuple(uint16_t{5}, uint8_t{SwSecDiscStatic}, int64_t{0}, kStaticIp.bytes, Bytes{}, 0u));
   EXPECT_EQ(fixed.serverIp, (std::array<uint8_t, 4>{}));
   const session::SavedBinding &dhcp = d.bindings[1];
   EXPECT_EQ(std::tie(dhcp.method, dhcp.mac, dhcp.chaddr, dhcp.ip, dhcp.timeRemaining, dhcp.serverIp, dhcp.leaseTime),
             std::make_tuple(uint8_t{SwSecDiscDhcpSnooping}, macOf(1).bytes, macOf(1).bytes, ipOf(1).bytes, int64_t{60},
                             kServerIp.bytes, 100u));
   EXPECT_EQ(dhcp.clientId, (Bytes{0x01, 0xaa, 0xbb}));
   for (const size_t entry : {48u + 96u, 48u + 96u + 48u}) {   // no pointer or stale byte leaves the module
      EXPECT_EQ(Bytes(blob.begin() + entry + 13, blob.begin() + entry + 16), Bytes(3, 0));
      EXPECT_EQ(Bytes(blob.begin() + entry + 31, blob.begin() + entry + 40), Bytes(9, 0));
   }
}

TEST_F(SavedStateTest, remaining_times_past_their_end_but_not_yet_aged_are_saved_as_zero)
{
   const host::FilterId id = create();
   ASSERT_EQ(writeConfig(id, {kDai, 0, 32, 10, 2, 10, {}}), ORR_OK);
   host().clock().advance(1s);
   learnDhcp(id, 1, 180);                                             // ends at 181 s, aged at 190 s
   host().clock().advance(174s);
   (void)send(id, kTx, std::vector<Bytes>(11, arpRequest(kVmMac, Ip4{})));   // until 185 s, over at 190 s
   ASSERT_EQ(context(id)->txRateLimitErr, 1);
   host().clock().advance(12s);
   const session::SavedPortState d = session::decodeSavedState(save(id));
   EXPECT_TRUE(d.txRateLimitErr);
   EXPECT_EQ(d.txRateLimitErrRemaining, 0);
   ASSERT_EQ(d.bindings.size(), 1u);
   EXPECT_EQ(d.bindings[0].timeRemaining, 0);
}

TEST_F(SavedStateTest, a_save_never_writes_past_the_length_announced_before_more_bindings_were_learned)
{
   const host::FilterId id = create();
   learnDhcp(id, 1, 600, Bytes{7, 7});
   const uint64_t announced = ops(id).getSavedStateLen(record(id));
   learnDhcp(id, 2, 600);
   Bytes part(announced + 64, 0xee);
   ops(id).saveState(record(id), part.data(), announced);
   EXPECT_EQ(Bytes(part.begin() + static_cast<std::ptrdiff_t>(announced), part.end()), Bytes(64, 0xee));
   EXPECT_EQ(get32(part, 28), 1u) << "the newest entry is left out";
}

TEST_F(SavedStateTest, a_port_without_ip_discovery_saves_a_bare_fixed_part_and_empties_its_destination)
{
   const host::FilterId source = create();
   ASSERT_EQ(writeConfig(source, {.features = SwSecFeatureBpduFilter}), ORR_OK);
   const Bytes blob = save(source);
   ASSERT_EQ(blob.size(), 48u + 96u + 40u);

   const host::FilterId destination = create({}, kOtherPort);
   learnDhcp(destination, 1, 600);
   ASSERT_EQ(restore(destination, blob), ORR_OK);
   EXPECT_EQ(context(destination)->numVmiEntries, 0u);
   EXPECT_EQ(+context(destination)->config.featuresEnabled, SwSecFeatureBpduFilter);
   ASSERT_EQ(host().portsets().posted().size(), 2u);
   EXPECT_EQ(host().portsets().posted().back().name, "portdb.entry.removed") << "the learned binding goes";
}

// ---------------------------------------------------------------- round trips

// The saved blob comes back whole from the restored port: configuration, frame guard, counters.
TEST_F(SavedStateTest, the_error_rate_limit_state_keeps_its_remaining_seconds)
{
   const host::FilterId source = create();
   ASSERT_EQ(writeConfig(source, {kDai, 0, 32, 10, 2, 60, {}, true, {0x0806}}), ORR_OK);
   EXPECT_FALSE(passes(source, kTx, udpFrame({.src = macOf(1)})));   // not a listed ethertype
   (void)send(source, kTx, std::vector<Bytes>(12, arpRequest(kVmMac, Ip4{})));
   host().clock().advance(20s);
   const Bytes blob = save(source);
   const session::SavedPortState saved = session::decodeSavedState(blob);
   EXPECT_TRUE(saved.allowTagged && saved.etherTypes == std::vector<uint16_t>{0x0806} && saved.etherTypeDropCnt == 1);
   const int64_t left = saved.txRateLimitErrRemaining;
   ASSERT_GT(left, 30);

   host().clock().advance(2h);
   const host::FilterId destination = create({}, kOtherPort);
   ASSERT_EQ(restore(destination, blob), ORR_OK);
   EXPECT_EQ(save(destination), blob);
   EXPECT_EQ(context(destination)->txRateLimit.limit, 2u);
   EXPECT_EQ(context(destination)->rxRateLimit.limit, 10u);
   // The state ends at the first timer tick after its seconds ran out.
   host().clock().advance(std::chrono::seconds(left + 11));
   EXPECT_EQ(context(destination)->txRateLimitErr, 0);
}

// Saves taken while another thread's ARP floods raise the counters and move
// the port in and out of the error-rate-limit state read what the frames
// wrote, whole (run under ThreadSanitizer in CI).
TEST_F(SavedStateTest, saves_read_counters_and_the_error_state_while_frames_change_them)
{
   const host::FilterId id = create();
   ASSERT_EQ(writeConfig(id, {kDai, 0, 32, 4, 1, 10, {}}), ORR_OK);
   std::atomic<bool> done{false};
   std::thread flood([&] {
      for (int round = 0; round < 60; ++round) {
         (void)send(id, kTx, std::vector<Bytes>(6, arpRequest(macOf(1), ipOf(5))));
         (void)send(id, kRx, std::vector<Bytes>(6, arpRequest(macOf(2), ipOf(6))));
      }
      done = true;
   });
   uint64_t last = 0;
   for (bool over = false; !over;) {
      over = done.load();
      const session::SavedPortState d = session::decodeSavedState(save(id));
      const uint64_t sum = d.counters[1] + d.counters[2] + d.counters[4];   // DAI, ARP limits both ways
      EXPECT_GE(sum, last) << "a counter went back";
      last = sum;
   }
   flood.join();
   EXPECT_GT(last, 0u) << "the floods were dropped and counted";
}

// ---------------------------------------------------------------- the source's phases

// Calls of the source side, one letter each: p prefetch, l length (the
// one-entry blob's, or a failure), c cancel, s save into 4096 bytes, t
// save into one byte less than the blob, n save with no buffer. The case
// gives the status of the last call.
struct PhaseCase {
   const char *name;
   const char *calls;
   orr_Status status;
   const char *message;   // "" none
};

class SavePhaseTest : public SavedStateTest, public ::testing::WithParamInterface<PhaseCase> {};

constexpr uint64_t kOneEntryBlob = 48 + 96 + 48 + 40;

TEST_P(SavePhaseTest, each_call_answers_as_its_phase_says)
{
   const host::FilterId id = create();
   learnDhcp(id, 1, 600);
   host::Migration &m = host().migration();
   orr_Status status = ORR_OK;
   for (const char *call = GetParam().calls; *call != '\0'; ++call) {
      Bytes blob;
      uint64_t length = 0;
      switch (*call) {
      case 'p': m.prefetch(id); break;
      case 'l': status = m.length(id, &length); break;
      case 'c': status = m.length(id, nullptr); break;
      case 's': status = m.save(id, 4096, &blob); break;
      case 't': status = m.save(id, kOneEntryBlob - 1, &blob); break;
      case 'n': status = m.save(id, 4096, nullptr); break;
      }
      if (status == ORR_OK && (*call == 'l' || *call == 's')) {
         EXPECT_EQ(std::max<uint64_t>(length, blob.size()), kOneEntryBlob) << *call;
      }
   }
   EXPECT_EQ(status, GetParam().status);
   if (*GetParam().message != '\0') {
      EXPECT_TRUE(logged(GetParam().message)) << ::testing::PrintToString(logTexts());
   }
   EXPECT_EQ(record(id)->refCount, 1u);
}

INSTANTIATE_TEST_SUITE_P(
   Phases, SavePhaseTest,
   ::testing::Values(
      PhaseCase{"length_without_prefetch_fails_silently", "l", ORR_FAILURE, ""},
      PhaseCase{"length_after_prefetch_is_header_and_agent_part", "pl", ORR_OK, ""},
      PhaseCase{"a_second_prefetch_is_ignored", "ppl", ORR_OK, "filter: Ignoring state prefetch request; wrong state (3)"},
      PhaseCase{"a_save_without_prefetch_is_refused", "s", ORR_INVALID_HANDLE, "Unexpected request to save state"},
      PhaseCase{"a_second_save_needs_a_new_prefetch", "pss", ORR_INVALID_HANDLE, "Unexpected request to save state"},
      PhaseCase{"a_buffer_one_byte_short_is_refused", "pt", ORR_BUFFER_TOO_SMALL,
                "Buffer too short for saved state (requested 232, got 231)"},
      PhaseCase{"a_refused_save_spends_the_prefetch", "ptl", ORR_FAILURE, ""},
      PhaseCase{"a_cancel_returns_to_idle", "pcs", ORR_INVALID_HANDLE, "Unexpected request to save state"},
      PhaseCase{"a_save_without_buffer_cancels", "pnl", ORR_FAILURE, ""}),
   [](const auto &testInfo) { return std::string(testInfo.param.name); });

// ---------------------------------------------------------------- refusals of a restore

struct RestoreCase {
   const char *name;
   std::function<void(Bytes &)> edit;
   orr_Status status;
   const char *message;
   uint32_t failurePolicy = 0;   // the destination's
};

class RestoreRefusalTest : public SavedStateTest, public ::testing::WithParamInterface<RestoreCase> {};

TEST_P(RestoreRefusalTest, a_bad_blob_is_refused_with_its_message_and_changes_nothing)
{
   const host::FilterId source = create();
   ASSERT_EQ(writeConfig(source, {.statics = {binding(5, kStaticMac, kStaticIp)}}), ORR_OK);
   learnDhcp(source, 1, 600, Bytes{9, 9});
   learnDhcp(source, 2, 600);
   Bytes blob = save(source);
   GetParam().edit(blob);

   const host::FilterId destination = create({.name = "dest", .failurePolicy = GetParam().failurePolicy}, kOtherPort);
   learnDhcp(destination, 3, 600);
   const Bytes before = save(destination);
   const uint64_t liveBytes = host().heap().liveBytes();
   EXPECT_EQ(restore(destination, blob), GetParam().status);
   EXPECT_TRUE(logged(GetParam().message)) << ::testing::PrintToString(logTexts());
   if (GetParam().status != ORR_OK) {
      EXPECT_EQ(host().heap().liveBytes(), liveBytes);
      EXPECT_EQ(save(destination), before);
   } else {
      EXPECT_EQ(context(destination)->numVmiEntries, 4u);
   }
}

constexpr size_t kAgent0 = 48;   // the agent part's offset in a blob as written

void addSlowPathPart(Bytes &b)
{
   b.insert(b.end(), {1, 2, 3});
   putLe(b, 40, 3);
}

INSTANTIATE_TEST_SUITE_P(
   Refusals, RestoreRefusalTest,
   ::testing::Values(
      RestoreCase{"a_blob_shorter_than_the_header", [](Bytes &b) { b.resize(47); }, ORR_FAILURE,
                  "dest: Buffer too short for header (47 bytes)"},
      RestoreCase{"a_foreign_magic", [](Bytes &b) { b[0] = 'S'; }, ORR_FAILURE,
                  "dest: Bad state header magic (got 0x6576617367666953)"},
      RestoreCase{"version_2", [](Bytes &b) { putLe(b, 8, 2); }, ORR_FAILURE,
                  "dest: Bad state header verison (expected 1, got 2)"},
      RestoreCase{"a_slow_path_part_one_byte_past_the_end",
                  [](Bytes &b) { putLe(b, 40, 1); }, ORR_FAILURE, "Buffer not large enough (expected "},
      RestoreCase{"a_slow_path_sum_that_wraps",
                  [](Bytes &b) { putLe(b, 32, UINT64_MAX); putLe(b, 40, 2); },
                  ORR_FAILURE, "dest: Buffer not large enough (expected 1, got "},
      RestoreCase{"an_agent_part_inside_the_header", [](Bytes &b) { putLe(b, 16, 40); }, ORR_FAILURE,
                  "dest: Bad state header offsets (40 "},
      RestoreCase{"an_agent_part_overlapping_the_slow_path_part",
                  [](Bytes &b) { putLe(b, 24, get32(b, 24) + 1); }, ORR_FAILURE, "dest: Bad state header offsets (48 "},
      RestoreCase{"an_agent_sum_that_wraps",
                  [](Bytes &b) { putLe(b, 24, UINT64_MAX - 40); }, ORR_FAILURE,
                  "dest: Bad state header offsets (48 18446744073709551575 "},
      RestoreCase{"an_agent_part_too_short_for_its_fixed_bytes",
                  [](Bytes &b) { putLe(b, 24, 95); putLe(b, 32, 48 + 95); },
                  ORR_FAILURE, "dest: Failed to restore fast path agent state"},
      RestoreCase{"a_count_that_runs_past_the_part",
                  [](Bytes &b) { putLe(b, kAgent0 + 28, get32(b, kAgent0 + 28) + 1, 4); }, ORR_FAILURE,
                  "dest: Saved state VMI 4 of 4 runs past the part's"},
      RestoreCase{"a_client_id_that_runs_past_the_part",
                  [](Bytes &b) { b[kAgent0 + 96 + 48 + 30] = 200; }, ORR_FAILURE,
                  "dest: Saved state VMI 2 of 3 runs past the part's"},
      RestoreCase{"entries_with_ip_discovery_off",
                  [](Bytes &b) { b[kAgent0 + 1] = static_cast<uint8_t>(SwSecFeatureBpduFilter); }, ORR_FAILURE,
                  "dest: Saved state has 3 VMIs but IP discovery is off"},
      RestoreCase{"a_configuration_the_property_would_refuse",
                  [](Bytes &b) { b[kAgent0 + 1] = static_cast<uint8_t>(SwSecFeatureIpDiscovery | SwSecFeatureDai); },
                  ORR_FAILURE, "dest: Invalid config: featuresEnabled = 0xc trusted = 1"},
      RestoreCase{"a_database_size_the_port_refuses", [](Bytes &b) { putLe(b, kAgent0 + 6, 33, 4); },
                  ORR_FAILURE, "dest: Invalid portDbSize: 33. Expected in the range [1 32]"},
      RestoreCase{"a_slow_path_part_without_a_slow_path_under_policy_0", addSlowPathPart, ORR_FAILURE,
                  "dest: Have saved slow path state, but no slow path"},
      RestoreCase{"a_slow_path_part_without_a_slow_path_dropped_under_policy_1", addSlowPathPart, ORR_OK,
                  "dest: Have saved slow path state, but no slow path", 1},
      RestoreCase{"a_gap_after_the_header_is_accepted",
                  [](Bytes &b) {
                     b.insert(b.begin() + 48, 16, 0xee);
                     putLe(b, 16, 64);
                     putLe(b, 32, get32(b, 32) + 16);
                  },
                  ORR_OK, "dest: Finished restoring state"}),
   [](const auto &testInfo) { return std::string(testInfo.param.name); });

TEST_F(SavedStateTest, a_restore_outside_the_idle_phase_or_without_a_restore_callback_is_refused_an_empty_one_not)
{
   const Bytes blob = save(create());
   const host::FilterId destination = create({.name = "dest"}, kOtherPort);
   EXPECT_EQ(host().migration().restore(destination, {}), ORR_OK);
   host().migration().prefetch(destination);
   EXPECT_EQ(restore(destination, blob), ORR_FAILURE);
   EXPECT_TRUE(logged("dest: Ignoring state restore request; wrong state (3)"));
   EXPECT_EQ(host().migration().length(destination, nullptr), ORR_OK);

   // An agent part for an agent that cannot read one.
   SifraGenericAgentOps withoutRestore = ops(destination);
   withoutRestore.restoreState = nullptr;
   const SifraGenericAgentOps *original = record(destination)->agent->ops;
   record(destination)->agent->ops = &withoutRestore;
   EXPECT_EQ(restore(destination, blob), ORR_FAILURE);
   record(destination)->agent->ops = original;
   EXPECT_TRUE(logged("dest: Failed to restore fast path agent state"));
   EXPECT_EQ(restore(destination, blob), ORR_OK);
}

TEST_F(SavedStateTest, a_part_naming_a_smaller_database_keeps_what_fits)
{
   const host::FilterId source = create();
   learnDhcp(source, 1, 600);
   learnDhcp(source, 2, 600);
   Bytes blob = save(source);
   putLe(blob, kAgent0 + 6, 1, 4);   // portDbSize 1
   const host::FilterId destination = create({.name = "dest"}, kOtherPort);
   ASSERT_EQ(restore(destination, blob), ORR_OK);
   EXPECT_TRUE(logged("dest: Exceeding the max portDbSize 1"));
   const session::SavedPortState d = session::decodeSavedState(save(destination));
   ASSERT_EQ(d.bindings.size(), 1u);
   EXPECT_EQ(d.bindings[0].mac, macOf(1).bytes);
}

// ---------------------------------------------------------------- allocation failures

TEST_F(SavedStateTest, every_allocation_of_a_restore_failed_in_turn_changes_nothing)
{
   const host::FilterId source = create();
   ASSERT_EQ(writeConfig(source, {.statics = {binding(5, kStaticMac, kStaticIp)}}), ORR_OK);
   learnDhcp(source, 1, 600, Bytes{9, 9, 9});
   learnDhcp(source, 2, 600);
   learnDhcp(source, 4, 600, Bytes{1});
   const Bytes blob = save(source);

   for (const char *point : {"orr_HeapAllocWithRA", "Hash_Alloc"}) {
      uint64_t refused = 0;
      for (bool destinationLearned : {false, true}) {
         for (uint64_t nth = 1;; ++nth) {
            SCOPED_TRACE(std::string(point) + " #" + std::to_string(nth) +
                         (destinationLearned ? " onto a learned entry" : " onto a bare port"));
            const host::FilterId destination = create({.name = "dest"}, kOtherPort);
            if (destinationLearned) {
               learnDhcp(destination, 3, 600);
            }
            const Bytes before = save(destination);
            const uint64_t liveBytes = host().heap().liveBytes();
            host().faults().failOnce(point, ORR_NO_MEMORY, nth);
            const orr_Status status = restore(destination, blob);
            host().faults().clear();
            if (status == ORR_OK) {
               EXPECT_EQ(context(destination)->numVmiEntries, destinationLearned ? 5u : 4u);
               EXPECT_EQ(host().sifra().destroyFilterAsHypervisor(destination).status, ORR_OK);
               break;
            }
            ++refused;
            EXPECT_EQ(status, ORR_FAILURE);
            EXPECT_EQ(host().heap().liveBytes(), liveBytes);
            EXPECT_EQ(save(destination), before);
            ASSERT_EQ(host().sifra().destroyFilterAsHypervisor(destination).status, ORR_OK);
            ASSERT_LT(nth, 64u) << "the restore never succeeded";
         }
      }
      // Four records, two client identifiers, and the spare table, for each destination.
      EXPECT_EQ(refused, std::string(point) == "Hash_Alloc" ? 2u : 12u) << point;
   }
}

}  // namespace
}  // namespace swsec::testing
