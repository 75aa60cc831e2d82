// The management branch driven through the host's Nexo facade, as an
// administrator's tools would: port and VMI lists, summaries, clears and
// agent creation.
#include "module_checks.h"
#include "support/frames.h"
#include "support/host_fixture.h"

#include "swsec/config_record.h"
#include "swsec/swsec_vmi.h"

#include <chrono>
#include <cstring>
#include <string>
#include <vector>

namespace swsec::testing {
namespace {

constexpr const char *kAgent = "sifra-generic-tarlin-swsec";
constexpr const char *kSecurityProperty = "sifra-generic-tarlin-swsec.security";
constexpr uint32_t kPort = 7;
constexpr uint32_t kOtherPort = 8;

const Mac kVmMac = Mac::parse("02:00:00:01:02:03");
const Ip4 kVmIp = Ip4::parse("10.0.0.5");
const Mac kPeerMac = Mac::parse("02:00:00:00:00:fe");
const Ip4 kPeerIp = Ip4::parse("10.0.0.254");

struct StaticEntry {
   uint16_t vlanId;
   Mac mac;
   Ip4 ip;
};

struct PortConfig {
   uint32_t features = SwSecFeatureIpDiscovery;
   uint8_t trusted = 1;
   uint32_t portDbSize = 32;
   uint32_t arpRateLimit = 0;
   uint32_t errRateLimit = 0;
   uint32_t errRateLimitPeriod = 0;
   std::vector<StaticEntry> statics;
};

std::vector<uint8_t> configBytes(const PortConfig &config)
{
   SwSecConfig header{};
   header.version = SWSEC_CONFIG_VERSION;
   header.featuresEnabled = config.features;
   header.trusted = config.trusted;
   header.portDbSize = config.portDbSize;
   header.numStatic = static_cast<uint32_t>(config.statics.size());
   header.arpRateLimit = config.arpRateLimit;
   header.errRateLimit = config.errRateLimit;
   header.errRateLimitPeriod = config.errRateLimitPeriod;
   std::vector<uint8_t> bytes(sizeof header);
   std::memcpy(bytes.data(), &header, sizeof header);
   for (const auto &entry : config.statics) {
      SwSecVmiKey key{};
      key.vlanId = entry.vlanId;
      std::memcpy(key.macAddr, entry.mac.bytes.data(), 6);
      key.ipAddr = entry.ip.raw();
      const auto *raw = reinterpret_cast<const uint8_t *>(&key);
      bytes.insert(bytes.end(), raw, raw + sizeof key);
   }
   return bytes;
}

Bytes arpRequestFrom(const Mac &mac, const Ip4 &ip)
{
   Arp arp;
   arp.op = 1;
   arp.senderMac = mac;
   arp.senderIp = ip;
   arp.targetIp = kPeerIp;
   return arpFrame(mac, kBroadcastMac, arp);
}

std::string portPath(uint32_t port, std::string_view node)
{
   return "/security/" + std::to_string(port) + "/" + std::string(node);
}

class NexoTest : public ModuleTest {
protected:
   void SetUp() override
   {
      ModuleTest::SetUp();
      host().portsets().addPortset("vs0");
      host().portsets().addPort("vs0", kPort);
      host().portsets().addPort("vs0", kOtherPort);
   }

   void TearDown() override
   {
      // A reference a handler failed to drop would keep the filter: destroy must succeed.
      for (const auto &filter : host().sifra().filters()) {
         EXPECT_EQ(host().sifra().destroyFilterAsHypervisor(filter.id).status, ORR_OK);
      }
      ModuleTest::TearDown();
   }

   host::FilterId create(uint32_t port = kPort)
   {
      host::FilterConfig config;
      config.name = "vm-" + std::to_string(port) + ".eth0";
      host::FilterId id = 0;
      EXPECT_EQ(host().sifra().createFilter(kAgent, port, config, &id), ORR_OK);
      return id;
   }

   void configure(host::FilterId id, const PortConfig &config)
   {
      ASSERT_EQ(host().sifra().writeProperty(kSecurityProperty, id, configBytes(config)), ORR_OK);
   }

   void sendFromVm(host::FilterId id, const Bytes &frame)
   {
      host::FrameSpec frameSpec;
      frameSpec.bytes = frame;
      (void)host().sifra().processPackets(id, ORR_SIFRA_DIR_TX, {frameSpec});
   }

   host::NexoRecord get(const std::string &path, orr_Status expected = ORR_OK)
   {
      host::NexoRecord record;
      EXPECT_EQ(host().nexo().get(path, &record), expected) << path;
      return record;
   }

   std::vector<int64_t> list(const std::string &path, orr_Status expected = ORR_OK)
   {
      std::vector<int64_t> instances;
      EXPECT_EQ(host().nexo().list(path, &instances), expected) << path;
      return instances;
   }
};

// ---------------------------------------------------------------- the branch

TEST_F(NexoTest, the_branch_is_installed_while_the_module_is_loaded)
{
   ASSERT_TRUE(host().nexo().installed());
   EXPECT_EQ(host().nexo().paths(),
             (std::vector<std::string>{"/", "/createAgent", "/security", "/security/<key>/featureSummary",
                                       "/security/<key>/clearVmi", "/security/<key>/vmi", "/startTest",
                                       "/stopTest"}));
   ASSERT_EQ(host().unload(), ORR_OK);
   EXPECT_FALSE(host().nexo().installed());
   EXPECT_THROW((void)host().nexo().set("/startTest", {}), std::invalid_argument);
}

TEST_F(NexoTest, only_ports_with_ip_discovery_are_listed_and_others_are_not_found)
{
   const host::FilterId withDiscovery = create(kPort);
   const host::FilterId without = create(kOtherPort);
   configure(without, {.features = SwSecFeatureBpduFilter});
   (void)withDiscovery;

   EXPECT_EQ(list("/security"), (std::vector<int64_t>{kPort}));
   (void)get(portPath(kOtherPort, "featureSummary"), ORR_NOT_FOUND);
   (void)list(portPath(kOtherPort, "vmi"), ORR_NOT_FOUND);
   (void)get(portPath(kOtherPort, "vmi/0"), ORR_NOT_FOUND);
   EXPECT_EQ(host().nexo().set(portPath(kOtherPort, "clearVmi"), {"all"}), ORR_NOT_FOUND);
   EXPECT_EQ(host().nexo().set(portPath(99, "clearVmi"), {"all"}), ORR_NOT_FOUND);
}

TEST_F(NexoTest, the_port_list_stops_at_the_first_refused_append_and_says_so)
{
   create(kPort);
   create(kOtherPort);
   EXPECT_EQ(list("/security"), (std::vector<int64_t>{kPort, kOtherPort}));

   host().faults().failOnce("Nexo_ParamListAddInt", ORR_LIMIT_EXCEEDED, 2);
   EXPECT_EQ(list("/security", ORR_LIMIT_EXCEEDED), (std::vector<int64_t>{kPort}));
   EXPECT_TRUE(loggedWithPrefix(host(), "Nexo_ParamListAddInt() failed: " + statusText(ORR_LIMIT_EXCEEDED),
                                ORR_LOG_ERROR, "SwSecNexoListPortIds"));
}

TEST_F(NexoTest, an_unreadable_port_argument_is_logged_and_returned)
{
   create();
   host().faults().failOnce("Nexo_ParamListGetInt32", ORR_BAD_PARAM);
   (void)get(portPath(kPort, "featureSummary"), ORR_BAD_PARAM);
   EXPECT_TRUE(loggedWithPrefix(host(), "Nexo_ParamListGetInt32() failed: " + statusText(ORR_BAD_PARAM),
                                ORR_LOG_ERROR, "SwSecNexoGetFilter"));
}

// ---------------------------------------------------------------- feature summary

TEST_F(NexoTest, feature_summary_of_an_untrusted_dai_port_with_rate_limits)
{
   const host::FilterId id = create();
   configure(id, {.features = SwSecFeatureIpDiscovery | SwSecFeatureDai,
                  .trusted = 0,
                  .portDbSize = 16,
                  .arpRateLimit = 100,
                  .errRateLimit = 10,
                  .errRateLimitPeriod = 30,
                  .statics = {{5, kVmMac, kVmIp}}});
   const auto summary = get(portPath(kPort, "featureSummary")).values();
   const std::map<std::string, std::string, std::less<>> expected = {
      {"version", "1"},
      {"highestSupportedVersion", "1"},
      {"lowestSupportedVersion", "1"},
      {"featuresEnabled", "IP Discovery,DAI"},
      {"portMode", "Untrusted"},
      {"portDbSize", "16"},
      {"numStaticEntries", "1"},
      {"numVmiEntries", "1"},
      {"numAuthVmiEntries", "1"},
      {"numNonAuthVmiEntries", "0"},
      {"dhcpSnoopingDropCnt", "0"},
      {"daiDropCnt", "0"},
      {"ipSrcGuardDropCnt", "N/A"},
      {"arpRateLimit", "100 pps"},
      {"errRateLimit", "10 pps"},
      {"errRateLimitPeriod", "30 sec"},
      {"txRateLimitDropCnt", "0"},
      {"txRateLimitErr", "No"},
      {"txRateLimitErrEntryCnt", "0"},
      {"rxRateLimitDropCnt", "0"},
   };
   EXPECT_EQ(summary, expected);
}

TEST_F(NexoTest, dai_without_an_arp_rate_limit_shows_na_for_the_rate_fields_but_counts_dai_drops)
{
   const host::FilterId id = create();
   configure(id, {.features = SwSecFeatureIpDiscovery | SwSecFeatureDai | SwSecFeatureIpSrcGuard,
                  .trusted = 0,
                  .arpRateLimit = 0});
   // An ARP from an address the port database does not hold: DAI drops it.
   sendFromVm(id, arpRequestFrom(kVmMac, kVmIp));

   const auto record = get(portPath(kPort, "featureSummary"));
   EXPECT_EQ(record.value("portMode"), "Untrusted");
   EXPECT_EQ(record.value("featuresEnabled"), "IP Discovery,DAI,IP source guard");
   EXPECT_EQ(record.value("daiDropCnt"), "1");
   EXPECT_EQ(record.value("ipSrcGuardDropCnt"), "0");
   for (const char *field : {"arpRateLimit", "errRateLimit", "errRateLimitPeriod", "txRateLimitDropCnt",
                             "txRateLimitErr", "txRateLimitErrEntryCnt", "rxRateLimitDropCnt"}) {
      EXPECT_EQ(record.value(field), "N/A") << field;
   }
}

TEST_F(NexoTest, feature_summary_text_shows_the_padded_labels)
{
   create();
   const std::string text = get(portPath(kPort, "featureSummary")).text();
   EXPECT_NE(text.find("Feature summary\n"), std::string::npos) << text;
   EXPECT_NE(text.find("Features enabled         : IP Discovery\n"), std::string::npos) << text;
   EXPECT_NE(text.find("Non-authoritative entries: 0\n"), std::string::npos) << text;
}

// ---------------------------------------------------------------- VMIs

TEST_F(NexoTest, a_static_vmi_shows_na_for_its_lifetime_and_dhcp_fields)
{
   const host::FilterId id = create();
   configure(id, {.statics = {{100, Mac::parse("02:00:00:0a:Bc:0d"), Ip4::parse("192.168.1.20")}}});
   EXPECT_EQ(list(portPath(kPort, "vmi")), (std::vector<int64_t>{0}));
   const auto summary = get(portPath(kPort, "vmi/0")).values();
   const std::map<std::string, std::string, std::less<>> expected = {
      {"portID", "7"},
      {"vlanId", "100"},
      {"macAddr", "02:00:00:0a:bc:0d"},
      {"ipAddr", "192.168.1.20"},
      {"discoveryMethod", "Static"},
      {"timeRemaining", "N/A"},
      {"chaddr", "N/A"},
      {"clientIdLen", "N/A"},
      {"serverIp", "N/A"},
      {"leaseTime", "N/A"},
   };
   EXPECT_EQ(summary, expected);
}

TEST_F(NexoTest, an_arp_snooped_vmi_counts_down_to_zero_once_expired_but_not_yet_aged)
{
   const host::FilterId id = create();
   host().clock().advance(std::chrono::seconds(5));
   sendFromVm(id, arpRequestFrom(kVmMac, kVmIp));
   ASSERT_EQ(list(portPath(kPort, "vmi")), (std::vector<int64_t>{0}));

   auto record = get(portPath(kPort, "vmi/0"));
   EXPECT_EQ(record.value("discoveryMethod"), "ARP Snooping");
   EXPECT_EQ(record.value("timeRemaining"), "180 sec");
   EXPECT_EQ(record.value("chaddr"), "N/A");
   EXPECT_EQ(record.value("leaseTime"), "N/A");

   host().clock().advance(std::chrono::seconds(60));
   EXPECT_EQ(get(portPath(kPort, "vmi/0")).value("timeRemaining"), "120 sec");

   // Expired one second ago; the next ageing pass is still to come.
   host().clock().advance(std::chrono::seconds(121));
   ASSERT_EQ(list(portPath(kPort, "vmi")), (std::vector<int64_t>{0}));
   EXPECT_EQ(get(portPath(kPort, "vmi/0")).value("timeRemaining"), "0 sec");
}

TEST_F(NexoTest, vmi_indexes_at_or_past_the_count_are_not_found)
{
   const host::FilterId id = create();
   (void)get(portPath(kPort, "vmi/0"), ORR_NOT_FOUND);   // empty database
   EXPECT_TRUE(list(portPath(kPort, "vmi")).empty());

   configure(id, {.statics = {{1, kVmMac, kVmIp}, {2, kVmMac, kVmIp}}});
   EXPECT_EQ(list(portPath(kPort, "vmi")), (std::vector<int64_t>{0, 1}));
   EXPECT_EQ(get(portPath(kPort, "vmi/1")).value("vlanId"), "2");
   (void)get(portPath(kPort, "vmi/2"), ORR_NOT_FOUND);
   (void)get(portPath(kPort, "vmi/4294967295"), ORR_NOT_FOUND);
}

TEST_F(NexoTest, a_vmi_summary_without_an_index_or_memory_fails_and_lets_the_port_go)
{
   const host::FilterId id = create();
   configure(id, {.statics = {{1, kVmMac, kVmIp}}});

   (void)get(portPath(kPort, "vmi"), ORR_NOT_FOUND);
   EXPECT_TRUE(loggedWithPrefix(host(), "Nexo_ParamListGetUInt32() failed: " + statusText(ORR_NOT_FOUND),
                                ORR_LOG_ERROR, "SwSecNexoVmiSummaryGet"));

   host().faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY);
   (void)get(portPath(kPort, "vmi/0"), ORR_NO_MEMORY);

   // The configLock was let go: a clear takes it exclusively.
   EXPECT_EQ(host().nexo().set(portPath(kPort, "clearVmi"), {"all"}), ORR_OK);
}

// ---------------------------------------------------------------- clearVmi

TEST_F(NexoTest, clear_with_two_or_three_arguments_is_refused_before_the_port_is_looked_up)
{
   for (const std::vector<std::string> &args :
        {std::vector<std::string>{"a", "b"}, std::vector<std::string>{"a", "b", "c"}}) {
      host().log().clear();
      // Port 99 does not exist: the count is checked first.
      EXPECT_EQ(host().nexo().set(portPath(99, "clearVmi"), args), ORR_BAD_PARAM);
      EXPECT_TRUE(loggedWithPrefix(host(), "Invalid no. of arguments: " + std::to_string(args.size()),
                                   ORR_LOG_ERROR, "SwSecNexoClearVmi"));
   }
}

TEST_F(NexoTest, clear_all_removes_learned_vmis_and_keeps_static_ones)
{
   const host::FilterId id = create();
   configure(id, {.statics = {{1, kPeerMac, kPeerIp}}});
   sendFromVm(id, arpRequestFrom(kVmMac, kVmIp));
   ASSERT_EQ(list(portPath(kPort, "vmi")).size(), 2u);

   EXPECT_EQ(host().nexo().set(portPath(kPort, "clearVmi"), {"all"}), ORR_OK);
   ASSERT_EQ(list(portPath(kPort, "vmi")).size(), 1u);
   EXPECT_EQ(get(portPath(kPort, "vmi/0")).value("discoveryMethod"), "Static");
}

TEST_F(NexoTest, clear_by_vlan_mac_and_ip_removes_that_vmi_and_succeeds_when_absent)
{
   const host::FilterId id = create();
   sendFromVm(id, arpRequestFrom(kVmMac, kVmIp));
   sendFromVm(id, arpRequestFrom(kPeerMac, kPeerIp));
   ASSERT_EQ(list(portPath(kPort, "vmi")).size(), 2u);
   const std::string clear = portPath(kPort, "clearVmi");

   // VLAN 0 (the frames are untagged), the VM's MAC and IP.
   EXPECT_EQ(host().nexo().set(clear, {"one", "0", "02:00:00:01:02:03", "10.0.0.5"}), ORR_OK);
   ASSERT_EQ(list(portPath(kPort, "vmi")).size(), 1u);
   EXPECT_EQ(get(portPath(kPort, "vmi/0")).value("ipAddr"), "10.0.0.254");

   EXPECT_EQ(host().nexo().set(clear, {"one", "100", "02:00:00:01:02:03", "10.0.0.5"}), ORR_OK);
   EXPECT_EQ(list(portPath(kPort, "vmi")).size(), 1u);
}

TEST_F(NexoTest, clear_texts_that_do_not_parse_are_refused_and_change_nothing)
{
   const host::FilterId id = create();
   sendFromVm(id, arpRequestFrom(kVmMac, kVmIp));
   const std::string clear = portPath(kPort, "clearVmi");
   struct Case {
      const char *vlan;
      const char *mac;
      const char *ip;
   };
   for (const Case &c : {Case{"x", "02:00:00:01:02:03", "10.0.0.5"}, Case{"0", "02:00:00:01:02", "10.0.0.5"},
                         Case{"0", "02:00:00:01:02:03", "10.0.0.256"}, Case{"0", "02:00:00:01:02:03", "ten"}}) {
      EXPECT_EQ(host().nexo().set(clear, {"one", c.vlan, c.mac, c.ip}), ORR_BAD_PARAM)
         << c.vlan << " " << c.mac << " " << c.ip;
   }
   EXPECT_EQ(list(portPath(kPort, "vmi")).size(), 1u);
   // The parsers take the C library's forms: "0" "10.5" is 10.0.0.5 in inet_aton's short form.
   EXPECT_EQ(host().nexo().set(clear, {"one", " 0", "2:0:0:1:2:3", "10.5"}), ORR_OK);
   EXPECT_TRUE(list(portPath(kPort, "vmi")).empty());
}

TEST_F(NexoTest, a_clear_argument_that_is_not_text_is_logged_with_the_filter_name)
{
   create();
   struct Case {
      uint64_t nth;
      const char *message;
   };
   for (const Case &c : {Case{1, "vm-7.eth0: Invalid vlan str = (argument 1)"},
                         Case{2, "vm-7.eth0: Invalid Mac str = (argument 2)"},
                         Case{3, "vm-7.eth0: Invalid IP str = (argument 3)"}}) {
      host().faults().failOnce("Nexo_ParamListGetString", ORR_NOT_SUPPORTED, c.nth);
      EXPECT_EQ(host().nexo().set(portPath(kPort, "clearVmi"), {"one", "0", "02:00:00:01:02:03", "10.0.0.5"}),
                ORR_NOT_SUPPORTED);
      EXPECT_TRUE(loggedWithPrefix(host(), c.message, ORR_LOG_ERROR, "SwSecNexoReadClearKey"));
   }
}

// ---------------------------------------------------------------- createAgent

TEST_F(NexoTest, create_agent_registers_a_new_fast_path_and_returns_the_hosts_refusal_of_a_known_name)
{
   EXPECT_EQ(host().nexo().set("/createAgent", {"sifra-generic-extra:opt"}), ORR_OK);
   EXPECT_TRUE(host().sifra().fastPath("sifra-generic-extra").has_value());
   const size_t registered = host().sifra().fastPaths().size();

   const orr_Status again = host().nexo().set("/createAgent", {"sifra-generic-extra"});
   EXPECT_NE(again, ORR_OK);
   EXPECT_EQ(host().sifra().fastPaths().size(), registered);
   EXPECT_NE(host().nexo().set("/createAgent", {kAgent}), ORR_OK);

   EXPECT_EQ(host().nexo().set("/createAgent", {}), ORR_BAD_PARAM);
}

}  // namespace
}  // namespace swsec::testing
