// The list arena: bytes appended, offsets kept, views made at hand-over.
#include "replay/frame_batch.h"

#include <algorithm>
#include <cstring>

namespace swsec::replay {

FrameBatch::FrameBatch(size_t frames, size_t arenaBytes)
{
   grow(arenaBytes);
   frames_.reserve(frames);
   views_.reserve(frames);
}

void FrameBatch::grow(size_t needed)
{
   const size_t size = std::max(needed, 2 * arenaSize_);
   auto larger = std::make_unique_for_overwrite<uint8_t[]>(size);
   if (arenaUsed_ != 0) {
      std::memcpy(larger.get(), arena_.get(), arenaUsed_);
   }
   arena_ = std::move(larger);
   arenaSize_ = size;
}

void FrameBatch::add(uint64_t index, int64_t timeNs, uint8_t direction, std::span<const uint8_t> bytes)
{
   if (frames_.empty()) {
      direction_ = direction;
      firstTimeNs_ = timeNs;
   }
   if (bytes.size() > arenaSize_ - arenaUsed_) {
      grow(arenaUsed_ + bytes.size());
   }
   if (!bytes.empty()) {
      std::memcpy(arena_.get() + arenaUsed_, bytes.data(), bytes.size());
   }
   frames_.push_back({index, timeNs, arenaUsed_, bytes.size()});
   arenaUsed_ += bytes.size();
}

std::span<const host::FrameView> FrameBatch::views()
{
   views_.clear();
   for (const Frame &frame : frames_) {
      views_.push_back({std::span<const uint8_t>(arena_.get() + frame.offset, frame.length), 0, true});
   }
   return views_;
}

void FrameBatch::clear()
{
   arenaUsed_ = 0;
   frames_.clear();
   views_.clear();
}

}  // namespace swsec::replay
