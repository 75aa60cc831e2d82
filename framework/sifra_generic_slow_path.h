/*
 * The framework's record of one slow path registered for an agent, and the
 * attachment of the agent's filters to its slow paths.
 *
 * Life of a slow path record: made by the host's register call (magic set,
 * useCount 1) and appended to the agent's slowPathList; taken off the list
 * when its unregistration starts, so that no filter chooses it any more;
 * freed, with the complemented magic, once no filter uses it (useCount back
 * at 1). The host holds the record's address as its handle from the
 * register call until an unregister call returns ORR_OK.
 *
 * References: every filter attached or attaching to a slow path counts once
 * in its numFilters and useCount. On the filter (refCount, Part of the
 * filter record): an attach takes 2 before its set request (the call's,
 * dropped when the call returns, and the reply's, dropped by the reply or at
 * once when the call is refused); a reply that sends the request again takes
 * 1 for that call and hands its own on to the next reply; a detach takes 1
 * for its clear request.
 *
 * Locks: the agent lock (rank 2) and then the filter lock (rank 3); both are
 * released, filter lock first, around every host request and taken back in
 * the same order after it.
 */
#pragma once

#include "framework/sifra_generic_magic.h"
#include "platform/orr_hash.h"
#include "platform/orr_sifra.h"

#include <cstddef>

struct SifraGenericFastPathAgent;
struct SifraGenericFilter;

struct SifraGenericSlowPath {
   uint64_t magic;                       /* SIFRAGENERIC_SLOWPATH_MAGIC while registered */
   orr_ListLinks links;                  /* in the agent's slowPathList; null once unregistering */
   uint32_t slowPathID;                  /* the host's ID */
   uint32_t useCount;                    /* 1 + numFilters */
   uint32_t numFilters;                  /* filters attached or attaching */
   SifraGenericFastPathAgent *agent;
};

static_assert(offsetof(SifraGenericSlowPath, magic) == 0);
static_assert(offsetof(SifraGenericSlowPath, links) == 8);
static_assert(offsetof(SifraGenericSlowPath, slowPathID) == 24);
static_assert(offsetof(SifraGenericSlowPath, useCount) == 28);
static_assert(offsetof(SifraGenericSlowPath, numFilters) == 32);
static_assert(offsetof(SifraGenericSlowPath, agent) == 40);

/* True when `slowPath` is a registered slow path record. A null record is none. */
static inline bool SifraGenericSlowPathIsValid(const void *slowPath)
{
   return slowPath != nullptr &&
          static_cast<const SifraGenericSlowPath *>(slowPath)->magic == SIFRAGENERIC_SLOWPATH_MAGIC;
}

static inline SifraGenericSlowPath *SifraGenericSlowPathFromLinks(orr_ListLinks *links)
{
   return reinterpret_cast<SifraGenericSlowPath *>(reinterpret_cast<char *>(links) -
                                                   offsetof(SifraGenericSlowPath, links));
}

/*
 * Attaches a detached filter to the least loaded slow path of its agent
 * (ties to the oldest) and sends the set request; with no slow path
 * registered the filter stays detached. Agent lock and filter lock held;
 * both are released around the request and held again on return.
 */
void SifraGenericAttachSlowPath(SifraGenericFilter *filter);

/*
 * Detaches a filter in state 3 or 4 from its slow path. From state 4 a
 * clear request is sent (locks released around it as for attach): ORR_BUSY
 * after a transient failure, the filter then still attached; ORR_OK
 * otherwise, the filter detached. Agent lock and filter lock held.
 */
orr_Status SifraGenericDetachSlowPath(SifraGenericFilter *filter);

/*
 * Stores the filter's new attach state and tells the agent
 * (attachStateChanged), whose status is returned. Both locks held.
 */
orr_Status SifraGenericSetAttachState(SifraGenericFilter *filter, uint32_t attachState);

/* The one-shot timer callback that attaches the agent's detached filters. */
void SifraGenericAttachSlowPathsToFilters(void *agentHandle);

/* The host's reply to a set request; no lock held. */
void SifraGenericSetSlowPathReply(orr_SifraFilter filter, void *cookie, orr_Status status);

/*
 * Cancels an attach callback still scheduled for an agent being released,
 * waiting for one that runs. No lock held; no slow path can register any
 * more (the agent's fast path is withdrawn).
 */
void SifraGenericCancelAttach(SifraGenericFastPathAgent *agent);
