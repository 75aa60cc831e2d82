#include "module_port.h"

#include "support/security_config.h"

#include <cstring>
#include <stdexcept>
#include <string>

namespace swsec::bench {

namespace {

constexpr const char *kAgent = "sifra-generic-tarlin-swsec";
constexpr const char *kSecurityProperty = "sifra-generic-tarlin-swsec.security";

}  // namespace

ModulePort::ModulePort(host::Host &host, uint32_t portId, const std::vector<Binding> &bindings, bool arpLimits)
   : host_(host)
{
   if (host.portsets().portset("vs0") == nullptr) {
      host.portsets().addPortset("vs0");
   }
   host.portsets().addPort("vs0", portId);

   const uint64_t before = host.heap().liveBytes();
   host::FilterConfig filterConfig;
   filterConfig.name = "vm-" + std::to_string(portId) + ".eth0";
   if (host.sifra().createFilter(kAgent, portId, filterConfig, &id_) != ORR_OK) {
      throw std::runtime_error("createFilter refused");
   }
   // Every feature on an untrusted port.
   testing::PortConfig config = testing::enforcingConfig();
   if (!arpLimits) {
      config.arpRateLimit = 0;
      config.errRateLimit = 0;
      config.errRateLimitPeriod = 0;
   }
   config.portDbSize = 32;
   for (const auto &binding : bindings) {
      testing::StaticBinding entry;
      entry.mac = binding.mac.bytes;
      entry.ip = binding.ip.bytes;
      config.statics.push_back(entry);
   }
   if (host.sifra().writeProperty(kSecurityProperty, id_, testing::configBytes(config)) != ORR_OK) {
      (void)host.sifra().destroyFilterAsHypervisor(id_);
      throw std::runtime_error("security property write refused");
   }
   heapBytes_ = host.heap().liveBytes() - before;

   const auto info = host.sifra().filter(id_);
   const auto fastPath = host.sifra().fastPath(kAgent);
   if (!info || !fastPath || fastPath->ops == nullptr || fastPath->ops->processPackets == nullptr) {
      throw std::runtime_error("filter has no frame path");
   }
   ops_ = fastPath->ops;
   record_ = info->record;
   minMappedLen_ = (info->minMappedDirections & ORR_SIFRA_DIR_TX) != 0 ? info->minMappedLen : 0;
}

ModulePort::~ModulePort()
{
   (void)host_.sifra().destroyFilterAsHypervisor(id_);
}

std::unique_ptr<host::FrameList> ModulePort::makeList(const std::vector<MixFrame> &frames) const
{
   std::vector<host::FrameSpec> frameSpecs(frames.size());
   for (size_t i = 0; i < frames.size(); ++i) {
      frameSpecs[i].bytes = frames[i].bytes;
   }
   return host_.frames().makeList(frameSpecs, minMappedLen_);
}

}  // namespace swsec::bench
