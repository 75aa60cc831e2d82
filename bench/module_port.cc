#include "module_port.h"

#include "support/ipv6_frames.h"
#include "support/security_config.h"

#include <cstring>
#include <stdexcept>
#include <string>

namespace swsec::bench {

namespace {

constexpr const char *kAgent = "sifra-generic-tarlin-swsec";
constexpr const char *kSecurityProperty = "sifra-generic-tarlin-swsec.security";
constexpr const char *kIpv6Agent = "sifra-generic-tarlin-fhs";

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
   if (host.sifra().writeProperty(kSecurityProperty, id_, testing::configRecord(config)) != ORR_OK) {
      (void)host.sifra().destroyFilterAsHypervisor(id_);
      throw std::runtime_error("security property write refused");
   }
   heapBytes_ = host.heap().liveBytes() - before;
   attach(kAgent);
}

std::array<uint8_t, 16> ModulePort::ipv6Of(const Binding &binding)
{
   std::array<uint8_t, 16> addr{0x20, 0x01, 0x0d, 0xb8};
   std::memcpy(addr.data() + 12, binding.ip.bytes.data(), 4);
   return addr;
}

ModulePort::ModulePort(Ipv6, host::Host &host, uint32_t portId, const std::vector<Binding> &bindings, bool arpLimits)
   : host_(host)
{
   if (host.portsets().portset("vs0") == nullptr) {
      host.portsets().addPortset("vs0");
   }
   host.portsets().addPort("vs0", portId);
   if (!host.sifra().fastPath(kIpv6Agent) &&
       host.plex().write("com.tarlin.common.switch-security", kIpv6Agent) != ORR_OK) {
      throw std::runtime_error("IPv6 agent refused");
   }
   host::FilterConfig filterConfig;
   filterConfig.name = "vm-" + std::to_string(portId) + ".eth0";
   if (host.sifra().createFilter(kIpv6Agent, portId, filterConfig, &id_) != ORR_OK) {
      throw std::runtime_error("createFilter refused");
   }
   testing::FhsPortConfig config;
   if (arpLimits) {
      config.ndRateLimit = 10;
      config.errRateLimit = 5;
      config.errRateLimitPeriod = 10;
   }
   for (const auto &binding : bindings) {
      FhsBindingKey key{};
      std::memcpy(key.mac, binding.mac.bytes.data(), sizeof(key.mac));
      const auto addr = ipv6Of(binding);
      std::memcpy(key.addr, addr.data(), sizeof(key.addr));
      config.statics.push_back(key);
   }
   if (host.sifra().writeProperty(std::string(kIpv6Agent) + ".security", id_, testing::fhsConfigBytes(config)) != ORR_OK) {
      (void)host.sifra().destroyFilterAsHypervisor(id_);
      throw std::runtime_error("IPv6 configuration refused");
   }
   attach(kIpv6Agent);
}

void ModulePort::attach(const char *agent)
{
   const auto info = host_.sifra().filter(id_);
   const auto fastPath = host_.sifra().fastPath(agent);
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
