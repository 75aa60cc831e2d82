/*
 * The port database queries exported to other modules in the namespace
 * "switchSecurity#1.0".
 *
 * Calling order: optionally SwSec_PortDBGetNumEntries; then
 * SwSec_PortDBGetEntries; when it returns ORR_OK with a count above 0,
 * read `numEntries` SwSecPortDbEntry records at `entries` and pass `buffer`
 * to SwSec_PortDBReleaseBuf exactly once. A held buffer keeps the module
 * loaded. Every call may be made from any context that may sleep. The
 * entry record, SwSecPortDbEntry, is contract/notification.h.
 */
#pragma once

#include "contract/notification.h"
#include "platform/orr_base.h"
#include "swsec/swsec_vmi.h"

/* Fills a zeroed entry record from a VMI. */
void SwSecPortDbEntryFill(SwSecPortDbEntry *entry, const SwSecVmi *vmi);

/* Which VMIs a query selects. Any other value selects none. */
enum SwSecPortDbSelector : uint32_t {
   SwSecPortDbAuth = 0,      /* DHCP snooping and static */
   SwSecPortDbNonAuth = 1,   /* TOFU and ARP snooping */
   SwSecPortDbAll = 2,
};

/* ORR_NOT_FOUND for a port without a database; ORR_BAD_PARAM for a null output. */
extern "C" orr_Status SwSec_PortDBGetNumEntries(uint32_t portId, uint32_t selector,
                                                uint32_t *numEntries);
/* As above; on ORR_OK with a count above 0 the caller owns `*buffer`. */
extern "C" orr_Status SwSec_PortDBGetEntries(uint32_t portId, uint32_t selector, void **entries,
                                             uint32_t *numEntries, void **buffer);
/* Gives back a buffer from SwSec_PortDBGetEntries; ORR_BAD_PARAM for null. */
extern "C" orr_Status SwSec_PortDBReleaseBuf(void *buffer);
