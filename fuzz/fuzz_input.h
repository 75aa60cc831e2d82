// Reads a fuzzer's input from the front: control bytes first, then the rest
// as the payload. Reading past the end yields zeros, so that every input,
// however short, is a valid description.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <vector>

namespace swsec::fuzz {

class FuzzInput {
public:
   FuzzInput(const uint8_t *data, size_t size) : data_(data), size_(size) {}

   uint8_t byte()
   {
      return pos_ < size_ ? data_[pos_++] : 0;
   }

   uint16_t u16()
   {
      const uint16_t high = byte();
      return static_cast<uint16_t>(high << 8 | byte());
   }

   uint32_t u32()
   {
      const uint32_t high = u16();
      return high << 16 | u16();
   }

   // The next `count` bytes, or fewer when the input ends first.
   std::vector<uint8_t> bytes(size_t count)
   {
      const size_t take = std::min(count, size_ - pos_);
      std::vector<uint8_t> out(data_ + pos_, data_ + pos_ + take);
      pos_ += take;
      return out;
   }

   std::vector<uint8_t> rest() { return bytes(size_ - pos_); }

   size_t remaining() const { return size_ - pos_; }

private:
   const uint8_t *data_;
   size_t size_;
   size_t pos_ = 0;
};

// Scatter-gather element lengths for a frame of `frameLen` bytes from raw
// input bytes (one byte each, 0 allowed), clamped so that they never run
// past the frame, as the host requires.
inline std::vector<uint32_t> clampSplits(const std::vector<uint8_t> &raw, size_t frameLen)
{
   std::vector<uint32_t> split;
   size_t used = 0;
   for (const uint8_t want : raw) {
      const size_t length = std::min<size_t>(want, frameLen - used);
      split.push_back(static_cast<uint32_t>(length));
      used += length;
   }
   return split;
}

}  // namespace swsec::fuzz
