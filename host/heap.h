// Module heaps: real allocations with a size limit, and accounting of live
// bytes and blocks per calling site so that a leak names where it was made.
#pragma once

#include "host/faults.h"
#include "host/host.h"
#include "host/symbolizer.h"
#include "host/violations.h"

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

namespace swsec::host {

class HeapRegistry final : public Heap {
public:
   HeapRegistry(Violations &violations, FaultTable &faults, Symbolizer &symbolizer);
   ~HeapRegistry() override;

   // Platform operations.
   orr_Status create(const orr_HeapProps *props, orr_HeapID *heap);
   void destroy(orr_HeapID heap);
   void *allocate(orr_HeapID heap, uint32_t size, const void *callSite);
   void release(orr_HeapID heap, void *block);

   // A block the host allocates on the module's behalf (a hash table): no
   // fault point of its own, charged to the named site.
   void *allocateFor(orr_HeapID heap, size_t size, std::string_view site);
   bool isLive(orr_HeapID heap) const;

   // Host objects made on a heap (a log, a lock, a timer queue) are part of
   // it in a real kernel: destroying the heap before them is a violation.
   // attach() is false when `heap` is neither null nor a live heap.
   bool attach(orr_HeapID heap, const void *object, std::string what);
   void detach(orr_HeapID heap, const void *object);

   // The heap the module made its default (orr_ModuleSetHeapID).
   void setModuleHeap(orr_HeapID heap);
   void forgetModuleHeap();

   // Reports every heap still alive (with its live blocks by site), frees
   // them, and forgets symbolised sites of the image about to be closed.
   std::vector<std::string> purge(std::string_view when);

   // Heap
   uint64_t liveBytes() const override;
   uint64_t liveBlocks() const override;
   uint64_t peakBytes() const override;
   std::vector<HeapSite> sites() const override;
   std::optional<orr_HeapProps> moduleHeapProps() const override;

   struct Record;

private:
   struct Block {
      size_t size = 0;
      HeapSite *site = nullptr;
   };

   Record *find(orr_HeapID heap) const;
   void *allocateLocked(Record &heap, size_t size, HeapSite &site);
   void releaseLocked(Record &heap, std::unordered_map<void *, Block>::iterator block);
   HeapSite &siteFor(const void *callSite);
   HeapSite &siteNamed(std::string_view name);
   static std::vector<std::string> liveBlockReport(const Record &heap, std::string_view prefix);

   Violations &violations_;
   FaultTable &faults_;
   Symbolizer &symbolizer_;

   mutable std::mutex mutex_;
   uint64_t nextSeq_ = 1;
   std::map<const orr_HeapOpaque *, std::unique_ptr<Record>> heaps_;
   std::map<std::string, HeapSite, std::less<>> sites_;
   std::unordered_map<const void *, HeapSite *> siteByAddress_;
   uint64_t liveBytes_ = 0;
   uint64_t liveBlocks_ = 0;
   uint64_t peakBytes_ = 0;
   std::optional<orr_HeapProps> moduleHeap_;
};

}  // namespace swsec::host
