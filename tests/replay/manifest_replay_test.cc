// Every committed capture replayed under the three port settings of the
// manifest (learning: a new port's defaults; enforcing: examples/enforcing.json;
// dual-stack: examples/dual-stack.json, the IPv6 agent behind the IPv4 one),
// checked against the expectations an independent model computed from the
// frames: which frames are dropped, the events in order, the final
// bindings and the drop counters.
#include "replay_support.h"

#include "replay/engine.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <set>
#include <tuple>

namespace swsec::testing {
namespace {

using nlohmann::json;

struct Case {
   std::string capture;
   std::string setting;
};

std::vector<Case> allCases()
{
   std::vector<Case> cases;
   for (const auto &entry : manifest()) {
      for (const auto &config : entry["expected"]["configs"]) {
         cases.push_back({entry["file"], config["name"]});
      }
   }
   return cases;
}

const json &entryFor(const std::string &capture)
{
   for (const auto &entry : manifest()) {
      if (entry["file"] == capture) {
         return entry;
      }
   }
   throw std::out_of_range(capture);
}

const json &settingFor(const json &entry, const std::string &setting)
{
   for (const auto &config : entry["expected"]["configs"]) {
      if (config["name"] == setting) {
         return config;
      }
   }
   throw std::out_of_range(setting);
}

bool authoritativeMethod(const std::string &method)
{
   return method == "DHCP Snooping" || method == "Static" || method == "DHCPv6";
}

// The non-zero drop counters of both agents, and those the manifest expects.
using Counters = std::map<std::string, uint64_t, std::less<>>;
Counters nonZeroCounters(const replay::PortResult &port)
{
   session::DropCounters all = port.counters;
   if (port.ipv6) {
      all.insert(port.ipv6->counters.begin(), port.ipv6->counters.end());
   }
   Counters counters;
   for (const auto &[name, value] : all) {
      if (value != 0) {
         counters[name] = value;
      }
   }
   return counters;
}

Counters expectedCounters(const json &expected)
{
   Counters counters;
   for (const auto &[name, value] : expected["counters"].items()) {
      counters[name] = value.get<uint64_t>();
   }
   return counters;
}

using Event = std::tuple<uint64_t, std::string, uint16_t, std::string, std::string, bool>;
using Binding = std::tuple<uint16_t, std::string, std::string, std::string, std::string>;

class ManifestReplay : public ::testing::TestWithParam<Case> {
protected:
   // The capture as pcapng with the manifest's direction of every frame, so
   // that a frame the VM sends with a foreign source MAC is still from it.
   replay::ReplayResult replayCase(uint32_t batch, bool reasons = false)
   {
      const Case &c = GetParam();
      const json &entry = entryFor(c.capture);
      auto frames = readCapture(sourceDir() / "tests/data" / c.capture);
      EXPECT_EQ(frames.size(), entry["frames"].size());
      for (size_t i = 0; i < frames.size() && i < entry["frames"].size(); ++i) {
         frames[i].direction = entry["frames"][i]["fromVm"].get<bool>() ? replay::kDirFromVm : replay::kDirToVm;
      }
      const auto capture = dir_.path() / "directed.pcapng";
      writePcapng(capture, frames);

      replay::ReplayOptions options;
      options.capturePath = capture.string();
      options.batch = batch;
      options.reasons = reasons;
      if (c.setting != "learning") {
         options.config = session::loadConfigFile((sourceDir() / "examples" / (c.setting + ".json")).string());
      }
      return replay::runReplay(options);
   }

   TempDir dir_;
};

TEST(ManifestSettings, the_shipped_configurations_are_the_manifests_settings)
{
   const json &entry = manifest().at(0);
   for (const char *name : {"learning", "enforcing"}) {
      const json &expected = settingFor(entry, name);
      const auto config = session::loadConfigFile((sourceDir() / "examples" / (std::string(name) + ".json")).string());
      EXPECT_EQ(config.features, expected["featuresEnabled"].get<uint32_t>()) << name;
      EXPECT_EQ(config.trusted, expected["trusted"].get<int>() != 0) << name;
      EXPECT_EQ(config.portDbSize, expected["portDbSize"].get<uint32_t>()) << name;
      EXPECT_EQ(config.arpRateLimit, expected["arpRateLimit"].get<uint32_t>()) << name;
      EXPECT_EQ(config.errRateLimit, expected["errRateLimit"].get<uint32_t>()) << name;
      EXPECT_EQ(config.errRateLimitPeriod, expected["errRateLimitPeriod"].get<uint32_t>()) << name;
   }
   const json &dual = settingFor(entry, "dual-stack");
   const auto ipv6 = session::loadConfigFile((sourceDir() / "examples/dual-stack.json").string()).ipv6;
   ASSERT_TRUE(ipv6.has_value());
   EXPECT_EQ(ipv6->features, dual["ipv6"]["featuresEnabled"].get<uint32_t>());
   EXPECT_EQ(ipv6->trusted, dual["ipv6"]["trusted"].get<int>() != 0);
   EXPECT_EQ(ipv6->bindingLimit, dual["ipv6"]["bindingLimit"].get<uint32_t>());
   EXPECT_EQ(ipv6->ndRateLimit, dual["ipv6"]["ndRateLimit"].get<uint32_t>());
   EXPECT_EQ(ipv6->errRateLimit, dual["ipv6"]["errRateLimit"].get<uint32_t>());
   EXPECT_EQ(ipv6->errRateLimitPeriod, dual["ipv6"]["errRateLimitPeriod"].get<uint32_t>());
   // Learning is what a new port starts with, so replays without --config match it too.
   EXPECT_EQ(session::configRecord(session::PortSecurityConfig{}),
             session::configRecord(session::loadConfigFile((sourceDir() / "examples/learning.json").string())));
}

TEST_P(ManifestReplay, verdicts_events_database_and_counters_match_the_manifest_one_frame_or_a_list_at_a_time)
{
   const Case &c = GetParam();
   const json &expected = settingFor(entryFor(c.capture), c.setting);
   const replay::ReplayResult result = replayCase(1);
   EXPECT_TRUE(result.violations.empty()) << ::testing::PrintToString(result.violations);

   std::vector<uint64_t> dropped;
   for (const auto &frame : result.frames) {
      if (!frame.passed) {
         dropped.push_back(frame.index);
      }
   }
   std::vector<uint64_t> expectedDropped;
   for (const auto &d : expected["dropped"]) {
      expectedDropped.push_back(d["index"]);
   }
   EXPECT_EQ(dropped, expectedDropped);

   // With one frame a list, each event is seen right after the frame that made it.
   std::vector<Event> events;
   for (const auto &n : result.ports[0].notifications) {
      events.emplace_back(n.afterFrame, n.name, n.vlan, n.mac, n.ip, n.authoritative);
   }
   std::vector<Event> expectedEvents;
   for (const auto &e : expected["events"]) {
      expectedEvents.emplace_back(e["index"], e["event"], e["vlan"], e["mac"], e["ip"],
                                  authoritativeMethod(e["method"]));
   }
   EXPECT_EQ(events, expectedEvents);

   std::multiset<Binding> bindings;
   for (const auto &b : result.ports[0].portDb) {
      bindings.emplace(b.vlan, b.mac, b.ip, b.method, b.method == "DHCP Snooping" ? b.leaseTime : "");
   }
   if (result.ports[0].ipv6) {
      for (const auto &b : result.ports[0].ipv6->bindings) {
         bindings.emplace(b.vlan, b.mac, b.ip, b.method, "");
      }
   }
   std::multiset<Binding> expectedBindings;
   for (const auto &b : expected["bindings"]) {
      const std::string method = b["method"];
      expectedBindings.emplace(b["vlan"], b["mac"], b["ip"], method,
                               method == "DHCP Snooping" ? std::to_string(b["leaseSeconds"].get<int>()) : "");
   }
   for (const auto &b : expected.value("ipv6Bindings", json::array())) {
      expectedBindings.emplace(b["vlan"], b["mac"], b["ip"], b["method"], "");
   }
   EXPECT_EQ(bindings, expectedBindings);

   EXPECT_EQ(nonZeroCounters(result.ports[0]), expectedCounters(expected));

   // A list spans at most a millisecond and no capture puts a timer tick
   // inside one, so frames handed over in lists decide as single frames do;
   // a list's events are seen after its last frame, never before the frame
   // that made them.
   const replay::ReplayResult batched = replayCase(32);
   ASSERT_EQ(batched.frames.size(), result.frames.size());
   for (size_t i = 0; i < result.frames.size(); ++i) {
      EXPECT_EQ(batched.frames[i].passed, result.frames[i].passed) << "frame " << result.frames[i].index;
   }
   const auto &single = result.ports[0].notifications;
   const auto &listed = batched.ports[0].notifications;
   ASSERT_EQ(listed.size(), single.size());
   for (size_t i = 0; i < single.size(); ++i) {
      EXPECT_EQ(std::tie(listed[i].name, listed[i].ip), std::tie(single[i].name, single[i].ip)) << i;
      EXPECT_GE(listed[i].afterFrame, single[i].afterFrame) << i;
   }
   EXPECT_EQ(nonZeroCounters(batched.ports[0]), expectedCounters(expected));
}

// The manifest's model names each drop's rule; the replay finds it from
// the counters and the frame (handing the frames over one at a time).
TEST_P(ManifestReplay, every_dropped_frame_has_the_reason_the_manifest_names)
{
   const Case &c = GetParam();
   const json &expected = settingFor(entryFor(c.capture), c.setting);
   static const std::map<std::string, std::string, std::less<>> kReasonOfRule = {
      {"ARP inspection: sender MAC/IP not bound on its VLAN (daiDropCnt)", "DAI"},
      {"ARP rate limit exceeded, port enters the error-rate-limit state", "ARP rate limit"},
      {"ARP rate limit, to the VM (rxRateLimitDropCnt)", "ARP rate limit"},
      {"error-rate-limit state (txRateLimitDropCnt)", "ARP rate limit: error state"},
      {"BPDU filter", "BPDU filter"},
      {"DHCP server block", "DHCP server block"},
      {"DHCP server block: DHCPv6 server message", "DHCP server block: DHCPv6 server message"},
      {"DHCP from the VM with chaddr not its source MAC, untrusted port (dhcpSnoopingDropCnt)",
       "DHCP snooping: chaddr mismatch"},
      {"DHCPACK answers no pending request of the port", "DHCP snooping: unanswered ACK"},
      {"IP source guard: source MAC/IP not bound on its VLAN (ipSrcGuardDropCnt)", "IP source guard"},
      {"IPv6 header chain malformed, too long or cut by a fragment (headerChainDropCnt)", "IPv6 header chain"},
      {"fragmented ND or RA from the VM (fragmentedNdDropCnt)", "Fragmented ND or RA"},
      {"RA guard: router advertisement or redirect from the VM (raGuardDropCnt)", "RA guard"},
      {"DHCPv6 guard: server message from the VM (dhcpv6GuardDropCnt)", "DHCPv6 guard"},
      {"IPv6 source guard: source not bound on its VLAN (sourceGuardDropCnt)", "IPv6 source guard"},
      {"ND inspection: an address or link-layer option not the VM's (ndInspectionDropCnt)", "ND inspection"},
      {"ND rate limit exceeded, port enters the error-rate-limit state (ndRateLimitDropCnt)", "ND rate limit"},
      {"ND error-rate-limit state (ndRateLimitDropCnt)", "ND rate limit: error state"},
      {"tagged frame from the VM inside its VLAN (taggedDropCnt)", "Tagged frame"},
   };
   const replay::ReplayResult result = replayCase(32, true);
   std::map<uint64_t, std::string> reasons;
   for (const auto &frame : result.frames) {
      EXPECT_EQ(frame.passed, frame.reason == replay::DropReason::none) << frame.index;
      if (!frame.passed) {
         reasons[frame.index] = replay::dropReasonName(frame.reason);
      }
   }
   std::map<uint64_t, std::string> expectedReasons;
   for (const auto &d : expected["dropped"]) {
      expectedReasons[d["index"].get<uint64_t>()] = kReasonOfRule.at(d["rule"].get<std::string>());
   }
   EXPECT_EQ(reasons, expectedReasons);
   EXPECT_EQ(nonZeroCounters(result.ports[0]), expectedCounters(expected));
}

std::string caseName(const ::testing::TestParamInfo<Case> &info)
{
   std::string name = info.param.capture.substr(0, info.param.capture.find('.')) + "_" + info.param.setting;
   for (char &ch : name) {
      if (!std::isalnum(static_cast<unsigned char>(ch))) {
         ch = '_';
      }
   }
   return name;
}

INSTANTIATE_TEST_SUITE_P(Captures, ManifestReplay, ::testing::ValuesIn(allCases()), caseName);

}  // namespace
}  // namespace swsec::testing
