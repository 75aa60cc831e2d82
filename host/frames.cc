#include "host/frames.h"

#include "host/state.h"

#include <sanitizer/asan_interface.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <new>
#include <mutex>
#include <stdexcept>
#include <string>

// Iterator storage, the caller's (orr_PktListIterSizeOf bytes).
struct orr_PktListIter {
   uint64_t magic;
   swsec::host::FrameStore::List *list;
   swsec::host::FrameStore::Frame *current;
};
static_assert(sizeof(orr_PktListIter) <= ORR_PKT_LIST_ITER_MAX_SIZE);

namespace swsec::host {

namespace {

constexpr uint64_t kFrameMagic = 0x7266'7473'6f68'6673ull;      // a live frame
constexpr uint64_t kReleasedMagic = 0x6473'6172'6665'6c72ull;   // released, its list not yet given back
constexpr uint64_t kIterMagic = 0x7265'7469'7473'6f68ull;       // a started iterator
// Poisoned bytes around every buffer of a list's arena.
constexpr size_t kRedZone = 32;
// Each element owns a 4 GiB slot of its list's machine address range.
constexpr unsigned kElementSlotShift = 32;
// Mappings of headers in the mapped part a frame keeps in its first cache
// line (two bits each); the frame loop holds at most three at once.
constexpr uint32_t kQuickMappings = 8;

constexpr size_t alignedUp(size_t size)
{
   return (size + 7) & ~size_t{7};
}

}  // namespace

struct alignas(64) FrameStore::Frame : orr_Pkt {
   // A mapping the quick stack does not hold (one in an element or a copy,
   // or past the stack's depth); a copy is freed when the mapping is given
   // back or the frame goes.
   struct Mapping {
      const orr_PktHeaderEntry *entry = nullptr;
      uint8_t *data = nullptr;
      uint8_t *copy = nullptr;
   };

   // The first cache line holds everything the frame path reads and
   // writes, so that a long list costs one line a frame besides its bytes.
   uint64_t magic = kFrameMagic;
   uint8_t *mapped = nullptr;     // the mapped part, its own buffer in the arena
   Frame *next = nullptr;
   uint32_t length = 0;
   uint32_t mappedLen = 0;
   uint16_t vlanId = 0;
   uint8_t present = 0;           // bit per layer with a header entry
   // Mappings of headers in the mapped part (their data is mapped + the
   // entry's offset): a stack of layers, two bits each, oldest lowest. The
   // count is read by outstandingMappings() from other threads.
   std::atomic<uint8_t> quickCount{0};
   uint16_t quickLayers = 0;
   std::array<orr_PktHeaderEntry, 3> entries{};

   // The rest: list bookkeeping and the other mappings.
   List *list = nullptr;
   Frame *prev = nullptr;
   size_t index = 0;              // in the caller's input
   uint32_t firstElement = 0;     // in the list's element tables
   orr_SgArray sgArray{};
   bool inList = false;
   std::atomic<uint32_t> otherCount{0};
   std::vector<Mapping> others;

   Frame() = default;
   Frame(const Frame &) = delete;
   Frame &operator=(const Frame &) = delete;
   ~Frame() { dropMappings(); }

   uint32_t outstanding() const
   {
      return quickCount.load(std::memory_order_relaxed) + otherCount.load(std::memory_order_relaxed);
   }

   uint8_t *quickData(uint32_t layer) const { return mapped + entries[layer].offset; }

   // Removes the quick mapping at `position` (0: the oldest).
   void dropQuick(uint32_t position)
   {
      const uint32_t count = quickCount.load(std::memory_order_relaxed);
      const uint32_t low = quickLayers & ((1u << (2 * position)) - 1);
      const uint32_t high = static_cast<uint32_t>(quickLayers) >> (2 * position + 2);
      quickLayers = static_cast<uint16_t>(low | (high << (2 * position)));
      quickCount.store(static_cast<uint8_t>(count - 1), std::memory_order_relaxed);
   }

   void dropMappings()
   {
      for (const Mapping &mapping : others) {
         delete[] mapping.copy;
      }
      others.clear();
      otherCount.store(0, std::memory_order_relaxed);
      quickCount.store(0, std::memory_order_relaxed);
      quickLayers = 0;
   }
};
static_assert(sizeof(orr_PktHeaderEntry) == 8 && alignof(FrameStore::Frame) == 64);

class FrameStore::List final : public orr_PktList, public FrameList {
public:
   struct Element {
      uint8_t *data = nullptr;
      uint32_t length = 0;
      uint32_t frame = 0;   // index of the frame it belongs to
   };

   // One allocation holds the frames (cache-line aligned), the element
   // tables and the arena: a list costs the host one malloc and one free.
   List(FrameStore &store, size_t frameCount, size_t elementCount, size_t arenaSize)
      : store_(store), frameCount_(frameCount), elementCount_(elementCount), arenaSize_(arenaSize)
   {
      const size_t frameBytes = frameCount * sizeof(Frame);
      const size_t tableBytes = elementCount * (sizeof(orr_SgElem) + sizeof(Element));
      storage_.reset(static_cast<uint8_t *>(std::malloc(alignof(Frame) + frameBytes + tableBytes + arenaSize)));
      if (!storage_) {
         throw std::bad_alloc();
      }
      const auto start = reinterpret_cast<uintptr_t>(storage_.get());
      auto *at = storage_.get() + ((alignof(Frame) - start % alignof(Frame)) % alignof(Frame));
      frames_ = reinterpret_cast<Frame *>(at);
      for (size_t index = 0; index < frameCount; ++index) {
         new (frames_ + index) Frame();
      }
      sgElems_ = reinterpret_cast<orr_SgElem *>(at + frameBytes);
      elements_ = reinterpret_cast<Element *>(at + frameBytes + elementCount * sizeof(orr_SgElem));
      for (size_t index = 0; index < elementCount; ++index) {
         new (sgElems_ + index) orr_SgElem{};
         new (elements_ + index) Element{};
      }
      arena_ = at + frameBytes + tableBytes;
      // Everything is out of bounds until a buffer is laid out over it.
      ASAN_POISON_MEMORY_REGION(arena_, arenaSize_);
   }

   ~List() override
   {
      std::vector<std::string> problems;
      for (size_t index = 0; index < frameCount_; ++index) {
         Frame &frame = frames_[index];
         if (frame.magic == kReleasedMagic) {
            continue;
         }
         // Text only for a frame with a problem: a list ends for every judged batch.
         auto which = [index] { return "frame " + std::to_string(index); };
         if (!frame.inList) [[unlikely]] {
            problems.push_back(which() + " was taken out of its list and never released");
         }
         if (const uint32_t outstanding = frame.outstanding(); outstanding != 0) [[unlikely]] {
            problems.push_back(which() + " returned to the host with " + std::to_string(outstanding) +
                               " header mapping(s) outstanding");
         }
      }
      store_.forget(*this);
      for (size_t index = 0; index < frameCount_; ++index) {
         frames_[index].magic = ~kFrameMagic;
         frames_[index].~Frame();
      }
      ASAN_UNPOISON_MEMORY_REGION(arena_, arenaSize_);
      store_.violations_.reportAll(std::move(problems));
   }

   orr_PktList *list() override { return this; }

   orr_Pkt *frame(size_t index) override
   {
      if (index >= frameCount_ || frames_[index].magic != kFrameMagic) {
         return nullptr;
      }
      return &frames_[index];
   }

   std::vector<size_t> kept() const override
   {
      std::vector<size_t> indices;
      for (const Frame *frame = head_; frame != nullptr; frame = frame->next) {
         indices.push_back(frame->index);
      }
      return indices;
   }

   size_t released() const override { return releasedCount_; }

   // Places `length` bytes in the arena at `offset` (advanced past the
   // buffer and its red zone) and opens them to reads and writes.
   uint8_t *place(size_t &offset, const uint8_t *bytes, size_t length)
   {
      if (offset + alignedUp(length) + kRedZone > arenaSize_) {
         throw std::logic_error("frame list arena laid out past its size");
      }
      uint8_t *buffer = arena_ + offset;
      ASAN_UNPOISON_MEMORY_REGION(buffer, length);
      if (length != 0) {
         std::memcpy(buffer, bytes, length);
      }
      offset += alignedUp(length) + kRedZone;
      return buffer;
   }

   void append(Frame &frame)
   {
      frame.list = this;
      frame.inList = true;
      frame.prev = tail_;
      (tail_ != nullptr ? tail_->next : head_) = &frame;
      tail_ = &frame;
   }

   void unlink(Frame &frame)
   {
      (frame.prev != nullptr ? frame.prev->next : head_) = frame.next;
      (frame.next != nullptr ? frame.next->prev : tail_) = frame.prev;
      frame.prev = nullptr;
      frame.next = nullptr;
      frame.inList = false;
   }

   // Closes a released frame's buffers: a later read through a kept
   // pointer is a use after free.
   void poisonBuffers(const Frame &frame)
   {
      for (uint32_t element = 0; element < frame.sgArray.numElems; ++element) {
         ASAN_POISON_MEMORY_REGION(elements_[frame.firstElement + element].data,
                                   elements_[frame.firstElement + element].length);
      }
      ASAN_POISON_MEMORY_REGION(frame.mapped, frame.mappedLen);
   }

   // Copies frame bytes out of its elements; false past the frame's end.
   bool copyOut(const Frame &frame, uint32_t offset, uint32_t length, uint8_t *dst) const
   {
      if (offset > frame.length || length > frame.length - offset) {
         return false;
      }
      uint32_t begin = 0;
      for (uint32_t element = 0; element < frame.sgArray.numElems && length != 0; ++element) {
         const Element &part = elements_[frame.firstElement + element];
         const uint32_t end = begin + part.length;
         if (offset < end) {
            const uint32_t take = std::min(length, end - offset);
            std::memcpy(dst, part.data + (offset - begin), take);
            dst += take;
            offset += take;
            length -= take;
         }
         begin = end;
      }
      return true;
   }

   Frame *head() const { return head_; }
   Frame &frameAt(size_t index) { return frames_[index]; }
   orr_SgElem &sgElem(size_t index) { return sgElems_[index]; }
   Element &element(size_t index) { return elements_[index]; }
   const Element &element(size_t index) const { return elements_[index]; }
   size_t elementCount() const { return elementCount_; }
   const Frame &frameOf(const Element &element) const { return frames_[element.frame]; }
   size_t frameCount() const { return frameCount_; }
   void countRelease() { ++releasedCount_; }

   orr_MA base = 0;

private:
   FrameStore &store_;
   size_t frameCount_;
   struct Free {
      void operator()(uint8_t *storage) const { std::free(storage); }
   };
   size_t elementCount_;
   std::unique_ptr<uint8_t, Free> storage_;
   Frame *frames_ = nullptr;
   orr_SgElem *sgElems_ = nullptr;
   Element *elements_ = nullptr;
   size_t arenaSize_;
   uint8_t *arena_ = nullptr;
   Frame *head_ = nullptr;
   Frame *tail_ = nullptr;
   size_t releasedCount_ = 0;
};

namespace {

// The frame operations' check: a live frame of some list, else an abort
// that says what the pointer was.
[[noreturn]] void notLive(const orr_Pkt *pkt, const char *op)
{
   if (pkt == nullptr) {
      fatal(std::string(op) + ": null frame");
   }
   if (static_cast<const FrameStore::Frame *>(pkt)->magic == kReleasedMagic) {
      fatal(std::string(op) + ": frame " + pointerText(pkt) + " used after orr_PktRelease");
   }
   fatal(std::string(op) + ": " + pointerText(pkt) + " is not a frame the host handed out");
}

inline FrameStore::Frame &checked(const orr_Pkt *pkt, const char *op)
{
   auto *frame = static_cast<FrameStore::Frame *>(const_cast<orr_Pkt *>(pkt));
   if (pkt == nullptr || frame->magic != kFrameMagic) [[unlikely]] {
      notLive(pkt, op);
   }
   return *frame;
}

}  // namespace

FrameStore::FrameStore(Violations &violations, FaultTable &faults) : violations_(violations), faults_(faults) {}

FrameStore::~FrameStore() = default;

std::unique_ptr<FrameList> FrameStore::makeList(const std::vector<FrameSpec> &frameSpecs, uint32_t minMappedLen)
{
   std::vector<FrameInput> inputs(frameSpecs.size());
   for (size_t index = 0; index < frameSpecs.size(); ++index) {
      const FrameSpec &frameSpec = frameSpecs[index];
      inputs[index] =
         FrameInput{frameSpec.bytes, frameSpec.vlanId, frameSpec.untag, frameSpec.split, frameSpec.mappedLen};
   }
   return build(inputs, minMappedLen);
}

std::unique_ptr<FrameList> FrameStore::makeList(std::span<const FrameView> frames, uint32_t minMappedLen)
{
   std::vector<FrameInput> inputs(frames.size());
   for (size_t index = 0; index < frames.size(); ++index) {
      inputs[index] = FrameInput{frames[index].bytes, frames[index].vlanId, frames[index].untag, {}, {}};
   }
   return build(inputs, minMappedLen);
}

std::unique_ptr<FrameList> FrameStore::build(std::span<const FrameInput> inputs, uint32_t minMappedLen)
{
   // A frame as the filter sees it: untagged where asked, cut into elements.
   struct Shape {
      std::span<const uint8_t> bytes;   // the caller's, or `untagged`
      uint16_t vlanId = 0;
      size_t splitCount = 0;            // elements from the caller's split
      uint32_t rest = 0;                // bytes left after them
      bool restElement = false;
      uint32_t mappedLen = 0;
   };
   std::vector<Shape> shapes(inputs.size());
   std::vector<std::vector<uint8_t>> untagged;
   size_t elementCount = 0;
   size_t arenaSize = kRedZone;
   for (size_t index = 0; index < inputs.size(); ++index) {
      const FrameInput &input = inputs[index];
      Shape &shape = shapes[index];
      shape.bytes = input.bytes;
      shape.vlanId = input.vlanId;
      const auto &bytes = input.bytes;
      if (input.untag) {
         const std::optional<uint16_t> outer = outerTagVlan(bytes);
         const size_t untaggedLen = bytes.size() - (outer ? kVlanTagLen : 0);
         if (outer || switchPaddedLength(untaggedLen) != untaggedLen) {
            auto &copy = untagged.emplace_back(bytes.begin(), bytes.end());
            if (outer) {
               shape.vlanId = *outer;
               copy.erase(copy.begin() + 12, copy.begin() + 12 + kVlanTagLen);
            }
            copy.resize(switchPaddedLength(copy.size()), 0);
            shape.bytes = copy;
         }
      }
      if (shape.bytes.size() > UINT32_MAX) {
         throw std::invalid_argument("frame too long");
      }
      const auto length = static_cast<uint32_t>(shape.bytes.size());
      uint64_t total = 0;
      for (uint32_t part : input.split) {
         total += part;
      }
      if (total > length) {
         throw std::invalid_argument("split of " + std::to_string(total) + " bytes for a frame of " +
                                     std::to_string(length));
      }
      shape.splitCount = input.split.size();
      shape.rest = length - static_cast<uint32_t>(total);
      shape.restElement = input.split.empty() || shape.rest != 0;
      const size_t elements = shape.splitCount + (shape.restElement ? 1 : 0);
      if (elements > UINT16_MAX) {
         throw std::invalid_argument("too many scatter-gather elements");
      }
      if (input.mappedLen) {
         if (*input.mappedLen > length) {
            throw std::invalid_argument("mapped length beyond the frame");
         }
         shape.mappedLen = *input.mappedLen;
      } else {
         const uint32_t first = shape.splitCount != 0 ? input.split.front() : shape.rest;
         shape.mappedLen = std::min(std::max(first, minMappedLen), length);
      }
      // Exactly what place() takes: each buffer rounded up on its own, and its red zone.
      elementCount += elements;
      for (uint32_t part : input.split) {
         arenaSize += alignedUp(part) + kRedZone;
      }
      if (shape.restElement) {
         arenaSize += alignedUp(shape.rest) + kRedZone;
      }
      arenaSize += alignedUp(shape.mappedLen) + kRedZone;
   }

   auto list = std::make_unique<List>(*this, inputs.size(), elementCount, arenaSize);
   size_t offset = kRedZone;
   size_t element = 0;
   for (size_t index = 0; index < inputs.size(); ++index) {
      const Shape &shape = shapes[index];
      Frame &frame = list->frameAt(index);
      frame.index = index;
      frame.length = static_cast<uint32_t>(shape.bytes.size());
      frame.vlanId = shape.vlanId;
      frame.firstElement = static_cast<uint32_t>(element);
      const auto addElement = [&](uint32_t from, uint32_t length) {
         List::Element &part = list->element(element);
         part.data = list->place(offset, shape.bytes.data() + from, length);
         part.length = length;
         part.frame = static_cast<uint32_t>(index);
         list->sgElem(element) = orr_SgElem{0, length, 0};   // the address once the list has its range
         ++element;
      };
      uint32_t from = 0;
      for (size_t part = 0; part < shape.splitCount; ++part) {
         addElement(from, inputs[index].split[part]);
         from += inputs[index].split[part];
      }
      if (shape.restElement) {
         addElement(from, shape.rest);
      }
      frame.sgArray.numElems = static_cast<uint16_t>(element - frame.firstElement);
      frame.mappedLen = shape.mappedLen;
      frame.mapped = list->place(offset, shape.bytes.data(), shape.mappedLen);

      const FrameHeaders headers = findHeaders(shape.bytes);
      for (size_t layer = 0; layer < headers.entries.size(); ++layer) {
         if (headers.entries[layer]) {
            frame.entries[layer] = *headers.entries[layer];
            frame.present = static_cast<uint8_t>(frame.present | (1u << layer));
         }
      }
      list->append(frame);
   }

   // The list's machine address range: a slot per element (at least one,
   // so that no two lists start at the same address).
   list->base = nextBase_.fetch_add(std::max<size_t>(elementCount, 1) << kElementSlotShift);
   for (size_t index = 0; index < elementCount; ++index) {
      list->sgElem(index).addr = list->base + (static_cast<orr_MA>(index) << kElementSlotShift);
   }
   {
      std::unique_lock guard(listsMutex_);
      lists_.emplace(list->base, list.get());
   }
   return list;
}

void FrameStore::forget(const List &list)
{
   std::unique_lock guard(listsMutex_);
   lists_.erase(list.base);
}

uint64_t FrameStore::outstandingMappings() const
{
   std::shared_lock guard(listsMutex_);
   uint64_t outstanding = 0;
   for (const auto &[base, list] : lists_) {
      for (size_t index = 0; index < list->frameCount(); ++index) {
         outstanding += list->frameAt(index).outstanding();
      }
   }
   return outstanding;
}

uint64_t FrameStore::releases() const
{
   return static_cast<uint64_t>(releases_.value());
}

inline uint8_t *FrameStore::mappedPointer(orr_Pkt *pkt)
{
   return checked(pkt, "orr_PktFrameMappedPointerGet").mapped;
}

inline uint32_t FrameStore::frameLen(const orr_Pkt *pkt)
{
   return checked(pkt, "orr_PktFrameLenGet").length;
}

inline uint32_t FrameStore::mappedLen(const orr_Pkt *pkt)
{
   return checked(pkt, "orr_PktFrameMappedLenGet").mappedLen;
}

inline uint16_t FrameStore::vlanId(const orr_Pkt *pkt)
{
   return checked(pkt, "orr_PktVlanIDGet").vlanId;
}

orr_Status FrameStore::copyBytesOut(const orr_Pkt *pkt, uint32_t offset, uint32_t length, void *dst)
{
   Frame &frame = checked(pkt, "orr_PktCopyBytesOut");
   if (auto status = faults_.hit(faultPoint("orr_PktCopyBytesOut"))) {
      return *status;
   }
   if (dst == nullptr && length != 0) {
      return ORR_BAD_PARAM;
   }
   return frame.list->copyOut(frame, offset, length, static_cast<uint8_t *>(dst)) ? ORR_OK : ORR_BAD_PARAM;
}

void FrameStore::release(orr_Pkt *pkt)
{
   if (pkt == nullptr) {
      fatal("orr_PktRelease: null frame");
   }
   auto *frame = static_cast<Frame *>(pkt);
   if (frame->magic == kReleasedMagic) {
      fatal("orr_PktRelease: frame " + pointerText(pkt) + " released twice");
   }
   checked(pkt, "orr_PktRelease");
   if (frame->inList) {
      fatal("orr_PktRelease: frame " + pointerText(pkt) + " is still in a list");
   }
   const uint32_t outstanding = frame->outstanding();
   frame->dropMappings();
   frame->list->poisonBuffers(*frame);
   frame->magic = kReleasedMagic;
   frame->list->countRelease();
   releases_.add(1);
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
   if (index >= frame.sgArray.numElems) {
      return nullptr;
   }
   return &frame.list->sgElem(frame.firstElement + index);
}

orr_Status FrameStore::machineToVirtual(orr_MA addr, uint32_t length, void **va)
{
   if (auto status = faults_.hit(faultPoint("orr_MA2VA"))) {
      return *status;
   }
   if (va == nullptr) {
      return ORR_BAD_PARAM;
   }
   std::shared_lock guard(listsMutex_);
   auto next = lists_.upper_bound(addr);
   if (next == lists_.begin()) {
      return ORR_BAD_PARAM;
   }
   const List &list = *std::prev(next)->second;
   const uint64_t slot = (addr - list.base) >> kElementSlotShift;
   if (slot >= list.elementCount()) {
      return ORR_BAD_PARAM;
   }
   const List::Element &element = list.element(slot);
   if (list.frameOf(element).magic != kFrameMagic) {
      return ORR_BAD_PARAM;   // the frame was released
   }
   const uint64_t into = addr - (list.base + (slot << kElementSlotShift));
   if (into > element.length || length > element.length - into) {
      return ORR_BAD_PARAM;
   }
   *va = element.data + into;
   return ORR_OK;
}

inline orr_Status FrameStore::headerFind(orr_Pkt *pkt, orr_PktLayer layer, uint32_t classMask, uint32_t instance,
                                  orr_PktHeaderEntry **entry)
{
   Frame &frame = checked(pkt, "orr_PktHeaderFind");
   if (auto status = faults_.hit(faultPoint("orr_PktHeaderFind"))) [[unlikely]] {
      return *status;
   }
   if (entry == nullptr || layer > ORR_PKT_LAYER_4) {
      return ORR_BAD_PARAM;
   }
   // A frame has at most one header per layer: only instance 1 exists.
   if (instance != 1 || (frame.present & (1u << layer)) == 0 || (classMask & headerClassOf(layer)) == 0) {
      return ORR_NOT_FOUND;
   }
   *entry = &frame.entries[layer];
   return ORR_OK;
}

inline orr_Status FrameStore::headerDataGet(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t **data)
{
   Frame &frame = checked(pkt, "orr_PktHeaderDataGet");
   if (auto status = faults_.hit(faultPoint("orr_PktHeaderDataGet"))) [[unlikely]] {
      return *status;
   }
   // Compared as addresses: an entry from elsewhere is not one of the frame's.
   const auto address = reinterpret_cast<uintptr_t>(entry);
   const auto first = reinterpret_cast<uintptr_t>(frame.entries.data());
   const size_t layer = (address - first) / sizeof(orr_PktHeaderEntry);
   if (data == nullptr || entry == nullptr || address < first || layer >= frame.entries.size() ||
       address != first + layer * sizeof(orr_PktHeaderEntry) || (frame.present & (1u << layer)) == 0) {
      return ORR_BAD_PARAM;
   }
   const uint32_t offset = entry->offset;
   const uint32_t length = entry->length;
   const uint32_t quick = frame.quickCount.load(std::memory_order_relaxed);
   if (offset + length <= frame.mappedLen && quick < kQuickMappings) {
      frame.quickLayers = static_cast<uint16_t>(frame.quickLayers | (layer << (2 * quick)));
      frame.quickCount.store(static_cast<uint8_t>(quick + 1), std::memory_order_relaxed);
      *data = frame.quickData(static_cast<uint32_t>(layer));
      return ORR_OK;
   }
   Frame::Mapping mapping{entry, nullptr, nullptr};
   if (offset + length <= frame.mappedLen) {
      mapping.data = frame.mapped + offset;
   } else {
      uint32_t begin = 0;
      for (uint32_t index = 0; index < frame.sgArray.numElems; ++index) {
         const List::Element &part = frame.list->element(frame.firstElement + index);
         if (offset >= begin && offset + length <= begin + part.length && part.length != 0) {
            mapping.data = part.data + (offset - begin);
            break;
         }
         begin += part.length;
      }
   }
   if (mapping.data == nullptr) {
      // Spread over elements: the host maps a copy of its own.
      mapping.copy = new uint8_t[length];
      (void)frame.list->copyOut(frame, offset, length, mapping.copy);
      mapping.data = mapping.copy;
   }
   *data = mapping.data;
   frame.others.push_back(mapping);
   frame.otherCount.store(static_cast<uint32_t>(frame.others.size()), std::memory_order_relaxed);
   return ORR_OK;
}

inline void FrameStore::headerDataRelease(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t *data)
{
   Frame &frame = checked(pkt, "orr_PktHeaderDataRelease");
   // Mappings are mostly given back newest first: search from the top.
   for (uint32_t position = frame.quickCount.load(std::memory_order_relaxed); position-- > 0;) {
      const uint32_t layer = (frame.quickLayers >> (2 * position)) & 3u;
      if (entry == &frame.entries[layer] && data == frame.quickData(layer)) {
         frame.dropQuick(position);
         return;
      }
   }
   for (auto mapping = frame.others.rbegin(); mapping != frame.others.rend(); ++mapping) {
      if (mapping->entry == entry && mapping->data == data) {
         delete[] mapping->copy;
         frame.others.erase(std::next(mapping).base());
         frame.otherCount.store(static_cast<uint32_t>(frame.others.size()), std::memory_order_relaxed);
         return;
      }
   }
   fatal("orr_PktHeaderDataRelease: " + pointerText(data) + " is not a mapping of header " + pointerText(entry) +
         " of frame " + pointerText(pkt));
}

}  // namespace swsec::host

using swsec::host::FrameStore;
using swsec::host::fatal;
using swsec::host::pointerText;
using swsec::host::detail::requireState;

// The frame path's operations come in two parts. The quick part handles
// the common case (a live frame of a live host, a header in the mapped part,
// no fault rule armed, the thread's own counter shard) with no call and no
// saved register; anything else goes, as a tail call, to the full operation,
// which checks, counts and reports everything from the start.
namespace {

using swsec::host::detail::currentState;
using Frame = FrameStore::Frame;

constexpr uint64_t kLiveFrame = swsec::host::kFrameMagic;

// The frame, when the pointer is a live frame. A live frame belongs to a
// list of a live host, so the host need not be checked on this path.
// The lean host trusts a non-null frame to be live: only a broken module
// hands over a released or made-up one.
inline Frame *liveFrame(const orr_Pkt *pkt)
{
   auto *frame = static_cast<Frame *>(const_cast<orr_Pkt *>(pkt));
   if (pkt == nullptr || (!swsec::host::kLeanHost && frame->magic != kLiveFrame)) [[unlikely]] {
      return nullptr;
   }
   return frame;
}

// The host of a live frame.
inline swsec::host::FaultTable &faultTable()
{
   return currentState.load(std::memory_order_relaxed)->faults;
}

[[gnu::noinline]] uint8_t *mappedPointerFull(orr_Pkt *pkt)
{
   return requireState("orr_PktFrameMappedPointerGet").frames.mappedPointer(pkt);
}

[[gnu::noinline]] uint32_t frameLenFull(const orr_Pkt *pkt)
{
   return requireState("orr_PktFrameLenGet").frames.frameLen(pkt);
}

[[gnu::noinline]] uint32_t mappedLenFull(const orr_Pkt *pkt)
{
   return requireState("orr_PktFrameMappedLenGet").frames.mappedLen(pkt);
}

[[gnu::noinline]] uint16_t vlanIdFull(const orr_Pkt *pkt)
{
   return requireState("orr_PktVlanIDGet").frames.vlanId(pkt);
}

[[gnu::noinline]] orr_Status headerFindFull(orr_Pkt *pkt, orr_PktLayer layer, uint32_t classMask, uint32_t instance,
                                            orr_PktHeaderEntry **entry)
{
   return requireState("orr_PktHeaderFind").frames.headerFind(pkt, layer, classMask, instance, entry);
}

[[gnu::noinline]] orr_Status headerDataGetFull(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t **data)
{
   return requireState("orr_PktHeaderDataGet").frames.headerDataGet(pkt, entry, data);
}

[[gnu::noinline]] void headerDataReleaseFull(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t *data)
{
   requireState("orr_PktHeaderDataRelease").frames.headerDataRelease(pkt, entry, data);
}

}  // namespace

ORR_API uint8_t *orr_PktFrameMappedPointerGet(orr_Pkt *pkt)
{
   if (const Frame *frame = liveFrame(pkt)) [[likely]] {
      return frame->mapped;
   }
   return mappedPointerFull(pkt);
}

ORR_API uint32_t orr_PktFrameLenGet(const orr_Pkt *pkt)
{
   if (const Frame *frame = liveFrame(pkt)) [[likely]] {
      return frame->length;
   }
   return frameLenFull(pkt);
}

ORR_API uint32_t orr_PktFrameMappedLenGet(const orr_Pkt *pkt)
{
   if (const Frame *frame = liveFrame(pkt)) [[likely]] {
      return frame->mappedLen;
   }
   return mappedLenFull(pkt);
}

ORR_API uint16_t orr_PktVlanIDGet(const orr_Pkt *pkt)
{
   if (const Frame *frame = liveFrame(pkt)) [[likely]] {
      return frame->vlanId;
   }
   return vlanIdFull(pkt);
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
   Frame *frame = liveFrame(pkt);
   if (frame != nullptr && entry != nullptr && layer <= ORR_PKT_LAYER_4 &&
       faultTable().countQuietly(swsec::host::faultPoint("orr_PktHeaderFind"))) [[likely]] {
      if (instance != 1 || (frame->present & (1u << layer)) == 0 ||
          (classMask & swsec::host::headerClassOf(layer)) == 0) {
         return ORR_NOT_FOUND;
      }
      *entry = &frame->entries[layer];
      return ORR_OK;
   }
   return headerFindFull(pkt, layer, classMask, instance, entry);
}

ORR_API orr_Status orr_PktHeaderDataGet(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t **data)
{
   Frame *frame = liveFrame(pkt);
   if (frame != nullptr && data != nullptr) [[likely]] {
      // Compared as addresses: an entry from elsewhere is not one of the frame's.
      const auto offset = reinterpret_cast<uintptr_t>(entry) - reinterpret_cast<uintptr_t>(frame->entries.data());
      const size_t layer = offset / sizeof(orr_PktHeaderEntry);
      const uint32_t count = frame->quickCount.load(std::memory_order_relaxed);
      if (offset % sizeof(orr_PktHeaderEntry) == 0 && layer < frame->entries.size() &&
          (frame->present & (1u << layer)) != 0 &&
          uint32_t{entry->offset} + entry->length <= frame->mappedLen && count < swsec::host::kQuickMappings &&
          faultTable().countQuietly(swsec::host::faultPoint("orr_PktHeaderDataGet"))) [[likely]] {
         frame->quickLayers = static_cast<uint16_t>(frame->quickLayers | (layer << (2 * count)));
         frame->quickCount.store(static_cast<uint8_t>(count + 1), std::memory_order_relaxed);
         *data = frame->mapped + entry->offset;
         return ORR_OK;
      }
   }
   return headerDataGetFull(pkt, entry, data);
}

ORR_API void orr_PktHeaderDataRelease(orr_Pkt *pkt, orr_PktHeaderEntry *entry, uint8_t *data, uint32_t /*flags*/)
{
   Frame *frame = liveFrame(pkt);
   if (frame != nullptr) [[likely]] {
      const uint32_t count = frame->quickCount.load(std::memory_order_relaxed);
      // The newest quick mapping given back first, as the frame loop does.
      if (count != 0) {
         const uint32_t layer = (frame->quickLayers >> (2 * (count - 1))) & 3u;
         if (entry == &frame->entries[layer] && data == frame->quickData(layer)) [[likely]] {
            frame->quickLayers = static_cast<uint16_t>(frame->quickLayers & ((1u << (2 * (count - 1))) - 1));
            frame->quickCount.store(static_cast<uint8_t>(count - 1), std::memory_order_relaxed);
            return;
         }
      }
   }
   headerDataReleaseFull(pkt, entry, data);
}

// The iterator: the list and the frame it stands on.
ORR_API size_t orr_PktListIterSizeOf(void)
{
   return sizeof(orr_PktListIter);
}

namespace {

orr_PktListIter &startedIter(const orr_PktListIter *iter, const char *op)
{
   if (iter == nullptr || (!swsec::host::kLeanHost && iter->magic != swsec::host::kIterMagic)) [[unlikely]] {
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
