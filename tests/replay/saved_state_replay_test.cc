// A port carried across a cut in a capture: the first part replayed and
// its state saved, the second part replayed into a port restored from that
// state, against one replay of the whole capture. And the state files as
// the tool writes, shows and refuses them.
#include "replay_support.h"

#include "contract/saved_state_layout.h"
#include "live/inline.h"
#include "replay/engine.h"
#include "session/atomic_file.h"
#include "session/error.h"
#include "session/ipv6_saved_state.h"
#include "session/saved_state_format.h"
#include "session/state_file.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <sys/stat.h>

#include <fstream>
#include <optional>
#include <string>

namespace swsec::testing {
namespace {

using nlohmann::json;

// The cut after frame k (1-based) where no DHCP request waits for its
// answer, with the longest pause before the next frame; none when every
// gap has a request pending.
std::optional<size_t> cutOf(const json &frames)
{
   std::optional<size_t> best;
   double bestGap = -1;
   bool pending = false;
   for (size_t k = 1; k < frames.size(); ++k) {
      const std::string kind = frames[k - 1]["kind"];
      if (kind == "DHCPREQUEST") {
         pending = true;
      } else if (kind == "DHCPACK" || kind == "DHCPNAK") {
         pending = false;
      }
      const double gap = frames[k]["time"].get<double>() - frames[k - 1]["time"].get<double>();
      if (!pending && gap > bestGap) {
         best = k;
         bestGap = gap;
      }
   }
   return best;
}

// "118 sec" -> 118; texts without a number (N/A) compare as they are.
std::optional<long> seconds(const std::string &text)
{
   try {
      return std::stol(text);
   } catch (const std::exception &) {
      return std::nullopt;
   }
}

class SplitReplay : public ::testing::TestWithParam<std::string> {
protected:
   replay::ReplayResult run(const std::vector<CapturedFrame> &frames, const std::string &name, bool enforcing,
                            double until, const std::string &save, const std::string &restore)
   {
      const auto capture = dir_.path() / (name + ".pcapng");
      writePcapng(capture, frames);
      replay::ReplayOptions options;
      options.capturePath = capture.string();
      if (enforcing) {
         options.config = session::loadConfigFile((sourceDir() / "examples/enforcing.json").string());
      }
      options.untilSeconds = until;
      options.saveStatePath = save;
      options.restoreStatePath = restore;
      return replay::runReplay(options);
   }

   TempDir dir_;
};

TEST_P(SplitReplay, a_capture_cut_in_two_decides_as_one_run)
{
   size_t cutCaptures = 0;
   for (const auto &entry : manifest()) {
      const std::string file = entry["file"];
      const json &meta = entry["frames"];
      const auto cut = cutOf(meta);
      if (!cut) {
         continue;
      }
      ++cutCaptures;
      SCOPED_TRACE(file + " cut after frame " + std::to_string(*cut));
      auto frames = readCapture(sourceDir() / "tests/data" / file);
      ASSERT_EQ(frames.size(), meta.size());
      for (size_t i = 0; i < frames.size(); ++i) {
         frames[i].direction = meta[i]["fromVm"].get<bool>() ? replay::kDirFromVm : replay::kDirToVm;
      }
      const std::vector<CapturedFrame> first(frames.begin(), frames.begin() + static_cast<std::ptrdiff_t>(*cut));
      const std::vector<CapturedFrame> second(frames.begin() + static_cast<std::ptrdiff_t>(*cut), frames.end());
      // The first part's clock runs on to half a second before the second
      // part: the restored port is made that long before its first frame.
      const double gap = static_cast<double>(second.front().timeNs - first.back().timeNs) / 1e9;
      const bool enforcing = GetParam() == "enforcing";
      const std::string state = (dir_.path() / "state").string();

      const replay::ReplayResult whole = run(frames, "whole", enforcing, 0, "", "");
      const replay::ReplayResult before = run(first, "first", enforcing, std::max(0.0, gap - 0.5), state, "");
      const replay::ReplayResult after = run(second, "second", false, 0, "", state);
      EXPECT_TRUE(before.violations.empty() && after.violations.empty());

      ASSERT_EQ(after.frames.size(), whole.frames.size() - *cut);
      for (size_t i = 0; i < after.frames.size(); ++i) {
         EXPECT_EQ(after.frames[i].passed, whole.frames[*cut + i].passed) << "frame " << whole.frames[*cut + i].index;
      }
      ASSERT_EQ(after.ports.size(), 1u);
      ASSERT_EQ(whole.ports.size(), 1u);
      const replay::PortResult &afterPort = after.ports[0];
      const replay::PortResult &wholePort = whole.ports[0];
      EXPECT_EQ(afterPort.counters, wholePort.counters);
      EXPECT_EQ(afterPort.featureSummary.has_value(), wholePort.featureSummary.has_value());
      ASSERT_EQ(afterPort.portDb.size(), wholePort.portDb.size());
      for (size_t i = 0; i < afterPort.portDb.size(); ++i) {
         const session::PortDbEntry &a = afterPort.portDb[i];
         const session::PortDbEntry &w = wholePort.portDb[i];
         EXPECT_EQ(std::tie(a.vlan, a.mac, a.ip, a.method, a.chaddr, a.clientIdLen, a.serverIp, a.leaseTime),
                   std::tie(w.vlan, w.mac, w.ip, w.method, w.chaddr, w.clientIdLen, w.serverIp, w.leaseTime));
         // Whole seconds of two clocks that started at different fractions.
         const auto left = seconds(a.timeRemaining);
         const auto wholeLeft = seconds(w.timeRemaining);
         if (left && wholeLeft) {
            EXPECT_LE(std::abs(*left - *wholeLeft), 1) << a.timeRemaining << " vs " << w.timeRemaining;
         } else {
            EXPECT_EQ(a.timeRemaining, w.timeRemaining);
         }
      }
   }
   EXPECT_GE(cutCaptures, 10u);
}

INSTANTIATE_TEST_SUITE_P(Settings, SplitReplay, ::testing::Values("learning", "enforcing"),
                         [](const auto &testInfo) { return testInfo.param; });

// ---------------------------------------------------------------- the tool

class StateTool : public ::testing::Test {
protected:
   TempDir dir_;
};

TEST_F(StateTool, a_saved_state_is_shown_and_restored_by_the_tool)
{
   const std::string state = (dir_.path() / "port.state").string();
   // Enforcing, with a frame guard that drops every type but IPv4 and ARP.
   const std::string config = (dir_.path() / "port.json").string();
   std::string text = session::readConfigText(enforcing());
   writeFile(config, text.insert(text.rfind('}'), R"(, "allowTagged": true, "etherTypes": ["arp", "ipv4"])"));
   const ToolRun saved = runTool({"replay", "--json", "--vm-mac", kVmMac, "--config", config,
                                  "--save-state", state, example()});
   ASSERT_EQ(saved.status, 0) << saved.err;

   const ToolRun shown = runTool({"state", "show", "--json", state});
   ASSERT_EQ(shown.status, 0) << shown.err;
   const json doc = json::parse(shown.out);
   EXPECT_EQ(doc["header"]["agentOffset"], 48);
   EXPECT_EQ(doc["config"]["features"], "bpdu-filter,block-dhcp-server,ip-discovery,dai,ip-source-guard");
   ASSERT_EQ(doc["bindings"].size(), 1u);
   EXPECT_EQ(doc["bindings"][0]["method"], "DHCP Snooping");
   EXPECT_EQ(doc["bindings"][0]["ip"], "192.0.2.101");
   EXPECT_EQ(doc["counters"]["ipSrcGuardDropCnt"], 2);
   EXPECT_EQ(doc["frameGuard"], json::parse(R"({"allowTagged": true, "etherTypes": [2054, 2048]})"));
   EXPECT_EQ(doc["counters"]["etherTypeDropCnt"], json::parse(saved.out)["ports"][0]["counters"]["etherTypeDropCnt"]);

   // One binding, one shape: in replay's port database, in the saved state
   // shown, and in ctl's reply for the same port state (each may add its own).
   replay::ReplayOptions options;
   options.capturePath = example();
   options.vmMac = session::parseMac(kVmMac, "test");
   options.config = session::loadConfigFile(enforcing());
   json ctl = live::bindingsReply("vm", replay::runReplay(options).ports[0])[0];
   json shownBinding = doc["bindings"][0];
   EXPECT_EQ(ctl.value("port", ""), "vm");
   EXPECT_FALSE(shownBinding["clientId"].is_null());
   ctl.erase("port");
   shownBinding.erase("clientId");
   EXPECT_EQ(json::parse(saved.out)["ports"][0]["portDb"][0], shownBinding);
   EXPECT_EQ(ctl, shownBinding);
   EXPECT_TRUE(shownBinding["timeRemaining"].is_number() && shownBinding["clientIdLen"].is_number());

   const ToolRun shownText = runTool({"state", "show", state});
   EXPECT_EQ(shownText.status, 0);
   EXPECT_NE(shownText.out.find("192.0.2.101  DHCP Snooping"), std::string::npos) << shownText.out;
   EXPECT_NE(shownText.out.find("tagged frames:       allowed\n   ethertypes:          0x0806,0x0800\n"),
             std::string::npos) << shownText.out;

   // The restored binding is reported like a learned one, before the first frame.
   const ToolRun restored =
      runTool({"replay", "--json", "--vm-mac", kVmMac, "--restore-state", state, example()});
   ASSERT_EQ(restored.status, 0) << restored.err;
   const json result = json::parse(restored.out);
   ASSERT_FALSE(result["ports"][0]["notifications"].empty());
   EXPECT_EQ(result["ports"][0]["notifications"][0]["afterFrame"], 0);
   EXPECT_EQ(result["ports"][0]["notifications"][0]["name"], "portdb.entry.added");
   EXPECT_EQ(result["ports"][0]["notifications"][0]["ip"], "192.0.2.101");
}

TEST_F(StateTool, bad_state_files_are_refused_alike_by_show_and_restore_with_one_line_and_nothing_written)
{
   const std::string good = (dir_.path() / "good.state").string();
   ASSERT_EQ(runTool({"replay", "--vm-mac", kVmMac, "--config", enforcing(), "--save-state", good, example()}).status, 0);
   const std::vector<uint8_t> blob = session::readStateFile(good);
   // Offsets in the blob: the agent's part at 48, its first binding at 144,
   // its frame guard the part's last 40 bytes.
   const session::SavedPortState shape = session::decodeSavedState(blob);
   const size_t guard = static_cast<size_t>(shape.agentOffset + shape.agentLen) - sizeof(SwSecSavedFrameGuard);
   auto changed = [&blob](size_t at, std::initializer_list<uint8_t> bytes) {
      std::string out(blob.begin(), blob.end());
      std::copy(bytes.begin(), bytes.end(), out.begin() + static_cast<std::ptrdiff_t>(at));
      return out;
   };
   struct Bad {
      const char *name;
      std::string bytes;   // "" with fifo: a FIFO
      const char *message;
      bool fifo = false;
   };
   const Bad cases[] = {
      {"empty", "", "empty file, no saved state"},
      {"short", std::string(blob.begin(), blob.begin() + 47), "too short for the 48-byte header (47 bytes)"},
      {"foreign", changed(0, {'x'}), "not a saved state (magic"},
      {"truncated", std::string(blob.begin(), blob.end() - 1), "runs past the"},
      {"unknown_method", changed(144 + 12, {3}), "discovery method 3"},
      {"time_past_32_bits", changed(144 + 16, {0, 0, 0, 0, 1}), "outside 0 to 4294967295"},
      {"inspection_on_a_trusted_port", changed(48 + 5, {1}), "configuration refused"},
      {"nine_ethertypes", changed(guard + 1, {9}), "frame guard of 9 ethertypes (at most 8)"},
      {"cut_envelope", "swsecenv\1", "envelope is cut short"},
      {"fifo", "", "not a regular file", true},
   };
   for (const Bad &bad : cases) {
      SCOPED_TRACE(bad.name);
      const auto path = dir_.path() / (std::string(bad.name) + ".state");
      if (bad.fifo) {
         ASSERT_EQ(mkfifo(path.c_str(), 0600), 0);
      } else {
         writeFile(path, bad.bytes);
      }
      const auto written = (dir_.path() / "passed.pcap").string();
      const ToolRun replayed = runTool({"replay", "--vm-mac", kVmMac, "--restore-state", path.string(),
                                        "--write-passed", written, example()});
      const ToolRun shown = runTool({"state", "show", path.string()});
      for (const ToolRun *run : {&replayed, &shown}) {
         EXPECT_EQ(run->status, 2);
         EXPECT_NE(run->err.find(bad.message), std::string::npos) << run->err;
         EXPECT_EQ(std::count(run->err.begin(), run->err.end(), '\n'), 1) << run->err;
         EXPECT_TRUE(run->out.empty());
      }
      EXPECT_FALSE(std::filesystem::exists(written));
   }
}

TEST_F(StateTool, time_since_the_save_is_taken_from_each_lifetime_and_what_ran_out_is_left_out)
{
   const std::string saved = (dir_.path() / "port.state").string();
   ASSERT_EQ(runTool({"replay", "--vm-mac", kVmMac, "--config", enforcing(), "--save-state", saved, example()}).status, 0);
   const std::vector<uint8_t> blob = session::readStateFile(saved);
   const int64_t left = session::decodeSavedState(blob).bindings.at(0).timeRemaining;
   EXPECT_EQ(session::decodeSavedState(session::ageSavedState(blob, 10)).bindings.at(0).timeRemaining, left - 10);
   const std::vector<uint8_t> gone = session::ageSavedState(blob, left);
   EXPECT_TRUE(session::decodeSavedState(gone).bindings.empty());
   // In its envelope, with the time of the save, the file is shown and restored.
   const auto wrapped = session::wrapState(gone, 1'700'000'000'000'000);
   writeFile(saved, std::string(wrapped.begin(), wrapped.end()));
   const ToolRun shown = runTool({"state", "show", "--json", saved});
   EXPECT_EQ(json::parse(shown.out)["savedAt"], 1'700'000'000.0) << shown.err;
   EXPECT_EQ(runTool({"replay", "--vm-mac", kVmMac, "--restore-state", saved, example()}).status, 0);
}

// The IPv6 agent's state goes beside the port's (FILE6): shown, aged binding
// by binding, refused when damaged, and restored with its lifetimes.
TEST_F(StateTool, ipv6_bindings_are_saved_beside_the_ports_state_aged_and_restored)
{
   const std::string saved = (dir_.path() / "port.state").string();
   const std::string capture = (sourceDir() / "tests/data/attack6-ra-guard.pcap").string();
   const std::string dualStack = (sourceDir() / "examples/dual-stack.json").string();
   const std::string vm = "02:00:5e:c0:00:10";
   ASSERT_EQ(runTool({"replay", "--vm-mac", vm, "--config", dualStack, "--save-state", saved, capture}).status, 0);
   const ToolRun shown = runTool({"state", "show", "--json", saved + "6"});
   ASSERT_EQ(shown.status, 0) << shown.err;
   const json bindings = json::parse(shown.out)["ipv6"]["bindings"];
   ASSERT_EQ(bindings.size(), 2u);
   EXPECT_EQ(bindings[1]["ip"], "2001:db8:1::110");
   EXPECT_EQ(bindings[1]["method"], "DHCPv6");

   const std::vector<uint8_t> blob = session::readStateFile(saved + "6");
   const uint32_t fcfs = bindings[0]["timeRemaining"], dhcpv6 = bindings[1]["timeRemaining"];
   const struct {
      int64_t elapsed;
      std::vector<uint32_t> left;
   } ages[] = {{0, {fcfs, dhcpv6}}, {100, {fcfs - 100, dhcpv6 - 100}}, {dhcpv6, {fcfs - dhcpv6}}, {fcfs, {}}};
   for (const auto &age : ages) {
      std::vector<uint32_t> left;
      for (const auto &binding : session::decodeIpv6SavedState(session::ageIpv6SavedState(blob, age.elapsed)).bindings) {
         left.push_back(uint32_t{binding.remaining});
      }
      EXPECT_EQ(left, age.left) << age.elapsed;
   }

   const ToolRun restored = runTool({"replay", "--json", "--vm-mac", vm, "--restore-state", saved, capture});
   ASSERT_EQ(restored.status, 0) << restored.err;
   const json notes = json::parse(restored.out)["ports"][0]["notifications"];
   ASSERT_GE(notes.size(), 2u);
   EXPECT_EQ(notes[1]["afterFrame"], 0);
   EXPECT_EQ(notes[1]["ip"], "2001:db8:1::110");

   std::string damaged(blob.begin(), blob.end());
   damaged[48 + 104 + 7] = 0x7f;   // a binding limit past the most a port may hold
   writeFile(saved + "6", damaged);
   const ToolRun refused = runTool({"state", "show", saved + "6"});
   EXPECT_EQ(refused.status, 2);
   EXPECT_NE(refused.err.find("IPv6 configuration refused"), std::string::npos) << refused.err;
}

// The one writer of state files and capture outputs: a link at the target is
// replaced, not written through; a write given up or failed leaves nothing.
TEST(AtomicFile, a_link_is_replaced_and_a_write_given_up_leaves_nothing)
{
   TempDir dir;
   const auto target = dir.path() / "vm1.state";
   writeFile(dir.path() / "elsewhere", "kept");
   std::filesystem::create_symlink("elsewhere", target);
   const std::vector<uint8_t> blob{1, 2, 3};
   session::writeStateFile(target, blob, 0600);
   EXPECT_EQ(session::readStateFile(target), blob);   // refuses a link
   EXPECT_EQ(session::readStateFile(dir.path() / "elsewhere").size(), 4u);
   {
      session::AtomicFile abandoned(target, 0600);
      abandoned.write(std::vector<uint8_t>{9});
   }
   EXPECT_THROW(session::writeStateFile(dir.path() / "none" / "x.state", blob), session::InputError);
   EXPECT_EQ(dir.files(), (std::vector<std::string>{"elsewhere", "vm1.state"}));
   EXPECT_EQ(session::readStateFile(target), blob);
}

}  // namespace
}  // namespace swsec::testing
