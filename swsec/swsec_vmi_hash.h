/*
 * The port database's hash of a VMI key. The table is the module's own
 * (16 buckets, append at the tail); its hash is inline because the frame
 * path looks a key up for every frame a guarded port sends: two independent
 * multiplies instead of a call and a pass over the bytes.
 */
#pragma once

#include "swsec/swsec_vmi.h"

#include <cstdint>

static inline uint32_t SwSecVmiKeyHash(const SwSecVmiKey *key)
{
   uint64_t head;   /* VLAN ID and MAC */
   uint32_t tail;   /* IPv4 address */
   __builtin_memcpy(&head, key, sizeof(head));
   __builtin_memcpy(&tail, reinterpret_cast<const uint8_t *>(key) + sizeof(head), sizeof(tail));
   const uint64_t mixed =
      head * 0x9e37'79b9'7f4a'7c15ull + (static_cast<uint64_t>(tail) << 32 | tail) * 0xc2b2'ae3d'27d4'eb4full;
   /*
    * A product's low bits see only the factors' low bits; folding the top
    * down makes the bits a bucket mask keeps depend on every key byte.
    */
   return static_cast<uint32_t>((mixed ^ (mixed >> 29)) >> 32);
}
