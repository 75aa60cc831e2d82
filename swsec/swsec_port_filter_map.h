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

struct SwSecContext;

/*
 * One port in the map, a zero-filled heap record.
 *
 * Life: allocated by the configuration that switches IP discovery on
 * (SwSecNewPortFilterMap), outside the map's lock; linked into its bucket
 * and the map's list by SwSecInsertPortFilterMap once the rest of the
 * configuration is applied (or freed there when another entry appeared);
 * unlinked and freed by SwSecDelPortFilterMap when IP discovery goes off
 * with no reference held. Readers hold it by `refCount` between
 * SwSecRefPortFilterMap and SwSecReleasePortFilterMap; a removal that
 * finds it referenced sets `removePending`, after which no new reference
 * is granted. Everything in it is guarded by the map's lock.
 */
struct SwSecPortFilterMap {
   orr_ListLinks hashLinks;  /* in a bucket chain */
   orr_ListLinks listLinks;  /* in portFilterMapDb.list */
   uint32_t portId;          /* the key */
   SwSecContext *context;
   uint32_t refCount;        /* references held by readers */
   uint8_t removePending;    /* a removal found it referenced */
};

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

/* The entry of `portId`, or null; the caller holds the map's lock. */
SwSecPortFilterMap *SwSecFindPortFilterMap(uint32_t portId);
/*
 * Takes a reference on the port's entry and gives its context.
 * ORR_NOT_FOUND: no entry, or it is being removed. Takes the map's lock.
 */
orr_Status SwSecRefPortFilterMap(uint32_t portId, SwSecContext **context);
/* Drops a reference taken by SwSecRefPortFilterMap. Takes the map's lock. */
void SwSecReleasePortFilterMap(uint32_t portId, SwSecContext *context);

/*
 * First half of adding a context's port, before the configuration changes
 * anything: `*entry` is null when the port has an entry already, else a
 * new unlinked entry (ORR_NO_MEMORY when it cannot be allocated). The map's
 * lock is taken for the lookup only, never across the allocation.
 */
orr_Status SwSecNewPortFilterMap(SwSecContext *context, SwSecPortFilterMap **entry);
/* Second half: links the new entry, or frees it when another one appeared. */
void SwSecInsertPortFilterMap(SwSecPortFilterMap *entry);
/* Frees an entry that SwSecNewPortFilterMap made and that was never linked. */
void SwSecFreePortFilterMap(SwSecPortFilterMap *entry);
/*
 * Removes the context's port from the map. ORR_BUSY (and `removePending`
 * set) while a reader holds a reference; ORR_OK also when there is no entry.
 * Called under the port's configLock exclusive.
 */
orr_Status SwSecDelPortFilterMap(SwSecContext *context);
