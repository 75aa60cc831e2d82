/*
 * The IPv6 first-hop security agent: its name, callback table and the
 * per-filter callbacks the framework calls with the filter record and no
 * framework lock held (unless said so).
 */
#pragma once

#include "fhs/fhs_context.h"
#include "framework/sifra_generic_agent.h"
#include "framework/sifra_generic_filter.h"

#define FHS_AGENT_NAME "sifra-generic-tarlin-fhs"

extern const SifraGenericAgentOps fhsAgentOps;

/* Registers the agent's security property "%s.security" (a failure is logged and costs only the property). */
orr_Status FhsInitProperty(SifraGenericFastPathAgent *agent);
/* Withdraws it, if registered. */
void FhsCleanupProperty(SifraGenericFastPathAgent *agent);

/* Builds the port context with the default configuration; undoes everything on a failure. */
orr_Status FhsCreateFilter(SifraGenericFilter *filter);
/* Removes the bindings and frees the context. ORR_OK also without a context. */
orr_Status FhsDestroyFilter(SifraGenericFilter *filter);
/* Judges every frame of the list; dropped frames are removed and released. Always ORR_OK. */
orr_Status FhsProcessPackets(SifraGenericFilter *filter, orr_PktList *pktList, uint32_t direction);

/*
 * Checks a configuration record of `length` bytes and, when it is valid,
 * applies it under the exclusive configLock: features, limits, the static
 * bindings (replacing the old ones; dynamic bindings stay unless the new
 * limit is lower, when the oldest go), counters cleared. ORR_BAD_PARAM for
 * a record refused, with its reason logged; nothing changes then.
 */
orr_Status FhsConfigure(FhsContext *ctx, const uint8_t *record, uint64_t length);

/* The context of a filter of this agent; null for any other record. */
FhsContext *FhsContextOf(const void *filter);

/* The periodic tick of a port: ageing, pending requests, the ND error state. */
void FhsTimerCb(void *data);
