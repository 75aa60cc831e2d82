/*
 * Sifra, the host's network filter framework.
 *
 * A module registers named fast paths with a table of operations. The host
 * then creates a filter of a fast path on each port configured for it and
 * calls the operations with that filter: frame lists, ioctls, configuration
 * changes, saved state and destruction.
 *
 * Handles that the module gives the host (agent, filter record, slow path
 * record) are opaque to the host and passed back unchanged.
 */
#pragma once

#include "platform/orr_base.h"
#include "platform/orr_pkt.h"

typedef void *orr_SifraAgentHandle;          /* the module's agent, given at registration */
typedef void *orr_SifraFilter;               /* the module's filter record, from createFilter */
typedef void *orr_SifraSlowPath;             /* the module's slow path record, from registerSlowPath */
typedef struct orr_SifraFastPathOpaque *orr_SifraFastPath;     /* the host's registration */
typedef struct orr_SifraFilterHandleOpaque *orr_SifraFilterHandle;  /* the host's filter */

/* Frame list directions. */
enum orr_SifraDirection : uint32_t {
   ORR_SIFRA_DIR_RX = 1,     /* from the switch to the port's endpoint */
   ORR_SIFRA_DIR_TX = 2,     /* from the endpoint into the switch */
};

/* The fast path operations table, in the host's slot order. */
typedef struct orr_SifraFastPathOps {
   orr_Status (*registerSlowPath)(orr_SifraAgentHandle agent, uint32_t slowPathID,
                                  orr_SifraSlowPath *slowPath);
   orr_Status (*unregisterSlowPath)(orr_SifraSlowPath slowPath);
   orr_Status (*createFilter)(orr_SifraAgentHandle agent, orr_SifraFilterHandle handle,
                              orr_SifraFilter *filter, uint8_t flags);
   orr_Status (*destroyFilter)(orr_SifraFilter filter);
   void (*prefetchSavedState)(orr_SifraFilter filter);
   orr_Status (*getSavedStateLen)(orr_SifraFilter filter, uint64_t *length);
   orr_Status (*saveState)(orr_SifraFilter filter, void *buffer, uint64_t *length);
   orr_Status (*restoreState)(orr_SifraFilter filter, const void *buffer, uint64_t length);
   orr_Status (*processPackets)(orr_SifraFilter filter, orr_PktList *pktList, uint32_t direction);
   orr_Status (*processSlowPathPackets)(orr_SifraFilter filter, orr_PktList *pktList,
                                        uint32_t direction);
   orr_Status (*processFilterIoctl)(orr_SifraFilter filter, uint32_t requestId, void *payload,
                                    uint64_t payloadSize);
   orr_Status (*processSlowPathIoctl)(orr_SifraSlowPath slowPath, uint32_t requestId,
                                      void *payload, uint64_t payloadSize);
   orr_Status (*configurationChanged)(orr_SifraFilter filter);
} orr_SifraFastPathOps;

#define ORR_SIFRA_FASTPATH_REVISION 0x1010000u

/* Registers a fast path by name; ORR_EXISTS when the name is taken. */
ORR_API orr_Status orr_SifraRegisterFastPath(const char *name, uint32_t revision,
                                             uint32_t compatRevision, orr_ModuleID module,
                                             const orr_SifraFastPathOps *ops,
                                             orr_SifraAgentHandle agent, orr_SifraFastPath *fastPath);
/* Withdraws a fast path; its filters have been destroyed when this returns. */
ORR_API void orr_SifraUnregisterFastPath(orr_SifraFastPath fastPath);

/* A filter's configuration. Text is copied, terminated, into `size` bytes. */
ORR_API orr_Status orr_SifraGetName(orr_SifraFilterHandle handle, char *buffer, uint32_t size);
ORR_API orr_Status orr_SifraGetFailurePolicy(orr_SifraFilterHandle handle, uint32_t *policy);
ORR_API orr_Status orr_SifraGetEndPointType(orr_SifraFilterHandle handle, uint32_t *type);
/* ORR_NO_VM_UUID when the filter's virtual machine has no UUID. */
ORR_API orr_Status orr_SifraGetVMUUID(orr_SifraFilterHandle handle, char *buffer, uint32_t size);
ORR_API orr_Status orr_SifraGetVnicIndex(orr_SifraFilterHandle handle, int32_t *index);
ORR_API orr_Status orr_SifraGetPortID(orr_SifraFilterHandle handle, uint32_t *portID);

/* Asks the host to map at least `length` bytes of each frame; `directions` 3 = both. */
ORR_API orr_Status orr_SifraSetMinPktMappedLen(orr_SifraFilterHandle handle, uint32_t length,
                                               uint32_t directions);
ORR_API orr_Status orr_SifraSendFilterIoctlReply(orr_SifraFilterHandle handle, uint32_t requestId,
                                                 const void *data, uint64_t length);

/*
 * Slow paths. The host announces each slow path of a fast path with the
 * operation registerSlowPath and withdraws it with unregisterSlowPath; the
 * module pairs each filter with one of them through these requests. No
 * spinlock may be held across any of them.
 */

/* The outcome of a set request: 0 when the filter now has the slow path. */
typedef void (*orr_SifraSetSlowPathCB)(orr_SifraFilter filter, void *cookie, orr_Status status);

/*
 * Asks the host to give the filter the slow path `slowPathID`, with a
 * communication timeout. ORR_OK: the request was accepted and exactly one
 * call of `callback(filter record, cookie, outcome)` follows, from a
 * context that holds none of the caller's locks. Any other status: the
 * request was not made and no reply will come.
 */
ORR_API orr_Status orr_SifraSetSlowPath(orr_SifraFilterHandle handle, uint32_t slowPathID,
                                        orr_SifraSetSlowPathCB callback, void *cookie,
                                        int32_t timeoutMs);
/* Synchronous: ORR_OK when the filter no longer has a slow path. */
ORR_API orr_Status orr_SifraClearSlowPath(orr_SifraFilterHandle handle);

/* Per-filter properties registered by name for all filters of a fast path. */
typedef struct orr_SifraPropertyOpaque *orr_SifraPropertyHandle;

typedef struct orr_SifraPropertyOps {
   orr_Status (*write)(orr_SifraFilter filter, void *extra, const void *data, uint32_t length);
   orr_Status (*read)(orr_SifraFilter filter, void *extra, void *buffer, uint32_t length);
   bool (*poll)(orr_SifraFilter filter, void *extra, uint32_t *length);
   void (*cleanup)(void);
} orr_SifraPropertyOps;

ORR_API orr_Status orr_SifraPropertyRegister(orr_SifraPropertyHandle *handle, const char *name,
                                             const orr_SifraPropertyOps *ops);
ORR_API void orr_SifraPropertyUnregister(orr_SifraPropertyHandle handle);

/*
 * A filter's slow path state across a migration. Both requests are
 * asynchronous: ORR_OK means accepted, and exactly one call of `reply`
 * follows, with the filter's module record and `cookie`, from a context
 * that holds no module lock; any other status means no reply will come.
 * The retrieve reply's bytes belong to the host and live only during the
 * reply. The restore request reads `length` bytes at `state`, which the
 * caller keeps valid until the reply.
 */
typedef void (*orr_SifraRetrieveSlowPathStateReply)(orr_SifraFilter filter, void *cookie,
                                                    const void *state, uint64_t length,
                                                    orr_Status status);
typedef void (*orr_SifraRestoreSlowPathStateReply)(orr_SifraFilter filter, void *cookie,
                                                   orr_Status status);

ORR_API orr_Status orr_SifraRetrieveSlowPathState(orr_SifraFilterHandle handle,
                                                  orr_SifraRetrieveSlowPathStateReply reply,
                                                  void *cookie, uint32_t timeoutMs);
ORR_API orr_Status orr_SifraRestoreSlowPathState(orr_SifraFilterHandle handle, const void *state,
                                                 uint64_t length,
                                                 orr_SifraRestoreSlowPathStateReply reply,
                                                 void *cookie, uint32_t timeoutMs);
