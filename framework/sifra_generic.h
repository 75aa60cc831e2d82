/*
 * Framework-wide resources: the module registration, heap, log component,
 * timer queue, lock domain, the agent-creation client-port registration and
 * the agent list, with the start-up and teardown that make and release them.
 *
 * The globals are written only by the start-up and the teardown, which run
 * on the loader's thread alone, and are read without locks everywhere else.
 */
#pragma once

#include "platform/orr_base.h"
#include "platform/orr_hash.h"
#include "platform/orr_log.h"
#include "platform/orr_plex.h"
#include "platform/orr_time.h"

#include <cstddef>
#include <cstdint>

/* The number of entries of a constant table. */
template <typename T, size_t N>
constexpr uint32_t SifraGenericCountOf(const T (&)[N])
{
   return static_cast<uint32_t>(N);
}

/* The framework's name (timer queue, lock domain) and its client-port property. */
#define SIFRAGENERIC_FRAMEWORK_NAME "switch-security"
#define SIFRAGENERIC_CLIENT_PORT_NAME "com.tarlin.common.switch-security"

/* Module parameters, set by the loader before init_module. */
extern int SIFRAGENERIC_HEAP_MIN_SIZE;
extern int SIFRAGENERIC_HEAP_MAX_SIZE;
extern int SIFRAGENERIC_SLOWPATH_TIMEOUT;

/* All ones while the module is not registered. */
extern orr_ModuleID sifraGenericModuleID;
extern orr_HeapID sifraGenericHeapID;
extern orr_LogHandle sifraGenericLogHandle;
extern orr_TimerQueue sifraGenericTimerQueue;
/* ORR_INVALID_LOCK_DOMAIN while there is none. */
extern orr_LockDomainID sifraGenericLockDomain;
extern orr_PlexClientPortHandle sifraGenericPortClient;
/*
 * Every SifraGenericFastPathAgent, oldest first; the built-in agent is the
 * first. Empty from the moment the image is loaded. Changed and searched
 * only under sifraGenericAgentRegistryLock (sifra_generic_agent.h).
 */
extern orr_ListLinks agentList;

/* The agent-creation property handler: write only. */
extern const orr_PlexClientPortOps sifraGenericCreateAgentOps;

/*
 * Registers the module and makes the heap, log, timer queue and lock
 * domain, then the agent-creation property handler under `clientPortName`.
 * On any failure everything made so far is released again and the failing
 * status is returned.
 */
orr_Status SifraGenericInit(const char *name, const char *clientPortName);

/*
 * Releases every agent (oldest first), and with each the filters and slow
 * paths the host still holds of it. The module calls it before it takes
 * down what the filters use; SifraGenericCleanup calls it again.
 */
void SifraGenericCleanupAgents(void);

/*
 * Releases every agent (SifraGenericCleanupAgents), then the lock domain, timer queue,
 * log, heap, module registration and client-port registration, each only
 * if it exists. Safe after a partial start-up; a second call releases
 * nothing. Returns the status of the client-port withdrawal.
 */
orr_Status SifraGenericCleanup(void);

/*
 * A zero-filled block of `size` bytes from the module heap, tagged with the
 * caller's address for the host's accounting; null when the heap is full
 * (nothing is logged: the caller reports). Any context, no lock held.
 */
void *SifraGenericAlloc(uint32_t size);
/* Gives back a block from SifraGenericAlloc. */
void SifraGenericFree(void *block);
