/*
 * Kernel hash tables: an array of list heads that the owner links its
 * records into, and a byte hash to pick the bucket.
 */
#pragma once

#include "platform/orr_base.h"

/* Doubly linked list links; a head links to itself when empty. */
typedef struct orr_ListLinks {
   struct orr_ListLinks *prev;
   struct orr_ListLinks *next;
} orr_ListLinks;

typedef struct Hash_Table {
   uint32_t numBuckets;      /* a power of two */
   uint32_t bucketMask;      /* numBuckets - 1 */
   orr_ListLinks *buckets;   /* numBuckets empty heads at allocation */
} Hash_Table;

/* A table of `numBuckets` (a power of two) empty buckets, allocated from `heap`; null on failure. */
ORR_API Hash_Table *Hash_Alloc(orr_HeapID heap, uint32_t numBuckets);
/* Frees the table; its buckets must be empty. */
ORR_API void Hash_Free(Hash_Table *table);
ORR_API uint32_t HashFunc_HashBytes(const void *bytes, uint32_t length);
