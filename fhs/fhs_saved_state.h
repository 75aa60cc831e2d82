/*
 * The first-hop security agent's part of a filter's saved state: the
 * active configuration record (with its static bindings), the ND error
 * state, the drop counters and the dynamic bindings with their remaining
 * lifetimes, so that a restore re-bases them on its own clock. Pending
 * DHCPv6 requests are not carried: a client repeats an unanswered one.
 *
 * Packed and little-endian: a 104-byte fixed part, then `configLen` bytes
 * of configuration record, then `numBindings` 32-byte bindings.
 */
#pragma once

#include "fhs/fhs_config_record.h"
#include "fhs/fhs_context.h"
#include "framework/sifra_generic_filter.h"

#include <cstddef>
#include <cstdint>

constexpr uint32_t FHS_SAVED_MAGIC = 0x31736866;   /* "fhs1" */

struct __attribute__((packed)) FhsSavedState {
   uint32_t magic;
   uint32_t configLen;                /* bytes of the configuration record that follows */
   uint32_t numBindings;              /* dynamic bindings after the record */
   uint8_t ndRateLimitErr;            /* non-zero: in the ND error state */
   uint8_t reserved[3];
   int64_t ndRateLimitErrRemaining;   /* seconds that state had left */
   FhsDropCounters counters;
};

static_assert(sizeof(FhsSavedState) == 104);
static_assert(offsetof(FhsSavedState, magic) == 0);
static_assert(offsetof(FhsSavedState, configLen) == 4);
static_assert(offsetof(FhsSavedState, numBindings) == 8);
static_assert(offsetof(FhsSavedState, ndRateLimitErr) == 12);
static_assert(offsetof(FhsSavedState, ndRateLimitErrRemaining) == 16);
static_assert(offsetof(FhsSavedState, counters) == 24);

struct __attribute__((packed)) FhsSavedBinding {
   FhsBindingKey key;
   uint8_t method;                    /* FhsBindDhcpv6 or FhsBindFcfs */
   uint8_t reserved[3];
   uint32_t remaining;                /* seconds left, at least 1 */
};

static_assert(sizeof(FhsSavedBinding) == 32);
static_assert(offsetof(FhsSavedBinding, key) == 0);
static_assert(offsetof(FhsSavedBinding, method) == 24);
static_assert(offsetof(FhsSavedBinding, remaining) == 28);

/* The agent's saved-state callbacks; the framework holds the filter lock. */
uint64_t FhsGetSavedStateLen(SifraGenericFilter *filter);
void FhsSaveState(SifraGenericFilter *filter, void *agentPart, uint64_t agentLen);
/*
 * Refuses a part shorter than its fixed bytes, or whose record or bindings
 * run past `agentLen`, or whose record or bindings a new configuration
 * would refuse, before anything changes (ORR_FAILURE).
 */
orr_Status FhsRestoreState(SifraGenericFilter *filter, const void *agentPart, uint64_t agentLen);
