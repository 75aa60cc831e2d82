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
