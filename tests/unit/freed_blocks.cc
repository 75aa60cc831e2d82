#include "freed_blocks.h"

#include "platform/orr_heap.h"

#include <dlfcn.h>

#include <cstdio>
#include <cstdlib>
#include <map>
#include <mutex>

namespace swsec::testing::freedBlocks {
namespace {

std::mutex mutex;
std::map<const void *, size_t> watched;
std::vector<Block> copies;

}  // namespace

void watch(const void *block, size_t size)
{
   std::lock_guard guard(mutex);
   watched[block] = size;
}

std::vector<Block> freed()
{
   std::lock_guard guard(mutex);
   return copies;
}

void clear()
{
   std::lock_guard guard(mutex);
   watched.clear();
   copies.clear();
}

// Copies the block if it is watched; called before the host sees the free.
static void noteFree(const void *block)
{
   std::lock_guard guard(mutex);
   auto found = watched.find(block);
   if (found != watched.end()) {
      const auto *bytes = static_cast<const uint8_t *>(block);
      copies.push_back({block, std::vector<uint8_t>(bytes, bytes + found->second)});
      watched.erase(found);
   }
}

}  // namespace swsec::testing::freedBlocks

ORR_API void orr_HeapFree(orr_HeapID heap, void *block)
{
   using HeapFreeFn = void (*)(orr_HeapID, void *);
   static const auto hostHeapFree = reinterpret_cast<HeapFreeFn>(dlsym(RTLD_NEXT, "orr_HeapFree"));
   if (hostHeapFree == nullptr) {
      std::fprintf(stderr, "unit tests: the host's orr_HeapFree is not found\n");
      std::abort();
   }
   swsec::testing::freedBlocks::noteFree(block);
   hostHeapFree(heap, block);
}
