/*
 * The IPv6 first-hop security configuration record of a port, as it
 * travels through the agent's security property and its saved state.
 *
 * A packed record in the host's byte order: a 30-byte header followed by
 * `numStatic` 24-byte static bindings (FhsBindingKey).
 *
 * Wire contract: freestanding, shared by the module and the tools.
 */
#pragma once

#include <cstddef>
#include <cstdint>

/* Feature bits of `featuresEnabled`, with the text the summary shows. */
#define FHS_FEATURE_LIST(X)                                          \
   X(FhsFeatureHeaderChain,  0x01u, "Header chain check,")           \
   X(FhsFeatureRaGuard,      0x02u, "RA guard,")                     \
   X(FhsFeatureDhcpv6Guard,  0x04u, "DHCPv6 guard,")                 \
   X(FhsFeatureDhcpv6Snoop,  0x08u, "DHCPv6 snooping,")              \
   X(FhsFeatureFcfs,         0x10u, "First come first served,")      \
   X(FhsFeatureSourceGuard,  0x20u, "IPv6 source guard,")            \
   X(FhsFeatureNdInspection, 0x40u, "ND inspection,")

#define FHS_FEATURE_CONSTANT(name, bit, summary) constexpr uint32_t name = bit;
FHS_FEATURE_LIST(FHS_FEATURE_CONSTANT)
#undef FHS_FEATURE_CONSTANT

constexpr uint32_t FhsFeaturesKnown = 0x7fu;

constexpr uint8_t FHS_CONFIG_VERSION = 1;

/* Bindings a port may hold: the default and the most a configuration may ask for. */
constexpr uint32_t FHS_DEFAULT_BINDING_LIMIT = 64;
constexpr uint32_t FHS_BINDING_LIMIT_MAX = 1024;
/* Seconds a first-come-first-served binding lives past the VM's last traffic from it. */
constexpr uint32_t FHS_DEFAULT_FCFS_LIFETIME = 600;
/* Limits of ND rate limiting, as for ARP. */
constexpr uint32_t FHS_ND_RATE_LIMIT_MAX = 2048;
constexpr uint32_t FHS_ERR_RATE_LIMIT_MAX = 32;
constexpr uint32_t FHS_ERR_RATE_LIMIT_PERIOD_MIN = 10;

struct __attribute__((packed)) FhsConfig {
   uint8_t version;
   uint32_t featuresEnabled;
   uint8_t trusted;              /* non-zero: a router's port, frames from it are not judged */
   uint32_t bindingLimit;        /* most bindings the port may hold; 0: the default */
   uint32_t numStatic;           /* static bindings that follow */
   uint32_t ndRateLimit;         /* ND frames a second from the VM; 0: no limit */
   uint32_t errRateLimit;        /* frames a second the VM may send in the error state */
   uint32_t errRateLimitPeriod;  /* seconds the error state lasts */
   uint32_t fcfsLifetime;        /* seconds; 0: the default */
};

static_assert(sizeof(FhsConfig) == 30);
static_assert(offsetof(FhsConfig, version) == 0);
static_assert(offsetof(FhsConfig, featuresEnabled) == 1);
static_assert(offsetof(FhsConfig, trusted) == 5);
static_assert(offsetof(FhsConfig, bindingLimit) == 6);
static_assert(offsetof(FhsConfig, numStatic) == 10);
static_assert(offsetof(FhsConfig, ndRateLimit) == 14);
static_assert(offsetof(FhsConfig, errRateLimit) == 18);
static_assert(offsetof(FhsConfig, errRateLimitPeriod) == 22);
static_assert(offsetof(FhsConfig, fcfsLifetime) == 26);

/* A binding's key, as static entries, queries and saved state carry it. */
struct __attribute__((packed)) FhsBindingKey {
   uint16_t vlanId;
   uint8_t mac[6];
   uint8_t addr[16];             /* IPv6 address in network order */
};

static_assert(sizeof(FhsBindingKey) == 24);
static_assert(offsetof(FhsBindingKey, vlanId) == 0);
static_assert(offsetof(FhsBindingKey, mac) == 2);
static_assert(offsetof(FhsBindingKey, addr) == 8);

/*
 * What makes a record's header one a port cannot take, checked before any
 * of it is applied, by the agent and by the tool before it writes either
 * agent's record of a port.
 */
enum FhsConfigFault : uint8_t {
   FhsConfigFine = 0,
   FhsConfigBadBindingLimit,    /* over FHS_BINDING_LIMIT_MAX, or below numStatic */
   FhsConfigBadNdRateLimit,     /* a limit over its maximum, errRateLimit not below it, a period too short */
};

constexpr FhsConfigFault FhsCheckConfig(const FhsConfig &config)
{
   const uint32_t limit = config.bindingLimit == 0 ? FHS_DEFAULT_BINDING_LIMIT : config.bindingLimit;
   if (limit > FHS_BINDING_LIMIT_MAX || config.numStatic > limit) {
      return FhsConfigBadBindingLimit;
   }
   if (config.ndRateLimit != 0 &&
       (config.ndRateLimit > FHS_ND_RATE_LIMIT_MAX || config.errRateLimit >= config.ndRateLimit ||
        config.errRateLimit > FHS_ERR_RATE_LIMIT_MAX || config.errRateLimitPeriod < FHS_ERR_RATE_LIMIT_PERIOD_MIN)) {
      return FhsConfigBadNdRateLimit;
   }
   return FhsConfigFine;
}

/* A static binding must be of a unicast address (not multicast, not unspecified) on a VLAN. */
constexpr bool FhsStaticKeyUsable(const FhsBindingKey &key)
{
   bool specified = false;
   for (uint8_t byte : key.addr) {
      specified = specified || byte != 0;
   }
   return specified && key.addr[0] != 0xff && key.vlanId <= 4095;
}

/* Bytes of a record with `numStatic` entries; 64-bit so that no count overflows it. */
constexpr uint64_t FhsConfigLength(uint32_t numStatic)
{
   return sizeof(FhsConfig) + sizeof(FhsBindingKey) * static_cast<uint64_t>(numStatic);
}
