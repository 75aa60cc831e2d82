#include "host/hash.h"

#include "host/state.h"

#include <bit>

namespace swsec::host {

HashTables::HashTables(Violations &violations, FaultTable &faults, HeapRegistry &heaps)
   : violations_(violations), faults_(faults), heaps_(heaps)
{
}

Hash_Table *HashTables::allocate(orr_HeapID heap, uint32_t numBuckets)
{
   if (faults_.hit(faultPoint("Hash_Alloc"))) {
      return nullptr;
   }
   if (!std::has_single_bit(numBuckets)) {
      violations_.report("Hash_Alloc: " + std::to_string(numBuckets) + " buckets is not a power of two");
      return nullptr;
   }
   if (!heaps_.isLive(heap)) {
      violations_.report("Hash_Alloc: unknown heap " + pointerText(heap));
      return nullptr;
   }
   // One block: the table record, then its bucket heads.
   const size_t size = sizeof(Hash_Table) + size_t{numBuckets} * sizeof(orr_ListLinks);
   void *block = heaps_.allocateFor(heap, size, "Hash_Alloc");
   if (block == nullptr) {
      return nullptr;
   }
   auto *table = static_cast<Hash_Table *>(block);
   table->numBuckets = numBuckets;
   table->bucketMask = numBuckets - 1;
   table->buckets = reinterpret_cast<orr_ListLinks *>(static_cast<char *>(block) + sizeof(Hash_Table));
   for (uint32_t i = 0; i < numBuckets; ++i) {
      table->buckets[i].prev = &table->buckets[i];
      table->buckets[i].next = &table->buckets[i];
   }
   std::lock_guard guard(mutex_);
   tables_.emplace(table, Allocation{heap, numBuckets});
   return table;
}

void HashTables::free(Hash_Table *table)
{
   Allocation allocation;
   {
      std::lock_guard guard(mutex_);
      auto found = tables_.find(table);
      if (found != tables_.end()) {
         allocation = found->second;
         tables_.erase(found);
      }
   }
   if (allocation.heap == nullptr) {
      violations_.report("Hash_Free: unknown table " + pointerText(table));
      return;
   }
   const orr_ListLinks *buckets = reinterpret_cast<const orr_ListLinks *>(reinterpret_cast<const char *>(table) + sizeof(Hash_Table));
   uint32_t linked = 0;
   for (uint32_t i = 0; i < allocation.numBuckets; ++i) {
      if (buckets[i].next != &buckets[i]) {
         ++linked;
      }
   }
   if (linked != 0) {
      violations_.report("Hash_Free: table freed with " + std::to_string(linked) + " non-empty bucket(s)");
   }
   heaps_.release(allocation.heap, table);
}

void HashTables::purge()
{
   std::lock_guard guard(mutex_);
   tables_.clear();
}

}  // namespace swsec::host

ORR_API Hash_Table *Hash_Alloc(orr_HeapID heap, uint32_t numBuckets)
{
   return swsec::host::detail::requireState("Hash_Alloc").hashTables.allocate(heap, numBuckets);
}

ORR_API void Hash_Free(Hash_Table *table)
{
   swsec::host::detail::requireState("Hash_Free").hashTables.free(table);
}

// FNV-1a over the bytes, then the murmur3 finaliser: FNV alone leaves the
// low bits (the ones a bucket mask keeps) weakly mixed for short keys.
// A pure function: it needs no Host.
ORR_API uint32_t HashFunc_HashBytes(const void *bytes, uint32_t length)
{
   const auto *data = static_cast<const unsigned char *>(bytes);
   uint32_t hash = 2166136261u;
   for (uint32_t i = 0; i < length; ++i) {
      hash ^= data[i];
      hash *= 16777619u;
   }
   hash ^= hash >> 16;
   hash *= 0x85ebca6bu;
   hash ^= hash >> 13;
   hash *= 0xc2b2ae35u;
   hash ^= hash >> 16;
   return hash;
}
