// Frames and frame lists: what the host hands a filter, and the platform's
// frame operations on them.
//
// A frame's bytes live in scatter-gather elements, each its own exact-size
// allocation, plus a separate exact-size buffer for the mapped part, so
// that AddressSanitizer catches a read past either. Machine addresses are
// not virtual addresses: each element gets a base of its own in a made-up
// machine address space, and orr_MA2VA maps a range only when it lies in
// one live element.
//
// A list is handled by one thread at a time; different lists may be
// handled by different threads at once. The machine address map and the
// counters are shared and locked.
#pragma once

#include "host/sharded_counter.h"

#include "host/faults.h"
#include "host/header_lookup.h"
#include "host/host.h"
#include "host/violations.h"

#include <atomic>
#include <map>
#include <memory>
#include <shared_mutex>
#include <string>
#include <vector>

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

   // Used by lists and frames.
   void addElement(orr_MA base, uint8_t *data, uint32_t length);
   void removeElement(orr_MA base);
   Violations &violations() { return violations_; }

private:
   Frame &checked(const orr_Pkt *pkt, const char *op);

   Violations &violations_;
   FaultTable &faults_;

   ShardedCounter outstandingMappings_;
   std::atomic<uint64_t> releases_{0};
   std::atomic<orr_MA> nextBase_{0x10000000000ull};

   struct Element {
      uint8_t *data = nullptr;
      uint32_t length = 0;
   };
   mutable std::shared_mutex elementsMutex_;
   std::map<orr_MA, Element> elements_;   // by base machine address
};

}  // namespace swsec::host
