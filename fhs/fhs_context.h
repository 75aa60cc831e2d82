/*
 * The IPv6 first-hop security context of one port (FhsContext), hung in
 * its filter's agentData, and its bindings (FhsBinding).
 *
 * Life of a context: made zero-filled by FhsCreateFilter, which adds the
 * locks, port ID and portset, the timer and the default configuration;
 * owned by the filter; torn down by FhsDestroyFilter once the bindings are
 * gone.
 *
 * Life of a binding: allocated zero-filled from the module heap and linked
 * into its port's list (oldest first), its port's hash bucket and the
 * bridge table, all under the port's configLock held exclusive and, for
 * the bridge table, fhsBridge.lock; unlinked from all three under the same
 * locks and freed at once. Another port reads a binding only under
 * fhsBridge.lock, and only its key, method, expiry and owner.
 *
 * Locks, in rank order:
 *   4 configLock "sifg.fhs.config" (reader-writer): the configuration,
 *     bindings, pending DHCPv6 requests and counters; frames are judged
 *     under it shared, anything that changes the port holds it exclusive.
 *   5 fhsBridge.lock "sifg.fhs.bridge": the bridge table of every port's
 *     bindings, for claims across ports; taken under a configLock.
 *   6 ndRateLimitLock "sifg.fhs.ndratelimit": the ND limiter and its
 *     error state, for use under the shared configLock.
 */
#pragma once

#include "contract/fhs_binding.h"
#include "contract/fhs_config_record.h"
#include "fhs/fhs_dhcpv6.h"
#include "swsec/swsec_context.h"

#include "platform/orr_hash.h"
#include "platform/orr_lock.h"
#include "platform/orr_portset.h"
#include "platform/orr_time.h"

#include <cstddef>
#include <cstdint>

struct SifraGenericFilter;
struct FhsContext;

struct FhsBinding {
   orr_ListLinks portLinks;      /* the port's list, oldest first */
   orr_ListLinks hashLinks;      /* the port's hash bucket */
   orr_ListLinks bridgeLinks;    /* the bridge table's bucket */
   FhsBindingKey key;
   uint8_t method;               /* FhsBindMethod */
   uint8_t seen;                 /* FCFS: the VM sent from it since the last tick (relaxed) */
   int64_t expiry;               /* uptime seconds; 0: never (static) */
   FhsContext *owner;
};

/* A DHCPv6 client message awaiting the server's Reply. */
struct FhsDhcpv6Pending {
   int64_t expiry;               /* uptime seconds; 0: a free slot */
   uint32_t xid;
   uint16_t vlanId;
   uint8_t mac[6];
   uint8_t msgType;
   uint8_t clientIdLen;
   uint8_t clientId[FHS_DHCPV6_DUID_MAX];
};

constexpr uint32_t FHS_PORT_HASH_BUCKETS = 64;
constexpr uint32_t FHS_DHCPV6_PENDING_MAX = 8;
constexpr uint32_t FHS_DHCPV6_PENDING_SEC = 60;

struct FhsContext {
   SifraGenericFilter *filter;          /* owner; its agentData points back here */
   FhsConfig config;                    /* numStatic: the live count of static bindings */
   uint32_t bindingLimit;               /* the configured limit or the default */
   uint32_t fcfsLifetime;

   /* Bindings (guarded by configLock). */
   orr_ListLinks bindingList;
   uint32_t numBindings;
   uint32_t numByMethod[3];             /* DHCPv6, static, FCFS */
   orr_ListLinks buckets[FHS_PORT_HASH_BUCKETS];
   FhsDhcpv6Pending pending[FHS_DHCPV6_PENDING_MAX];
   uint8_t claimLogged;                 /* a refused claim was logged since the last tick */

   /* ND rate limiting. */
   SifraGenericRateLimit ndRateLimit;
   uint8_t ndRateLimitErr;              /* in the error state; read without the lock (relaxed) */
   int64_t ndRateLimitErrEnd;
   orr_Spinlock ndRateLimitLock;        /* "sifg.fhs.ndratelimit", rank 6 */

   FhsDropCounters counters;

   orr_Timer timer;                     /* periodic 10 s, FhsTimerCb; 0 when none */
   orr_Portset *portset;                /* the bridge: claims are judged across its ports */
   uint32_t portId;
   uint8_t joinedBridge;                /* counted in fhsBridge.numPorts */
   orr_Spinlock configLock;             /* "sifg.fhs.config", reader-writer, rank 4 */
};

/*
 * The bridge table: every port's bindings by bridge, VLAN and address. It
 * lives while the agent has ports: the first port's creation makes its
 * lock, the last port's destruction destroys it, both under `users`, a
 * sleeping mutex taken before any spinlock.
 */
constexpr uint32_t FHS_BRIDGE_BUCKETS = 256;
struct FhsBridgeTable {
   orr_Mutex users;                     /* "sifg.fhs.bridgeUsers": numPorts and the lock's life */
   uint32_t numPorts;
   orr_Spinlock lock;                   /* "sifg.fhs.bridge", rank 5 */
   orr_ListLinks buckets[FHS_BRIDGE_BUCKETS];
};
extern FhsBridgeTable fhsBridge;

/* Counts a port in, making the table at the first; the lock's creation status. */
orr_Status FhsBridgeJoin(void);
/* Counts a port out (one that joined), destroying the lock at the last. */
void FhsBridgeLeave(void);

/* Restarts a limiter: one-second interval, already ended, count 0. */
static inline void FhsRateLimitInit(SifraGenericRateLimit *rateLimit, uint32_t limit)
{
   rateLimit->periodSec = 1;
   rateLimit->limit = limit;
   rateLimit->intervalEnd = orr_GetTimerCycles();
   rateLimit->count = 0;
}

/* Counts one event; true when the current interval's limit is exceeded. */
static inline bool FhsRateLimitReached(SifraGenericRateLimit *rateLimit)
{
   const uint64_t now = orr_GetTimerCycles();
   if (now > rateLimit->intervalEnd) {
      rateLimit->intervalEnd = now + rateLimit->periodSec * orr_TimerCyclesPerSecond();
      rateLimit->count = 1;
   } else {
      rateLimit->count++;
   }
   return rateLimit->count > rateLimit->limit;
}

/* Raises a drop counter; safe against frames judged in parallel. */
static inline void FhsCountDrop(uint64_t *counter)
{
   __atomic_fetch_add(counter, 1, __ATOMIC_RELAXED);
}
