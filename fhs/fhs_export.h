/*
 * A port of the first-hop security agent found by its port ID, and the
 * binding queries exported to other modules beside the switch-security
 * agent's ("switchSecurity#1.0").
 *
 * Calling order, as for the port database: optionally
 * Fhs_BindingsGetNumEntries; then Fhs_BindingsGetEntries; when it returns
 * ORR_OK with a count above 0, read `numEntries` FhsBindingEntry records
 * (contract/fhs_binding.h) at `entries` and pass `buffer` to
 * Fhs_BindingsReleaseBuf exactly once. A held buffer keeps the module
 * loaded. Every call may be made from any context that may sleep.
 */
#pragma once

#include "contract/fhs_binding.h"
#include "fhs/fhs_context.h"
#include "framework/sifra_generic_agent.h"

/* The agent's record, or null when it was not made. */
SifraGenericFastPathAgent *FhsFindAgent(void);

/*
 * Finds the port `portId` and locks its configLock (exclusive when `write`)
 * under the agent lock, taken first (rank 2 before 4), which keeps the
 * port from being destroyed meanwhile. ORR_NOT_FOUND without such a port.
 * FhsUnlockPort undoes it.
 */
orr_Status FhsLockPort(uint32_t portId, bool write, SifraGenericFastPathAgent **agentOut, FhsContext **ctxOut);
void FhsUnlockPort(SifraGenericFastPathAgent *agent, FhsContext *ctx, bool write);

/* ORR_NOT_FOUND for a port without the agent; ORR_BAD_PARAM for a null output. */
extern "C" orr_Status Fhs_BindingsGetNumEntries(uint32_t portId, uint32_t selector, uint32_t *numEntries);
/* As above; on ORR_OK with a count above 0 the caller owns `*buffer`. */
extern "C" orr_Status Fhs_BindingsGetEntries(uint32_t portId, uint32_t selector, void **entries,
                                             uint32_t *numEntries, void **buffer);
/* Gives back a buffer from Fhs_BindingsGetEntries; ORR_BAD_PARAM for null. */
extern "C" orr_Status Fhs_BindingsReleaseBuf(void *buffer);
