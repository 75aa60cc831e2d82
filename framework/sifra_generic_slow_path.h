/*
 * The framework's record of one slow path registered for an agent.
 *
 * Life of a slow path record: made by the host's register call (magic set,
 * useCount 1) and appended to the agent's slowPathList; taken off the list
 * when its unregistration starts; freed, with the complemented magic, once
 * no filter uses it (useCount back at 1).
 */
#pragma once

#include "framework/sifra_generic_magic.h"
#include "platform/orr_hash.h"

#include <cstddef>

struct SifraGenericFastPathAgent;
struct SifraGenericFilter;

struct SifraGenericSlowPath {
   uint64_t magic;                       /* SIFRAGENERIC_SLOWPATH_MAGIC while registered */
   orr_ListLinks links;                  /* in the agent's slowPathList */
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

/*
 * Attaches a new filter to the least loaded slow path of its agent; with
 * no slow path registered the filter stays detached. Agent lock and filter
 * lock held; the filter is detached.
 */
void SifraGenericAttachSlowPath(SifraGenericFilter *filter);
