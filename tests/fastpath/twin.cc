#include "twin.h"

#include "port_mirror.h"

#include <linux/pkt_cls.h>

#include <map>
#include <sstream>
#include <utility>

namespace swsec::testing {
namespace {

constexpr std::string_view kAgent = "sifra-generic-tarlin-swsec";
constexpr std::string_view kProperty = "sifra-generic-tarlin-swsec.security";
constexpr const char *kDropCounters[] = {"dhcpSnoopingDropCnt", "daiDropCnt",          "ipSrcGuardDropCnt",
                                         "txRateLimitDropCnt",  "txRateLimitErrEntryCnt", "rxRateLimitDropCnt"};

std::map<std::string, std::string, std::less<>> node(host::Host &host, const std::string &path)
{
   host::NexoRecord record;
   return host.nexo().get(path, &record) == ORR_OK ? record.values() : decltype(record.values()){};
}

std::vector<std::map<std::string, std::string, std::less<>>> vmis(host::Host &host, uint32_t port)
{
   const std::string path = "/security/" + std::to_string(port) + "/vmi";
   std::vector<int64_t> instances;
   std::vector<std::map<std::string, std::string, std::less<>>> out;
   if (host.nexo().list(path, &instances) == ORR_OK) {
      for (int64_t instance : instances) {
         auto values = node(host, path + "/" + std::to_string(instance));
         values.erase("portID");
         out.push_back(std::move(values));
      }
   }
   return out;
}

}  // namespace

Twin::Ports::Ports(host::Host &hostRef, uint32_t first) : host(hostRef), alonePort(first), kernelPort(first + 1)
{
   const std::string portset = "twin" + std::to_string(first);
   host.portsets().addPortset(portset);
   for (auto [port, filter, name] : {std::tuple{alonePort, &alone, "alone"}, std::tuple{kernelPort, &kernel, "kernel"}}) {
      host.portsets().addPort(portset, port);
      if (host.sifra().createFilter(kAgent, port, host::FilterConfig{.name = name}, filter) != ORR_OK) {
         release();
         throw std::runtime_error("cannot create a filter");
      }
   }
}

Twin::Ports::~Ports()
{
   release();
}

void Twin::Ports::release()
{
   for (host::FilterId *filter : {&alone, &kernel}) {
      if (*filter != 0) {
         (void)host.sifra().destroyFilterAsHypervisor(std::exchange(*filter, 0));
      }
   }
}

Twin::Twin(host::Host &host, uint32_t firstPort)
   : host_(host), ports_(host, firstPort), alonePort_(firstPort), kernelPort_(firstPort + 1),
     alone_(ports_.alone), kernel_(ports_.kernel), program_(fastpath::Program::Options{})
{
   (void)host_.portsets().takePosted();
   program_.describe(fastpath::readPort(host_, kernel_, kernelPort_));
}

bool Twin::configure(std::span<const uint8_t> record)
{
   const std::vector<uint8_t> bytes(record.begin(), record.end());
   const orr_Status alone = host_.sifra().writeProperty(kProperty, alone_, bytes);
   const orr_Status kernel = host_.sifra().writeProperty(kProperty, kernel_, bytes);
   if (alone != kernel) {
      throw std::runtime_error("the two ports took one configuration differently");
   }
   // As the daemon does on a new configuration: start the mirror over.
   (void)host_.portsets().takePosted();
   program_.describe(fastpath::readPort(host_, kernel_, kernelPort_));
   kernelGuardDrops_ = 0;
   return alone == ORR_OK;
}

void Twin::follow()
{
   for (const host::PostedMessage &message : host_.portsets().takePosted()) {
      if (message.portID == kernelPort_) {
         if (const auto change = fastpath::bindingChange(message)) {
            program_.apply(*change);
         }
      }
   }
   program_.setErrorState(fastpath::readErrorState(host_, kernelPort_));
}

void Twin::advance(std::chrono::microseconds by)
{
   host_.clock().advance(by);
   follow();
}

std::string Twin::judge(std::span<const uint8_t> frame, uint32_t direction)
{
   const fastpath::Untagged untagged = fastpath::takeOuterTag(frame);
   const host::FrameSpec asSwitched{.bytes = untagged.bytes, .vlanId = untagged.vlan.value_or(0)};
   const bool passedAlone = host_.sifra().processPackets(alone_, direction, {asSwitched}).kept.size() == 1;

   const uint64_t guardBefore = program_.counters()[SWSEC_FP_DROP_IP_SOURCE_GUARD];
   const int action = program_.testRun(frame, direction).action;
   std::vector<fastpath::Punt> punts;
   program_.drainPunts([&punts](fastpath::Punt &&punt) { punts.push_back(std::move(punt)); });
   bool passedKernel = action == TC_ACT_OK;
   std::ostringstream how;
   if (action == TC_ACT_STOLEN) {
      if (punts.size() != 1 || punts[0].bytes != untagged.bytes || punts[0].vlan != asSwitched.vlanId ||
          punts[0].direction != direction || punts[0].portId != kernelPort_) {
         return "punted, but " + std::to_string(punts.size()) + " records do not carry the frame as switched";
      }
      how << "punted (" << fastpath::reasonName(punts[0].reason) << ")";
      const host::FrameSpec punted{.bytes = punts[0].bytes, .vlanId = punts[0].vlan};
      passedKernel = host_.sifra().processPackets(kernel_, direction, {punted}).kept.size() == 1;
      follow();
   } else {
      ++decided_;
      kernelGuardDrops_ += program_.counters()[SWSEC_FP_DROP_IP_SOURCE_GUARD] - guardBefore;
      how << "decided in the kernel (action " << action << ")";
      if (!punts.empty()) {
         return "decided in the kernel, and punted too";
      }
   }
   if (passedAlone != passedKernel) {
      return std::string("the module alone ") + (passedAlone ? "passed" : "dropped") + " it, the fast path " +
             (passedKernel ? "passed" : "dropped") + " it: " + how.str();
   }
   return counters();
}

std::string Twin::counters()
{
   const auto alone = node(host_, "/security/" + std::to_string(alonePort_) + "/featureSummary");
   auto kernel = node(host_, "/security/" + std::to_string(kernelPort_) + "/featureSummary");
   if (kernelGuardDrops_ != 0) {
      kernel["ipSrcGuardDropCnt"] = std::to_string(std::stoull(kernel["ipSrcGuardDropCnt"]) + kernelGuardDrops_);
   }
   for (const char *name : kDropCounters) {
      if (alone.at(name) != kernel.at(name)) {
         return std::string(name) + ": " + alone.at(name) + " alone, " + kernel.at(name) + " with the fast path";
      }
   }
   return {};
}

std::string Twin::databases()
{
   if (vmis(host_, alonePort_) != vmis(host_, kernelPort_)) {
      return "the two port databases differ";
   }
   auto inMap = program_.bindings();
   auto inModule = fastpath::readPort(host_, kernel_, kernelPort_).bindings;
   std::sort(inMap.begin(), inMap.end());
   std::sort(inModule.begin(), inModule.end());
   if (inMap != inModule) {
      return "the binding map (" + std::to_string(inMap.size()) + ") is not the port database (" +
             std::to_string(inModule.size()) + ")";
   }
   return {};
}

}  // namespace swsec::testing
