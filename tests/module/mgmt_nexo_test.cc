// The management branch driven through the host's Nexo facade, as an
// administrator's tools would: port and VMI lists, summaries, clears and
// agent creation.
#include "port_fixture.h"

#include "swsec/swsec_port_db_links.h"

#include <chrono>
#include <string>
#include <vector>

namespace swsec::testing {
namespace {


std::string portPath(uint32_t port, std::string_view node)
{
   return "/security/" + std::to_string(port) + "/" + std::string(node);
}

class NexoTest : public PortTest {
protected:
   void configure(host::FilterId id, const PortConfig &config) { ASSERT_EQ(writeConfig(id, config), ORR_OK); }
   void sendFromVm(host::FilterId id, const Bytes &frame) { (void)send(id, kTx, {frame}); }

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
                                       "/stopTest", "/ipv6", "/ipv6/<key>/summary", "/ipv6/<key>/bindings",
                                       "/ipv6/<key>/clear"}));
   ASSERT_EQ(host().unload(), ORR_OK);
   EXPECT_FALSE(host().nexo().installed());
   EXPECT_THROW((void)host().nexo().set("/startTest", {}), std::invalid_argument);
}

TEST_F(NexoTest, only_ports_with_ip_discovery_are_listed_the_list_stops_at_a_refused_append)
{
   create();
   const host::FilterId other = create({}, kOtherPort);
   EXPECT_EQ(list("/security"), (std::vector<int64_t>{kPort, kOtherPort}));
   host().faults().failOnce("Nexo_ParamListAddInt", ORR_LIMIT_EXCEEDED, 2);
   EXPECT_EQ(list("/security", ORR_LIMIT_EXCEEDED), (std::vector<int64_t>{kPort}));
   EXPECT_TRUE(loggedWithPrefix(host(), "Nexo_ParamListAddInt() failed: " + statusText(ORR_LIMIT_EXCEEDED),
                                ORR_LOG_ERROR, "SwSecNexoListPortIds"));
   host().faults().failOnce("Nexo_ParamListGetInt32", ORR_BAD_PARAM);
   (void)get(portPath(kPort, "featureSummary"), ORR_BAD_PARAM);
   EXPECT_TRUE(loggedWithPrefix(host(), "Nexo_ParamListGetInt32() failed: " + statusText(ORR_BAD_PARAM),
                                ORR_LOG_ERROR, "SwSecNexoGetFilter"));

   configure(other, {.features = SwSecFeatureBpduFilter});
   EXPECT_EQ(list("/security"), (std::vector<int64_t>{kPort}));
   (void)get(portPath(kOtherPort, "featureSummary"), ORR_NOT_FOUND);
   (void)list(portPath(kOtherPort, "vmi"), ORR_NOT_FOUND);
   (void)get(portPath(kOtherPort, "vmi/0"), ORR_NOT_FOUND);
   EXPECT_EQ(host().nexo().set(portPath(kOtherPort, "clearVmi"), {"all"}), ORR_NOT_FOUND);
   EXPECT_EQ(host().nexo().set(portPath(99, "clearVmi"), {"all"}), ORR_NOT_FOUND);
}

// ---------------------------------------------------------------- feature summary

TEST_F(NexoTest, feature_summary_of_untrusted_dai_ports_with_and_without_rate_limits)
{
   const host::FilterId id = create();
   configure(id, {SwSecFeatureIpDiscovery | SwSecFeatureDai, 0, 16, 100, 10, 30, {binding(5, kVmMac, kVmIp)}});
   const std::map<std::string, std::string, std::less<>> expected = {
      {"version", "2"}, {"highestSupportedVersion", "2"}, {"lowestSupportedVersion", "1"},
      {"featuresEnabled", "IP Discovery,DAI"}, {"portMode", "Untrusted"}, {"portDbSize", "16"},
      {"numStaticEntries", "1"}, {"numVmiEntries", "1"}, {"numAuthVmiEntries", "1"}, {"numNonAuthVmiEntries", "0"},
      {"dhcpSnoopingDropCnt", "0"}, {"daiDropCnt", "0"}, {"ipSrcGuardDropCnt", "N/A"}, {"arpRateLimit", "100 pps"},
      {"errRateLimit", "10 pps"}, {"errRateLimitPeriod", "30 sec"}, {"txRateLimitDropCnt", "0"},
      {"txRateLimitErr", "No"}, {"txRateLimitErrEntryCnt", "0"}, {"rxRateLimitDropCnt", "0"},
      {"allowTagged", "Dropped"}, {"etherTypes", "Any"}, {"taggedDropCnt", "0"}, {"etherTypeDropCnt", "0"}};
   EXPECT_EQ(get(portPath(kPort, "featureSummary")).values(), expected);
   const std::string text = get(portPath(kPort, "featureSummary")).text();
   EXPECT_NE(text.find("Feature summary\n"), std::string::npos) << text;
   EXPECT_NE(text.find("Features enabled         : IP Discovery,DAI\n"), std::string::npos) << text;
   EXPECT_NE(text.find("Non-authoritative entries: 0\n"), std::string::npos) << text;

   // 101 ARP frames within a second: the port enters the error-rate-limit state.
   (void)send(id, kTx, std::vector<Bytes>(101, arpRequest(kVmMac, Ip4{})));
   const auto limited = get(portPath(kPort, "featureSummary"));
   EXPECT_EQ(limited.value("txRateLimitErr"), "Yes");
   EXPECT_EQ(limited.value("txRateLimitErrEntryCnt"), "1");

   // Without an ARP rate limit the rate fields are N/A, DAI drops still counted.
   const host::FilterId plain = create({}, kOtherPort);
   configure(plain, {.features = SwSecFeatureIpDiscovery | SwSecFeatureDai | SwSecFeatureIpSrcGuard, .trusted = 0});
   sendFromVm(plain, arpRequest(kVmMac, kVmIp));   // from an address the port database does not hold
   const auto record = get(portPath(kOtherPort, "featureSummary"));
   EXPECT_EQ(record.value("featuresEnabled"), "IP Discovery,DAI,IP source guard");
   EXPECT_EQ(record.value("daiDropCnt"), "1");
   EXPECT_EQ(record.value("ipSrcGuardDropCnt"), "0");
   for (const char *field : {"arpRateLimit", "errRateLimit", "errRateLimitPeriod", "txRateLimitDropCnt",
                             "txRateLimitErr", "txRateLimitErrEntryCnt", "rxRateLimitDropCnt"}) {
      EXPECT_EQ(record.value(field), "N/A") << field;
   }
}

// ---------------------------------------------------------------- VMIs

TEST_F(NexoTest, each_vmi_shows_its_method_and_only_a_dhcp_binding_shows_lease_details)
{
   const host::FilterId id = create();
   configure(id, {.statics = {binding(100, Mac::parse("02:00:00:0a:Bc:0d"), Ip4::parse("192.168.1.20"))}});
   bindByDhcp(id, {.mac = kVmMac, .ip = kVmIp, .server = kServerIp, .lease = 600, .clientId = Bytes{1, 2, 3}});
   // The client hardware address is kept apart from the MAC: tell them apart.
   SwSecVmiFromListLinks(context(id)->portDbList.prev)->chaddr[5] = 0x33;
   sendFromVm(id, arpRequest(kPeerMac, kPeerIp));
   EXPECT_EQ(list(portPath(kPort, "vmi")), (std::vector<int64_t>{0, 1, 2}));
   using Fields = std::map<std::string, std::string, std::less<>>;
   const Fields na = {{"chaddr", "N/A"}, {"clientIdLen", "N/A"}, {"serverIp", "N/A"}, {"leaseTime", "N/A"}};
   auto with = [](Fields fields, const Fields &more) {
      fields.insert(more.begin(), more.end());
      return fields;
   };
   EXPECT_EQ(get(portPath(kPort, "vmi/0")).values(),
             with(na, {{"portID", "7"}, {"vlanId", "100"}, {"macAddr", "02:00:00:0a:bc:0d"}, {"ipAddr", "192.168.1.20"},
                       {"discoveryMethod", "Static"}, {"timeRemaining", "N/A"}}));
   EXPECT_EQ(get(portPath(kPort, "vmi/1")).values(),
             (Fields{{"portID", "7"}, {"vlanId", "0"}, {"macAddr", "02:00:00:00:00:01"}, {"ipAddr", "10.0.0.5"},
                     {"discoveryMethod", "DHCP Snooping"}, {"timeRemaining", "600 sec"}, {"chaddr", "02:00:00:00:00:33"},
                     {"clientIdLen", "3"}, {"serverIp", "10.0.0.254"}, {"leaseTime", "600"}}));
   EXPECT_EQ(get(portPath(kPort, "vmi/2")).values(),
             with(na, {{"portID", "7"}, {"vlanId", "0"}, {"macAddr", "02:00:00:00:00:02"}, {"ipAddr", "10.0.0.9"},
                       {"discoveryMethod", "ARP Snooping"}, {"timeRemaining", "180 sec"}}));
   // Expired one second ago, the next ageing pass still to come.
   host().clock().advance(std::chrono::seconds(181));
   EXPECT_EQ(get(portPath(kPort, "vmi/2")).value("timeRemaining"), "0 sec");
}

TEST_F(NexoTest, vmi_indexes_at_or_past_the_count_a_missing_index_or_no_memory_find_nothing_and_let_the_port_go)
{
   const host::FilterId id = create();
   (void)get(portPath(kPort, "vmi/0"), ORR_NOT_FOUND);   // empty database
   EXPECT_TRUE(list(portPath(kPort, "vmi")).empty());

   configure(id, {.statics = {binding(1, kVmMac, kVmIp), binding(2, kVmMac, kVmIp)}});
   EXPECT_EQ(list(portPath(kPort, "vmi")), (std::vector<int64_t>{0, 1}));
   EXPECT_EQ(get(portPath(kPort, "vmi/1")).value("vlanId"), "2");
   (void)get(portPath(kPort, "vmi/2"), ORR_NOT_FOUND);
   (void)get(portPath(kPort, "vmi/4294967295"), ORR_NOT_FOUND);

   (void)get(portPath(kPort, "vmi"), ORR_NOT_FOUND);
   EXPECT_TRUE(loggedWithPrefix(host(), "Nexo_ParamListGetUInt32() failed: " + statusText(ORR_NOT_FOUND),
                                ORR_LOG_ERROR, "SwSecNexoVmiSummaryGet"));
   host().faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY);
   (void)get(portPath(kPort, "vmi/0"), ORR_NO_MEMORY);
   // The configLock was let go: a clear takes it exclusively.
   EXPECT_EQ(host().nexo().set(portPath(kPort, "clearVmi"), {"all"}), ORR_OK);
}

// ---------------------------------------------------------------- clearVmi

// A static binding, and two learned ones (the VM's and the peer's), cleared
// through the management node and through the clear ioctl.
struct ClearCase {
   const char *name;
   bool ioctl;
   std::vector<std::string> args;   // "all", or VLAN, MAC and address
   std::vector<std::string> left;   // the addresses left, in order
};

class ClearTest : public NexoTest, public ::testing::WithParamInterface<ClearCase> {};

TEST_P(ClearTest, clears_what_it_names_and_never_a_static_binding)
{
   const ClearCase &c = GetParam();
   const host::FilterId id = create();
   configure(id, {.statics = {binding(0, kServerMac, kServerIp)}});
   sendFromVm(id, arpRequest(kVmMac, kVmIp));
   sendFromVm(id, arpRequest(kPeerMac, kPeerIp));
   if (!c.ioctl) {
      EXPECT_EQ(host().nexo().set(portPath(kPort, "clearVmi"), c.args), ORR_OK);
   } else {
      Bytes clear = typeOnly(11);
      clear.push_back(c.args.size() == 1);
      put32(clear, c.args.size() == 1 ? 0 : 1);
      if (c.args.size() != 1) {
         const StaticBinding key = binding(static_cast<uint16_t>(std::stoi(c.args[1])), Mac::parse(c.args[2]),
                                           Ip4::parse(c.args[3]));
         const Bytes record = configRecord({.statics = {key}});
         clear.insert(clear.end(), record.begin() + 26, record.begin() + 38);
      }
      EXPECT_EQ(host().sifra().sendIoctl(id, 4, clear), ORR_OK);
      EXPECT_TRUE(host().sifra().ioctlReplies().empty());
   }
   std::vector<std::string> left;
   for (const int64_t index : list(portPath(kPort, "vmi"))) {
      left.push_back(get(portPath(kPort, "vmi/" + std::to_string(index))).value("ipAddr"));
   }
   EXPECT_EQ(left, c.left);
}

INSTANTIATE_TEST_SUITE_P(
   EntryPoints, ClearTest,
   ::testing::Values(
      ClearCase{"node_all", false, {"all"}, {"10.0.0.254"}},
      ClearCase{"ioctl_all", true, {"all"}, {"10.0.0.254"}},
      ClearCase{"node_one", false, {"one", "0", "02:00:00:00:00:01", "10.0.0.5"}, {"10.0.0.254", "10.0.0.9"}},
      ClearCase{"ioctl_one", true, {"one", "0", "02:00:00:00:00:01", "10.0.0.5"}, {"10.0.0.254", "10.0.0.9"}},
      ClearCase{"node_absent_key", false, {"one", "100", "02:00:00:00:00:01", "10.0.0.5"},
                {"10.0.0.254", "10.0.0.5", "10.0.0.9"}},
      ClearCase{"node_static_key", false, {"one", "0", "02:00:00:00:00:fe", "10.0.0.254"},
                {"10.0.0.254", "10.0.0.5", "10.0.0.9"}}),
   [](const auto &test) { return std::string(test.param.name); });

TEST_F(NexoTest, clear_requests_it_cannot_read_are_refused_and_change_nothing)
{
   // Port 99 does not exist: the argument count is checked first.
   for (const std::vector<std::string> &args :
        {std::vector<std::string>{}, std::vector<std::string>{"a", "b"}, std::vector<std::string>{"a", "b", "c"},
         std::vector<std::string>{"a", "0", "02:00:00:01:02:03", "10.0.0.5", "e"}}) {
      EXPECT_EQ(host().nexo().set(portPath(99, "clearVmi"), args), ORR_BAD_PARAM);
      EXPECT_TRUE(loggedWithPrefix(host(), "Invalid no. of arguments: " + std::to_string(args.size()),
                                   ORR_LOG_ERROR, "SwSecNexoClearVmi"));
   }

   const host::FilterId id = create({.name = "vm-7.eth0"});
   sendFromVm(id, arpRequest(kVmMac, kVmIp));
   const std::string clear = portPath(kPort, "clearVmi");
   for (const std::vector<std::string> &args : {std::vector<std::string>{"one", "x", "02:00:00:01:02:03", "10.0.0.5"},
                                                std::vector<std::string>{"one", "0", "02:00:00:01:02", "10.0.0.5"},
                                                std::vector<std::string>{"one", "0", "02:00:00:01:02:03", "10.0.0.256"},
                                                std::vector<std::string>{"one", "0", "02:00:00:01:02:03", "ten"}}) {
      EXPECT_EQ(host().nexo().set(clear, args), ORR_BAD_PARAM) << args[1] << " " << args[2] << " " << args[3];
   }
   // Arguments that are not text, each logged with the filter's name.
   uint64_t nth = 1;
   for (const char *message : {"vm-7.eth0: Invalid vlan str = (argument 1)", "vm-7.eth0: Invalid Mac str = (argument 2)",
                               "vm-7.eth0: Invalid IP str = (argument 3)"}) {
      host().faults().failOnce("Nexo_ParamListGetString", ORR_NOT_SUPPORTED, nth++);
      EXPECT_EQ(host().nexo().set(clear, {"one", "0", "02:00:00:01:02:03", "10.0.0.5"}), ORR_NOT_SUPPORTED);
      EXPECT_TRUE(loggedWithPrefix(host(), message, ORR_LOG_ERROR, "SwSecNexoReadClearKey"));
   }
   EXPECT_EQ(list(portPath(kPort, "vmi")).size(), 1u);
   // The parsers take the C library's forms: "0" "10.5" is 10.0.0.5 in inet_aton's short form.
   EXPECT_EQ(host().nexo().set(clear, {"one", " 0", "2:0:0:0:0:1", "10.5"}), ORR_OK);
   EXPECT_TRUE(list(portPath(kPort, "vmi")).empty());
}

// ---------------------------------------------------------------- createAgent

TEST_F(NexoTest, create_agent_registers_a_new_fast_path_and_returns_the_hosts_refusal_of_a_known_name)
{
   EXPECT_EQ(host().nexo().set("/createAgent", {"sifra-generic-extra:opt"}), ORR_OK);
   EXPECT_TRUE(host().sifra().fastPath("sifra-generic-extra").has_value());
   const size_t registered = host().sifra().fastPaths().size();

   EXPECT_NE(host().nexo().set("/createAgent", {"sifra-generic-extra"}), ORR_OK);
   EXPECT_EQ(host().sifra().fastPaths().size(), registered);
   EXPECT_NE(host().nexo().set("/createAgent", {kAgent}), ORR_OK);

   // No name: the parameter list's own status; several: the first is the name.
   EXPECT_EQ(host().nexo().set("/createAgent", {}), ORR_NOT_FOUND);
   EXPECT_EQ(host().nexo().set("/createAgent", {"sifra-generic-two", "sifra-generic-three"}), ORR_OK);
   EXPECT_TRUE(host().sifra().fastPath("sifra-generic-two").has_value());
   EXPECT_FALSE(host().sifra().fastPath("sifra-generic-three").has_value());
}

}  // namespace
}  // namespace swsec::testing
