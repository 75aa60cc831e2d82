// A port's security configuration as the management plane holds it, and
// the configuration record (config_record.h) it is written as: the one
// encoder of the tool and the tests. Host side only (standard library);
// the module reads records, it does not build them.
#pragma once

#include "contract/config_record.h"

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstring>
#include <vector>

namespace swsec::contract {

struct StaticBinding {
   uint16_t vlan = 0;
   std::array<uint8_t, 6> mac{};
   std::array<uint8_t, 4> ip{};   // network order, as a frame carries it
};

// Defaults are those of a new port: IP discovery alone, trusted, 32 entries.
struct PortSecurityConfig {
   uint32_t features = SwSecFeatureIpDiscovery;
   bool trusted = true;
   uint32_t portDbSize = 32;
   uint32_t arpRateLimit = 0;
   uint32_t errRateLimit = 0;
   uint32_t errRateLimitPeriod = 0;
   std::vector<StaticBinding> statics;
   // The frame guard: tagged frames from the VM (dropped unless allowed)
   // and the ethertypes it may send (empty: any; at most SWSEC_ETHERTYPES_MAX).
   bool allowTagged = false;
   std::vector<uint16_t> etherTypes;
};

// The packed record (version 2): header, one 12-byte entry per static
// binding, then the frame guard block.
inline std::vector<uint8_t> configRecord(const PortSecurityConfig &config)
{
   SwSecConfig header{};
   header.version = SWSEC_CONFIG_VERSION_FRAME_GUARD;
   header.featuresEnabled = config.features;
   header.trusted = config.trusted ? 1 : 0;
   header.portDbSize = config.portDbSize;
   header.numStatic = static_cast<uint32_t>(config.statics.size());
   header.arpRateLimit = config.arpRateLimit;
   header.errRateLimit = config.errRateLimit;
   header.errRateLimitPeriod = config.errRateLimitPeriod;
   std::vector<uint8_t> bytes(SwSecConfigRecordLength(header.version, header.numStatic));
   std::memcpy(bytes.data(), &header, sizeof header);
   uint8_t *entry = bytes.data() + sizeof header;
   for (const auto &binding : config.statics) {
      SwSecVmiKey key{};
      key.vlanId = binding.vlan;
      std::memcpy(key.macAddr, binding.mac.data(), sizeof key.macAddr);
      uint32_t ip = 0;   // network order, as the bytes stand
      std::memcpy(&ip, binding.ip.data(), sizeof ip);
      key.ipAddr = ip;
      std::memcpy(entry, &key, sizeof key);
      entry += sizeof key;
   }
   // A list longer than the block holds is written whole in its count, for
   // the module to refuse, never cut short.
   SwSecFrameGuard guard{};
   guard.flags = config.allowTagged ? SwSecFrameGuardAllowTagged : 0;
   guard.numEtherTypes = static_cast<uint8_t>(std::min<size_t>(config.etherTypes.size(), 0xff));
   for (size_t i = 0; i < config.etherTypes.size() && i < SWSEC_ETHERTYPES_MAX; ++i) {
      guard.etherTypes[i] = config.etherTypes[i];
   }
   std::memcpy(entry, &guard, sizeof guard);
   return bytes;
}

}  // namespace swsec::contract
