/*
 * The module's spinlocks: names and ranks in one place, and their creation
 * in the module's lock domain on the module heap.
 *
 * A thread takes locks in strictly increasing rank:
 *   1 the agent's attach timer callback runs as if it held rank 1
 *   2 "sifg.fastpath"            an agent's filter and slow path lists
 *   3 "sifg.filter"              one filter's attachment and saved state
 *   4 "sifg.sec.config"          a port's configuration and database (rw)
 *   5 "sifg.sec.portFilterMapDb" the port filter map
 *   6 "sifg.sec.txratelimit", "sifg.sec.rxratelimit"  a port's ARP limiters
 *   7 "sifg.sec.testConfig"      the test hook registration (rw), alone
 * The agent registry mutex (a sleeping lock) is taken before any of them.
 */
#pragma once

#include "platform/orr_lock.h"

enum class SifraGenericLockRank : uint32_t {
   AttachCallback = 1,
   Agent = 2,
   Filter = 3,
   PortConfig = 4,
   PortFilterMap = 5,
   RateLimit = 6,
   TestConfig = 7,
};

#define SIFRAGENERIC_AGENT_LOCK_NAME "sifg.fastpath"
#define SIFRAGENERIC_FILTER_LOCK_NAME "sifg.filter"

/*
 * Creates a spinlock of `type` and `rank` named `name` for the running
 * module, in sifraGenericLockDomain, on the module heap. Returns the host's
 * status; `*lock` is written only on success.
 */
orr_Status SifraGenericCreateSpinlock(const char *name, orr_SpinlockType type,
                                      SifraGenericLockRank rank, orr_Spinlock *lock);
