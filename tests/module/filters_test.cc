// Switch-security ports driven as the hypervisor drives them: filter
// creation and destruction, dispatch, the frame loop, the filter ioctls,
// the configuration and the per-packet policy on the virtual clock.
#include "port_fixture.h"

#include "framework/sifra_generic_agent.h"

#include <gmock/gmock.h>

#include <array>
#include <atomic>
#include <string>
#include <thread>

using ::testing::ElementsAre;

namespace swsec::testing {
namespace {

constexpr uint32_t kDai = SwSecFeatureIpDiscovery | SwSecFeatureDai;

Bytes arpFrom(const Mac &mac, const Ip4 &ip, uint16_t op = 2)
{
   return arpFrame(mac, kBroadcastMac,
                   {.op = op, .senderMac = mac, .senderIp = ip, .targetMac = kPeerMac, .targetIp = kPeerIp});
}

Bytes arpProbe()
{
   return arpFrom(kVmMac, Ip4{}, 1);
}

Bytes udpFrom(const Ip4 &src, uint16_t srcPort = 1024, uint16_t dstPort = 80, const Mac &mac = kVmMac)
{
   return udpFrame(
      {.src = mac, .dst = kPeerMac, .ipSrc = src, .ipDst = kPeerIp, .srcPort = srcPort, .dstPort = dstPort});
}

class FilterTest : public PortTest {
protected:
   // A new port with the configuration accepted by set-features.
   host::FilterId port(const PortConfig &config)
   {
      const host::FilterId id = create();
      EXPECT_EQ(setFeatures(id, config), 1u);
      return id;
   }
};

// ---------------------------------------------------------------- filters

TEST_F(FilterTest, a_filter_reads_the_uuid_and_vnic_index_of_a_vm_alone_and_refuses_a_configuration_it_cannot_read)
{
   const uint64_t uuidCalls = host().faults().calls("orr_SifraGetVMUUID");
   const uint64_t vnicCalls = host().faults().calls("orr_SifraGetVnicIndex");
   const host::FilterId uplink = create({.name = "uplink", .endPointType = 1, .vmUuid = "4220-aa", .vnicIndex = 3});
   EXPECT_EQ(host().faults().calls("orr_SifraGetVMUUID"), uuidCalls);
   EXPECT_EQ(host().faults().calls("orr_SifraGetVnicIndex"), vnicCalls);
   EXPECT_STREQ(record(uplink)->name, "uplink");
   EXPECT_STREQ(record(uplink)->vmUuid, "");
   EXPECT_EQ(record(uplink)->vnicIndex, -1);
   EXPECT_EQ(record(uplink)->endPointType, 1u);

   // A VM without UUID still gets its vNIC index; a configuration change renames.
   const host::FilterId id = create({.vnicIndex = 4}, kOtherPort);
   EXPECT_STREQ(record(id)->vmUuid, "");
   EXPECT_EQ(record(id)->vnicIndex, 4);
   EXPECT_EQ(host().sifra().changeConfiguration(id, {.name = "renamed", .vmUuid = "4220-bb", .vnicIndex = 4}), ORR_OK);
   EXPECT_STREQ(record(id)->vmUuid, "4220-bb");
   EXPECT_STREQ(record(id)->name, "renamed");

   host().faults().failOnce("orr_SifraGetVnicIndex", ORR_FAILURE);
   host::FilterId refused = 0;
   EXPECT_EQ(host().sifra().createFilter(kAgent, kPort, {}, &refused), ORR_FAILURE);
   EXPECT_TRUE(logged("filter: Could not get filter vnic index (0xbad0001): Failure"));
   EXPECT_EQ(host().sifra().filters().size(), 2u);
}

TEST_F(FilterTest, a_new_port_maps_its_headers_runs_its_timer_and_is_destroyed_once_unreferenced)
{
   const size_t timers = host().clock().pendingTimers();
   const host::FilterId id = create();
   EXPECT_EQ(host().clock().pendingTimers(), timers + 1);
   EXPECT_EQ(host().sifra().filter(id)->minMappedLen, 66u);
   EXPECT_EQ(host().sifra().filter(id)->minMappedDirections, 3u);
   EXPECT_EQ(host().portsets().outstandingAcquisitions(), 0u);

   // Destroy is refused while a reference is held, and unlinks the filter.
   SifraGenericFastPathAgent *agent = record(id)->agent;
   record(id)->refCount = 2;   // as a slow path request in flight holds it
   EXPECT_EQ(host().sifra().destroyFilter(id), ORR_BUSY);
   ASSERT_EQ(host().sifra().filters().size(), 1u);
   EXPECT_NE(context(id), nullptr);

   record(id)->refCount = 1;
   EXPECT_EQ(host().sifra().destroyFilter(id), ORR_OK);
   EXPECT_TRUE(host().sifra().filters().empty());
   // The agent's list lost the freed record: the next filter is its only one.
   const host::FilterId next = create();
   EXPECT_EQ(agent->filterList.next, &record(next)->links);
   EXPECT_EQ(record(next)->links.prev, &agent->filterList);
}

// ---------------------------------------------------------------- frame loop

TEST_F(FilterTest, without_features_every_frame_stays_dropped_ones_leave_the_list_and_are_released_a_runt_passes)
{
   const host::FilterId id = port({.features = 0});
   ASSERT_EQ(setFeatures(id, {.features = 0}), 1u) << "switching off twice succeeds";
   EXPECT_EQ(+context(id)->config.featuresEnabled, 0u);
   const uint64_t releases = host().frames().releases();
   EXPECT_THAT(send(id, kTx, {bpduFrame(kVmMac), Bytes(6, 0xff), udpFrom(kVmIp, 67, 68)}).kept,
               ElementsAre(0u, 1u, 2u));
   EXPECT_EQ(host().frames().releases(), releases);

   ASSERT_EQ(setFeatures(id, {.features = SwSecFeatureBpduFilter}), 1u);
   // The last starts with the spanning-tree address but is too short to be Ethernet.
   const Bytes stub = {0x01, 0x80, 0xc2, 0x00, 0x00, 0x00, 0x02, 0x00};
   const auto result =
      send(id, kTx, {udpFrom(kVmIp), bpduFrame(kVmMac), arpProbe(), bpduFrame(kVmMac, kPvstMac), stub});
   EXPECT_EQ(result.status, ORR_OK);
   EXPECT_THAT(result.kept, ElementsAre(0u, 2u, 4u));
   EXPECT_EQ(result.released, 2u);
   EXPECT_EQ(host().frames().releases(), releases + 2);
   EXPECT_EQ(host().frames().outstandingMappings(), 0u);
}

// ---------------------------------------------------------------- ioctls

TEST_F(FilterTest, echo_answers_only_a_request_with_an_id_set_features_every_one_and_get_vmi_lists_every_method)
{
   const host::FilterId id = create();
   const Bytes echo = {1, 0, 0, 0, 'a', 'b', 'c', 0, 'x', 'y', '1'};
   EXPECT_EQ(host().sifra().sendIoctl(id, 0, echo), ORR_OK);
   EXPECT_TRUE(host().sifra().ioctlReplies().empty());

   EXPECT_EQ(host().sifra().sendIoctl(id, 9, echo), ORR_OK);
   // A text without its NUL is read to the payload's end and no further.
   EXPECT_EQ(host().sifra().sendIoctl(id, 10, {1, 0, 0, 0, 'q', 'z'}), ORR_OK);
   const auto replies = host().sifra().ioctlReplies();
   ASSERT_EQ(replies.size(), 2u);
   EXPECT_EQ(replies[0].requestId, 9u);
   EXPECT_EQ(replies[0].bytes, (Bytes{1, 0, 0, 0, 'A', 'B', 'C', 0, 'x', 'y', '1'}));
   EXPECT_EQ(replies[1].bytes, (Bytes{1, 0, 0, 0, 'Q', 'Z'}));

   host().sifra().clearIoctlReplies();
   // Short payloads, unknown types and the reply types are ignored.
   for (const Bytes &payload : {Bytes{}, Bytes{1, 0, 0}, typeOnly(8), typeOnly(10), typeOnly(2), typeOnly(0xffff)}) {
      EXPECT_EQ(host().sifra().sendIoctl(id, 3, payload), ORR_OK);
   }
   EXPECT_TRUE(host().sifra().ioctlReplies().empty());
   EXPECT_EQ(+context(id)->config.featuresEnabled, SwSecFeatureIpDiscovery);

   EXPECT_EQ(host().sifra().sendIoctl(id, 0, setFeaturesPayload({})), ORR_OK);
   ASSERT_EQ(host().sifra().ioctlReplies().size(), 1u);
   EXPECT_EQ(host().sifra().ioctlReplies()[0].bytes, (Bytes{8, 0, 0, 0, 1, 0, 0, 0}));

   // Get-VMI: an empty database as count 0, then entries of every method.
   EXPECT_EQ(host().sifra().sendIoctl(id, 12, typeOnly(9)), ORR_OK);
   ASSERT_EQ(host().sifra().ioctlReplies().size(), 2u);
   EXPECT_EQ(host().sifra().ioctlReplies()[1].bytes, (Bytes{10, 0, 0, 0, 0, 0, 0, 0}));

   ASSERT_EQ(setFeatures(id, {.statics = {binding(5, kVmMac, kVmIp)}}), 1u);
   bindByDhcp(id, {.mac = kPeerMac, .ip = Ip4::parse("10.0.0.20"), .server = kPeerIp});
   ASSERT_TRUE(passes(id, kTx, arpFrom(kPeerMac, kPeerIp, 1)));
   EXPECT_EQ(host().sifra().sendIoctl(id, 13, typeOnly(9)), ORR_OK);
   EXPECT_EQ(host().sifra().ioctlReplies().back().bytes,
             (Bytes{10, 0, 0, 0, 3, 0, 0, 0,                        // type, count
                    5, 0, 0x02, 0, 0, 0, 0, 0x01, 10, 0, 0, 5,      // static
                    0, 0, 0x02, 0, 0, 0, 0, 0x02, 10, 0, 0, 20,     // DHCP
                    0, 0, 0x02, 0, 0, 0, 0, 0x02, 10, 0, 0, 9}));   // ARP
}

TEST_F(FilterTest, set_features_and_clear_payloads_shorter_than_their_records_are_refused)
{
   const host::FilterId id = port({.features = SwSecFeatureBpduFilter});
   Bytes cutHeader = setFeaturesPayload({});
   cutHeader.resize(4 + 25);
   EXPECT_EQ(setFeaturesRaw(id, cutHeader), 0u);
   Bytes missingEntry = setFeaturesPayload({.statics = {binding(0, kVmMac, kVmIp)}});
   missingEntry.pop_back();
   EXPECT_EQ(setFeaturesRaw(id, missingEntry), 0u);
   // A count that would wrap a 32-bit size.
   Bytes hugeCount = setFeaturesPayload({});
   std::fill(hugeCount.begin() + 14, hugeCount.begin() + 18, 0xff);
   EXPECT_EQ(setFeaturesRaw(id, hugeCount), 0u);
   EXPECT_EQ(+context(id)->config.featuresEnabled, SwSecFeatureBpduFilter);

   // Clear requests: no count, or fewer keys than counted.
   ASSERT_EQ(setFeatures(id, {.statics = {binding(0, kVmMac, kVmIp)}}), 1u);
   Bytes clear = typeOnly(11);
   clear.push_back(1);
   EXPECT_EQ(host().sifra().sendIoctl(id, 4, clear), ORR_OK);
   put32(clear, 2);
   clear.resize(clear.size() + 12);
   EXPECT_EQ(host().sifra().sendIoctl(id, 4, clear), ORR_OK);
   EXPECT_EQ(host().log().count("Clear VMI payload of"), 2u);
   EXPECT_EQ(+context(id)->config.numStatic, 1u);
}

TEST_F(FilterTest, the_security_property_reads_back_the_header_and_the_static_keys_alone)
{
   const PortConfig config{.statics = {binding(1, kVmMac, kVmIp), binding(2, kPeerMac, kPeerIp),
                                       binding(3, kVmMac, kPeerIp)},
                           .allowTagged = true,
                           .etherTypes = {0x0800, 0x0806}};
   const host::FilterId id = create();
   ASSERT_TRUE(passes(id, kTx, arpFrom(kPeerMac, Ip4::parse("10.0.0.77"), 1)));   // a learned binding, listed first
   ASSERT_EQ(writeConfig(id, config), ORR_OK);
   const char *property = "sifra-generic-tarlin-swsec.security";
   EXPECT_EQ(host().sifra().pollProperty(property, id), 80u);   // with the frame guard block
   Bytes larger(80 + 12);
   EXPECT_EQ(host().sifra().readProperty(property, id, larger), ORR_OK);
   EXPECT_EQ(larger, [&] { Bytes b = configRecord(config); b.resize(80 + 12); return b; }());

   Bytes cut(79);
   EXPECT_EQ(host().sifra().readProperty(property, id, cut), ORR_BAD_PARAM);
   EXPECT_TRUE(logged("filter: Invalid security config read length for version 2. Got 79, expecting 80"));
}

// ---------------------------------------------------------------- configuration

struct ConfigCase {
   const char *name;
   PortConfig config;
   bool accepted;
   std::string message;   // the refusal, after "filter: "
};

class ConfigTest : public FilterTest, public ::testing::WithParamInterface<ConfigCase> {};

TEST_P(ConfigTest, validates_before_anything_changes)
{
   const ConfigCase &c = GetParam();
   const host::FilterId id = create();
   SwSecContext *ctx = context(id);
   ctx->counters.daiDropCnt = 5;
   ctx->counters.ipSrcGuardDropCnt = 6;
   host().log().clear();

   EXPECT_EQ(setFeatures(id, c.config), c.accepted ? 1u : 0u);
   EXPECT_TRUE(logged("Received set features via Sifra IOCTL, payloadSize: 48"));
   // A refusal keeps the configuration in force and its counters.
   EXPECT_EQ(+ctx->config.featuresEnabled, c.accepted ? c.config.features : SwSecFeatureIpDiscovery);
   EXPECT_EQ(ctx->counters.daiDropCnt, c.accepted ? 0u : 5u);
   EXPECT_EQ(ctx->counters.ipSrcGuardDropCnt, c.accepted ? 0u : 6u);
   EXPECT_TRUE(logged(c.accepted ? "Configured successfully" : "filter: " + c.message + "\n"))
      << ::testing::PrintToString(logTexts());
}

INSTANTIATE_TEST_SUITE_P(
   Records, ConfigTest,
   ::testing::Values(
      ConfigCase{"dai_without_discovery", {.features = SwSecFeatureDai, .trusted = 0}, false,
                 "Invalid config: featuresEnabled = 0x8 trusted = 0"},
      ConfigCase{"source_guard_on_a_trusted_port", {.features = 0x14, .trusted = 1}, false,
                 "Invalid config: featuresEnabled = 0x14 trusted = 1"},
      ConfigCase{"source_guard_untrusted", {.features = 0x14, .trusted = 0}, true, ""},
      ConfigCase{"bpdu_and_server_block", {.features = 0x3}, true, ""},
      ConfigCase{"highest_limits", {kDai, 0, 32, 2048, 32, 10}, true, ""},
      ConfigCase{"arp_limit_too_high", {kDai, 0, 32, 2049, 32, 10}, false, "Invalid ARP rate limit config: 2049 32 10"},
      ConfigCase{"error_limit_too_high", {kDai, 0, 32, 2048, 33, 10}, false,
                 "Invalid ARP rate limit config: 2048 33 10"},
      ConfigCase{"error_limit_equal_to_arp_limit", {kDai, 0, 32, 20, 20, 10}, false,
                 "Invalid ARP rate limit config: 20 20 10"},
      ConfigCase{"error_period_too_short", {kDai, 0, 32, 20, 5, 9}, false, "Invalid ARP rate limit config: 20 5 9"},
      ConfigCase{"no_rate_limit_ignores_the_rest", {kDai, 0, 32, 0, 999, 0}, true, ""},
      ConfigCase{"unknown_bits_are_kept", {.features = 0x105}, true, ""},
      ConfigCase{"nine_ethertypes", {.etherTypes = std::vector<uint16_t>(9, 0x0800)}, false,
                 "Invalid frame guard config: 9 ethertypes (at most 8)"}),
   [](const auto &test) { return std::string(test.param.name); });

// ---------------------------------------------------------------- policy

// Frames from the VM beyond the features' checks: tags inside its VLAN, ethertypes outside a list.
TEST_F(FilterTest, the_frame_guard_drops_stacked_tags_and_unlisted_ethertypes_from_the_vm)
{
   const PortConfig tags{.allowTagged = true};
   const PortConfig listed{.etherTypes = {0x0800, 0x0806, 0x86dd}};
   Bytes snap = udpFrom(kPeerIp);   // its IPv4 packet behind an 802.3 length and an LLC/SNAP header
   snap.insert(snap.begin() + 14, {0xaa, 0xaa, 0x03, 0, 0, 0, 0x08, 0x00});
   snap[12] = 0, snap[13] = static_cast<uint8_t>(snap.size() - 14);
   Bytes rarp = arpFrom(kVmMac, kPeerIp, 3);
   rarp[13] = 0x35;
   const Bytes deep = pushTag(pushTag(arpFrom(kVmMac, kVmIp), 0x8100, 0, 4), 0x9100);
   struct Case {
      const char *name;
      PortConfig guard;
      Bytes frame;
      uint32_t direction;
      std::array<uint64_t, 3> drops;   // tagged, ethertype, DAI; none: the frame passes
   };
   const Case cases[] = {
      {"tagged ARP to the VM", {}, pushTag(arpFrom(kPeerMac, kPeerIp), 0x8100), kRx, {0, 0, 0}},
      {"allowed: the spoof behind the tag", tags, pushTag(arpFrom(kVmMac, kPeerIp), 0x9100), kTx, {0, 0, 1}},
      {"allowed: a bound sender", tags, pushTag(arpFrom(kVmMac, kVmIp), 0x88a8), kTx, {0, 0, 0}},
      {"allowed: deeper than the walk", tags, deep, kTx, {1, 0, 0}},
      {"listed: LLC/SNAP IPv4", listed, snap, kTx, {0, 1, 0}},
      {"listed: RARP", listed, rarp, kTx, {0, 1, 0}},
      {"listed: IPv6", listed, udp6Frame({.src = kVmMac, .dst = kPeerMac}), kTx, {0, 0, 0}},
      {"no list: RARP", {}, rarp, kTx, {0, 0, 0}},
   };
   const host::FilterId id = create();
   for (const Case &c : cases) {
      SCOPED_TRACE(c.name);
      ASSERT_EQ(setFeatures(id, {kDai, false, 32, 0, 0, 0, {binding(0, kVmMac, kVmIp)}, c.guard.allowTagged,
                                 c.guard.etherTypes}),
                1u);
      EXPECT_EQ(passes(id, c.direction, c.frame), (c.drops == std::array<uint64_t, 3>{}));
      const SwSecContext *ctx = context(id);
      EXPECT_EQ((std::array{ctx->frameGuardCounters.taggedDropCnt, ctx->frameGuardCounters.etherTypeDropCnt,
                            ctx->counters.daiDropCnt}),
                c.drops);
   }
}

using RateLimitTest = FilterTest;

TEST_F(RateLimitTest, an_error_limit_of_zero_drops_everything_the_vm_sends_until_a_new_configuration)
{
   const host::FilterId id = port({kDai, 0, 32, 1, 0, 10});
   EXPECT_THAT(send(id, kTx, {arpProbe(), arpProbe(), udpFrom(kVmIp), arpProbe()}).kept, ElementsAre(0u));
   EXPECT_TRUE(passes(id, kRx, udpFrom(kPeerIp)));
   ASSERT_EQ(context(id)->txRateLimitErr, 1u);
   ASSERT_EQ(setFeatures(id, {kDai, 0, 32, 1, 0, 10}), 1u);
   EXPECT_EQ(context(id)->txRateLimitErr, 0u);
   EXPECT_EQ(context(id)->counters.txRateLimitErrEntryCnt, 0u);
   EXPECT_TRUE(passes(id, kTx, arpProbe()));
}

TEST_F(FilterTest, an_arp_header_cut_short_is_not_inspected)
{
   const host::FilterId id = port({kDai, 0, 32, 0, 0, 0});
   Bytes cut = arpFrom(kPeerMac, kPeerIp);   // an unbound sender, one byte short of the header
   cut.resize(14 + 27);
   EXPECT_TRUE(passes(id, kTx, cut));
}

// ---------------------------------------------------------------- concurrency

TEST_F(FilterTest, two_threads_judge_lists_while_a_third_rewrites_the_configuration)
{
   const host::FilterId id = port({.features = SwSecFeatureBpduFilter});
   std::atomic<bool> stop{false};
   std::atomic<int> wrongVerdicts{0};
   auto judge = [&](uint32_t direction) {
      while (!stop) {
         // Whatever configuration is active, the UDP and ARP frames pass.
         const auto result = send(id, direction, {udpFrom(kVmIp), bpduFrame(kVmMac), arpProbe()});
         if (result.kept.empty() || result.kept.front() != 0 || result.kept.back() != 2) {
            ++wrongVerdicts;
         }
      }
   };
   std::thread tx(judge, kTx);
   std::thread rx(judge, kRx);
   for (int i = 0; i < 200; i++) {
      const uint32_t features = i % 2 == 0 ? SwSecFeatureBpduFilter | SwSecFeatureIpDiscovery : 0;
      EXPECT_EQ(host().sifra().sendIoctl(id, 1, setFeaturesPayload({.features = features})), ORR_OK);
      host().sifra().clearIoctlReplies();
   }
   stop = true;
   tx.join();
   rx.join();
   EXPECT_EQ(wrongVerdicts, 0);
   EXPECT_EQ(host().frames().outstandingMappings(), 0u);
}

}  // namespace
}  // namespace swsec::testing
