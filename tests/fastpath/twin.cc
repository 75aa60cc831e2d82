#include "twin.h"

#include <linux/pkt_cls.h>

#include <algorithm>
#include <map>
#include <utility>

namespace swsec::testing {
namespace {

constexpr std::string_view kAgent = "sifra-generic-tarlin-swsec";
constexpr std::string_view kProperty = "sifra-generic-tarlin-swsec.security";
constexpr std::string_view kAgent6 = "sifra-generic-tarlin-fhs";
constexpr std::string_view kProperty6 = "sifra-generic-tarlin-fhs.security";

auto node(host::Host &host, const std::string &path)
{
   host::NexoRecord record;
   return host.nexo().get(path, &record) == ORR_OK ? record.values() : decltype(record.values()){};
}

// Each binding as its "vmi" node (or the IPv6 agent's "bindings" node)
// shows it, the port's ID left out, and a first-come-first-served IPv6
// binding's seconds left: the program has the module renew it on one frame
// in SWSEC_FP_FCFS_REFRESH_NS of real time, which a test run does not last.
std::vector<std::map<std::string, std::string, std::less<>>> vmis(host::Host &host, const std::string &path)
{
   std::vector<int64_t> instances;
   std::vector<std::map<std::string, std::string, std::less<>>> out;
   (void)host.nexo().list(path, &instances);
   for (int64_t instance : instances) {
      out.push_back(node(host, path + "/" + std::to_string(instance)));
      out.back().erase("portID");
      if (out.back()["method"] == "First come first served") {
         out.back().erase("timeRemaining");
      }
   }
   return out;
}

}  // namespace

Twin::Twin(host::Host &host, uint32_t firstPort)
   : host_(host), alonePort_(firstPort), kernelPort_(firstPort + 1), program_(fastpath::Program::Options{})
{
   // Each port on a switch of its own: the IPv6 agent refuses a claim of an address another port of its switch holds.
   for (auto [port, filter, name] : {std::tuple{alonePort_, &alone_, "alone"}, std::tuple{kernelPort_, &kernel_, "kernel"}}) {
      const std::string portset = "twin" + std::to_string(port);
      host_.portsets().addPortset(portset);
      host_.portsets().addPort(portset, port);
      if (host_.sifra().createFilter(kAgent, port, host::FilterConfig{.name = name}, filter) != ORR_OK) {
         dropFilters();
         throw std::runtime_error("cannot create a filter");
      }
   }
   mirror_.emplace(program_, host_, kernel_, kernelPort_);
   (void)host_.portsets().takePosted();
   mirror_->start();
}

Twin::~Twin()
{
   dropFilters();
}

void Twin::dropFilters()
{
   for (host::FilterId filter : {alone6_, kernel6_, alone_, kernel_}) {
      if (filter != 0) {
         (void)host_.sifra().destroyFilterAsHypervisor(filter);
      }
   }
}

bool Twin::configure(const session::PortSecurityConfig &config)
{
   const std::vector<uint8_t> bytes = session::configRecord(config);
   // A record one port took and the other refused shows in the summaries.
   bool taken = host_.sifra().writeProperty(kProperty, alone_, bytes) == ORR_OK;
   (void)host_.sifra().writeProperty(kProperty, kernel_, bytes);
   if (config.ipv6 && alone6_ == 0) {
      if ((!host_.sifra().fastPath(kAgent6) &&
           host_.plex().write("com.tarlin.common.switch-security", std::string(kAgent6)) != ORR_OK) ||
          host_.sifra().createFilter(kAgent6, alonePort_, host::FilterConfig{.name = "alone"}, &alone6_) != ORR_OK ||
          host_.sifra().createFilter(kAgent6, kernelPort_, host::FilterConfig{.name = "kernel"}, &kernel6_) != ORR_OK) {
         throw std::runtime_error("cannot make the IPv6 agent's filters");
      }
   }
   if (alone6_ != 0) {
      const std::vector<uint8_t> record6 = contract::fhsConfigRecord(config.ipv6.value_or(contract::Ipv6SecurityConfig{}));
      taken = host_.sifra().writeProperty(kProperty6, alone6_, record6) == ORR_OK && taken;
      (void)host_.sifra().writeProperty(kProperty6, kernel6_, record6);
   }
   // As the daemon does on a new configuration: start the mirror over.
   (void)host_.portsets().takePosted();
   mirror_->start();
   base_ = program_.counters();   // the module's counters restart
   return taken;
}

void Twin::advance(std::chrono::microseconds by)
{
   host_.clock().advance(by);
   mirror_->follow(host_.portsets().takePosted());
}

std::string Twin::judge(std::span<const uint8_t> frame, uint32_t direction)
{
   // BPF_PROG_TEST_RUN refuses an untagged IPv4 frame shorter than its
   // header (34 bytes) and IPv6 shorter than 54: neither port sees those.
   const uint16_t type = frame.size() >= 14 ? static_cast<uint16_t>(frame[12] << 8 | frame[13]) : 0;
   if ((type == 0x0800 && frame.size() < 34) || (type == 0x86dd && frame.size() < 54)) {
      return {};
   }
   const fastpath::Untagged untagged = fastpath::takeOuterTag(frame);
   const host::FrameSpec asSwitched{.bytes = untagged.bytes, .vlanId = untagged.vlan.value_or(0)};
   // Each port's filters in turn, the IPv4 agent's and then the IPv6 agent's.
   const bool passedAlone = host_.sifra().processPort(alonePort_, direction, {asSwitched}).kept.size() == 1;

   const int action = program_.testRun(frame, direction).action;
   std::vector<fastpath::Punt> punts;
   program_.drainPunts([&punts](fastpath::Punt &&punt) { punts.push_back(std::move(punt)); });
   if ((action == TC_ACT_STOLEN) != (punts.size() == 1) ||
       (!punts.empty() && (punts[0].bytes != untagged.bytes || punts[0].vlan != asSwitched.vlanId ||
                           punts[0].direction != direction || punts[0].portId != kernelPort_))) {
      return "action " + std::to_string(action) + " with " + std::to_string(punts.size()) +
             " punt records, or not the frame as switched";
   }
   bool passedKernel = action == TC_ACT_OK;
   if (action == TC_ACT_STOLEN) {
      const host::FrameSpec punted{.bytes = punts[0].bytes, .vlanId = punts[0].vlan};
      passedKernel = host_.sifra().processPort(kernelPort_, direction, {punted}).kept.size() == 1;
      mirror_->follow(host_.portsets().takePosted());
   }
   if (passedAlone != passedKernel) {
      return std::string("the module alone ") + (passedAlone ? "passed" : "dropped") + " it, the fast path " +
             (passedKernel ? "passed" : "dropped") + " it, " +
             (punts.empty() ? "in the kernel" : "punted: " + std::string(fastpath::reasonName(punts[0].reason)));
   }
   return counters();
}

// Both agents' summaries, drop counters included, with the kernel's drops added.
std::string Twin::counters()
{
   auto alone = node(host_, "/security/" + std::to_string(alonePort_) + "/featureSummary");
   auto kernel = node(host_, "/security/" + std::to_string(kernelPort_) + "/featureSummary");
   for (const auto &[name, value] : node(host_, "/ipv6/" + std::to_string(alonePort_) + "/summary")) {
      alone["ipv6." + name] = value;
   }
   for (const auto &[name, value] : node(host_, "/ipv6/" + std::to_string(kernelPort_) + "/summary")) {
      kernel["ipv6." + name] = value;
   }
   const fastpath::Counters now = program_.counters();
   for (const auto &[reason, field] : {std::pair{SWSEC_FP_DROP_IP_SOURCE_GUARD, "ipSrcGuardDropCnt"},
                                      std::pair{SWSEC_FP_DROP_ETHER_TYPE, "etherTypeDropCnt"},
                                      std::pair{SWSEC_FP_DROP_IPV6_SOURCE_GUARD, "ipv6.sourceGuardDropCnt"}}) {
      if (const uint64_t drops = now[reason] - base_[reason]; drops != 0) {
         kernel[field] = std::to_string(std::stoull(kernel[field]) + drops);
      }
   }
   for (const auto &[name, value] : alone) {
      if (kernel[name] != value) {
         return name + ": " + value + " alone, " + kernel[name] + " with the fast path";
      }
   }
   return {};
}

std::string Twin::databases()
{
   for (const auto &[prefix, suffix] : {std::pair{"/security/", "/vmi"}, std::pair{"/ipv6/", "/bindings"}}) {
      if (vmis(host_, prefix + std::to_string(alonePort_) + suffix) != vmis(host_, prefix + std::to_string(kernelPort_) + suffix)) {
         return std::string("the two ports' ") + suffix + " nodes differ";
      }
   }
   const fastpath::PortDescription inModule = fastpath::readPort(host_, kernel_, kernelPort_);
   if (!std::ranges::is_permutation(program_.bindings(), inModule.bindings)) {
      return "the binding map is not the kernel port's database";
   }
   if (!std::ranges::is_permutation(program_.bindings6(), inModule.bindings6)) {
      return "the IPv6 binding map is not the kernel port's IPv6 bindings";
   }
   return {};
}

}  // namespace swsec::testing
