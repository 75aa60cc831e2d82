// A port's state carried across a migration, driven as the hypervisor
// drives it: prefetch, length and save on the source, create and restore
// on the destination, with the blob's bytes checked by hand, every
// refusal of a restore, lifetimes re-based on a later clock and every
// allocation of a restore failed in turn.
#include "port_fixture.h"

#include "framework/sifra_generic_filter.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_vmi.h"

#include <gmock/gmock.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <functional>
#include <string>
#include <thread>
#include <vector>

using namespace std::chrono_literals;

namespace swsec::testing {
namespace {

const Mac kServerMac = Mac::parse("02:00:00:00:00:fe");
const Ip4 kServerIp = Ip4::parse("10.0.0.1");
const Mac kStaticMac = Mac::parse("02:00:00:00:00:0a");
const Ip4 kStaticIp = Ip4::parse("10.0.0.10");

Mac macOf(uint8_t last)
{
   return Mac{{0x02, 0, 0, 0, 0, last}};
}

Ip4 ipOf(uint8_t last)
{
   return Ip4{{10, 0, 0, last}};
}

// What a port holds, read from its context, for before/after comparisons.
struct VmiSnapshot {
   uint16_t vlanId = 0;
   std::array<uint8_t, 6> mac{};
   uint32_t ipAddr = 0;
   uint8_t method = 0;
   int64_t expiryTime = 0;
   std::array<uint8_t, 6> chaddr{};
   Bytes clientId;
   uint32_t serverIp = 0;
   uint32_t leaseTime = 0;
   bool operator==(const VmiSnapshot &) const = default;
};

struct PortSnapshot {
   Bytes config;                      // the 26-byte header
   std::vector<VmiSnapshot> vmis;     // list order
   uint32_t numAuth = 0;
   uint32_t numNonAuth = 0;
   uint32_t totalClientIdLen = 0;
   Bytes counters;                    // the 48-byte block
   uint8_t txRateLimitErr = 0;
   int64_t txRateLimitErrEnd = 0;
   bool hasHash = false;
   bool operator==(const PortSnapshot &) const = default;
};

class SavedStateTest : public PortTest {
protected:
   SifraGenericFilter *record(host::FilterId id)
   {
      return static_cast<SifraGenericFilter *>(host().sifra().filter(id)->record);
   }
   SwSecContext *context(host::FilterId id) { return static_cast<SwSecContext *>(record(id)->agentData); }

   int64_t uptime() { return 1000 + std::chrono::duration_cast<std::chrono::seconds>(host().clock().now()).count(); }

   PortSnapshot snapshot(host::FilterId id)
   {
      const SwSecContext *ctx = context(id);
      PortSnapshot out;
      const auto *config = reinterpret_cast<const uint8_t *>(&ctx->config);
      out.config.assign(config, config + sizeof(ctx->config));
      for (const orr_ListLinks *links = ctx->portDbList.next; links != &ctx->portDbList; links = links->next) {
         const auto *vmi = reinterpret_cast<const SwSecVmi *>(reinterpret_cast<const uint8_t *>(links) -
                                                               offsetof(SwSecVmi, listLinks));
         VmiSnapshot entry;
         entry.vlanId = vmi->vlanId;
         std::memcpy(entry.mac.data(), vmi->macAddr, 6);
         entry.ipAddr = vmi->ipAddr;
         entry.method = vmi->discoveryMethod;
         entry.expiryTime = vmi->expiryTime;
         std::memcpy(entry.chaddr.data(), vmi->chaddr, 6);
         if (vmi->clientIdLen != 0) {
            entry.clientId.assign(vmi->clientIdStr, vmi->clientIdStr + vmi->clientIdLen);
         }
         entry.serverIp = vmi->serverIp;
         entry.leaseTime = vmi->leaseTime;
         out.vmis.push_back(entry);
      }
      out.numAuth = ctx->numAuthVmiEntries;
      out.numNonAuth = ctx->numNonAuthVmiEntries;
      out.totalClientIdLen = ctx->totalClientIdLen;
      const auto *counters = reinterpret_cast<const uint8_t *>(&ctx->counters);
      out.counters.assign(counters, counters + sizeof(ctx->counters));
      out.txRateLimitErr = ctx->txRateLimitErr;
      out.txRateLimitErrEnd = ctx->txRateLimitErrEnd;
      out.hasHash = ctx->portDbHash != nullptr;
      return out;
   }

   // A DHCP request from the VM and the server's ACK: a DHCP Snooping binding.
   void learnDhcp(host::FilterId id, const Mac &mac, const Ip4 &ip, uint32_t xid, uint32_t lease,
                  std::optional<Bytes> clientId = std::nullopt)
   {
      const Bytes request = dhcpFrame(
         {.src = mac, .dhcp = {.op = 1, .xid = xid, .chaddr = mac, .type = kDhcpRequest, .clientId = clientId}});
      const Bytes ack = dhcpFrame({.src = kServerMac,
                                   .dst = mac,
                                   .ipSrc = kServerIp,
                                   .ipDst = ip,
                                   .fromServer = true,
                                   .dhcp = {.op = 2,
                                            .xid = xid,
                                            .yiaddr = ip,
                                            .siaddr = kServerIp,
                                            .chaddr = mac,
                                            .type = kDhcpAck,
                                            .leaseTime = lease}});
      ASSERT_TRUE(passes(id, kTx, request));
      ASSERT_TRUE(passes(id, kRx, ack));
   }

   // The source side as the hypervisor runs it; the blob the module wrote.
   Bytes save(host::FilterId id)
   {
      Bytes blob;
      EXPECT_EQ(host().migration().saveAsHypervisor(id, &blob), ORR_OK);
      return blob;
   }

   orr_Status restore(host::FilterId id, const Bytes &blob) { return host().migration().restore(id, blob); }

   // Messages posted for `port`, names in order.
   std::vector<std::string> postedNames(uint32_t port)
   {
      std::vector<std::string> names;
      for (const auto &message : host().portsets().posted()) {
         if (message.portID == port) {
            names.push_back(message.name);
         }
      }
      return names;
   }
};

void putLe(Bytes &blob, size_t offset, uint64_t value, size_t size = 8)
{
   for (size_t i = 0; i < size; ++i) {
      blob[offset + i] = static_cast<uint8_t>(value >> (8 * i));
   }
}

uint64_t getLe(const Bytes &blob, size_t offset, size_t size = 8)
{
   uint64_t value = 0;
   for (size_t i = 0; i < size; ++i) {
      value |= static_cast<uint64_t>(blob[offset + i]) << (8 * i);
   }
   return value;
}

// ---------------------------------------------------------------- the blob's bytes

TEST_F(SavedStateTest, the_blob_is_laid_out_byte_for_byte)
{
   const host::FilterId id = create();
   ASSERT_EQ(writeConfig(id, {.features = SwSecFeatureIpDiscovery | SwSecFeatureIpSrcGuard,
                              .trusted = 0,
                              .portDbSize = 8,
                              .statics = {binding(5, kStaticMac, kStaticIp)}}),
             ORR_OK);
   learnDhcp(id, macOf(1), ipOf(5), 0x1234, 100, Bytes{0x01, 0xaa, 0xbb});
   host().clock().advance(40s);
   EXPECT_FALSE(passes(id, kTx, udpFrame({.src = macOf(1), .dst = kServerMac, .ipSrc = ipOf(66), .ipDst = kServerIp})));

   const Bytes expected = {
      // header: "sifgsave", version 1, agentOffset 48, agentLen 195, slowPathOffset 243, slowPathLen 0
      's', 'i', 'f', 'g', 's', 'a', 'v', 'e',
      0x01, 0, 0, 0, 0, 0, 0, 0,
      0x30, 0, 0, 0, 0, 0, 0, 0,
      0xc3, 0, 0, 0, 0, 0, 0, 0,
      0xf3, 0, 0, 0, 0, 0, 0, 0,
      0, 0, 0, 0, 0, 0, 0, 0,
      // agent: version 1, features 0x14, untrusted, portDbSize 8, numStatic 1, no ARP limits
      0x01, 0x14, 0, 0, 0, 0x00, 0x08, 0, 0, 0, 0x01, 0, 0, 0,
      0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0,
      0, 0,                                       // reserved
      0x02, 0, 0, 0,                              // numSavedVmis
      0, 0, 0, 0, 0, 0, 0, 0,                     // not in the error state, reserved
      0, 0, 0, 0, 0, 0, 0, 0,                     // no error time left
      0, 0, 0, 0, 0, 0, 0, 0,                     // dhcpSnoopingDropCnt
      0, 0, 0, 0, 0, 0, 0, 0,                     // daiDropCnt
      0, 0, 0, 0, 0, 0, 0, 0,                     // txRateLimitDropCnt
      0, 0, 0, 0, 0, 0, 0, 0,                     // txRateLimitErrEntryCnt
      0, 0, 0, 0, 0, 0, 0, 0,                     // rxRateLimitDropCnt
      0x01, 0, 0, 0, 0, 0, 0, 0,                  // ipSrcGuardDropCnt
      // the static entry: VLAN 5, its MAC and address, Static, no time, no DHCP details
      0x05, 0x00, 0x02, 0, 0, 0, 0, 0x0a, 10, 0, 0, 10, 0x02, 0, 0, 0,
      0, 0, 0, 0, 0, 0, 0, 0,
      0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0,
      // the DHCP entry: VLAN 0, 60 s left, chaddr, 3-byte client ID, server, lease 100, the ID
      0x00, 0x00, 0x02, 0, 0, 0, 0, 0x01, 10, 0, 0, 5, 0x01, 0, 0, 0,
      0x3c, 0, 0, 0, 0, 0, 0, 0,
      0x02, 0, 0, 0, 0, 0x01, 0x03, 0,
      0, 0, 0, 0, 0, 0, 0, 0,
      10, 0, 0, 1, 0x64, 0, 0, 0,
      0x01, 0xaa, 0xbb,
   };
   ASSERT_EQ(expected.size(), 243u);
   EXPECT_EQ(save(id), expected);
}

TEST_F(SavedStateTest, a_port_without_ip_discovery_saves_a_bare_fixed_part_and_empties_its_destination)
{
   const host::FilterId source = create();
   ASSERT_EQ(writeConfig(source, {.features = SwSecFeatureBpduFilter}), ORR_OK);
   const Bytes blob = save(source);
   ASSERT_EQ(blob.size(), 48u + 96u);
   EXPECT_EQ(getLe(blob, 48 + 28, 4), 0u);

   const host::FilterId destination = create({}, kOtherPort);
   learnDhcp(destination, macOf(1), ipOf(5), 7, 600);
   host().portsets().clearPosted();
   ASSERT_EQ(restore(destination, blob), ORR_OK);
   EXPECT_TRUE(snapshot(destination).vmis.empty());
   EXPECT_EQ(+context(destination)->config.featuresEnabled, SwSecFeatureBpduFilter);
   EXPECT_THAT(postedNames(kOtherPort), ::testing::ElementsAre("portdb.entry.removed"));
   EXPECT_TRUE(logged("filter: Finished restoring state"));
}

// ---------------------------------------------------------------- round trips

TEST_F(SavedStateTest, a_learning_port_arrives_whole_and_in_order_hours_later)
{
   const host::FilterId source = create();
   ASSERT_EQ(writeConfig(source, {.features = SwSecFeatureIpDiscovery | SwSecFeatureBpduFilter,
                                  .portDbSize = 16,
                                  .statics = {binding(5, kStaticMac, kStaticIp)}}),
             ORR_OK);
   Bytes id255(255);
   for (size_t i = 0; i < id255.size(); ++i) {
      id255[i] = static_cast<uint8_t>(i);
   }
   learnDhcp(source, macOf(1), ipOf(21), 0x11, 30);
   learnDhcp(source, macOf(2), ipOf(22), 0x12, 3600, Bytes{0x7f});
   learnDhcp(source, macOf(3), ipOf(23), 0x13, 7200, Bytes{1, 2, 3, 4, 5, 6, 7});
   learnDhcp(source, macOf(4), ipOf(24), 0x14, 86400, id255);
   ASSERT_TRUE(passes(source, kTx, arpRequest(macOf(9), ipOf(29))));
   // An ACK nobody asked for is dropped.
   EXPECT_FALSE(passes(source, kRx,
                       dhcpFrame({.src = kServerMac, .dst = macOf(8), .ipSrc = kServerIp, .ipDst = ipOf(28),
                                  .fromServer = true,
                                  .dhcp = {.op = 2, .xid = 99, .yiaddr = ipOf(28), .chaddr = macOf(8),
                                           .type = kDhcpAck, .leaseTime = 60}})));
   const PortSnapshot before = snapshot(source);
   ASSERT_EQ(before.vmis.size(), 6u);
   const int64_t savedAt = uptime();
   const Bytes blob = save(source);
   EXPECT_EQ(blob.size(), 48u + 96u + 6 * 48u + 1 + 7 + 255);

   host().clock().advance(3h + 17s);
   const host::FilterId destination = create({}, kOtherPort);
   host().portsets().clearPosted();
   const int64_t restoredAt = uptime();
   ASSERT_EQ(restore(destination, blob), ORR_OK);

   PortSnapshot after = snapshot(destination);
   // Lifetimes count from the restore: shift the source's expiries by the time between.
   PortSnapshot expected = before;
   for (VmiSnapshot &vmi : expected.vmis) {
      if (vmi.method != SwSecDiscStatic) {
         vmi.expiryTime += restoredAt - savedAt;
      }
   }
   EXPECT_EQ(after, expected);
   EXPECT_EQ(after.vmis[1].expiryTime, restoredAt + 30);
   EXPECT_EQ(postedNames(kOtherPort), std::vector<std::string>(6, "portdb.entry.added"));

   // The 30-second lease ends 30 s after the restore, and not before.
   host().clock().advance(30s);
   EXPECT_EQ(snapshot(destination).vmis.size(), 6u);
   host().clock().advance(20s);
   EXPECT_EQ(snapshot(destination).vmis.size(), 5u);
}

TEST_F(SavedStateTest, the_error_rate_limit_state_keeps_its_remaining_seconds)
{
   const host::FilterId source = create();
   ASSERT_EQ(writeConfig(source, {.features = SwSecFeatureIpDiscovery | SwSecFeatureDai,
                                  .trusted = 0,
                                  .arpRateLimit = 10,
                                  .errRateLimit = 2,
                                  .errRateLimitPeriod = 60}),
             ORR_OK);
   (void)kept(source, kTx, std::vector<Bytes>(12, arpRequest(macOf(1), ipOf(5))));
   ASSERT_EQ(context(source)->txRateLimitErr, 1);
   host().clock().advance(20s);
   const int64_t left = context(source)->txRateLimitErrEnd - uptime();
   ASSERT_GT(left, 30);
   const PortSnapshot before = snapshot(source);
   const Bytes blob = save(source);

   host().clock().advance(2h);
   const host::FilterId destination = create({}, kOtherPort);
   ASSERT_EQ(restore(destination, blob), ORR_OK);
   const SwSecContext *ctx = context(destination);
   EXPECT_EQ(ctx->txRateLimitErr, 1);
   EXPECT_EQ(ctx->txRateLimitErrEnd, uptime() + left);
   EXPECT_EQ(ctx->txRateLimit.limit, 2u);
   EXPECT_EQ(ctx->rxRateLimit.limit, 10u);
   EXPECT_EQ(snapshot(destination).counters, before.counters);
   EXPECT_EQ(snapshot(destination).config, before.config);

   // The state ends at the first timer tick after its seconds ran out.
   host().clock().advance(std::chrono::seconds(left + 11));
   EXPECT_EQ(context(destination)->txRateLimitErr, 0);
}

// Saves taken while another thread's ARP floods raise the counters and move
// the port in and out of the error-rate-limit state: each save reads what
// the frames wrote, whole (run under ThreadSanitizer in CI).
TEST_F(SavedStateTest, saves_read_counters_and_the_error_state_while_frames_change_them)
{
   const host::FilterId id = create();
   ASSERT_EQ(writeConfig(id, {.features = SwSecFeatureIpDiscovery | SwSecFeatureDai,
                              .trusted = 0,
                              .arpRateLimit = 4,
                              .errRateLimit = 1,
                              .errRateLimitPeriod = 10}),
             ORR_OK);
   constexpr size_t kCounters = 48 + 48;   // the counters' offset in a blob
   std::atomic<bool> done{false};
   std::thread flood([&] {
      for (int round = 0; round < 60; ++round) {
         (void)send(id, kTx, std::vector<Bytes>(6, arpRequest(macOf(1), ipOf(5))));
         (void)send(id, kRx, std::vector<Bytes>(6, arpRequest(macOf(2), ipOf(6))));
      }
      done = true;
   });
   std::array<uint64_t, 6> last{};
   // Saves until the floods are over, and one more after.
   for (bool over = false; !over;) {
      over = done.load();
      Bytes blob;
      ASSERT_EQ(host().migration().saveAsHypervisor(id, &blob), ORR_OK);
      ASSERT_EQ(blob.size(), 48u + 96u);
      for (size_t i = 0; i < last.size(); ++i) {
         const uint64_t value = getLe(blob, kCounters + 8 * i);
         EXPECT_GE(value, last[i]) << "counter " << i << " went back";
         last[i] = value;
      }
      EXPECT_LE(blob[48 + 32], 1) << "the error flag is 0 or 1";
   }
   flood.join();
   EXPECT_GT(last[1] + last[2] + last[4], 0u) << "the floods were dropped and counted";
}

// ---------------------------------------------------------------- the source's phases

struct PhaseCase {
   const char *name;
   std::function<orr_Status(host::Migration &, host::FilterId)> steps;
   orr_Status status;
   const char *message;   // "" none
};

class SavePhaseTest : public SavedStateTest, public ::testing::WithParamInterface<PhaseCase> {};

TEST_P(SavePhaseTest, each_call_answers_as_its_phase_says)
{
   const host::FilterId id = create();
   learnDhcp(id, macOf(1), ipOf(5), 7, 600);
   EXPECT_EQ(GetParam().steps(host().migration(), id), GetParam().status);
   if (*GetParam().message != '\0') {
      EXPECT_TRUE(logged(GetParam().message)) << ::testing::PrintToString(logTexts());
   }
   EXPECT_EQ(record(id)->slowPathState, nullptr);
   EXPECT_EQ(record(id)->refCount, 1u);
}

constexpr uint64_t kOneEntryBlob = 48 + 96 + 48;

INSTANTIATE_TEST_SUITE_P(
   Phases, SavePhaseTest,
   ::testing::Values(
      PhaseCase{"length_without_prefetch_fails_silently",
                [](host::Migration &m, host::FilterId id) {
                   uint64_t length = 0;
                   return m.length(id, &length);
                },
                ORR_FAILURE, ""},
      PhaseCase{"length_after_prefetch_is_header_and_agent_part",
                [](host::Migration &m, host::FilterId id) {
                   m.prefetch(id);
                   uint64_t length = 0;
                   const orr_Status status = m.length(id, &length);
                   return length == kOneEntryBlob ? status : ORR_FAILURE;
                },
                ORR_OK, ""},
      PhaseCase{"a_second_prefetch_is_ignored",
                [](host::Migration &m, host::FilterId id) {
                   m.prefetch(id);
                   m.prefetch(id);
                   uint64_t length = 0;
                   return m.length(id, &length);
                },
                ORR_OK, "filter: Ignoring state prefetch request; wrong state (3)"},
      PhaseCase{"a_save_without_prefetch_is_refused",
                [](host::Migration &m, host::FilterId id) {
                   Bytes blob;
                   return m.save(id, 4096, &blob);
                },
                ORR_INVALID_HANDLE, "Unexpected request to save state"},
      PhaseCase{"a_second_save_needs_a_new_prefetch",
                [](host::Migration &m, host::FilterId id) {
                   Bytes blob;
                   m.prefetch(id);
                   if (m.save(id, 4096, &blob) != ORR_OK || blob.size() != kOneEntryBlob) {
                      return ORR_FAILURE;
                   }
                   return m.save(id, 4096, &blob);
                },
                ORR_INVALID_HANDLE, "Unexpected request to save state"},
      PhaseCase{"a_buffer_one_byte_short_is_refused_and_spends_the_prefetch",
                [](host::Migration &m, host::FilterId id) {
                   Bytes blob;
                   m.prefetch(id);
                   const orr_Status status = m.save(id, kOneEntryBlob - 1, &blob);
                   uint64_t length = 0;
                   return m.length(id, &length) == ORR_FAILURE ? status : ORR_OK;
                },
                ORR_BUFFER_TOO_SMALL, "Buffer too short for saved state (requested 192, got 191)"},
      PhaseCase{"a_cancel_returns_to_idle",
                [](host::Migration &m, host::FilterId id) {
                   Bytes blob;
                   m.prefetch(id);
                   if (m.length(id, nullptr) != ORR_OK) {
                      return ORR_FAILURE;
                   }
                   return m.save(id, 4096, &blob);
                },
                ORR_INVALID_HANDLE, "Unexpected request to save state"},
      PhaseCase{"a_save_without_buffer_cancels",
                [](host::Migration &m, host::FilterId id) {
                   m.prefetch(id);
                   const orr_Status status = m.save(id, 4096, nullptr);
                   uint64_t length = 0;
                   return m.length(id, &length) == ORR_FAILURE ? status : ORR_FAILURE;
                },
                ORR_OK, ""}),
   [](const auto &testInfo) { return std::string(testInfo.param.name); });

// ---------------------------------------------------------------- refusals of a restore

struct RestoreCase {
   const char *name;
   std::function<void(Bytes &)> edit;
   orr_Status status;
   const char *message;
};

class RestoreRefusalTest : public SavedStateTest, public ::testing::WithParamInterface<RestoreCase> {};

TEST_P(RestoreRefusalTest, a_bad_blob_is_refused_with_its_message_and_changes_nothing)
{
   const host::FilterId source = create();
   ASSERT_EQ(writeConfig(source, {.statics = {binding(5, kStaticMac, kStaticIp)}}), ORR_OK);
   learnDhcp(source, macOf(1), ipOf(5), 7, 600, Bytes{9, 9});
   learnDhcp(source, macOf(2), ipOf(6), 8, 600);
   Bytes blob = save(source);
   GetParam().edit(blob);

   const host::FilterId destination = create({.name = "dest"}, kOtherPort);
   learnDhcp(destination, macOf(3), ipOf(7), 9, 600);
   const PortSnapshot before = snapshot(destination);
   const uint64_t liveBytes = host().heap().liveBytes();
   EXPECT_EQ(restore(destination, blob), GetParam().status);
   EXPECT_TRUE(logged(GetParam().message)) << ::testing::PrintToString(logTexts());
   if (GetParam().status != ORR_OK) {
      EXPECT_EQ(snapshot(destination), before);
      EXPECT_EQ(host().heap().liveBytes(), liveBytes);
   } else {
      EXPECT_EQ(snapshot(destination).vmis.size(), 4u);
   }
}

constexpr size_t kAgent0 = 48;   // the agent part's offset in a blob as written

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
                  [](Bytes &b) {
                     putLe(b, 32, UINT64_MAX);
                     putLe(b, 40, 2);
                  },
                  ORR_FAILURE, "dest: Buffer not large enough (expected 1, got "},
      RestoreCase{"an_agent_part_inside_the_header", [](Bytes &b) { putLe(b, 16, 40); }, ORR_FAILURE,
                  "dest: Bad state header offsets (40 "},
      RestoreCase{"an_agent_part_overlapping_the_slow_path_part",
                  [](Bytes &b) { putLe(b, 24, getLe(b, 24) + 1); }, ORR_FAILURE, "dest: Bad state header offsets (48 "},
      RestoreCase{"an_agent_sum_that_wraps",
                  [](Bytes &b) { putLe(b, 24, UINT64_MAX - 40); }, ORR_FAILURE,
                  "dest: Bad state header offsets (48 18446744073709551575 "},
      RestoreCase{"an_agent_part_too_short_for_its_fixed_bytes",
                  [](Bytes &b) {
                     putLe(b, 24, 95);
                     putLe(b, 32, 48 + 95);
                  },
                  ORR_FAILURE, "dest: Failed to restore fast path agent state"},
      RestoreCase{"a_count_that_runs_past_the_part",
                  [](Bytes &b) { putLe(b, kAgent0 + 28, getLe(b, kAgent0 + 28, 4) + 1, 4); }, ORR_FAILURE,
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
      RestoreCase{"a_slow_path_part_without_a_slow_path_under_policy_0",
                  [](Bytes &b) {
                     b.insert(b.end(), {1, 2, 3});
                     putLe(b, 40, 3);
                  },
                  ORR_FAILURE, "dest: Have saved slow path state, but no slow path"},
      RestoreCase{"a_gap_after_the_header_is_accepted",
                  [](Bytes &b) {
                     b.insert(b.begin() + 48, 16, 0xee);
                     putLe(b, 16, 64);
                     putLe(b, 32, getLe(b, 32) + 16);
                  },
                  ORR_OK, "dest: Finished restoring state"}),
   [](const auto &testInfo) { return std::string(testInfo.param.name); });

TEST_F(SavedStateTest, a_slow_path_part_without_a_slow_path_is_dropped_under_another_policy)
{
   const host::FilterId source = create();
   learnDhcp(source, macOf(1), ipOf(5), 7, 600);
   Bytes blob = save(source);
   blob.insert(blob.end(), {1, 2, 3});
   putLe(blob, 40, 3);
   const host::FilterId destination = create({.name = "dest", .failurePolicy = 1}, kOtherPort);
   ASSERT_EQ(restore(destination, blob), ORR_OK);
   EXPECT_TRUE(logged("dest: Have saved slow path state, but no slow path"));
   EXPECT_TRUE(logged("dest: Finished restoring state"));
   EXPECT_EQ(snapshot(destination).vmis.size(), 1u);
   EXPECT_TRUE(host().migration().requests().empty());
}

TEST_F(SavedStateTest, a_restore_outside_the_idle_phase_and_an_empty_blob)
{
   const host::FilterId source = create();
   const Bytes blob = save(source);
   const host::FilterId destination = create({.name = "dest"}, kOtherPort);
   EXPECT_EQ(host().migration().restore(destination, {}), ORR_OK);
   host().migration().prefetch(destination);
   EXPECT_EQ(restore(destination, blob), ORR_FAILURE);
   EXPECT_TRUE(logged("dest: Ignoring state restore request; wrong state (3)"));
   EXPECT_EQ(host().migration().length(destination, nullptr), ORR_OK);
   EXPECT_EQ(restore(destination, blob), ORR_OK);
}

TEST_F(SavedStateTest, a_part_naming_a_smaller_database_keeps_what_fits)
{
   const host::FilterId source = create();
   learnDhcp(source, macOf(1), ipOf(5), 7, 600);
   learnDhcp(source, macOf(2), ipOf(6), 8, 600);
   Bytes blob = save(source);
   putLe(blob, kAgent0 + 6, 1, 4);   // portDbSize 1
   const host::FilterId destination = create({.name = "dest"}, kOtherPort);
   ASSERT_EQ(restore(destination, blob), ORR_OK);
   EXPECT_TRUE(logged("dest: Exceeding the max portDbSize 1"));
   ASSERT_EQ(snapshot(destination).vmis.size(), 1u);
   EXPECT_EQ(snapshot(destination).vmis[0].mac, macOf(1).bytes);
}

// ---------------------------------------------------------------- allocation failures

TEST_F(SavedStateTest, every_allocation_of_a_restore_failed_in_turn_changes_nothing)
{
   const host::FilterId source = create();
   ASSERT_EQ(writeConfig(source, {.statics = {binding(5, kStaticMac, kStaticIp)}}), ORR_OK);
   learnDhcp(source, macOf(1), ipOf(5), 7, 600, Bytes{9, 9, 9});
   learnDhcp(source, macOf(2), ipOf(6), 8, 600);
   learnDhcp(source, macOf(4), ipOf(8), 10, 600, Bytes{1});
   const Bytes blob = save(source);

   for (const char *point : {"orr_HeapAllocWithRA", "Hash_Alloc"}) {
      uint64_t refused = 0;
      for (bool destinationLearned : {false, true}) {
         for (uint64_t nth = 1;; ++nth) {
            SCOPED_TRACE(std::string(point) + " #" + std::to_string(nth) +
                         (destinationLearned ? " onto a learned entry" : " onto a bare port"));
            const host::FilterId destination = create({.name = "dest"}, kOtherPort);
            if (destinationLearned) {
               learnDhcp(destination, macOf(3), ipOf(7), 9, 600);
            }
            const PortSnapshot before = snapshot(destination);
            const uint64_t liveBytes = host().heap().liveBytes();
            host().log().clear();
            host().faults().failOnce(point, ORR_NO_MEMORY, nth);
            const orr_Status status = restore(destination, blob);
            host().faults().clear();
            if (status == ORR_OK) {
               EXPECT_EQ(snapshot(destination).vmis.size(), destinationLearned ? 5u : 4u);
               EXPECT_EQ(host().sifra().destroyFilterAsHypervisor(destination).status, ORR_OK);
               break;
            }
            ++refused;
            EXPECT_EQ(status, ORR_FAILURE);
            EXPECT_TRUE(logged("dest: Failed to restore fast path agent state"));
            EXPECT_EQ(snapshot(destination), before);
            EXPECT_EQ(host().heap().liveBytes(), liveBytes);
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
