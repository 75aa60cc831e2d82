// The bytes of a port configuration as the management plane writes them to
// the security property, and as the set-features ioctl carries them after
// its type: the fixed record, then the static entries. Shared by the tests,
// the fuzz targets and the benchmark.
#pragma once

#include "contract/config_record.h"
#include "contract/vmi_key.h"

#include <array>
#include <cstdint>
#include <cstring>
#include <vector>

namespace swsec::testing {

struct StaticBinding {
   uint16_t vlanId = 0;
   std::array<uint8_t, 6> mac{};
   std::array<uint8_t, 4> ip{};   // as the frame carries it
};

struct PortConfig {
   uint32_t features = SwSecFeatureIpDiscovery;
   uint8_t trusted = 1;
   uint32_t portDbSize = 32;
   uint32_t arpRateLimit = 0;
   uint32_t errRateLimit = 0;
   uint32_t errRateLimitPeriod = 0;
   std::vector<StaticBinding> statics;
};

// Learning: IP discovery alone on a trusted port, as every new port starts.
inline PortConfig learningConfig()
{
   return PortConfig{};
}

// Enforcing: every feature on an untrusted port, with rate limits.
inline PortConfig enforcingConfig(std::vector<StaticBinding> statics = {})
{
   PortConfig config;
   config.features = SwSecFeatureBpduFilter | SwSecFeatureBlockDhcpServer | SwSecFeatureIpDiscovery |
                     SwSecFeatureDai | SwSecFeatureIpSrcGuard;
   config.trusted = 0;
   config.arpRateLimit = 10;
   config.errRateLimit = 5;
   config.errRateLimitPeriod = 10;
   config.statics = std::move(statics);
   return config;
}

inline std::vector<uint8_t> configBytes(const PortConfig &config)
{
   SwSecConfig header{};
   header.version = SWSEC_CONFIG_VERSION;
   header.featuresEnabled = config.features;
   header.trusted = config.trusted;
   header.portDbSize = config.portDbSize;
   header.numStatic = static_cast<uint32_t>(config.statics.size());
   header.arpRateLimit = config.arpRateLimit;
   header.errRateLimit = config.errRateLimit;
   header.errRateLimitPeriod = config.errRateLimitPeriod;
   std::vector<uint8_t> bytes(sizeof header);
   std::memcpy(bytes.data(), &header, sizeof header);
   for (const auto &entry : config.statics) {
      SwSecVmiKey key{};
      key.vlanId = entry.vlanId;
      std::memcpy(key.macAddr, entry.mac.data(), 6);
      uint32_t ip = 0;
      std::memcpy(&ip, entry.ip.data(), 4);
      key.ipAddr = ip;
      const auto *raw = reinterpret_cast<const uint8_t *>(&key);
      bytes.insert(bytes.end(), raw, raw + sizeof key);
   }
   return bytes;
}

}  // namespace swsec::testing
