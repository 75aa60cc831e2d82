#include "host/heap.h"

#include "host/state.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

// The record behind an orr_HeapID.
struct orr_HeapOpaque {};

namespace swsec::host {

struct HeapRegistry::Record : orr_HeapOpaque {
   uint64_t seq = 0;
   orr_HeapProps props{};
   std::string name;
   uint64_t liveBytes = 0;
   std::unordered_map<void *, Block> blocks;
   std::map<const void *, std::string> users;   // host objects made on this heap
};

namespace {

// Fresh blocks hold this byte and freed ones are overwritten with the other
// before they go back to malloc: code that reads a block it did not fill, or
// one it freed, sees a pattern instead of a lucky zero.
constexpr int kFreshByte = 0xa5;
constexpr int kFreedByte = 0x5a;

std::string nameText(const orr_Name &name)
{
   return std::string(name.name, strnlen(name.name, sizeof name.name));
}

std::string plural(uint64_t count, const char *one, const char *many)
{
   return std::to_string(count) + " " + (count == 1 ? one : many);
}

}  // namespace

HeapRegistry::HeapRegistry(Violations &violations, FaultTable &faults, Symbolizer &symbolizer)
   : violations_(violations), faults_(faults), symbolizer_(symbolizer)
{
}

HeapRegistry::~HeapRegistry()
{
   for (auto &[key, heap] : heaps_) {
      for (auto &[block, info] : heap->blocks) {
         std::free(block);
      }
   }
}

HeapRegistry::Record *HeapRegistry::find(orr_HeapID heap) const
{
   auto found = heaps_.find(heap);
   return found == heaps_.end() ? nullptr : found->second.get();
}

HeapSite &HeapRegistry::siteNamed(std::string_view name)
{
   auto found = sites_.find(name);
   if (found == sites_.end()) {
      found = sites_.emplace(std::string(name), HeapSite{std::string(name)}).first;
   }
   return found->second;
}

HeapSite &HeapRegistry::siteFor(const void *callSite)
{
   auto cached = siteByAddress_.find(callSite);
   if (cached != siteByAddress_.end()) {
      return *cached->second;
   }
   HeapSite &site = siteNamed(symbolizer_.describe(callSite));
   siteByAddress_.emplace(callSite, &site);
   return site;
}

orr_Status HeapRegistry::create(const orr_HeapProps *props, orr_HeapID *heap)
{
   if (auto status = faults_.hit(faultPoint("orr_HeapCreate"))) {
      return *status;
   }
   if (props == nullptr || heap == nullptr) {
      return ORR_BAD_PARAM;
   }
   // Only the dynamic kind exists here; a careful kernel refuses what it
   // does not know rather than guessing.
   if (props->kind != 0) {
      return ORR_NOT_SUPPORTED;
   }
   if (props->flags != 0 || props->initialSize > props->maximumSize) {
      return ORR_BAD_PARAM;
   }
   auto record = std::make_unique<Record>();
   record->props = *props;
   record->name = nameText(props->name);
   std::lock_guard guard(mutex_);
   record->seq = nextSeq_++;
   *heap = record.get();
   if (!moduleHeap_) {
      moduleHeap_ = record->props;
   }
   heaps_.emplace(static_cast<const orr_HeapOpaque *>(record.get()), std::move(record));
   return ORR_OK;
}

std::vector<std::string> HeapRegistry::liveBlockReport(const Record &heap, std::string_view prefix)
{
   struct Count {
      uint64_t blocks = 0;
      uint64_t bytes = 0;
   };
   std::map<std::string, Count> bySite;
   for (const auto &[block, info] : heap.blocks) {
      Count &count = bySite[info.site->site];
      ++count.blocks;
      count.bytes += info.size;
   }
   std::vector<std::string> report;
   for (const auto &[site, count] : bySite) {
      report.push_back(std::string(prefix) + "heap '" + heap.name + "': " +
                       plural(count.blocks, "live block", "live blocks") + " (" +
                       plural(count.bytes, "byte", "bytes") + ") allocated at " + site);
   }
   return report;
}

void HeapRegistry::destroy(orr_HeapID heap)
{
   std::vector<std::string> problems;
   {
      std::lock_guard guard(mutex_);
      Record *record = find(heap);
      if (record == nullptr) {
         problems.push_back("orr_HeapDestroy: unknown heap " + pointerText(heap));
      } else {
         problems = liveBlockReport(*record, "orr_HeapDestroy: ");
         for (const auto &[object, what] : record->users) {
            problems.push_back("orr_HeapDestroy: heap '" + record->name + "' destroyed before " + what +
                               " made on it");
         }
         while (!record->blocks.empty()) {
            releaseLocked(*record, record->blocks.begin());
         }
         heaps_.erase(heap);
      }
   }
   violations_.reportAll(std::move(problems));
}

void *HeapRegistry::allocateLocked(Record &heap, size_t size, HeapSite &site)
{
   if (size > heap.props.maximumSize || heap.liveBytes > heap.props.maximumSize - size) {
      return nullptr;
   }
   // A block of 0 bytes is still a distinct block that must be freed.
   void *block = std::malloc(size == 0 ? 1 : size);
   if (block == nullptr) {
      return nullptr;
   }
   std::memset(block, kFreshByte, size);
   heap.blocks.emplace(block, Block{size, &site});
   heap.liveBytes += size;
   liveBytes_ += size;
   ++liveBlocks_;
   peakBytes_ = std::max(peakBytes_, liveBytes_);
   site.liveBytes += size;
   ++site.liveBlocks;
   ++site.allocations;
   return block;
}

void HeapRegistry::releaseLocked(Record &heap, std::unordered_map<void *, Block>::iterator block)
{
   const Block info = block->second;
   void *memory = block->first;
   heap.blocks.erase(block);
   heap.liveBytes -= info.size;
   liveBytes_ -= info.size;
   --liveBlocks_;
   info.site->liveBytes -= info.size;
   --info.site->liveBlocks;
   std::memset(memory, kFreedByte, info.size);
   std::free(memory);
}

void *HeapRegistry::allocate(orr_HeapID heap, uint32_t size, const void *callSite)
{
   if (faults_.hit(faultPoint("orr_HeapAllocWithRA"))) {
      return nullptr;
   }
   std::string problem;
   {
      std::lock_guard guard(mutex_);
      Record *record = find(heap);
      if (record != nullptr) {
         return allocateLocked(*record, size, siteFor(callSite));
      }
      problem = "orr_HeapAllocWithRA: unknown heap " + pointerText(heap);
   }
   violations_.report(std::move(problem));
   return nullptr;
}

void *HeapRegistry::allocateFor(orr_HeapID heap, size_t size, std::string_view site)
{
   std::lock_guard guard(mutex_);
   Record *record = find(heap);
   if (record == nullptr) {
      return nullptr;
   }
   return allocateLocked(*record, size, siteNamed(site));
}

void HeapRegistry::release(orr_HeapID heap, void *block)
{
   std::string problem;
   {
      std::lock_guard guard(mutex_);
      Record *record = find(heap);
      if (record == nullptr) {
         problem = "orr_HeapFree: unknown heap " + pointerText(heap);
      } else {
         auto found = record->blocks.find(block);
         if (found != record->blocks.end()) {
            releaseLocked(*record, found);
            return;
         }
         // A double free, a block of another heap, or a pointer into a block:
         // a real heap would corrupt itself; this one keeps the block and says so.
         problem = "orr_HeapFree: " + pointerText(block) + " is not a live block of heap '" + record->name + "'";
      }
   }
   violations_.report(std::move(problem));
}

bool HeapRegistry::isLive(orr_HeapID heap) const
{
   std::lock_guard guard(mutex_);
   return find(heap) != nullptr;
}

bool HeapRegistry::attach(orr_HeapID heap, const void *object, std::string what)
{
   if (heap == nullptr) {
      return true;
   }
   std::lock_guard guard(mutex_);
   Record *record = find(heap);
   if (record == nullptr) {
      return false;
   }
   record->users.emplace(object, std::move(what));
   return true;
}

void HeapRegistry::detach(orr_HeapID heap, const void *object)
{
   std::lock_guard guard(mutex_);
   if (Record *record = find(heap)) {
      record->users.erase(object);
   }
}

void HeapRegistry::setModuleHeap(orr_HeapID heap)
{
   std::lock_guard guard(mutex_);
   if (Record *record = find(heap)) {
      moduleHeap_ = record->props;
   }
}

void HeapRegistry::forgetModuleHeap()
{
   std::lock_guard guard(mutex_);
   moduleHeap_.reset();
}

std::vector<std::string> HeapRegistry::purge(std::string_view when)
{
   std::vector<std::string> problems;
   std::lock_guard guard(mutex_);
   std::vector<Record *> live;
   for (auto &[key, record] : heaps_) {
      live.push_back(record.get());
   }
   std::sort(live.begin(), live.end(), [](const Record *a, const Record *b) { return a->seq < b->seq; });
   for (Record *record : live) {
      problems.push_back(std::string(when) + ": heap '" + record->name + "' was not destroyed");
      auto blocks = liveBlockReport(*record, std::string(when) + ": ");
      problems.insert(problems.end(), blocks.begin(), blocks.end());
      while (!record->blocks.empty()) {
         releaseLocked(*record, record->blocks.begin());
      }
   }
   heaps_.clear();
   // The image is about to close: its addresses may name other code next time.
   siteByAddress_.clear();
   return problems;
}

uint64_t HeapRegistry::liveBytes() const
{
   std::lock_guard guard(mutex_);
   return liveBytes_;
}

uint64_t HeapRegistry::liveBlocks() const
{
   std::lock_guard guard(mutex_);
   return liveBlocks_;
}

uint64_t HeapRegistry::peakBytes() const
{
   std::lock_guard guard(mutex_);
   return peakBytes_;
}

std::vector<HeapSite> HeapRegistry::sites() const
{
   std::lock_guard guard(mutex_);
   std::vector<HeapSite> result;
   for (const auto &[name, site] : sites_) {
      result.push_back(site);
   }
   return result;
}

std::optional<orr_HeapProps> HeapRegistry::moduleHeapProps() const
{
   std::lock_guard guard(mutex_);
   return moduleHeap_;
}

}  // namespace swsec::host

using swsec::host::detail::requireState;

ORR_API orr_Status orr_HeapCreate(const orr_HeapProps *props, orr_HeapID *heap)
{
   return requireState("orr_HeapCreate").heaps.create(props, heap);
}

ORR_API void orr_HeapDestroy(orr_HeapID heap)
{
   requireState("orr_HeapDestroy").heaps.destroy(heap);
}

ORR_API void *orr_HeapAllocWithRA(orr_HeapID heap, uint32_t size, const void *callSite)
{
   return requireState("orr_HeapAllocWithRA").heaps.allocate(heap, size, callSite);
}

ORR_API void orr_HeapFree(orr_HeapID heap, void *block)
{
   requireState("orr_HeapFree").heaps.release(heap, block);
}
