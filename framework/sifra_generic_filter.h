/*
 * The framework's record of one filtered port.
 *
 * Life of a filter record: made by the host's create call (magic set,
 * refCount 1), linked in its agent's filterList, handed to the agent
 * callbacks; its destruction is refused while refCount is above 1 and ends
 * with the complemented magic and the record freed.
 */
#pragma once

#include "framework/sifra_generic_magic.h"
#include "platform/orr_hash.h"
#include "platform/orr_lock.h"
#include "platform/orr_sifra.h"

#include <cstddef>

struct SifraGenericFastPathAgent;
struct SifraGenericSlowPath;

#define SIFRAGENERIC_FILTER_NAME_LEN 100
#define SIFRAGENERIC_VM_UUID_LEN 128

/* The endpoint type of a VM's vNIC, the one endpoint with a VM UUID and a vNIC index. */
#define SIFRAGENERIC_ENDPOINT_VM_VNIC 0u

/* Attach states of a filter. */
enum SifraGenericAttachState : uint32_t {
   SifraGenericAttachDetaching = 1,
   SifraGenericAttachDetached = 2,
   SifraGenericAttachAttaching = 3,
   SifraGenericAttachAttached = 4,
};

/* Save/restore phases of a filter. */
enum SifraGenericMigrationState : uint32_t {
   SifraGenericMigrationIdle = 1,
   SifraGenericMigrationFetching = 2,
   SifraGenericMigrationReady = 3,
   SifraGenericMigrationRestoring = 4,
};

struct SifraGenericFilter {
   uint64_t magic;                       /* SIFRAGENERIC_FILTER_MAGIC while live */
   orr_Spinlock lock;                    /* "sifg.filter", rank 3 */
   orr_ListLinks links;                  /* in the agent's filterList; null when not linked */
   orr_SifraFilterHandle handle;         /* the host's filter */
   uint32_t refCount;                    /* 1 at creation */
   uint32_t attachRetries;
   void *slowPathState;                  /* heap copy of the slow path's state, or null */
   uint64_t slowPathStateLen;
   SifraGenericSlowPath *slowPath;       /* attached or attaching to; null when detached */
   SifraGenericFastPathAgent *agent;     /* owner */
   uint32_t attachState;                 /* SifraGenericAttachState */
   uint32_t migrationState;              /* SifraGenericMigrationState */
   void *agentData;                      /* the agent's per-filter context */
   char name[SIFRAGENERIC_FILTER_NAME_LEN];
   char vmUuid[SIFRAGENERIC_VM_UUID_LEN];
   uint32_t failurePolicy;
   uint32_t endPointType;                /* 0: a VM's vNIC */
   int32_t vnicIndex;                    /* -1 when unknown */
};

static_assert(offsetof(SifraGenericFilter, magic) == 0);
static_assert(offsetof(SifraGenericFilter, lock) == 8);
static_assert(offsetof(SifraGenericFilter, links) == 16);
static_assert(offsetof(SifraGenericFilter, handle) == 32);
static_assert(offsetof(SifraGenericFilter, refCount) == 40);
static_assert(offsetof(SifraGenericFilter, attachRetries) == 44);
static_assert(offsetof(SifraGenericFilter, slowPathState) == 48);
static_assert(offsetof(SifraGenericFilter, slowPathStateLen) == 56);
static_assert(offsetof(SifraGenericFilter, slowPath) == 64);
static_assert(offsetof(SifraGenericFilter, agent) == 72);
static_assert(offsetof(SifraGenericFilter, attachState) == 80);
static_assert(offsetof(SifraGenericFilter, migrationState) == 84);
static_assert(offsetof(SifraGenericFilter, agentData) == 88);
static_assert(offsetof(SifraGenericFilter, name) == 96);
static_assert(offsetof(SifraGenericFilter, vmUuid) == 196);
static_assert(offsetof(SifraGenericFilter, failurePolicy) == 324);
static_assert(offsetof(SifraGenericFilter, endPointType) == 328);
static_assert(offsetof(SifraGenericFilter, vnicIndex) == 332);

/* True when `filter` is a live filter record. A null record is none. */
static inline bool SifraGenericFilterIsValid(const void *filter)
{
   return filter != nullptr &&
          static_cast<const SifraGenericFilter *>(filter)->magic == SIFRAGENERIC_FILTER_MAGIC;
}

static inline SifraGenericFilter *SifraGenericFilterFromLinks(orr_ListLinks *links)
{
   return reinterpret_cast<SifraGenericFilter *>(reinterpret_cast<char *>(links) -
                                                 offsetof(SifraGenericFilter, links));
}

/*
 * Reads the filter's name, failure policy, endpoint type and, for a VM's
 * vNIC, its VM UUID (none is tolerated) and vNIC index from the host. At
 * creation and at every configuration change; the first failure is logged
 * and returned, and what was read before it stays.
 */
orr_Status SifraGenericReadConfiguration(SifraGenericFilter *filter);

/*
 * The address of the frame's bytes [startOffset, endOffset) when one
 * scatter-gather element holds them whole; null otherwise (the caller then
 * copies the bytes out). Maps only that element; allocates nothing.
 */
uint8_t *SifraGenericFindSGEntry(orr_Pkt *pkt, uint32_t startOffset, uint32_t endOffset);
