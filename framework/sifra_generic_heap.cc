/* The module heap's two allocation functions. */
#include "framework/sifra_generic.h"

#include "platform/orr_heap.h"
#include "platform/orr_text.h"

/*
 * Not inlined: the return address must be the caller's, so that the host
 * charges the block to the site that asked for it.
 */
__attribute__((noinline)) void *SifraGenericAlloc(uint32_t size)
{
   void *block = orr_HeapAllocWithRA(sifraGenericHeapID, size, __builtin_return_address(0));
   if (block == nullptr) {
      return nullptr;
   }
   orr_Memset(block, 0, size);
   return block;
}

void SifraGenericFree(void *block)
{
   orr_HeapFree(sifraGenericHeapID, block);
}
