// The bytes of a port configuration as the management plane writes them to
// the security property, and as the set-features ioctl carries them after
// its type: the fixed record, then the static entries. Shared by the tests,
// the fuzz targets and the benchmark.
#pragma once

#include "contract/config_record_encode.h"

#include <vector>

namespace swsec::testing {

using contract::configRecord;
using contract::StaticBinding;
using PortConfig = contract::PortSecurityConfig;

// Learning: IP discovery alone on a trusted port, as every new port starts.
inline PortConfig learningConfig() { return PortConfig{}; }

// Enforcing: every feature on an untrusted port, with rate limits.
inline PortConfig enforcingConfig(std::vector<StaticBinding> statics = {})
{
   return PortConfig{.features = SwSecFeatureBpduFilter | SwSecFeatureBlockDhcpServer | SwSecFeatureIpDiscovery |
                                 SwSecFeatureDai | SwSecFeatureIpSrcGuard,
                     .trusted = false, .arpRateLimit = 10, .errRateLimit = 5, .errRateLimitPeriod = 10,
                     .statics = std::move(statics)};
}

}  // namespace swsec::testing
