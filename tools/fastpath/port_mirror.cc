#include "port_mirror.h"

#include "contract/config_record.h"
#include "contract/fhs_binding.h"
#include "contract/notification.h"

#include <charconv>
#include <cstring>
#include <string>

namespace swsec::fastpath {
namespace {

constexpr std::string_view kSecurityProperty = "sifra-generic-tarlin-swsec.security";
constexpr std::string_view kAdded = SWSEC_PORTDB_MSG_ADDED;
constexpr std::string_view kRemoved = SWSEC_PORTDB_MSG_REMOVED;

// The security configuration record's header: features at 1 (u32, host
// order), trusted at 5.
constexpr size_t kConfigHeaderLen = sizeof(SwSecConfig);
constexpr size_t kConfigFeaturesOffset = offsetof(SwSecConfig, featuresEnabled);
constexpr size_t kConfigTrustedOffset = offsetof(SwSecConfig, trusted);

// A notification's 40-byte payload: op, count, then one entry record
// (VLAN at 8, MAC at 10, IPv4 at 20 in network order, authoritative at 36).
constexpr size_t kNotificationLen = sizeof(SwSecPortDbMsgPayload);
constexpr size_t kEntryOffset = offsetof(SwSecPortDbMsgPayload, entry);
constexpr size_t kEntryVlanOffset = kEntryOffset + offsetof(SwSecPortDbEntry, vlanId);
constexpr size_t kEntryMacOffset = kEntryOffset + offsetof(SwSecPortDbEntry, macAddr);
constexpr size_t kEntryIpOffset = kEntryOffset + offsetof(SwSecPortDbEntry, ipAddr);
constexpr size_t kEntryAuthoritativeOffset = kEntryOffset + offsetof(SwSecPortDbEntry, authoritative);

// The IPv6 agent: its name, its security property and the binding queries it exports.
constexpr std::string_view kIpv6Agent = "sifra-generic-tarlin-fhs";
constexpr std::string_view kIpv6SecurityProperty = "sifra-generic-tarlin-fhs.security";
constexpr std::string_view kExportNamespace = "switchSecurity#1.0";

static_assert(SWSEC_FP_FHS_SOURCE_GUARD == FhsFeatureSourceGuard);
static_assert(sizeof(swsec_fp_binding6_key) == sizeof(FhsBindingKey));
static_assert(offsetof(swsec_fp_binding6_key, mac) == offsetof(FhsBindingKey, mac));
static_assert(offsetof(swsec_fp_binding6_key, addr) == offsetof(FhsBindingKey, addr));
static_assert(SWSEC_FP_MAX_BINDINGS6 >= FHS_BINDING_LIMIT_MAX);

std::string portPath(uint32_t portId)
{
   return "/security/" + std::to_string(portId);
}

std::string field(const host::NexoRecord &record, std::string_view name)
{
   const auto values = record.values();
   const auto found = values.find(name);
   if (found == values.end()) {
      throw std::runtime_error("no field " + std::string(name) + " in " + record.name);
   }
   return found->second;
}

// "a:b:c:d:e:f" in hex, "a.b.c.d" in decimal: exactly that, or an error.
template <size_t N>
std::array<uint8_t, N> parseParts(std::string_view text, char separator, int base)
{
   std::array<uint8_t, N> out{};
   const char *at = text.data();
   const char *end = text.data() + text.size();
   for (size_t i = 0; i < N; ++i) {
      if (i != 0) {
         if (at == end || *at != separator) {
            throw std::runtime_error("malformed address " + std::string(text));
         }
         ++at;
      }
      const auto [next, error] = std::from_chars(at, end, out[i], base);
      if (error != std::errc()) {
         throw std::runtime_error("malformed address " + std::string(text));
      }
      at = next;
   }
   if (at != end) {
      throw std::runtime_error("malformed address " + std::string(text));
   }
   return out;
}

}  // namespace

std::optional<host::FilterId> ipv6FilterOf(host::Host &host, uint32_t portId)
{
   for (const host::FilterInfo &filter : host.sifra().filters()) {
      if (filter.portID == portId && filter.agent == kIpv6Agent) {
         return filter.id;
      }
   }
   return std::nullopt;
}

bool readNdErrorState(host::Host &host, uint32_t portId, uint32_t ipv6Features, uint32_t ndRateLimit)
{
   if ((ipv6Features & FhsFeatureNdInspection) == 0 || ndRateLimit == 0) {
      return false;
   }
   host::NexoRecord summary;
   if (host.nexo().get("/ipv6/" + std::to_string(portId) + "/summary", &summary) != ORR_OK) {
      throw std::runtime_error("cannot read the IPv6 summary of port " + std::to_string(portId));
   }
   return field(summary, "ndRateLimitErr") == "yes";
}

namespace {

// The IPv6 agent's configuration and bindings of the port, by its security
// property and its exported query; nothing where the port has no IPv6 agent.
void readIpv6Part(host::Host &host, uint32_t portId, PortDescription &port)
{
   const std::optional<host::FilterId> filter = ipv6FilterOf(host, portId);
   if (!filter) {
      return;
   }
   const std::optional<uint32_t> length = host.sifra().pollProperty(kIpv6SecurityProperty, *filter);
   std::vector<uint8_t> config(length.value_or(0));
   if (config.size() < sizeof(FhsConfig) || host.sifra().readProperty(kIpv6SecurityProperty, *filter, config) != ORR_OK) {
      throw std::runtime_error("cannot read the IPv6 configuration of port " + std::to_string(portId));
   }
   FhsConfig header{};
   std::memcpy(&header, config.data(), sizeof header);
   port.ipv6Features = header.featuresEnabled;
   port.ipv6Trusted = header.trusted != 0;
   port.ndRateLimit = (header.featuresEnabled & FhsFeatureNdInspection) != 0 ? header.ndRateLimit : 0;
   port.ndErrorState = readNdErrorState(host, portId, port.ipv6Features, port.ndRateLimit);

   using GetEntries = orr_Status (*)(uint32_t, uint32_t, void **, uint32_t *, void **);
   using ReleaseBuf = orr_Status (*)(void *);
   const auto get = reinterpret_cast<GetEntries>(host.resolveExport(kExportNamespace, "Fhs_BindingsGetEntries"));
   const auto release = reinterpret_cast<ReleaseBuf>(host.resolveExport(kExportNamespace, "Fhs_BindingsReleaseBuf"));
   void *entries = nullptr;
   void *buffer = nullptr;
   uint32_t count = 0;
   if (get == nullptr || release == nullptr || get(portId, FhsBindingsAll, &entries, &count, &buffer) != ORR_OK) {
      throw std::runtime_error("cannot read the IPv6 bindings of port " + std::to_string(portId));
   }
   for (uint32_t i = 0; i < count; ++i) {
      FhsBindingEntry entry{};
      std::memcpy(&entry, static_cast<const uint8_t *>(entries) + i * sizeof entry, sizeof entry);
      Binding6 binding{.vlan = entry.key.vlanId, .mac = {}, .addr = {}, .fcfs = entry.method == FhsBindFcfs};
      std::memcpy(binding.mac.data(), entry.key.mac, binding.mac.size());
      std::memcpy(binding.addr.data(), entry.key.addr, binding.addr.size());
      port.bindings6.push_back(binding);
   }
   if (count != 0) {
      (void)release(buffer);
   }
}

}  // namespace

bool readErrorState(host::Host &host, uint32_t portId, uint32_t features)
{
   if ((features & SWSEC_FP_FEATURE_DAI) == 0) {
      return false;
   }
   host::NexoRecord summary;
   if (host.nexo().get(portPath(portId) + "/featureSummary", &summary) != ORR_OK) {
      throw std::runtime_error("cannot read the feature summary of port " + std::to_string(portId));
   }
   return field(summary, "txRateLimitErr") == "Yes";
}

PortDescription readPort(host::Host &host, host::FilterId filter, uint32_t portId)
{
   PortDescription port;
   port.portId = portId;
   const std::optional<uint32_t> length = host.sifra().pollProperty(kSecurityProperty, filter);
   std::vector<uint8_t> config(length.value_or(0));
   if (config.size() < kConfigHeaderLen || host.sifra().readProperty(kSecurityProperty, filter, config) != ORR_OK) {
      throw std::runtime_error("cannot read the configuration of port " + std::to_string(portId));
   }
   std::memcpy(&port.features, config.data() + kConfigFeaturesOffset, sizeof port.features);
   port.trusted = config[kConfigTrustedOffset] != 0;
   std::memcpy(&port.arpRateLimit, config.data() + offsetof(SwSecConfig, arpRateLimit), sizeof port.arpRateLimit);
   // The frame guard block after the static entries (a version 2 record).
   uint32_t numStatic = 0;
   std::memcpy(&numStatic, config.data() + offsetof(SwSecConfig, numStatic), sizeof numStatic);
   const uint64_t guardAt = SwSecConfigLength(numStatic);
   if (SwSecConfigHasFrameGuard(config[offsetof(SwSecConfig, version)]) && guardAt + sizeof(SwSecFrameGuard) <= config.size()) {
      SwSecFrameGuard guard{};
      std::memcpy(&guard, config.data() + guardAt, sizeof guard);
      for (uint32_t i = 0; i < guard.numEtherTypes && i < SWSEC_ETHERTYPES_MAX; ++i) {
         port.etherTypes.push_back(guard.etherTypes[i]);
      }
   }
   port.errorState = readErrorState(host, portId, port.features);
   readIpv6Part(host, portId, port);

   std::vector<int64_t> instances;
   const std::string vmiPath = portPath(portId) + "/vmi";
   if ((port.features & SWSEC_FP_FEATURE_IP_DISCOVERY) == 0) {
      return port;   // no port database
   }
   if (host.nexo().list(vmiPath, &instances) != ORR_OK) {
      throw std::runtime_error("cannot list the bindings of port " + std::to_string(portId));
   }
   for (const int64_t instance : instances) {
      host::NexoRecord vmi;
      if (host.nexo().get(vmiPath + "/" + std::to_string(instance), &vmi) != ORR_OK) {
         throw std::runtime_error("cannot read binding " + std::to_string(instance) + " of port " +
                                  std::to_string(portId));
      }
      Binding binding;
      const std::string vlan = field(vmi, "vlanId");
      if (std::from_chars(vlan.data(), vlan.data() + vlan.size(), binding.vlan).ec != std::errc()) {
         throw std::runtime_error("malformed VLAN " + vlan);
      }
      binding.mac = parseParts<6>(field(vmi, "macAddr"), ':', 16);
      const auto ip = parseParts<4>(field(vmi, "ipAddr"), '.', 10);
      std::memcpy(&binding.ip, ip.data(), sizeof binding.ip);
      const std::string method = field(vmi, "discoveryMethod");
      binding.authoritative = method == "DHCP Snooping" || method == "Static";
      port.bindings.push_back(binding);
   }
   return port;
}

std::optional<BindingChange> bindingChange(const host::PostedMessage &message)
{
   if (message.name == FHS_MSG_ADDED || message.name == FHS_MSG_REMOVED) {
      if (message.payload.size() < sizeof(FhsBindingMsgPayload)) {
         return std::nullopt;
      }
      FhsBindingMsgPayload payload{};
      std::memcpy(&payload, message.payload.data(), sizeof payload);
      Binding6 binding{.vlan = payload.key.vlanId, .mac = {}, .addr = {}, .fcfs = payload.method == FhsBindFcfs};
      std::memcpy(binding.mac.data(), payload.key.mac, binding.mac.size());
      std::memcpy(binding.addr.data(), payload.key.addr, binding.addr.size());
      return BindingChange{.added = message.name == FHS_MSG_ADDED, .binding = {}, .ipv6 = binding};
   }
   if ((message.name != kAdded && message.name != kRemoved) || message.payload.size() < kNotificationLen) {
      return std::nullopt;
   }
   const uint8_t *payload = message.payload.data();
   BindingChange change;
   change.added = message.name == kAdded;
   std::memcpy(&change.binding.vlan, payload + kEntryVlanOffset, sizeof change.binding.vlan);
   std::memcpy(change.binding.mac.data(), payload + kEntryMacOffset, change.binding.mac.size());
   std::memcpy(&change.binding.ip, payload + kEntryIpOffset, sizeof change.binding.ip);
   change.binding.authoritative = payload[kEntryAuthoritativeOffset] != 0;
   return change;
}

Mirror::Mirror(Program &program, host::Host &host, host::FilterId filter, uint32_t portId)
   : program_(program), host_(host), filter_(filter), portId_(portId)
{
}

void Mirror::start()
{
   const PortDescription port = readPort(host_, filter_, portId_);
   features_ = port.features;
   ipv6Features_ = port.ipv6Features;
   ndRateLimit_ = port.ndRateLimit;
   program_.describe(port);
}

void Mirror::follow(std::span<const host::PostedMessage> messages)
{
   for (const host::PostedMessage &message : messages) {
      if (message.portID == portId_) {
         if (const auto change = bindingChange(message)) {
            program_.apply(*change);
         }
      }
   }
   program_.setErrorState(readErrorState(host_, portId_, features_),
                          readNdErrorState(host_, portId_, ipv6Features_, ndRateLimit_));
}

}  // namespace swsec::fastpath
