/*
 * The first-hop security agent's part of a filter's saved state: the
 * active configuration record (with its static bindings), the ND error
 * state, the drop counters and the dynamic bindings with their remaining
 * lifetimes, so that a restore re-bases them on its own clock.
 *
 * Packed and little-endian: a 104-byte fixed part, then `configLen` bytes
 * of configuration record, then `numBindings` 32-byte bindings. The part
 * sits in the blob of contract/state_blob.h.
 *
 * Wire contract: freestanding, shared by the module and the tools.
 */
#pragma once

#include "contract/fhs_binding.h"
#include "contract/fhs_config_record.h"

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
