// The replay as a user meets it: directions, the clock running on, the
// configuration file and output captures (bad input: hostile_input_test.cc).
#include "replay_support.h"

#include "replay/describe.h"
#include "replay/engine.h"
#include "session/config_file.h"
#include "session/error.h"

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

TEST(ReplayDirections, the_vm_mac_decides_unless_the_capture_records_a_direction)
{
   TempDir dir;
   auto frames = readCapture(example());
   replay::ReplayOptions options;
   options.vmMac = session::parseMac(kVmMac, "test");
   options.capturePath = example();
   auto byMac = replay::runReplay(options);
   ASSERT_EQ(byMac.frames.size(), frames.size());
   for (size_t i = 0; i < frames.size(); ++i) {
      EXPECT_EQ(byMac.frames[i].direction, sourceMac(frames[i].bytes) == kVmMac ? replay::kDirFromVm : replay::kDirToVm);
   }

   // Every frame recorded as inbound: the flags win over the MAC.
   for (auto &frame : frames) {
      frame.direction = replay::kDirToVm;
   }
   writePcapng(dir.path() / "in.pcapng", frames);
   options.capturePath = (dir.path() / "in.pcapng").string();
   for (const auto &frame : replay::runReplay(options).frames) {
      EXPECT_EQ(frame.direction, replay::kDirToVm) << frame.index;
   }
}

// ---------------------------------------------------------------- the clock

TEST(ReplayClock, running_on_past_the_lease_and_arp_lifetimes_ages_the_bindings_out)
{
   replay::ReplayOptions options;
   options.capturePath = example();
   options.vmMac = session::parseMac(kVmMac, "test");
   const auto atEnd = replay::runReplay(options);
   ASSERT_EQ(atEnd.ports[0].portDb.size(), 2u);   // the DHCP lease and the ARP-snooped 192.0.2.1

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

TEST(ReplayClock, the_lease_counts_down_on_capture_time)
{
   replay::ReplayOptions options;
   options.capturePath = example();
   options.vmMac = session::parseMac(kVmMac, "test");
   options.untilSeconds = 50;
   const auto result = replay::runReplay(options);
   ASSERT_FALSE(result.ports[0].portDb.empty());
   // Renewed at 9.04 s for 120 s; the clock stops at 10.54 + 50 s.
   EXPECT_EQ(result.ports[0].portDb.front().method, "DHCP Snooping");
   EXPECT_EQ(result.ports[0].portDb.front().timeRemaining, "68 sec");
}

// ---------------------------------------------------------------- configuration

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

// ---------------------------------------------------------------- captures and outputs

TEST(ReplayOutputs, passed_and_dropped_frames_are_written_as_they_were_captured)
{
   TempDir dir;
   const auto passed = dir.path() / "passed.pcap";
   const auto dropped = dir.path() / "dropped.pcap";
   const ToolRun run = runTool({"replay", "--json", "--vm-mac", kVmMac, "--config", enforcing(), "--write-passed",
                                passed.string(), "--write-dropped", dropped.string(), example()});
   ASSERT_EQ(run.status, 0) << run.err;
   EXPECT_EQ(dir.files(), (std::vector<std::string>{"dropped.pcap", "passed.pcap"}));
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
   EXPECT_EQ(bytesOf(readCapture(passed)), wantPassed);
   EXPECT_EQ(bytesOf(readCapture(dropped)), wantDropped);
   EXPECT_EQ(readCapture(dropped).front().timeNs / 1000, input.at(13).timeNs / 1000);
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
