/*
 * The switch-security agent's saved-state callbacks; the part they write
 * and read is contract/saved_state_layout.h.
 */
#pragma once

#include "contract/saved_state_layout.h"
#include "framework/sifra_generic_filter.h"
#include "swsec/swsec_context.h"

#include <cstdint>

/*
 * The agent's saved-state callbacks (sifraGenericFwFastPathOps), called by
 * the framework with the filter lock held; each takes the port's configLock
 * inside it (shared to save, exclusive to restore).
 */
uint64_t SwSecGetSavedStateLen(SifraGenericFilter *filter);
/*
 * Writes the part into `agentLen` zeroed bytes. Entries that no longer
 * fit (learned after the length was announced) are left out, newest first.
 */
void SwSecSaveState(SifraGenericFilter *filter, void *agentPart, uint64_t agentLen);
/*
 * Rebuilds the port from a part of `agentLen` bytes: ORR_OK; ORR_FAILURE
 * for a part that is malformed or inconsistent (nothing changed);
 * ORR_NO_MEMORY; or the port database configuration's status.
 */
orr_Status SwSecRestoreState(SifraGenericFilter *filter, const void *agentPart, uint64_t agentLen);
