// The replay as a user meets it: directions, the clock running on, the
// configuration file and output captures (bad input: hostile_input_test.cc).
#include "replay_support.h"

#include "replay/describe.h"
#include "replay/engine.h"
#include "session/config_file.h"
#include "session/error.h"
#include "session/serializer.h"
#include "support/ipv6_frames.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <algorithm>
#include <fstream>

namespace swsec::testing {
namespace {


std::string sourceMac(const std::vector<uint8_t> &bytes)
{
   return replay::macText(bytes.data() + 6);
}

// ---------------------------------------------------------------- directions

// (Recorded directions win over the MAC: HostileCapture.a_piped_pcapng_keeps_its_direction_flags.)
TEST(ReplayDirections, the_vm_mac_decides_where_the_capture_records_no_direction)
{
   const auto frames = readCapture(example());
   replay::ReplayOptions options;
   options.vmMac = session::parseMac(kVmMac, "test");
   options.capturePath = example();
   auto byMac = replay::runReplay(options);
   ASSERT_EQ(byMac.frames.size(), frames.size());
   for (size_t i = 0; i < frames.size(); ++i) {
      EXPECT_EQ(byMac.frames[i].direction, sourceMac(frames[i].bytes) == kVmMac ? replay::kDirFromVm : replay::kDirToVm);
   }
}

// ---------------------------------------------------------------- the clock

TEST(ReplayClock, the_lease_counts_down_on_capture_time_and_running_on_ages_the_bindings_out)
{
   replay::ReplayOptions options;
   options.capturePath = example();
   options.vmMac = session::parseMac(kVmMac, "test");
   ASSERT_EQ(replay::runReplay(options).ports[0].portDb.size(), 2u);   // the DHCP lease and the ARP-snooped 192.0.2.1
   options.untilSeconds = 50;
   const auto midway = replay::runReplay(options);
   ASSERT_FALSE(midway.ports[0].portDb.empty());
   // Renewed at 9.04 s for 120 s; the clock stops at 10.54 + 50 s.
   EXPECT_EQ(midway.ports[0].portDb.front().method, "DHCP Snooping");
   EXPECT_EQ(midway.ports[0].portDb.front().timeRemaining, "68 sec");

   options.untilSeconds = 200;
   const auto later = replay::runReplay(options);
   EXPECT_TRUE(later.ports[0].portDb.empty());
   std::vector<std::string> removed;
   for (const auto &n : later.ports[0].notifications) {
      if (n.name == "portdb.entry.removed") {
         EXPECT_EQ(n.afterFrame, 18u);   // after the last frame, as the clock ran on
         removed.push_back(n.ip);
      }
   }
   std::sort(removed.begin(), removed.end());
   EXPECT_EQ(removed, (std::vector<std::string>{"192.0.2.1", "192.0.2.101"}));
}

// ---------------------------------------------------------------- configuration

TEST(ReplayConfig, the_frame_guard_keys_reach_the_record)
{
   EXPECT_EQ(session::configRecord(session::parseConfig(R"({"allowTagged":true,"etherTypes":["ipv4",2054,"0x86DD"]})",
                                                        "inline")),
             contract::configRecord({.allowTagged = true, .etherTypes = {0x0800, 0x0806, 0x86dd}}));
}

TEST(ReplayConfig, a_static_binding_lets_its_owner_pass_inspection_without_dhcp)
{
   TempDir dir;
   const auto path = dir.path() / "static.json";
   writeFile(path, R"({"features":["ip-discovery","dai","ip-source-guard"],"trusted":false,)"
                   R"("static":[{"vlan":0,"mac":"02:00:5e:c0:00:01","ip":"192.0.2.101"}]})");
   replay::ReplayOptions options;
   options.capturePath = example();
   options.vmMac = session::parseMac(kVmMac, "test");
   options.config = session::loadConfigFile(path.string());
   const auto result = replay::runReplay(options);
   // Frame 10, the VM's ARP reply from 192.0.2.101, passes on the static binding.
   EXPECT_TRUE(result.frames.at(9).passed);
   ASSERT_FALSE(result.ports[0].portDb.empty());
   EXPECT_EQ(result.ports[0].portDb.front().method, "Static");
}

// Each IPv6 key lands in the IPv6 agent's record; a document without one makes no IPv6 agent.
TEST(ReplayConfig, ipv6_keys_give_the_port_the_ipv6_agent_with_their_values)
{
   using Ipv6 = contract::Ipv6SecurityConfig;
   const uint32_t learning = FhsFeatureDhcpv6Snoop | FhsFeatureFcfs;
   const struct {
      const char *text;
      std::optional<Ipv6> ipv6;
      uint32_t ipv4Features;
   } cases[] = {
      {R"({"features": ["dai", "ip-discovery"]})", std::nullopt, 0x0c},
      {R"({"features": ["ra-guard", "ip-discovery", "nd-inspection"]})",
       Ipv6{.features = FhsFeatureRaGuard | FhsFeatureNdInspection}, 0x04},
      {R"({"trusted": false, "ndRateLimit": 9, "errRateLimit": 3, "errRateLimitPeriod": 12})",
       Ipv6{.features = learning, .trusted = false, .ndRateLimit = 9, .errRateLimit = 3, .errRateLimitPeriod = 12},
       SwSecFeatureIpDiscovery},
      {R"({"ipv6BindingLimit": 5, "ipv6FcfsLifetime": 30})", Ipv6{.bindingLimit = 5, .fcfsLifetime = 30},
       SwSecFeatureIpDiscovery},
      {R"({"static": [{"vlan": 3, "mac": "02:00:5e:c0:00:01", "ip": "2001:db8::1"}]})",
       Ipv6{.statics = {FhsBindingKey{3, {2, 0, 0x5e, 0xc0, 0, 1}, {0x20, 1, 0x0d, 0xb8, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1}}}},
       SwSecFeatureIpDiscovery},
   };
   for (const auto &c : cases) {
      const auto config = session::parseConfig(c.text, "test");
      EXPECT_EQ(config.features, c.ipv4Features) << c.text;
      EXPECT_TRUE(config.statics.empty()) << c.text;
      ASSERT_EQ(config.ipv6.has_value(), c.ipv6.has_value()) << c.text;
      if (c.ipv6) {
         EXPECT_EQ(contract::fhsConfigRecord(*config.ipv6), contract::fhsConfigRecord(*c.ipv6)) << c.text;
      }
   }
}

// A dual-stack VM learns its link-local address and a DHCPv6 lease, then
// tries each IPv6 attack: every drop names its check, and the report shows
// the IPv6 bindings and counters in the shapes every front end uses.
TEST(ReplayIpv6, dual_stack_attacks_are_dropped_with_their_reasons_and_the_bindings_shown)
{
   const Mac vm = Mac::parse(kVmMac), router = Mac::parse("02:00:5e:c0:00:02");
   const Addr6 linkLocal = a6("fe80::7"), leased = a6("2001:db8::7"), gateway = a6("fe80::1");
   const Bytes duid{0, 3, 0, 1, 2, 0, 0x5e, 0xc0, 0, 1};
   const auto fromVm = [&](const Addr6 &src, uint8_t next, const Bytes &payload) {
      return frame6(vm, src, a6("ff02::1"), next, payload);
   };
   const struct {
      Bytes bytes;
      uint8_t direction;
      const char *reason;   // null: passes
      const char *description = "";
   } script[] = {
      {fromVm(Addr6{}, 58, nd(135, linkLocal)), replay::kDirFromVm, nullptr},
      {fromVm(linkLocal, 17, udp6(546, 547, dhcp6(3, 0x42, duid))), replay::kDirFromVm, nullptr},
      {frame6(router, gateway, linkLocal, 17, udp6(547, 546, dhcp6(7, 0x42, duid, {{leased, 7200}}))), replay::kDirToVm, nullptr},
      {fromVm(leased, 17, udp6(5000, 53, Bytes(8, 1))), replay::kDirFromVm, nullptr},
      {fromVm(linkLocal, 58, icmp6(134, Bytes(12, 0))), replay::kDirFromVm, "RA guard", "IPv6 fe80::7 > ff02::1 ICMPv6 router advertisement"},
      {fromVm(a6("2001:db8::66"), 17, udp6(5000, 53, Bytes(8, 1))), replay::kDirFromVm, "IPv6 source guard", "IPv6 2001:db8::66 > ff02::1 UDP 5000 > 53"},
      {fromVm(linkLocal, 58, nd(136, gateway, vm)), replay::kDirFromVm, "ND inspection", "ICMPv6 neighbour advertisement for fe80::1"},
      {fromVm(linkLocal, 44, cat(frag(60, 0, true), ext(58))), replay::kDirFromVm, "IPv6 header chain", "[first fragment, destination options] ICMPv6"},
      {fromVm(linkLocal, 17, udp6(546, 546, dhcp6(7, 1, duid))), replay::kDirFromVm, "DHCPv6 guard", "DHCPv6 Reply"},
   };
   TempDir dir;
   std::vector<CapturedFrame> frames;
   for (const auto &step : script) {
      frames.push_back({.timeNs = int64_t(frames.size()) * 1'000'000, .bytes = step.bytes, .direction = step.direction});
   }
   writePcapng(dir.path() / "v6.pcapng", frames);
   const ToolRun run = runTool({"replay", "--json", "--config", (sourceDir() / "examples/dual-stack.json").string(),
                                (dir.path() / "v6.pcapng").string()});
   ASSERT_EQ(run.status, 0) << run.err;
   const auto doc = nlohmann::json::parse(run.out);
   ASSERT_EQ(doc["frames"].size(), std::size(script));
   for (size_t i = 0; i < std::size(script); ++i) {
      EXPECT_EQ(doc["frames"][i]["verdict"], script[i].reason ? "dropped" : "passed") << i;
      EXPECT_EQ(doc["frames"][i].value("reason", ""), script[i].reason ? script[i].reason : "") << i;
      EXPECT_NE(doc["frames"][i].value("description", "").find(script[i].description), std::string::npos) << i;
   }
   const auto &ipv6 = doc["ports"][0]["ipv6"];
   const auto dhcpFields = R"(, "chaddr": null, "clientIdLen": null, "serverIp": null, "leaseTime": null})";
   EXPECT_EQ(ipv6["bindings"], nlohmann::json::parse(std::string(R"([
      {"vlan": 0, "mac": "02:00:5e:c0:00:01", "ip": "fe80::7", "method": "First come first served", "timeRemaining": 600)") +
      dhcpFields + R"(, {"vlan": 0, "mac": "02:00:5e:c0:00:01", "ip": "2001:db8::7", "method": "DHCPv6", "timeRemaining": 7200)" +
      dhcpFields + "]"));
   // One shape for every binding: an IPv4 entry's keys, no more.
   const nlohmann::json ipv4Shape = session::bindingJson(session::PortDbEntry{});
   EXPECT_EQ(ipv6["bindings"][0].size(), ipv4Shape.size());
   for (const auto &[key, value] : ipv4Shape.items()) {
      EXPECT_TRUE(ipv6["bindings"][0].contains(key)) << key;
   }
   EXPECT_EQ(ipv6["counters"]["raGuardDropCnt"], 1);
   EXPECT_EQ(ipv6["summary"]["numBindings"], 2);
   EXPECT_EQ(doc["ports"][0]["notifications"][1]["name"], "fhs.binding.added");
   EXPECT_EQ(doc["ports"][0]["notifications"][1]["ip"], "2001:db8::7");
}

// ---------------------------------------------------------------- captures and outputs

// Each output holds its frames as they were captured; an output that is a
// link is followed to the file it names (made where the link dangles) and
// stays a link.
TEST(ReplayOutputs, passed_and_dropped_frames_are_written_as_captured_through_links)
{
   TempDir dir;
   writeFile(dir.path() / "target.pcap", "old contents");
   std::filesystem::create_symlink("target.pcap", dir.path() / "link.pcap");
   std::filesystem::create_symlink("new.pcap", dir.path() / "dangling.pcap");
   const ToolRun run = runTool({"replay", "--json", "--vm-mac", kVmMac, "--config", enforcing(), "--write-passed",
                                (dir.path() / "link.pcap").string(), "--write-dropped",
                                (dir.path() / "dangling.pcap").string(), example()});
   ASSERT_EQ(run.status, 0) << run.err;
   EXPECT_TRUE(std::filesystem::is_symlink(dir.path() / "link.pcap"));
   EXPECT_TRUE(std::filesystem::is_symlink(dir.path() / "dangling.pcap"));
   EXPECT_EQ(dir.files(), (std::vector<std::string>{"dangling.pcap", "link.pcap", "new.pcap", "target.pcap"}));
   const auto input = readCapture(example());
   const auto doc = nlohmann::json::parse(run.out);
   std::vector<std::vector<uint8_t>> wantPassed;
   std::vector<std::vector<uint8_t>> wantDropped;
   for (const auto &frame : doc["frames"]) {
      const size_t i = frame["index"].get<size_t>() - 1;
      (frame["verdict"] == "passed" ? wantPassed : wantDropped).push_back(input.at(i).bytes);
   }
   auto bytesOf = [](const std::vector<CapturedFrame> &frames) {
      std::vector<std::vector<uint8_t>> out;
      for (const auto &f : frames) {
         out.push_back(f.bytes);
      }
      return out;
   };
   EXPECT_EQ(wantDropped.size(), 4u);
   EXPECT_EQ(bytesOf(readCapture(dir.path() / "target.pcap")), wantPassed);
   EXPECT_EQ(bytesOf(readCapture(dir.path() / "new.pcap")), wantDropped);
   EXPECT_EQ(readCapture(dir.path() / "new.pcap").front().timeNs / 1000, input.at(13).timeNs / 1000);
}

TEST(ReplayReport, the_readable_report_shows_the_binding_the_spoofs_and_the_log)
{
   const ToolRun run = runTool({"replay", "-v", "--vm-mac", kVmMac, "--config", enforcing(), example()});
   ASSERT_EQ(run.status, 0) << run.err;
   for (const char *line : {"  from-vm          8        4\n",
                            "dropped #16  10.344753  from-vm  DAI: 02:00:5e:c0:00:01 > ff:ff:ff:ff:ff:ff ARP reply 192.0.2.1 is at 02:00:5e:c0:00:01\n",
                            "dropped #14  10.144753  from-vm  IP source guard: ",
                            "  0     02:00:5e:c0:00:01  192.0.2.101  DHCP Snooping  118 sec",
                            "after #4     portdb.entry.added    VLAN 0    02:00:5e:c0:00:01  192.0.2.101      authoritative\n",
                            "   DAI drop count           : 2\n",
                            "featuresEnabled = 0x1f: Configured successfully\n"}) {
      EXPECT_NE(run.out.find(line), std::string::npos) << line << "\n---\n" << run.out;
   }
}

}  // namespace
}  // namespace swsec::testing
