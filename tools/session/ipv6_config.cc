// IPv6 configuration keys.
#include "session/ipv6_config.h"

#include "session/error.h"
#include "session/json_text.h"

#include <arpa/inet.h>

#include <cstring>
#include <limits>
#include <vector>

namespace swsec::session {

namespace {

struct Ipv6FeatureName {
   std::string_view name;
   uint32_t bit;
};

constexpr Ipv6FeatureName kIpv6Features[] = {
   {"ipv6-header-chain", FhsFeatureHeaderChain}, {"ra-guard", FhsFeatureRaGuard},
   {"dhcpv6-guard", FhsFeatureDhcpv6Guard},      {"dhcpv6-snooping", FhsFeatureDhcpv6Snoop},
   {"ipv6-fcfs", FhsFeatureFcfs},                {"ipv6-source-guard", FhsFeatureSourceGuard},
   {"nd-inspection", FhsFeatureNdInspection},
};

}  // namespace

uint32_t ipv6FeatureBit(std::string_view name)
{
   for (const auto &feature : kIpv6Features) {
      if (feature.name == name) {
         return feature.bit;
      }
   }
   return 0;
}

bool parseIpv6Number(std::string_view key, const nlohmann::json &value, contract::Ipv6SecurityConfig &config,
                     const std::string &origin)
{
   uint32_t *field = key == "ndRateLimit"        ? &config.ndRateLimit
                     : key == "ipv6BindingLimit" ? &config.bindingLimit
                     : key == "ipv6FcfsLifetime" ? &config.fcfsLifetime
                                                 : nullptr;
   if (field == nullptr) {
      return false;
   }
   if (!value.is_number_unsigned() || value.get<uint64_t>() > std::numeric_limits<uint32_t>::max()) {
      throw InputError(origin + ": \"" + std::string(key) + "\" must be an unsigned 32-bit integer");
   }
   *field = value.get<uint32_t>();
   return true;
}

std::optional<std::string> ipv6ConfigRefusal(const contract::Ipv6SecurityConfig &config)
{
   const std::vector<uint8_t> record = contract::fhsConfigRecord(config);
   FhsConfig header{};
   std::memcpy(&header, record.data(), sizeof header);
   const auto number = [](uint32_t value) { return std::to_string(value); };
   switch (FhsCheckConfig(header)) {
   case FhsConfigBadBindingLimit:
      return "\"ipv6BindingLimit\" " + number(config.bindingLimit) + " must be at most " +
             number(FHS_BINDING_LIMIT_MAX) + " and cover the " + number(header.numStatic) + " IPv6 static bindings";
   case FhsConfigBadNdRateLimit:
      return "\"ndRateLimit\" " + number(config.ndRateLimit) + " with \"errRateLimit\" " + number(config.errRateLimit) +
             " and \"errRateLimitPeriod\" " + number(config.errRateLimitPeriod) + ": ndRateLimit must be at most " +
             number(FHS_ND_RATE_LIMIT_MAX) + " and above errRateLimit, errRateLimit at most " +
             number(FHS_ERR_RATE_LIMIT_MAX) + ", errRateLimitPeriod at least " + number(FHS_ERR_RATE_LIMIT_PERIOD_MIN);
   case FhsConfigFine:
      break;
   }
   for (const FhsBindingKey &key : config.statics) {
      if (!FhsStaticKeyUsable(key)) {
         char text[INET6_ADDRSTRLEN] = {};
         inet_ntop(AF_INET6, key.addr, text, sizeof text);
         return std::string("static IPv6 binding ") + text + " is not a unicast address";
      }
   }
   return std::nullopt;
}

FhsBindingKey ipv6StaticKey(uint16_t vlan, const std::array<uint8_t, 6> &mac, const nlohmann::json &ip,
                            const std::string &what)
{
   FhsBindingKey key{};
   key.vlanId = vlan;
   std::memcpy(key.mac, mac.data(), sizeof key.mac);
   if (!ip.is_string() || inet_pton(AF_INET6, ip.get<std::string>().c_str(), key.addr) != 1) {
      throw InputError(what + ": malformed IPv6 address " + jsonText(ip));
   }
   return key;
}

}  // namespace swsec::session
