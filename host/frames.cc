#include "host/frames.h"

#include "host/state.h"

#include <algorithm>
#include <cstring>
#include <mutex>
#include <stdexcept>

// The records behind the platform's frame types.
struct orr_Pkt {};
struct orr_PktList {};

// Iterator storage, the caller's (orr_PktListIterSizeOf bytes).
struct orr_PktListIter {
   uint64_t magic;
   swsec::host::FrameStore::List *list;
   swsec::host::FrameStore::Frame *current;
};
static_assert(sizeof(orr_PktListIter) <= ORR_PKT_LIST_ITER_MAX_SIZE);

namespace swsec::host {

namespace {

constexpr uint64_t kFrameMagic = 0x7266'7473'6f68'6673ull;   // a live frame
constexpr uint64_t kIterMagic = 0x7265'7469'7473'6f68ull;    // a started iterator
constexpr uint16_t kEtherVlan = 0x8100;

}  // namespace

struct FrameStore::Frame : orr_Pkt {
   struct Mapping {
      const orr_PktHeaderEntry *entry = nullptr;
      uint8_t *data = nullptr;
      std::unique_ptr<uint8_t[]> copy;   // when the header had to be copied
   };

   uint64_t magic = kFrameMagic;
   List *list = nullptr;
   std::vector<uint8_t> bytes;
   std::vector<std::unique_ptr<uint8_t[]>> elementData;
   std::vector<orr_SgElem> elements;
   orr_SgArray sgArray{};
   std::unique_ptr<uint8_t[]> mapped;
   uint32_t mappedLen = 0;
   uint16_t vlanId = 0;
   std::array<orr_PktHeaderEntry, 3> entries{};
   std::array<bool, 3> present{};

   std::mutex mappingsMutex;
   std::vector<Mapping> mappings;

   Frame *prev = nullptr;
   Frame *next = nullptr;
   bool inList = false;
   bool released = false;

   // Gives the element buffers and the mapped buffer back; the record
   // stays so that a second release or a use after release is caught.
   void freeData(FrameStore &store)
   {
      for (const orr_SgElem &element : elements) {
         store.removeElement(element.addr);
      }
      elementData.clear();
      mapped.reset();
      bytes.clear();
      bytes.shrink_to_fit();
   }
};

class FrameStore::List final : public orr_PktList, public FrameList {
public:
   explicit List(FrameStore &store) : store_(store) {}

   ~List() override
   {
      std::vector<std::string> problems;
      for (size_t index = 0; index < frames_.size(); ++index) {
         Frame &frame = *frames_[index];
         if (frame.released) {
            continue;
         }
         const std::string which = "frame " + std::to_string(index);
         if (!frame.inList) {
            problems.push_back(which + " was taken out of its list and never released");
         }
         std::lock_guard guard(frame.mappingsMutex);
         if (!frame.mappings.empty()) {
            problems.push_back(which + " returned to the host with " + std::to_string(frame.mappings.size()) +
                               " header mapping(s) outstanding");
            store_.outstandingMappings_.add(-static_cast<int64_t>(frame.mappings.size()));
         }
      }
      for (auto &frame : frames_) {
         if (!frame->released) {
            frame->freeData(store_);
         }
         frame->magic = ~kFrameMagic;
      }
      store_.violations_.reportAll(std::move(problems));
   }

   orr_PktList *list() override { return this; }

   orr_Pkt *frame(size_t index) override
   {
      if (index >= frames_.size() || frames_[index]->released) {
         return nullptr;
      }
      return frames_[index].get();
   }

   std::vector<size_t> kept() const override
   {
      std::vector<size_t> indices;
      for (const Frame *frame = head_; frame != nullptr; frame = frame->next) {
         indices.push_back(indexOf(frame));
      }
      return indices;
   }

   size_t released() const override { return releasedCount_; }

   void append(std::unique_ptr<Frame> frame)
   {
      frame->list = this;
      frame->inList = true;
      frame->prev = tail_;
      if (tail_ != nullptr) {
         tail_->next = frame.get();
      } else {
         head_ = frame.get();
      }
      tail_ = frame.get();
      frames_.push_back(std::move(frame));
   }

   void unlink(Frame &frame)
   {
      (frame.prev != nullptr ? frame.prev->next : head_) = frame.next;
      (frame.next != nullptr ? frame.next->prev : tail_) = frame.prev;
      frame.prev = nullptr;
      frame.next = nullptr;
      frame.inList = false;
   }

   Frame *head() const { return head_; }
   void countRelease() { ++releasedCount_; }

private:
   size_t indexOf(const Frame *frame) const
   {
      for (size_t index = 0; index < frames_.size(); ++index) {
         if (frames_[index].get() == frame) {
            return index;
         }
      }
      return frames_.size();
   }

   FrameStore &store_;
   std::vector<std::unique_ptr<Frame>> frames_;
   Frame *head_ = nullptr;
   Frame *tail_ = nullptr;
   size_t releasedCount_ = 0;
};

FrameStore::FrameStore(Violations &violations, FaultTable &faults) : violations_(violations), faults_(faults) {}

FrameStore::~FrameStore() = default;

FrameStore::Frame &FrameStore::checked(const orr_Pkt *pkt, const char *op)
{
   if (pkt == nullptr) {
      fatal(std::string(op) + ": null frame");
   }
   auto *frame = static_cast<Frame *>(const_cast<orr_Pkt *>(pkt));
   if (frame->magic != kFrameMagic) {
      fatal(std::string(op) + ": " + pointerText(pkt) + " is not a frame the host handed out");
   }
   if (frame->released) {
      fatal(std::string(op) + ": frame " + pointerText(pkt) + " used after orr_PktRelease");
   }
   return *frame;
}

std::unique_ptr<FrameList> FrameStore::makeList(const std::vector<FrameSpec> &frameSpecs, uint32_t minMappedLen)
{
   auto list = std::make_unique<List>(*this);
   for (const FrameSpec &frameSpec : frameSpecs) {
      auto frame = std::make_unique<Frame>();
      frame->bytes = frameSpec.bytes;
      frame->vlanId = frameSpec.vlanId;
      auto &bytes = frame->bytes;
      if (frameSpec.untag && bytes.size() >= 18 && ((bytes[12] << 8) | bytes[13]) == kEtherVlan) {
         frame->vlanId = static_cast<uint16_t>(((bytes[14] << 8) | bytes[15]) & 0x0fff);
         bytes.erase(bytes.begin() + 12, bytes.begin() + 16);
      }
      if (bytes.size() > UINT32_MAX) {
         throw std::invalid_argument("frame too long");
      }
      const auto length = static_cast<uint32_t>(bytes.size());

      std::vector<uint32_t> split = frameSpec.split;
      uint64_t total = 0;
      for (uint32_t part : split) {
         total += part;
      }
      if (total > length) {
         throw std::invalid_argument("split of " + std::to_string(total) + " bytes for a frame of " +
                                     std::to_string(length));
      }
      if (split.empty() || total < length) {
         split.push_back(length - static_cast<uint32_t>(total));
      }
      if (split.size() > UINT16_MAX) {
         throw std::invalid_argument("too many scatter-gather elements");
      }
      uint32_t offset = 0;
      for (uint32_t part : split) {
         auto data = std::make_unique<uint8_t[]>(part);
         std::copy_n(bytes.data() + offset, part, data.get());
         const orr_MA base = nextBase_.fetch_add(1ull << 32);
         addElement(base, data.get(), part);
         frame->elements.push_back(orr_SgElem{base, part, 0});
         frame->elementData.push_back(std::move(data));
         offset += part;
      }
      frame->sgArray.numElems = static_cast<uint16_t>(split.size());

      if (frameSpec.mappedLen) {
         if (*frameSpec.mappedLen > length) {
            throw std::invalid_argument("mapped length beyond the frame");
         }
         frame->mappedLen = *frameSpec.mappedLen;
      } else {
         frame->mappedLen = std::min(std::max(split.front(), minMappedLen), length);
      }
      frame->mapped = std::make_unique<uint8_t[]>(frame->mappedLen);
      std::copy_n(bytes.data(), frame->mappedLen, frame->mapped.get());

      const FrameHeaders headers = findHeaders(bytes);
      for (size_t layer = 0; layer < headers.entries.size(); ++layer) {
         if (headers.entries[layer]) {
            frame->entries[layer] = *headers.entries[layer];
            frame->present[layer] = true;
         }
      }
      list->append(std::move(frame));
   }
   return list;
}

std::unique_ptr<FrameList> FrameStore::makeList(std::span<const FrameView> frames, uint32_t minMappedLen)
{
   std::vector<FrameSpec> frameSpecs(frames.size());
   for (size_t index = 0; index < frames.size(); ++index) {
      frameSpecs[index].bytes.assign(frames[index].bytes.begin(), frames[index].bytes.end());
      frameSpecs[index].vlanId = frames[index].vlanId;
      frameSpecs[index].untag = frames[index].untag;
   }
   return makeList(frameSpecs, minMappedLen);
}

uint64_t FrameStore::outstandingMappings() const
{
   return static_cast<uint64_t>(outstandingMappings_.value());
}

uint64_t FrameStore::releases() const
{
   return releases_.load();
}

void FrameStore::addElement(orr_MA base, uint8_t *data, uint32_t length)
{
   std::unique_lock guard(elementsMutex_);
   elements_[base] = Element{data, length};
}

void FrameStore::removeElement(orr_MA base)
{
   std::unique_lock guard(elementsMutex_);
   elements_.erase(base);
}

uint8_t *FrameStore::mappedPointer(orr_Pkt *pkt)
{
   return checked(pkt, "orr_PktFrameMappedPointerGet").mapped.get();
}

uint32_t FrameStore::frameLen(const orr_Pkt *pkt)
{
   return static_cast<uint32_t>(checked(pkt, "orr_PktFrameLenGet").bytes.size());
}

uint32_t FrameStore::mappedLen(const orr_Pkt *pkt)
{
   return checked(pkt, "orr_PktFrameMappedLenGet").mappedLen;
}

uint16_t FrameStore::vlanId(const orr_Pkt *pkt)
{
   return checked(pkt, "orr_PktVlanIDGet").vlanId;
}

orr_Status FrameStore::copyBytesOut(const orr_Pkt *pkt, uint32_t offset, uint32_t length, void *dst)
{
   Frame &frame = checked(pkt, "orr_PktCopyBytesOut");
   if (auto status = faults_.hit("orr_PktCopyBytesOut")) {
      return *status;
   }
   const size_t size = frame.bytes.size();
   if (offset > size || length > size - offset || (dst == nullptr && length != 0)) {
      return ORR_BAD_PARAM;
   }
   if (length != 0) {
      std::memcpy(dst, frame.bytes.data() + offset, length);
   }
   return ORR_OK;
}

void FrameStore::release(orr_Pkt *pkt)
{
   if (pkt == nullptr) {
      fatal("orr_PktRelease: null frame");
   }
   auto *frame = static_cast<Frame *>(pkt);
   if (frame->magic == kFrameMagic && frame->released) {
      fatal("orr_PktRelease: frame " + pointerText(pkt) + " released twice");
   }
   checked(pkt, "orr_PktRelease");
   if (frame->inList) {
      fatal("orr_PktRelease: frame " + pointerText(pkt) + " is still in a list");
   }
   size_t outstanding = 0;
   {
      std::lock_guard guard(frame->mappingsMutex);
      outstanding = frame->mappings.size();
      frame->mappings.clear();
   }
   outstandingMappings_.add(-static_cast<int64_t>(outstanding));
   frame->freeData(*this);
   frame->released = true;
   frame->list->countRelease();
   ++releases_;
   if (outstanding != 0) {
      violations_.report("orr_PktRelease: frame " + pointerText(pkt) + " released with " +
                         std::to_string(outstanding) + " header mapping(s) outstanding");
   }
}

const orr_SgArray *FrameStore::sgArray(const orr_Pkt *pkt)
{
   return &checked(pkt, "orr_PktSgArrayGet").sgArray;
}

const orr_SgElem *FrameStore::sgElem(const orr_Pkt *pkt, uint16_t index)
{
   Frame &frame = checked(pkt, "orr_PktSgElemGet");
   if (index >= frame.elements.size()) {
      return nullptr;
   }
   return &frame.elements[index];
}

orr_Status FrameStore::machineToVirtual(orr_MA addr, uint32_t length, void **va)
{
   if (auto status = faults_.hit("orr_MA2VA")) {
      return *status;
   }
   if (va == nullptr) {
      return ORR_BAD_PARAM;
   }
   std::shared_lock guard(elementsMutex_);
   auto next = elements_.upper_bound(addr);
   if (next == elements_.begin()) {
      return ORR_BAD_PARAM;
   }
   const auto &[base, element] = *std::prev(next);
   const uint64_t into = addr - base;
   if (into > element.length || length > element.length - into) {
      return ORR_BAD_PARAM;
   }
   *va = element.data + into;
   return ORR_OK;
}

orr_Status FrameStore::headerFind(orr_Pkt *pkt, orr_PktLayer layer, uint32_t classMask, uint32_t instance,
                                  orr_PktHeaderEntry **entry)
{
   Frame &frame = checked(pkt, "orr_PktHeaderFind");
   if (auto status = faults_.hit("orr_PktHeaderFind")) {
      return *status;
   }
   if (entry == nullptr || layer > ORR_PKT_LAYER_4) {
      return ORR_BAD_PARAM;
   }
   // A frame has at most one header per layer: only instance 1 exists.
   if (instance != 1 || !frame.present[layer] || (classMask & headerClassOf(layer)) == 0) {
      return ORR_NOT_FOUND;
   }
   *entry = &frame.entries[layer];
   return ORR_OK;
}

orr_Status FrameStore::headerDataGet(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t **data)
{
   Frame &frame = checked(pkt, "orr_PktHeaderDataGet");
   if (auto status = faults_.hit("orr_PktHeaderDataGet")) {
      return *status;
   }
   const auto layer = static_cast<size_t>(entry - frame.entries.data());
   if (data == nullptr || entry == nullptr || entry < frame.entries.data() || layer >= frame.entries.size() ||
       !frame.present[layer]) {
      return ORR_BAD_PARAM;
   }
   const uint32_t offset = entry->offset;
   const uint32_t length = entry->length;
   Frame::Mapping mapping{entry, nullptr, nullptr};
   if (offset + length <= frame.mappedLen) {
      mapping.data = frame.mapped.get() + offset;
   } else {
      uint32_t begin = 0;
      for (size_t index = 0; index < frame.elements.size(); ++index) {
         const uint32_t size = frame.elements[index].length;
         if (offset >= begin && offset + length <= begin + size && size != 0) {
            mapping.data = frame.elementData[index].get() + (offset - begin);
            break;
         }
         begin += size;
      }
   }
   if (mapping.data == nullptr) {
      // Spread over elements: the host maps a copy of its own.
      mapping.copy = std::make_unique<uint8_t[]>(length);
      std::copy_n(frame.bytes.data() + offset, length, mapping.copy.get());
      mapping.data = mapping.copy.get();
   }
   *data = mapping.data;
   {
      std::lock_guard guard(frame.mappingsMutex);
      frame.mappings.push_back(std::move(mapping));
   }
   outstandingMappings_.add(1);
   return ORR_OK;
}

void FrameStore::headerDataRelease(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t *data)
{
   Frame &frame = checked(pkt, "orr_PktHeaderDataRelease");
   std::lock_guard guard(frame.mappingsMutex);
   auto found = std::find_if(frame.mappings.rbegin(), frame.mappings.rend(), [&](const Frame::Mapping &mapping) {
      return mapping.entry == entry && mapping.data == data;
   });
   if (found == frame.mappings.rend()) {
      fatal("orr_PktHeaderDataRelease: " + pointerText(data) + " is not a mapping of header " + pointerText(entry) +
            " of frame " + pointerText(pkt));
   }
   frame.mappings.erase(std::next(found).base());
   outstandingMappings_.add(-1);
}

}  // namespace swsec::host

using swsec::host::FrameStore;
using swsec::host::fatal;
using swsec::host::pointerText;
using swsec::host::detail::requireState;

ORR_API uint8_t *orr_PktFrameMappedPointerGet(orr_Pkt *pkt)
{
   return requireState("orr_PktFrameMappedPointerGet").frames.mappedPointer(pkt);
}

ORR_API uint32_t orr_PktFrameLenGet(const orr_Pkt *pkt)
{
   return requireState("orr_PktFrameLenGet").frames.frameLen(pkt);
}

ORR_API uint32_t orr_PktFrameMappedLenGet(const orr_Pkt *pkt)
{
   return requireState("orr_PktFrameMappedLenGet").frames.mappedLen(pkt);
}

ORR_API uint16_t orr_PktVlanIDGet(const orr_Pkt *pkt)
{
   return requireState("orr_PktVlanIDGet").frames.vlanId(pkt);
}

ORR_API orr_Status orr_PktCopyBytesOut(const orr_Pkt *pkt, uint32_t offset, uint32_t length, void *dst)
{
   return requireState("orr_PktCopyBytesOut").frames.copyBytesOut(pkt, offset, length, dst);
}

ORR_API void orr_PktRelease(orr_Pkt *pkt)
{
   requireState("orr_PktRelease").frames.release(pkt);
}

ORR_API const orr_SgArray *orr_PktSgArrayGet(const orr_Pkt *pkt)
{
   return requireState("orr_PktSgArrayGet").frames.sgArray(pkt);
}

ORR_API const orr_SgElem *orr_PktSgElemGet(const orr_Pkt *pkt, uint16_t index)
{
   return requireState("orr_PktSgElemGet").frames.sgElem(pkt, index);
}

ORR_API orr_Status orr_MA2VA(orr_MA addr, uint32_t length, void **va)
{
   return requireState("orr_MA2VA").frames.machineToVirtual(addr, length, va);
}

ORR_API orr_Status orr_PktHeaderFind(orr_Pkt *pkt, orr_PktLayer layer, uint32_t classMask, uint32_t instance,
                                     orr_PktHeaderEntry **entry, uint32_t /*flags*/)
{
   return requireState("orr_PktHeaderFind").frames.headerFind(pkt, layer, classMask, instance, entry);
}

ORR_API orr_Status orr_PktHeaderDataGet(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t **data)
{
   return requireState("orr_PktHeaderDataGet").frames.headerDataGet(pkt, entry, data);
}

ORR_API void orr_PktHeaderDataRelease(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t *data, uint32_t /*flags*/)
{
   requireState("orr_PktHeaderDataRelease").frames.headerDataRelease(pkt, entry, data);
}

// The iterator: the list and the frame it stands on.
ORR_API size_t orr_PktListIterSizeOf(void)
{
   return sizeof(orr_PktListIter);
}

namespace {

orr_PktListIter &startedIter(const orr_PktListIter *iter, const char *op)
{
   if (iter == nullptr || iter->magic != swsec::host::kIterMagic) {
      fatal(std::string(op) + ": iterator " + pointerText(iter) + " was not started");
   }
   return *const_cast<orr_PktListIter *>(iter);
}

}  // namespace

ORR_API void orr_PktListIterStart(orr_PktList *list, orr_PktListIter *iter)
{
   (void)requireState("orr_PktListIterStart");
   if (list == nullptr || iter == nullptr) {
      fatal("orr_PktListIterStart: null list or iterator");
   }
   auto *frames = static_cast<FrameStore::List *>(list);
   *iter = orr_PktListIter{swsec::host::kIterMagic, frames, frames->head()};
}

ORR_API bool orr_PktListIterIsAtEnd(const orr_PktListIter *iter)
{
   return startedIter(iter, "orr_PktListIterIsAtEnd").current == nullptr;
}

ORR_API orr_Pkt *orr_PktListIterGetPkt(const orr_PktListIter *iter)
{
   return startedIter(iter, "orr_PktListIterGetPkt").current;
}

ORR_API void orr_PktListIterMove(orr_PktListIter *iter)
{
   orr_PktListIter &started = startedIter(iter, "orr_PktListIterMove");
   if (started.current == nullptr) {
      fatal("orr_PktListIterMove: the iterator is at the end of its list");
   }
   started.current = started.current->next;
}

ORR_API orr_Pkt *orr_PktListIterRemovePkt(orr_PktListIter *iter)
{
   orr_PktListIter &started = startedIter(iter, "orr_PktListIterRemovePkt");
   FrameStore::Frame *frame = started.current;
   if (frame == nullptr) {
      fatal("orr_PktListIterRemovePkt: the iterator is at the end of its list");
   }
   started.current = frame->next;
   started.list->unlink(*frame);
   return frame;
}
