// Kernel hash tables: the bucket array comes from a module heap and is
// counted there, so a table never freed shows as a leak.
#pragma once

#include "host/heap.h"
#include "host/violations.h"

#include <map>
#include <mutex>
#include <string>
#include <vector>

namespace swsec::host {

class HashTables {
public:
   HashTables(Violations &violations, FaultTable &faults, HeapRegistry &heaps);

   Hash_Table *allocate(orr_HeapID heap, uint32_t numBuckets);
   void free(Hash_Table *table);
   // Forgets every table (their heaps are being purged).
   void purge();

private:
   Violations &violations_;
   FaultTable &faults_;
   HeapRegistry &heaps_;

   std::mutex mutex_;
   struct Allocation {
      orr_HeapID heap = nullptr;
      uint32_t numBuckets = 0;   // as allocated, whatever the record says now
   };
   std::map<const Hash_Table *, Allocation> tables_;
};

}  // namespace swsec::host
