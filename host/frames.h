// Frames and frame lists: what the host hands a filter, and the platform's
// frame operations on them.
//
// A list keeps its frames in one array and their bytes in one arena: each
// scatter-gather element and each frame's mapped part is its own buffer in
// the arena, fenced by poisoned red zones, so that AddressSanitizer catches
// a read past (or before) any of them as it would past an exact-size
// allocation. A released frame's buffers are poisoned whole. Machine
// addresses are not virtual addresses: a list takes a range of a made-up
// machine address space, each element a 4 GiB slot of it, and orr_MA2VA
// maps a range only when it lies in one element of a live frame.
//
// A list is handled by one thread at a time; different lists may be
// handled by different threads at once. The frame path (lookups, header
// mappings, the iterator) touches only the list's own records and the
// per-thread shards of the host's counters; the list registry is locked
// only when a list is made or given back.
#pragma once

#include "host/faults.h"
#include "host/header_lookup.h"
#include "host/host.h"
#include "host/sharded_counter.h"
#include "host/violations.h"

#include <atomic>
#include <map>
#include <memory>
#include <optional>
#include <shared_mutex>
#include <span>
#include <vector>

// The records behind the platform's frame types.
struct orr_Pkt {};
struct orr_PktList {};

namespace swsec::host {

class FrameStore final : public Frames {
public:
   FrameStore(Violations &violations, FaultTable &faults);
   ~FrameStore() override;

   struct Frame;
   class List;

   // Platform operations.
   uint8_t *mappedPointer(orr_Pkt *pkt);
   uint32_t frameLen(const orr_Pkt *pkt);
   uint32_t mappedLen(const orr_Pkt *pkt);
   uint16_t vlanId(const orr_Pkt *pkt);
   orr_Status copyBytesOut(const orr_Pkt *pkt, uint32_t offset, uint32_t length, void *dst);
   void release(orr_Pkt *pkt);
   const orr_SgArray *sgArray(const orr_Pkt *pkt);
   const orr_SgElem *sgElem(const orr_Pkt *pkt, uint16_t index);
   orr_Status machineToVirtual(orr_MA addr, uint32_t length, void **va);
   orr_Status headerFind(orr_Pkt *pkt, orr_PktLayer layer, uint32_t classMask, uint32_t instance,
                         orr_PktHeaderEntry **entry);
   orr_Status headerDataGet(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t **data);
   void headerDataRelease(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t *data);

   // Frames
   std::unique_ptr<FrameList> makeList(const std::vector<FrameSpec> &frames, uint32_t minMappedLen) override;
   std::unique_ptr<FrameList> makeList(std::span<const FrameView> frames, uint32_t minMappedLen) override;
   uint64_t outstandingMappings() const override;
   uint64_t releases() const override;

private:
   friend class List;

   // What one frame is made of, whichever way the caller described it.
   struct FrameInput {
      std::span<const uint8_t> bytes;
      uint16_t vlanId = 0;
      bool untag = false;
      std::span<const uint32_t> split;
      std::optional<uint32_t> mappedLen;
   };
   std::unique_ptr<FrameList> build(std::span<const FrameInput> inputs, uint32_t minMappedLen);
   void forget(const List &list);

   Violations &violations_;
   FaultTable &faults_;

   ShardedCounter releases_;
   std::atomic<orr_MA> nextBase_{0x10000000000ull};

   // Live lists by the first machine address of their range.
   mutable std::shared_mutex listsMutex_;
   std::map<orr_MA, List *> lists_;
};

}  // namespace swsec::host
