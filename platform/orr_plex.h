/* Plex: client-port properties of the distributed switch. */
#pragma once

#include "platform/orr_base.h"

typedef struct orr_PlexClientPortOpaque *orr_PlexClientPortHandle;

/*
 * Operations of a client-port property. `write` receives the bytes written
 * to the property; the three leading arguments are the host's context for
 * the write and may be ignored. Members other than `write` may be null.
 */
typedef struct orr_PlexClientPortOps {
   orr_Status (*write)(void *portset, void *port, void *extra, const char *bytes, int32_t count);
   orr_Status (*read)(void *portset, void *port, void *extra, char *buffer, int32_t *count);
   orr_Status (*poll)(void *portset, void *port, void *extra, int32_t *count);
   void (*cleanup)(void *portset, void *port);
} orr_PlexClientPortOps;

ORR_API orr_Status orr_PlexClientPortRegister(orr_PlexClientPortHandle *handle, uint32_t flags,
                                              const char *name, const orr_PlexClientPortOps *ops);
ORR_API orr_Status orr_PlexClientPortUnregister(orr_PlexClientPortHandle handle);
