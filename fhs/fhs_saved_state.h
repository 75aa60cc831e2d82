/*
 * The first-hop security agent's saved-state callbacks; the layout of
 * its part is contract/fhs_saved_state_layout.h. Pending DHCPv6 requests
 * are not carried: a client repeats an unanswered one.
 */
#pragma once

#include "contract/fhs_saved_state_layout.h"
#include "fhs/fhs_context.h"
#include "framework/sifra_generic_filter.h"

#include <cstddef>
#include <cstdint>

/* The agent's saved-state callbacks; the framework holds the filter lock. */
uint64_t FhsGetSavedStateLen(SifraGenericFilter *filter);
void FhsSaveState(SifraGenericFilter *filter, void *agentPart, uint64_t agentLen);
/*
 * Refuses a part shorter than its fixed bytes, or whose record or bindings
 * run past `agentLen`, or whose record or bindings a new configuration
 * would refuse, before anything changes (ORR_FAILURE).
 */
orr_Status FhsRestoreState(SifraGenericFilter *filter, const void *agentPart, uint64_t agentLen);
