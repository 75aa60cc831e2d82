/*
 * From the links of a port database record back to the record, and the
 * bucket of a VMI key in a port database hash table.
 */
#pragma once

#include "contract/vmi_key.h"
#include "swsec/swsec_vmi.h"

#include <cstddef>
#include <cstdint>

static inline SwSecVmi *SwSecVmiFromListLinks(orr_ListLinks *links)
{
   return reinterpret_cast<SwSecVmi *>(reinterpret_cast<uint8_t *>(links) -
                                       offsetof(SwSecVmi, listLinks));
}

static inline SwSecVmi *SwSecVmiFromHashLinks(orr_ListLinks *links)
{
   return reinterpret_cast<SwSecVmi *>(reinterpret_cast<uint8_t *>(links) -
                                       offsetof(SwSecVmi, hashLinks));
}

static inline SwSecDhcpReq *SwSecDhcpReqFromLinks(orr_ListLinks *links)
{
   return reinterpret_cast<SwSecDhcpReq *>(reinterpret_cast<uint8_t *>(links) -
                                           offsetof(SwSecDhcpReq, links));
}

/* The bucket head of `key`: its hash, masked. */
static inline orr_ListLinks *SwSecVmiBucket(const Hash_Table *table, const SwSecVmiKey *key)
{
   return &table->buckets[SwSecVmiKeyHash(key) & table->bucketMask];
}
