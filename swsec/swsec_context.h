/*
 * The switch-security context of one port (SwSecContext), hung in its
 * filter's agentData.
 *
 * Life: made zero-filled by SwSecCreateFilter, which adds the locks, the
 * port ID and portset and applies the default configuration; owned by the
 * filter; torn down by a successful SwSecDestroyFilter. A port of the
 * built-in agent with IP discovery on is also reachable through the port
 * filter map, which cannot drop it while a reader holds a reference.
 *
 * Locks: configLock "sifg.sec.config" (reader-writer, rank 4) guards the
 * configuration, the port database and the counters; frames are judged
 * under it shared, everything that changes the port holds it exclusive. The
 * ARP limiters have their own short spinlocks (rank 6) for use under the
 * shared configLock.
 */
#pragma once

#include "contract/config_record.h"
#include "contract/saved_state_layout.h"
#include "swsec/swsec_vmi.h"

#include "platform/orr_hash.h"
#include "platform/orr_lock.h"
#include "platform/orr_portset.h"
#include "platform/orr_time.h"

#include <cstddef>
#include <cstdint>

struct SifraGenericFilter;

/* A fixed-interval event counter (ARP rate limiting). */
struct SifraGenericRateLimit {
   uint32_t periodSec;       /* always 1 */
   uint32_t limit;           /* events allowed per interval */
   uint64_t intervalEnd;     /* host timer cycles */
   uint32_t count;           /* events in the current interval */
};

/* Drops of the frame guard, beside the block above (saved after it, cleared with it). */
struct SwSecFrameGuardCounters {
   uint64_t taggedDropCnt;       /* a frame from the VM with a tag inside its port's VLAN */
   uint64_t etherTypeDropCnt;    /* a frame from the VM whose ethertype is not in the list */
};

struct SwSecContext {
   SifraGenericFilter *filter;         /* owner; its agentData points back here */
   /* The active header; numStatic is the live count of static VMIs. */
   SwSecConfig config;

   /* Port database (guarded by configLock). */
   Hash_Table *portDbHash;             /* present exactly while numVmiEntries >= 2 */
   orr_ListLinks portDbList;           /* SwSecVmi, oldest first */
   uint32_t numVmiEntries;
   uint32_t numAuthVmiEntries;
   uint32_t numNonAuthVmiEntries;
   uint32_t totalClientIdLen;          /* over the DHCP entries */
   orr_ListLinks dhcpReqList;          /* SwSecDhcpReq, oldest first */
   uint32_t numDhcpReqs;
   SwSecDhcpReqIndex dhcpReqIndex;     /* lookups beside dhcpReqList */

   /* ARP rate limiting. */
   SifraGenericRateLimit txRateLimit;  /* frames from the VM */
   uint8_t txRateLimitErr;             /* in the error-rate-limit state */
   int64_t txRateLimitErrEnd;          /* uptime seconds at which that state ends */
   orr_Spinlock txRateLimitLock;       /* "sifg.sec.txratelimit", rank 6 */
   SifraGenericRateLimit rxRateLimit;  /* frames to the VM */
   orr_Spinlock rxRateLimitLock;       /* "sifg.sec.rxratelimit", rank 6 */

   /* Cleared and saved whole; raised by frames judged in parallel, so with atomic adds. */
   SwSecDropCounters counters;
   SwSecFrameGuard frameGuard;         /* the active frame guard (defaults for a version-1 record) */
   SwSecFrameGuardCounters frameGuardCounters;

   orr_Timer portDbTimer;              /* periodic 10 s, SwSecTimerCb; 0 when none */
   uint8_t keepPortDbHash;             /* during a reconfiguration: park, don't free */
   Hash_Table *sparePortDbHash;        /* a parked empty table, or null */
   orr_Portset *portset;               /* holds the port; messages are posted there */
   uint32_t portId;
   orr_Spinlock configLock;            /* "sifg.sec.config", reader-writer, rank 4 */
};

/* Raises a drop counter; safe against frames judged in parallel. */
static inline void SwSecCountDrop(uint64_t *counter)
{
   __atomic_fetch_add(counter, 1, __ATOMIC_RELAXED);
}
