/*
 * Frames and frame lists.
 *
 * A frame is a chain of scatter-gather elements in machine memory; the host
 * maps its first bytes contiguously (at least the minimum a filter asked for,
 * at most the frame) and knows where its layer 2, 3 and 4 headers start.
 */
#pragma once

#include "platform/orr_base.h"

typedef struct orr_Pkt orr_Pkt;
typedef struct orr_PktList orr_PktList;

/* Frame data. */
ORR_API uint8_t *orr_PktFrameMappedPointerGet(orr_Pkt *pkt);
ORR_API uint32_t orr_PktFrameLenGet(const orr_Pkt *pkt);
ORR_API uint32_t orr_PktFrameMappedLenGet(const orr_Pkt *pkt);
/* The VLAN ID from the frame's metadata (0 when untagged). */
ORR_API uint16_t orr_PktVlanIDGet(const orr_Pkt *pkt);
/* Copies `length` bytes from frame offset `offset`; ORR_BAD_PARAM past the frame's end. */
ORR_API orr_Status orr_PktCopyBytesOut(const orr_Pkt *pkt, uint32_t offset, uint32_t length, void *dst);
ORR_API void orr_PktRelease(orr_Pkt *pkt);

/* Scatter-gather elements. */
typedef uint64_t orr_MA;

typedef struct orr_SgElem {
   orr_MA addr;
   uint32_t length;
   uint32_t reserved;
} orr_SgElem;

typedef struct orr_SgArray {
   uint16_t numElems;
   uint16_t reserved[3];
} orr_SgArray;

ORR_API const orr_SgArray *orr_PktSgArrayGet(const orr_Pkt *pkt);
/* Element `index`, or null when there is none. */
ORR_API const orr_SgElem *orr_PktSgElemGet(const orr_Pkt *pkt, uint16_t index);
/* Maps `length` bytes at machine address `addr` into the caller's address space. */
ORR_API orr_Status orr_MA2VA(orr_MA addr, uint32_t length, void **va);

/*
 * Header lookup. Layers 0 (link: Ethernet), 1 (network: IPv4, IPv6, ARP)
 * and 2 (transport: UDP, TCP). An entry belongs to the frame and lives as
 * long as the frame.
 */
enum orr_PktLayer : uint32_t {
   ORR_PKT_LAYER_2 = 0,
   ORR_PKT_LAYER_3 = 1,
   ORR_PKT_LAYER_4 = 2,
};

#define ORR_PKT_HEADER_CLASS_L2 0x1000u
#define ORR_PKT_HEADER_CLASS_L3 0x2000u
#define ORR_PKT_HEADER_CLASS_L4 0x4000u

typedef struct orr_PktHeaderEntry {
   uint16_t offset;          /* where this header starts in the frame */
   uint16_t length;          /* length of this header */
   uint16_t nextProto;       /* layer 2: ethertype (network order); layer 3: IP protocol */
   uint16_t nextHdrOffset;   /* where the next header starts in the frame */
} orr_PktHeaderEntry;

/*
 * Finds the `instance`th (1 = first) header of `layer` whose class is in
 * `classMask`. ORR_NOT_FOUND when the frame has none.
 */
ORR_API orr_Status orr_PktHeaderFind(orr_Pkt *pkt, orr_PktLayer layer, uint32_t classMask,
                                     uint32_t instance, orr_PktHeaderEntry **entry, uint32_t flags);
/* Maps a found header's bytes; a mapping is given back with orr_PktHeaderDataRelease. */
ORR_API orr_Status orr_PktHeaderDataGet(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t **data);
ORR_API void orr_PktHeaderDataRelease(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t *data,
                                      uint32_t flags);

/*
 * Frame list iterator. Its storage is the caller's, of orr_PktListIterSizeOf
 * bytes (at most ORR_PKT_LIST_ITER_MAX_SIZE), aligned for a pointer.
 */
typedef struct orr_PktListIter orr_PktListIter;
#define ORR_PKT_LIST_ITER_MAX_SIZE 64u

ORR_API size_t orr_PktListIterSizeOf(void);
ORR_API void orr_PktListIterStart(orr_PktList *list, orr_PktListIter *iter);
ORR_API bool orr_PktListIterIsAtEnd(const orr_PktListIter *iter);
ORR_API orr_Pkt *orr_PktListIterGetPkt(const orr_PktListIter *iter);
ORR_API void orr_PktListIterMove(orr_PktListIter *iter);
/* Takes the current frame out of the list and returns it; the iterator moves to the next. */
ORR_API orr_Pkt *orr_PktListIterRemovePkt(orr_PktListIter *iter);
