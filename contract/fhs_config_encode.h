// A port's IPv6 first-hop security configuration as the management plane
// holds it, and the record (fhs_config_record.h) it is written as: the one
// encoder of the tool and the tests. Host side only (standard library).
#pragma once

#include "contract/fhs_config_record.h"

#include <cstdint>
#include <cstring>
#include <vector>

namespace swsec::contract {

// Defaults are those of a new port: DHCPv6 snooping and first come, first
// served learning, trusted, the default cap and lifetime.
struct Ipv6SecurityConfig {
   uint32_t features = FhsFeatureDhcpv6Snoop | FhsFeatureFcfs;
   bool trusted = true;
   uint32_t bindingLimit = 0;         // 0: FHS_DEFAULT_BINDING_LIMIT
   uint32_t ndRateLimit = 0;          // ND frames a second from the VM; 0: no limit
   uint32_t errRateLimit = 0;
   uint32_t errRateLimitPeriod = 0;
   uint32_t fcfsLifetime = 0;         // 0: FHS_DEFAULT_FCFS_LIFETIME
   std::vector<FhsBindingKey> statics;
};

// The packed record: header, then one 24-byte key per static binding.
inline std::vector<uint8_t> fhsConfigRecord(const Ipv6SecurityConfig &config)
{
   FhsConfig header{};
   header.version = FHS_CONFIG_VERSION;
   header.featuresEnabled = config.features;
   header.trusted = config.trusted ? 1 : 0;
   header.bindingLimit = config.bindingLimit;
   header.numStatic = static_cast<uint32_t>(config.statics.size());
   header.ndRateLimit = config.ndRateLimit;
   header.errRateLimit = config.errRateLimit;
   header.errRateLimitPeriod = config.errRateLimitPeriod;
   header.fcfsLifetime = config.fcfsLifetime;
   std::vector<uint8_t> bytes(FhsConfigLength(header.numStatic));
   std::memcpy(bytes.data(), &header, sizeof header);
   if (!config.statics.empty()) {
      std::memcpy(bytes.data() + sizeof header, config.statics.data(), config.statics.size() * sizeof(FhsBindingKey));
   }
   return bytes;
}

}  // namespace swsec::contract
