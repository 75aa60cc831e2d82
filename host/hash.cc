#include "host/hash.h"

#include "host/state.h"

#include <bit>
#include <cstring>

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

// Eight bytes a step: each step a 64-bit multiply and an xor-shift that
// brings the product's high half down, so that the next bytes cannot cancel
// a difference and the low bits (the ones a bucket mask keeps) depend on
// every byte. A key of up to 16 bytes costs two short dependent steps, not
// a multiply per byte. A pure function: it needs no Host.
ORR_API uint32_t HashFunc_HashBytes(const void *bytes, uint32_t length)
{
   constexpr uint64_t kStep = 0xff51'afd7'ed55'8ccdull;
   constexpr uint64_t kLast = 0xc4ce'b9fe'1a85'ec53ull;
   const auto *data = static_cast<const unsigned char *>(bytes);
   uint64_t hash = 0x9e37'79b9'7f4a'7c15ull ^ length;
   uint32_t at = 0;
   for (; length - at >= 8; at += 8) {
      uint64_t word;
      std::memcpy(&word, data + at, sizeof word);
      hash = (hash ^ word) * kStep;
      hash ^= hash >> 32;
   }
   uint64_t tail = 0;
   uint32_t shift = 0;
   if (length - at >= 4) {
      uint32_t word;
      std::memcpy(&word, data + at, sizeof word);
      tail = word;
      at += 4;
      shift = 32;
   }
   for (; at < length; ++at, shift += 8) {
      tail |= uint64_t{data[at]} << shift;
   }
   hash = (hash ^ tail) * kLast;
   hash ^= hash >> 29;
   return static_cast<uint32_t>(hash ^ (hash >> 32));
}
