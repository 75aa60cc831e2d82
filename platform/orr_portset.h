/* Portsets: the virtual switches that hold ports. */
#pragma once

#include "platform/orr_base.h"

typedef struct orr_Portset orr_Portset;

/* A hold on a portset; `portset` is its first member. */
typedef struct orr_PortsetHandle {
   orr_Portset *portset;
   uint64_t reserved;
} orr_PortsetHandle;

#define ORR_PORTSET_ACQUIRE_SHARED 1u

ORR_API orr_Status orr_PortsetAcquireByPortID(uint32_t portID, uint32_t flags,
                                              orr_PortsetHandle *handle);
ORR_API void orr_PortsetRelease(orr_PortsetHandle *handle);

/*
 * Portset messages: a 32-byte name and a payload length, the payload
 * following the header directly.
 */
typedef struct orr_PortsetMessageHeader {
   char name[32];
   uint64_t payloadLength;
} orr_PortsetMessageHeader;
static_assert(sizeof(orr_PortsetMessageHeader) == 40);

/* Posts a message to the portset's listeners of `msgClass` for a port. */
ORR_API orr_Status orr_PortsetPostMessage(orr_Portset *portset, uint32_t portID, uint64_t msgClass,
                                          const orr_PortsetMessageHeader *message);

typedef void (*orr_PortsetMessageCB)(uint32_t portID, uint64_t msgClass,
                                     const orr_PortsetMessageHeader *message);
/* A listener registration; 0 is never one. */
typedef uint64_t orr_PortsetMessageCBHandle;

/*
 * Registers a listener for messages of `msgClass` (portset and port 0: any).
 * Unregistering waits until no call of the callback is running.
 */
ORR_API orr_Status orr_PortsetRegisterMessageCB(orr_Portset *portset, uint32_t portID,
                                                uint64_t msgClass, orr_PortsetMessageCB callback,
                                                void *priv, orr_PortsetMessageCBHandle *handle);
ORR_API void orr_PortsetUnregisterMessageCB(orr_PortsetMessageCBHandle handle);

/*
 * The portset lock as a poster of messages sees it. A message may be posted
 * only while the calling CPU holds its portset's lock, shared or exclusive.
 * A thread that does not hold it takes it shared for the post and lets it go
 * afterwards according to the hold it then has (a post may turn a shared
 * hold into an exclusive one).
 */
enum orr_PortsetHold : uint32_t {
   ORR_PORTSET_HOLD_NONE = 0,
   ORR_PORTSET_HOLD_EXCL = 1,
   ORR_PORTSET_HOLD_SHARED = 2,
};

/* The calling CPU's hold on the portset's lock. */
ORR_API orr_PortsetHold orr_PortsetHoldState(const orr_Portset *portset);
/* Takes the portset's lock shared (the caller holds no hold on it). */
ORR_API void orr_PortsetLockShared(orr_Portset *portset);
/* Runs the portset work deferred while the lock was held, then leaves the shared hold. */
ORR_API void orr_PortsetUnlockShared(orr_Portset *portset);
/* Releases an exclusive hold together with the global portset lock it implies. */
ORR_API void orr_PortsetUnlockExcl(orr_Portset *portset);
