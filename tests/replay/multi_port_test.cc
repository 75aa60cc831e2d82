// Several VMs in one capture: a capture taken on a bridge replayed with a
// port per VM, each with its own configuration and section; the network's
// broadcasts reach every port, a VM's broadcast crosses to the others only
// if its own port passed it. And what the whole run streams: JSON frames
// as they are judged, one object a line, the folded module log.
#include "replay_support.h"

#include "replay/describe.h"
#include "replay/engine.h"
#include "replay/json.h"
#include "replay/report.h"
#include "session/config_file.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <map>
#include <set>
#include <sstream>

namespace swsec::testing {
namespace {

using nlohmann::json;

std::string bridgeCapture()
{
   return (sourceDir() / "tests/data/bridge-three-vms.pcap").string();
}

const char *kVmMacs[] = {"02:00:5e:c0:00:11", "02:00:5e:c0:00:12", "02:00:5e:c0:00:13"};
const char *kLeases[] = {"192.0.2.111", "192.0.2.112", "192.0.2.113"};

replay::ReplayOptions threePorts()
{
   replay::ReplayOptions options;
   options.capturePath = bridgeCapture();
   for (int i = 0; i < 3; ++i) {
      replay::PortSpec &port = options.ports.emplace_back();
      port.name = "vm" + std::to_string(i + 1);
      port.macs.push_back(session::parseMac(kVmMacs[i], "test"));
   }
   return options;
}

std::set<std::string> leasesOf(const replay::PortResult &port)
{
   std::set<std::string> leases;
   for (const auto &entry : port.portDb) {
      if (entry.method == "DHCP Snooping") {
         leases.insert(entry.mac + " " + entry.ip);
      }
   }
   return leases;
}

TEST(MultiPort, each_port_of_a_bridge_capture_learns_only_its_own_vms_lease)
{
   for (const char *config : {"learning.json", "enforcing.json"}) {
      replay::ReplayOptions options = threePorts();
      options.config = session::loadConfigFile((sourceDir() / "examples" / config).string());
      const auto result = replay::runReplay(options);
      ASSERT_EQ(result.ports.size(), 3u);
      EXPECT_TRUE(result.violations.empty());
      EXPECT_EQ(result.unassigned, 0u);
      for (int i = 0; i < 3; ++i) {
         const auto &port = result.ports[i];
         EXPECT_EQ(leasesOf(port), (std::set<std::string>{std::string(kVmMacs[i]) + " " + kLeases[i]}))
            << config << " " << port.name;
         uint64_t added = 0;
         for (const auto &note : port.notifications) {
            added += note.name == "portdb.entry.added" && note.ip == kLeases[i] ? 1 : 0;
         }
         EXPECT_EQ(added, 1u) << config << " " << port.name;
         // Its own 8 frames, and the other VMs' 2 broadcast DHCP frames and
         // 1 ARP request each, crossing the bridge to it.
         EXPECT_EQ(port.totals[replay::kDirFromVm][0] + port.totals[replay::kDirFromVm][1], 4u) << port.name;
         EXPECT_EQ(port.totals[replay::kDirToVm][0] + port.totals[replay::kDirToVm][1], 4u + 6u) << port.name;
      }
   }
}

TEST(MultiPort, a_port_config_applies_to_its_port_and_config_to_the_others)
{
   TempDir dir;
   writeFile(dir.path() / "blocking.json", R"({"features":["ip-discovery","block-dhcp-server"],"trusted":true})");
   const ToolRun run = runTool({"replay", "--json", "--config", enforcing(), "--port", std::string("a=") + kVmMacs[0],
                                "--port", std::string("b=") + kVmMacs[1] + "," + kVmMacs[2], "--port-config",
                                "b=" + (dir.path() / "blocking.json").string(), bridgeCapture()});
   ASSERT_EQ(run.status, 0) << run.err;
   const json doc = json::parse(run.out);
   ASSERT_EQ(doc["ports"].size(), 2u);
   EXPECT_EQ(doc["ports"][0]["name"], "a");
   EXPECT_EQ(doc["ports"][0]["featureSummary"]["portMode"], "Untrusted");
   EXPECT_EQ(doc["ports"][1]["featureSummary"]["portMode"], "Trusted");
   EXPECT_EQ(doc["ports"][1]["macs"], (json{kVmMacs[1], kVmMacs[2]}));
   size_t leases = 0;
   for (const auto &entry : doc["ports"][1]["portDb"]) {
      leases += entry["method"] == "DHCP Snooping" ? 1 : 0;
   }
   EXPECT_EQ(leases, 2u);   // both of b's VMs'
   std::set<std::string> ports;
   for (const auto &frame : doc["frames"]) {
      ports.insert(frame["port"].get<std::string>());
   }
   EXPECT_EQ(ports, (std::set<std::string>{"a", "b"}));
}

// The bridge capture as one VM's port sees it, with the network's MAC: the
// VM's frames are from it whatever source they claim.
TEST(MultiPort, network_macs_make_every_other_source_the_vm)
{
   TempDir dir;
   auto frames = readCapture(bridgeCapture());
   // Frame 7, VM 1's ping, sent with a MAC that is no port's.
   frames.at(6).bytes[11] = 0x99;
   writePcapng(dir.path() / "spoof.pcapng", frames);
   replay::ReplayOptions options;
   options.capturePath = (dir.path() / "spoof.pcapng").string();
   options.networkMacs.push_back(session::parseMac("02:00:5e:c0:00:fe", "test"));
   options.config = session::loadConfigFile(enforcing());
   const auto single = replay::runReplay(options);
   ASSERT_EQ(single.ports.size(), 1u);
   ASSERT_EQ(single.frames.size(), 24u);
   EXPECT_EQ(single.frames.at(6).direction, replay::kDirFromVm);
   EXPECT_FALSE(single.frames.at(6).passed);   // IP source guard: that MAC holds no binding

   // With several ports the VM behind a foreign MAC is unknown: a warning, not a guess.
   options.ports = threePorts().ports;
   const auto several = replay::runReplay(options);
   EXPECT_EQ(several.unassigned, 1u);
   ASSERT_EQ(several.warnings.size(), 1u);
   EXPECT_NE(several.warnings[0].find("frame 7: sent from 02:00:5e:c0:00:99 by a VM"), std::string::npos)
      << several.warnings[0];
}

// ---------------------------------------------------------------- streams

TEST(ReplayStreams, json_lines_are_the_document_one_frame_a_line_then_the_summary)
{
   std::vector<std::string> args = {"replay", "--json", "--config", enforcing(), "--port",
                                    std::string("a=") + kVmMacs[0], "--port", std::string("b=") + kVmMacs[1],
                                    bridgeCapture()};
   const ToolRun whole = runTool(args);
   args[1] = "--json-lines";
   const ToolRun split = runTool(args);
   ASSERT_EQ(whole.status, 0) << whole.err;
   ASSERT_EQ(split.status, 0) << split.err;
   const json doc = json::parse(whole.out);
   std::istringstream in(split.out);
   std::string line;
   json frames = json::array();
   json summary;
   while (std::getline(in, line)) {
      json object = json::parse(line);
      const std::string type = object["type"];
      object.erase("type");
      if (type == "frame") {
         ASSERT_TRUE(summary.is_null()) << "a frame after the summary";
         frames.push_back(std::move(object));
      } else {
         EXPECT_EQ(type, "summary");
         summary = std::move(object);
      }
   }
   EXPECT_EQ(frames, doc["frames"]);
   json rest = doc;
   rest.erase("frames");
   EXPECT_EQ(summary, rest);
   // VM 3 has no port here: its unicast frames go to none.
   EXPECT_EQ(doc["unassigned"], 5);   // its unicasts; its broadcasts reach a and b
   EXPECT_EQ(doc["framesRead"], 24);
}

TEST(ReplayStreams, numbers_are_json_numbers_and_text_stays_text)
{
   const ToolRun run = runTool({"replay", "--json", "--vm-mac", kVmMac, "--config", enforcing(), example()});
   ASSERT_EQ(run.status, 0) << run.err;
   const json doc = json::parse(run.out);
   // (A binding's numbers: StateTool.a_saved_state_is_shown_and_restored_by_the_tool.)
   const json &port = doc["ports"][0];
   EXPECT_EQ(port["featureSummary"]["daiDropCnt"], 2);
   EXPECT_EQ(port["featureSummary"]["portMode"], "Untrusted");
   EXPECT_TRUE(port["featureSummary"]["featuresEnabled"].is_string());
   EXPECT_EQ(port["counters"]["ipSrcGuardDropCnt"], 2);
   // The module's own levels: it gives its configuration notice level 2.
   std::map<std::string, int> severities;
   for (const auto &line : doc["log"]) {
      const std::string text = line["text"];
      for (const char *what : {"Configured successfully", "Registered security rules property handler"}) {
         if (text.find(what) != std::string::npos) {
            severities[what] = line["severity"];
         }
      }
   }
   EXPECT_EQ(severities, (std::map<std::string, int>{{"Configured successfully", 2},
                                                     {"Registered security rules property handler", 1}}));
}

TEST(ReplayStreams, the_vlan_option_replays_one_vlan_and_unseen_vm_macs_are_warned)
{
   const std::string capture = (sourceDir() / "tests/data/attack-vlan100.pcap").string();
   replay::ReplayOptions options;
   options.capturePath = capture;
   options.vmMac = session::parseMac("02:00:5e:c0:00:10", "test");
   const auto all = replay::runReplay(options);
   options.vlan = 100;
   const auto tagged = replay::runReplay(options);
   uint64_t onVlan = 0;
   for (const auto &frame : all.frames) {
      onVlan += frame.vlan == 100 ? 1 : 0;
   }
   ASSERT_GT(onVlan, 0u);
   ASSERT_LT(onVlan, all.frames.size());
   EXPECT_EQ(tagged.frames.size(), onVlan);
   EXPECT_EQ(tagged.otherVlan, all.frames.size() - onVlan);
   for (const auto &frame : tagged.frames) {
      EXPECT_EQ(frame.vlan, 100);
   }

   const ToolRun run = runTool({"replay", "--vm-mac", "02:00:5e:c0:00:77", example()});
   EXPECT_EQ(run.status, 0) << run.err;
   EXPECT_NE(run.err.find("warning: " + example() + ": 02:00:5e:c0:00:77 (--vm-mac) is in no frame of the capture"),
             std::string::npos)
      << run.err;
}

TEST(ReplayReportLog, a_line_the_module_repeats_is_kept_and_shown_once_with_its_count)
{
   TempDir dir;
   const auto once = readCapture(sourceDir() / "tests/data/attack-malformed-dhcp.pcap");
   // Each frame 1001 times over, 1 ms apart: its parse failure 1001 times in a row.
   std::vector<CapturedFrame> frames;
   int64_t timeNs = once.front().timeNs;
   for (const CapturedFrame &frame : once) {
      for (int copy = 0; copy < 1001; ++copy) {
         frames.push_back(frame);
         frames.back().timeNs = timeNs;
         timeNs += 1'000'000;
      }
   }
   writePcapng(dir.path() / "repeated.pcapng", frames);
   replay::ReplayOptions options;
   options.capturePath = (dir.path() / "repeated.pcapng").string();
   options.vmMac = session::parseMac("02:00:5e:c0:00:10", "test");
   const auto result = replay::runReplay(options);
   size_t entries = 0;
   for (const auto &line : result.log) {
      if (line.text.find("Invalid htype/hlen") != std::string::npos) {
         ++entries;
         EXPECT_EQ(line.repeated, 1000u);
         EXPECT_EQ(line.severity, 2u);
      }
   }
   EXPECT_EQ(entries, 1u);
   std::ostringstream out;
   replay::printReplayReport(out, result);
   EXPECT_NE(out.str().find("  2  swsec: "), std::string::npos) << out.str();
   EXPECT_NE(out.str().find("Invalid htype/hlen: [6 6]\n     ... repeated 1,000 times\n"), std::string::npos) << out.str();
}

}  // namespace
}  // namespace swsec::testing
