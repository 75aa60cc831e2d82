/*
 * An IPv6 binding as it leaves the first-hop security agent: how it was
 * learned, the drop counters beside it, the 80-byte portset message that
 * announces its addition or removal, and the 32-byte entry the exported
 * queries hand to other modules.
 *
 * Wire contract: freestanding, shared by the module and the tools.
 */
#pragma once

#include "contract/fhs_config_record.h"

#include <cstddef>
#include <cstdint>

/* How a binding was learned. */
enum FhsBindMethod : uint8_t {
   FhsBindDhcpv6 = 1,
   FhsBindStatic = 2,
   FhsBindFcfs = 4,
};

/* Drop reasons, each with its counter and the text the summary shows. */
#define FHS_DROP_LIST(X)                                      \
   X(headerChainDropCnt, "header chain")                      \
   X(fragmentedNdDropCnt, "fragmented ND or RA")              \
   X(raGuardDropCnt, "RA guard")                              \
   X(dhcpv6GuardDropCnt, "DHCPv6 guard")                      \
   X(sourceGuardDropCnt, "source guard")                      \
   X(ndInspectionDropCnt, "ND inspection")                    \
   X(claimRefusedDropCnt, "address claimed by another port")  \
   X(ndRateLimitDropCnt, "ND rate limit")

/* A port's counters, one block, in the order the saved state carries them. */
struct FhsDropCounters {
#define FHS_DROP_FIELD(name, text) uint64_t name;
   FHS_DROP_LIST(FHS_DROP_FIELD)
#undef FHS_DROP_FIELD
   uint64_t ndRateLimitErrEntryCnt;
   uint64_t bindingsEvictedCnt;
};
static_assert(sizeof(FhsDropCounters) == 80);
static_assert(offsetof(FhsDropCounters, headerChainDropCnt) == 0);
static_assert(offsetof(FhsDropCounters, ndRateLimitDropCnt) == 56);
static_assert(offsetof(FhsDropCounters, ndRateLimitErrEntryCnt) == 64);
static_assert(offsetof(FhsDropCounters, bindingsEvictedCnt) == 72);

/* The class every binding message is posted with, and its two names. */
constexpr uint64_t FHS_PORTSET_MSG_BINDING = 0x0010000000000000ull;
#define FHS_MSG_ADDED "fhs.binding.added"
#define FHS_MSG_REMOVED "fhs.binding.removed"

enum FhsBindingOp : uint32_t {
   FhsBindingOpAdded = 0,
   FhsBindingOpRemoved = 1,
};

/* The message's payload, after the 40-byte portset message header. */
struct __attribute__((packed)) FhsBindingMsgPayload {
   uint32_t op;                  /* FhsBindingOp */
   uint8_t method;               /* FhsBindMethod */
   uint8_t reserved[3];
   FhsBindingKey key;
   uint32_t lifetime;            /* seconds left when added; 0: never expires (static), or removed */
   uint32_t reserved2;
};
static_assert(sizeof(FhsBindingMsgPayload) == 40);
static_assert(offsetof(FhsBindingMsgPayload, op) == 0);
static_assert(offsetof(FhsBindingMsgPayload, method) == 4);
static_assert(offsetof(FhsBindingMsgPayload, key) == 8);
static_assert(offsetof(FhsBindingMsgPayload, lifetime) == 32);

/* Which bindings an exported query selects. Any other value selects none. */
enum FhsBindingSelector : uint32_t {
   FhsBindingsAuth = 0,          /* DHCPv6 and static */
   FhsBindingsNonAuth = 1,       /* first come, first served */
   FhsBindingsAll = 2,
};

/* One exported binding, 32 bytes in host order except the address; reserved bytes are zero. */
struct __attribute__((packed)) FhsBindingEntry {
   FhsBindingKey key;
   uint8_t method;               /* FhsBindMethod */
   uint8_t authoritative;        /* 1: DHCPv6 or static */
   uint8_t reserved[2];
   uint32_t timeRemaining;       /* seconds; 0 for a static binding, which never expires */
};
static_assert(sizeof(FhsBindingEntry) == 32);
static_assert(offsetof(FhsBindingEntry, key) == 0);
static_assert(offsetof(FhsBindingEntry, method) == 24);
static_assert(offsetof(FhsBindingEntry, authoritative) == 25);
static_assert(offsetof(FhsBindingEntry, timeRemaining) == 28);
