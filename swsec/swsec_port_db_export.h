/*
 * The port database queries exported to other modules in the namespace
 * "switchSecurity#1.0".
 *
 * Calling order: optionally SwSec_PortDBGetNumEntries; then
 * SwSec_PortDBGetEntries; when it returns ORR_OK with a count above 0,
 * read `numEntries` SwSecPortDbEntry records at `entries` and pass `buffer`
 * to SwSec_PortDBReleaseBuf exactly once. A held buffer keeps the module
 * loaded. Every call may be made from any context that may sleep.
 */
#pragma once

#include "platform/orr_base.h"
#include "swsec/swsec_vmi.h"

#include <cstddef>

/*
 * One exported VMI, 32 bytes in host order except `ipAddr`; every byte not
 * named is zero. Also the entry of a port database message.
 */
struct __attribute__((packed)) SwSecPortDbEntry {
   uint16_t vlanId;
   uint8_t macAddr[6];
   uint8_t ipAddrType;       /* SWSEC_PORT_DB_ENTRY_IPV4 */
   uint8_t reserved1[3];
   uint32_t ipAddr;          /* network order */
   uint8_t reserved2[12];
   uint8_t authoritative;    /* 1: DHCP snooping or static */
   uint8_t reserved3[3];
};
static_assert(sizeof(SwSecPortDbEntry) == 32);
static_assert(offsetof(SwSecPortDbEntry, vlanId) == 0);
static_assert(offsetof(SwSecPortDbEntry, macAddr) == 2);
static_assert(offsetof(SwSecPortDbEntry, ipAddrType) == 8);
static_assert(offsetof(SwSecPortDbEntry, ipAddr) == 12);
static_assert(offsetof(SwSecPortDbEntry, authoritative) == 28);

constexpr uint8_t SWSEC_PORT_DB_ENTRY_IPV4 = 1;

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
