// The IPv6 first-hop security keys of a port's configuration document,
// read beside the IPv4 ones: feature names in "features", their own
// numbers, and IPv6 addresses in "static".
#pragma once

#include "contract/fhs_config_encode.h"

#include <nlohmann/json.hpp>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace swsec::session {

// The IPv6 feature names, as an error message lists them.
inline constexpr const char *kIpv6FeatureNames =
   "ipv6-header-chain, ra-guard, dhcpv6-guard, dhcpv6-snooping, ipv6-fcfs, ipv6-source-guard, nd-inspection";

// The feature bit of an IPv6 feature name; 0 for any other name.
uint32_t ipv6FeatureBit(std::string_view name);

// Reads `key` when it is one of the IPv6 agent's own numbers ("ndRateLimit",
// "ipv6BindingLimit", "ipv6FcfsLifetime") into `config`; false for any
// other key. Throws InputError for a value that is not an unsigned 32-bit
// integer.
bool parseIpv6Number(std::string_view key, const nlohmann::json &value, contract::Ipv6SecurityConfig &config,
                     const std::string &origin);

// Why the IPv6 agent would refuse the configuration (the checks it makes
// before applying a record), naming the keys; none when it would take it.
std::optional<std::string> ipv6ConfigRefusal(const contract::Ipv6SecurityConfig &config);

// A static entry whose "ip" is an IPv6 address, as the agent's key; throws
// InputError naming `what` for a malformed address.
FhsBindingKey ipv6StaticKey(uint16_t vlan, const std::array<uint8_t, 6> &mac, const nlohmann::json &ip,
                            const std::string &what);

}  // namespace swsec::session
