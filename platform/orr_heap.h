/* Module heaps. */
#pragma once

#include "platform/orr_base.h"

typedef struct orr_HeapProps {
   uint32_t kind;            /* 0: a dynamic heap that grows on demand */
   orr_Name name;
   orr_ModuleID module;
   uint32_t initialSize;
   uint32_t maximumSize;
   uint32_t flags;           /* 0 */
} orr_HeapProps;

ORR_API orr_Status orr_HeapCreate(const orr_HeapProps *props, orr_HeapID *heap);
/* The heap must be empty: live blocks at destruction are a leak. */
ORR_API void orr_HeapDestroy(orr_HeapID heap);
/*
 * Allocates `size` bytes (contents undefined) and records `callSite` for the
 * host's per-site accounting. Null when the heap has no room.
 */
ORR_API void *orr_HeapAllocWithRA(orr_HeapID heap, uint32_t size, const void *callSite);
ORR_API void orr_HeapFree(orr_HeapID heap, void *block);
