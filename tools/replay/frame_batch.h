// One direction list being gathered for the port. A capture reader's bytes
// last only until its next frame, so each frame is copied into one arena
// that the batch keeps from list to list: after the first lists, gathering
// a frame allocates nothing. The host's views are made when the list is
// handed over, once the arena no longer moves.
#pragma once

#include "host/host.h"

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <vector>

namespace swsec::replay {

class FrameBatch {
public:
   // Room for `frames` frames and `arenaBytes` of their bytes before growing.
   FrameBatch(size_t frames, size_t arenaBytes);

   bool empty() const { return frames_.empty(); }
   size_t size() const { return frames_.size(); }
   uint8_t direction() const { return direction_; }
   int64_t firstTimeNs() const { return firstTimeNs_; }

   // The first frame sets the list's direction and start time.
   void add(uint64_t index, int64_t timeNs, uint8_t direction, std::span<const uint8_t> bytes);
   // The frames as the host takes them (802.1Q tags to be untagged), valid
   // until the next add() or clear().
   std::span<const host::FrameView> views();
   void clear();

   uint64_t index(size_t frame) const { return frames_[frame].index; }
   int64_t timeNs(size_t frame) const { return frames_[frame].timeNs; }
   std::span<const uint8_t> bytes(size_t frame) const
   {
      return {arena_.get() + frames_[frame].offset, frames_[frame].length};
   }

private:
   void grow(size_t needed);

   struct Frame {
      uint64_t index = 0;
      int64_t timeNs = 0;
      size_t offset = 0;   // into arena_
      size_t length = 0;
   };

   uint8_t direction_ = 0;
   int64_t firstTimeNs_ = 0;
   // Bytes are copied in whole before they are read, so the arena is
   // never zero-filled.
   std::unique_ptr<uint8_t[]> arena_;
   size_t arenaUsed_ = 0;
   size_t arenaSize_ = 0;
   std::vector<Frame> frames_;
   std::vector<host::FrameView> views_;
};

}  // namespace swsec::replay
