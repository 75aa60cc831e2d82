/*
 * The port filter map: switch port ID -> the port's switch-security
 * context, for the ports of the built-in agent that keep a port database.
 * Other modules and the management nodes find a port's database through it.
 *
 * The map lives from module start to module end. Its lock
 * "sifg.sec.portFilterMapDb" (rank 5) guards everything in it.
 */
#pragma once

#include "platform/orr_hash.h"
#include "platform/orr_lock.h"

#define SWSEC_PORT_FILTER_MAP_BUCKETS 64u
#define SWSEC_PORT_FILTER_MAP_LOCK_NAME "sifg.sec.portFilterMapDb"

struct SwSecPortFilterMapDb {
   Hash_Table *hash;        /* SWSEC_PORT_FILTER_MAP_BUCKETS chains keyed by port ID */
   orr_ListLinks list;      /* every entry, oldest first */
   uint32_t numPfm;         /* number of entries */
   orr_Spinlock lock;
};

extern SwSecPortFilterMapDb portFilterMapDb;

/* Makes the map's lock and hash. A failure leaves what was made for the clean-up. */
orr_Status SwSecInitPortFilterMap(void);
/* Frees whichever of the map's parts exist; its entries are gone by then. */
void SwSecCleanupPortFilterMap(void);
