/*
 * Fast path agents: one named fast path registered with the host's Sifra
 * framework, with the agent callbacks that do the agent's work.
 *
 * Life of an agent record: allocated zero-filled; given its name, magic and
 * lock; registered with the host (`fastPath` set); given its security
 * property (the built-in agent only); appended to agentList. From then on
 * the host holds the agent handle (the address of `magic`) and the agent
 * lives until the module teardown, which takes it off agentList, withdraws
 * the property and the fast path, drains and destroys the lock, complements
 * the magic and frees the record. No operation removes a single agent while
 * the module runs.
 */
#pragma once

#include "framework/sifra_generic_magic.h"
#include "platform/orr_hash.h"
#include "platform/orr_lock.h"
#include "platform/orr_sifra.h"
#include "platform/orr_time.h"

#include <cstddef>

struct SifraGenericFilter;
struct SifraGenericSlowPath;

/* The agent the module creates at start-up; the only one with a security property. */
#define SIFRAGENERIC_BUILTIN_AGENT_NAME "sifra-generic-tarlin-swsec"

#define SIFRAGENERIC_AGENT_NAME_LEN 100
#define SIFRAGENERIC_AGENT_ARGS_LEN 128

/*
 * An agent's own callbacks, in slot order. Every slot may be null: the
 * agent does not handle that event. None is called with the agent lock
 * held unless said so.
 */
struct SifraGenericAgentOps {
   /* A new filter; sets `agentData`. A failure refuses the filter. */
   orr_Status (*createFilter)(SifraGenericFilter *filter);
   /* Tears down `agentData`; a failure keeps the filter for a later retry. */
   orr_Status (*destroyFilter)(SifraGenericFilter *filter);
   /* Length of the agent's part of the saved state; filter lock held. */
   uint64_t (*getSavedStateLen)(SifraGenericFilter *filter);
   /*
    * Writes the agent's part into `agentLen` zeroed bytes, the length that
    * getSavedStateLen announced just before; writes no byte past them
    * even if the agent's state grew meanwhile. Filter lock held.
    */
   void (*saveState)(SifraGenericFilter *filter, void *agentPart, uint64_t agentLen);
   /*
    * Rebuilds from the agent's part, `agentLen` bytes, reading none past
    * them; a failure fails the restore. Filter lock held.
    */
   orr_Status (*restoreState)(SifraGenericFilter *filter, const void *agentPart,
                              uint64_t agentLen);
   /* Frame lists, with the host's arguments unchanged. */
   orr_Status (*processPackets)(SifraGenericFilter *filter, orr_PktList *pktList,
                                uint32_t direction);
   orr_Status (*processSlowPathPackets)(SifraGenericFilter *filter, orr_PktList *pktList,
                                        uint32_t direction);
   /* Ioctls, with the host's arguments unchanged. */
   orr_Status (*filterIoctlRequest)(SifraGenericFilter *filter, uint32_t requestId,
                                    void *payload, uint64_t payloadSize);
   orr_Status (*slowPathIoctlRequest)(SifraGenericSlowPath *slowPath, uint32_t requestId,
                                      void *payload, uint64_t payloadSize);
   /* The host changed the filter's configuration (already re-read). */
   orr_Status (*configurationChanged)(SifraGenericFilter *filter);
   /* The filter's attach state changed; agent and filter locks held. */
   orr_Status (*attachStateChanged)(SifraGenericFilter *filter, uint32_t attachState);
};

struct SifraGenericFastPathAgent {
   orr_ListLinks links;                         /* in agentList */
   char name[SIFRAGENERIC_AGENT_NAME_LEN];      /* always terminated */
   char agentArgs[SIFRAGENERIC_AGENT_ARGS_LEN]; /* text after the first ':'; kept, not read */
   /* SIFRAGENERIC_AGENT_MAGIC while live; its address is the agent handle. */
   uint64_t magic;
   char *namePtr;                               /* points at `name` */
   char *agentArgsPtr;                          /* points at `agentArgs` */
   orr_SifraFastPath fastPath;                  /* the host's registration; null when none */
   const SifraGenericAgentOps *ops;             /* sifraGenericFwFastPathOps */
   orr_SifraPropertyHandle propHandle;          /* security property; null when none */
   /* "sifg.fastpath", rank 2: guards the two lists, attachTimer and attachRescan. */
   orr_Spinlock lock;
   orr_ListLinks filterList;                    /* SifraGenericFilter records, oldest first */
   orr_ListLinks slowPathList;                  /* SifraGenericSlowPath records, oldest first */
   orr_Timer attachTimer;                       /* the pending attach callback; 0 when none */
   uint8_t attachRescan;                        /* a slow path came while the callback ran */
};

static_assert(offsetof(SifraGenericFastPathAgent, links) == 0);
static_assert(offsetof(SifraGenericFastPathAgent, name) == 16);
static_assert(offsetof(SifraGenericFastPathAgent, agentArgs) == 116);
static_assert(offsetof(SifraGenericFastPathAgent, magic) == 248);
static_assert(offsetof(SifraGenericFastPathAgent, namePtr) == 256);
static_assert(offsetof(SifraGenericFastPathAgent, agentArgsPtr) == 264);
static_assert(offsetof(SifraGenericFastPathAgent, fastPath) == 272);
static_assert(offsetof(SifraGenericFastPathAgent, ops) == 280);
static_assert(offsetof(SifraGenericFastPathAgent, propHandle) == 288);
static_assert(offsetof(SifraGenericFastPathAgent, lock) == 296);
static_assert(offsetof(SifraGenericFastPathAgent, filterList) == 304);
static_assert(offsetof(SifraGenericFastPathAgent, slowPathList) == 320);
static_assert(offsetof(SifraGenericFastPathAgent, attachTimer) == 336);
static_assert(offsetof(SifraGenericFastPathAgent, attachRescan) == 344);

/*
 * What an agent's name makes of it: its callbacks and its per-agent
 * property, registered once the host registered the agent (a failure is
 * logged there and costs only the property; may be null) and withdrawn
 * first thing at its release (may be null).
 */
struct SifraGenericAgentKind {
   const char *name;                            /* null: any other name */
   const SifraGenericAgentOps *ops;
   orr_Status (*initProperty)(SifraGenericFastPathAgent *agent);
   void (*cleanupProperty)(SifraGenericFastPathAgent *agent);
};

/*
 * The kind of an agent named `name` (compared over the stored name's bytes),
 * from the module's table of agents (module/agent_kinds.cc).
 */
const SifraGenericAgentKind *SifraGenericAgentKindOf(const char *name);

/* The handle the host knows the agent by. */
static inline orr_SifraAgentHandle SifraGenericAgentHandle(SifraGenericFastPathAgent *agent)
{
   return &agent->magic;
}

/* True when `handle` is a live agent's handle. A null handle is no agent. */
static inline bool SifraGenericAgentHandleIsValid(orr_SifraAgentHandle handle)
{
   return handle != nullptr && *static_cast<const uint64_t *>(handle) == SIFRAGENERIC_AGENT_MAGIC;
}

/* The agent record of a handle; check the handle first. */
static inline SifraGenericFastPathAgent *SifraGenericAgentFromHandle(orr_SifraAgentHandle handle)
{
   return reinterpret_cast<SifraGenericFastPathAgent *>(
      static_cast<char *>(handle) - offsetof(SifraGenericFastPathAgent, magic));
}

static inline SifraGenericFastPathAgent *SifraGenericAgentFromLinks(orr_ListLinks *links)
{
   return reinterpret_cast<SifraGenericFastPathAgent *>(links);
}

/*
 * Serialises agent creation and every mutation and by-name lookup of
 * agentList: the property write, the management node and the module entry.
 * A sleeping mutex, taken before any spinlock.
 */
extern orr_Mutex sifraGenericAgentRegistryLock;

/*
 * Creates an agent from a creation text "name[:args]" and registers it
 * with the host; the text is cut at its first ':'. A null or empty name
 * creates nothing and succeeds. No duplicate check: the host's
 * registration refuses a name it already has. Takes the registry lock.
 */
orr_Status SifraGenericInitFastPathAgent(char *text);

/*
 * Creates an agent unless one with that name exists (ORR_OK then too).
 * Takes the registry lock.
 */
orr_Status SifraGenericRegisterFastpath(char *text);

/* The write operation of the agent-creation property: space-separated names. */
orr_Status SifraGenericAgentPropWrite(void *portset, void *port, void *extra, const char *bytes,
                                      int32_t count);

/*
 * Releases an agent already taken off agentList: property, fast path
 * registration, lock; then complements the magic and frees the record.
 * The host has destroyed the agent's filters and slow paths by the time
 * its fast path is withdrawn, so both lists are empty; an attach callback
 * still scheduled is cancelled before the record goes.
 */
void SifraGenericCleanupFastPathAgent(SifraGenericFastPathAgent *agent);

/*
 * Splits `text` into agent names at single spaces and hands each to
 * `registerName` in order. Every space ends a name, also an empty one; the
 * last name is handed over once more at the end of the text when a space
 * ended it. Stops at the first failure and returns it; ORR_OK for an empty
 * text. The spaces are overwritten with terminating zeros.
 */
using SifraGenericAgentNameFn = orr_Status (*)(char *name, void *context);
orr_Status SifraGenericForEachAgentName(char *text, SifraGenericAgentNameFn registerName,
                                        void *context);
