/*
 * The security configuration record of a port, as it travels: through the
 * security property, the set-features ioctl and the saved state.
 *
 * A packed record in the host's byte order: a 26-byte header followed by
 * `numStatic` 12-byte static entries (SwSecVmiKey, vmi_key.h), and in
 * version 2 the 18-byte frame guard block.
 *
 * Wire contract: freestanding, shared by the module and the tools.
 */
#pragma once

#include "contract/vmi_key.h"

#include <cstddef>
#include <cstdint>

/* Feature bits of `featuresEnabled`, with the text the feature summary shows. */
#define SWSEC_FEATURE_LIST(X)                                                  \
   X(SwSecFeatureBpduFilter,      0x01u, "BPDU Filter,")                      \
   X(SwSecFeatureBlockDhcpServer, 0x02u, "Block DHCP server functionality,")  \
   X(SwSecFeatureIpDiscovery,     0x04u, "IP Discovery,")                     \
   X(SwSecFeatureDai,             0x08u, "DAI,")                              \
   X(SwSecFeatureIpSrcGuard,      0x10u, "IP source guard,")

#define SWSEC_FEATURE_CONSTANT(name, bit, summary) constexpr uint32_t name = bit;
SWSEC_FEATURE_LIST(SWSEC_FEATURE_CONSTANT)
#undef SWSEC_FEATURE_CONSTANT

/* Features that act on the port database and so need IP discovery on an untrusted port. */
constexpr uint32_t SwSecFeaturesNeedingDiscovery = SwSecFeatureDai | SwSecFeatureIpSrcGuard;

constexpr uint8_t SWSEC_CONFIG_VERSION = 1;

/* Limits of ARP rate limiting. */
constexpr uint32_t SWSEC_ARP_RATE_LIMIT_MAX = 2048;
constexpr uint32_t SWSEC_ERR_RATE_LIMIT_MAX = 32;
constexpr uint32_t SWSEC_ERR_RATE_LIMIT_PERIOD_MIN = 10;

/* The most VMIs a port database may hold (`portDbSize`). */
constexpr uint32_t SWSEC_PORT_DB_SIZE_MIN = 1;
constexpr uint32_t SWSEC_PORT_DB_SIZE_MAX = 32;

struct __attribute__((packed)) SwSecConfig {
   uint8_t version;
   uint32_t featuresEnabled;
   uint8_t trusted;              /* non-zero: trusted port */
   uint32_t portDbSize;          /* most VMIs the port database may hold */
   uint32_t numStatic;           /* static entries that follow */
   uint32_t arpRateLimit;        /* ARP frames a second each way; 0: no limit */
   uint32_t errRateLimit;        /* frames a second the VM may send in the error state */
   uint32_t errRateLimitPeriod;  /* seconds the error state lasts */
};

static_assert(sizeof(SwSecConfig) == 26);
static_assert(offsetof(SwSecConfig, version) == 0);
static_assert(offsetof(SwSecConfig, featuresEnabled) == 1);
static_assert(offsetof(SwSecConfig, trusted) == 5);
static_assert(offsetof(SwSecConfig, portDbSize) == 6);
static_assert(offsetof(SwSecConfig, numStatic) == 10);
static_assert(offsetof(SwSecConfig, arpRateLimit) == 14);
static_assert(offsetof(SwSecConfig, errRateLimit) == 18);
static_assert(offsetof(SwSecConfig, errRateLimitPeriod) == 22);

/* Bytes of a record with `numStatic` entries; 64-bit so that no count overflows it. */
constexpr uint64_t SwSecConfigLength(uint32_t numStatic)
{
   return sizeof(SwSecConfig) + sizeof(SwSecVmiKey) * static_cast<uint64_t>(numStatic);
}

/*
 * Version 2 appends a frame guard block after the static entries: what a
 * VM may send besides what the features check. A version-1 record means
 * the block's defaults: tags the VM stacks inside its port's VLAN dropped,
 * every ethertype allowed.
 */
constexpr uint8_t SWSEC_CONFIG_VERSION_FRAME_GUARD = 2;
constexpr uint8_t SWSEC_CONFIG_VERSION_MAX = SWSEC_CONFIG_VERSION_FRAME_GUARD;
constexpr uint32_t SWSEC_ETHERTYPES_MAX = 8;

/* Frame guard flags. */
constexpr uint8_t SwSecFrameGuardAllowTagged = 0x01u;   /* the VM may send tagged frames */

struct __attribute__((packed)) SwSecFrameGuard {
   uint8_t flags;
   uint8_t numEtherTypes;                        /* 0: every ethertype; at most SWSEC_ETHERTYPES_MAX */
   uint16_t etherTypes[SWSEC_ETHERTYPES_MAX];    /* host order; the first numEtherTypes are the list */
};

static_assert(sizeof(SwSecFrameGuard) == 18);
static_assert(offsetof(SwSecFrameGuard, flags) == 0);
static_assert(offsetof(SwSecFrameGuard, numEtherTypes) == 1);
static_assert(offsetof(SwSecFrameGuard, etherTypes) == 2);

/* Whether a record of `version` carries the frame guard block. */
constexpr bool SwSecConfigHasFrameGuard(uint8_t version)
{
   return version == SWSEC_CONFIG_VERSION_FRAME_GUARD;
}

/* Bytes of a record of `version` with `numStatic` entries. */
constexpr uint64_t SwSecConfigRecordLength(uint8_t version, uint32_t numStatic)
{
   return SwSecConfigLength(numStatic) + (SwSecConfigHasFrameGuard(version) ? sizeof(SwSecFrameGuard) : 0u);
}
