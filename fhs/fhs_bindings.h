/*
 * A port's IPv6 bindings: lookup, addition with the per-port cap, removal,
 * ageing, and claims judged across the ports of a bridge.
 *
 * Every function here runs under the port's configLock: lookups with it
 * held either way, changes with it held exclusive. Changes take
 * fhsBridge.lock (rank 5) themselves.
 */
#pragma once

#include "fhs/fhs_context.h"

/* The binding with this key, or null. */
FhsBinding *FhsFindBinding(FhsContext *ctx, uint16_t vlanId, const uint8_t *mac, const uint8_t *addr);

/* The first dynamic binding of the port for this address, whatever its VLAN and MAC; or null. */
FhsBinding *FhsFindDynamicAddress(FhsContext *ctx, const uint8_t *addr);

/*
 * Binds `key` by `method` until `expiry` (0: never). An existing binding
 * of the key takes the new expiry (a static one stays static). A port at
 * its limit evicts its oldest dynamic binding, with a log line; with none
 * to evict, or without memory, nothing is added (ORR_FAILURE,
 * ORR_NO_MEMORY), logged.
 */
orr_Status FhsAddBinding(FhsContext *ctx, const FhsBindingKey *key, uint8_t method, int64_t expiry);

/* Unlinks and frees one binding. */
void FhsRemoveBinding(FhsContext *ctx, FhsBinding *binding);

/* Removes every binding whose method is in `methods`; the count removed. */
uint32_t FhsClearBindings(FhsContext *ctx, uint32_t methods);

/*
 * True when a port of the same bridge other than `ctx`'s holds a binding of
 * `addr` on `vlanId` that is still alive at `now`.
 */
bool FhsClaimedElsewhere(FhsContext *ctx, uint16_t vlanId, const uint8_t *addr, int64_t now);

/*
 * The periodic tick: removes dynamic bindings expired at `now`, and moves
 * the expiry of FCFS bindings the VM sent from since the last tick.
 */
void FhsAgeBindings(FhsContext *ctx, int64_t now);

/* The address as text, eight hexadecimal groups; `text` holds at least 40 bytes. */
void FhsFormatAddr(char *text, const uint8_t *addr);

/* The port hash of a key. */
static inline uint32_t FhsBindingHash(uint16_t vlanId, const uint8_t *mac, const uint8_t *addr)
{
   uint64_t head;
   uint64_t low;
   uint64_t high;
   __builtin_memcpy(&head, mac, 6);
   __builtin_memcpy(&low, addr, 8);
   __builtin_memcpy(&high, addr + 8, 8);
   /* Six MAC bytes read as eight: the two above them are masked away. */
   head = (head & 0xffff'ffff'ffffull) | static_cast<uint64_t>(vlanId) << 48;
   const uint64_t mixed =
      head * 0x9e37'79b9'7f4a'7c15ull + low * 0xc2b2'ae3d'27d4'eb4full + high * 0x1656'67b1'9e37'79f9ull;
   return static_cast<uint32_t>((mixed ^ (mixed >> 29)) >> 32);
}
