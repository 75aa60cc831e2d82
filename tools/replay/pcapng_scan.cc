// pcapng blocks walked as their bytes go by. A length is checked against
// the block limit and what remains of the file before a byte of the block is
// kept, and a packet block's body is gathered only as its bytes arrive.
#include "replay/pcapng_scan.h"

#include "replay/capture.h"

#include <algorithm>
#include <cstring>

namespace swsec::replay {

namespace {

constexpr uint32_t kBlockSectionHeader = 0x0A0D0D0A;
constexpr uint32_t kBlockPacketObsolete = 0x00000002;
constexpr uint32_t kBlockSimplePacket = 0x00000003;
constexpr uint32_t kBlockEnhancedPacket = 0x00000006;
constexpr uint32_t kByteOrderMagic = 0x1A2B3C4D;
constexpr uint16_t kOptionEnd = 0;
constexpr uint16_t kOptionFlags = 2;   // epb_flags (and pack_flags of the obsolete block)
constexpr size_t kBlockHeader = 8;     // type, total length
constexpr size_t kSectionHeader = 12;  // and the byte-order magic
constexpr size_t kPacketFixed = 20;    // interface, timestamp, captured and original lengths
constexpr size_t kInitialBodyReserve = size_t{64} << 10;

uint32_t load32(const uint8_t *p, bool swap)
{
   uint32_t v;
   std::memcpy(&v, p, sizeof v);
   return swap ? __builtin_bswap32(v) : v;
}

uint16_t load16(const uint8_t *p, bool swap)
{
   uint16_t v;
   std::memcpy(&v, p, sizeof v);
   return swap ? __builtin_bswap16(v) : v;
}

// The direction in a packet block's options, which start at `offset` of the body.
uint8_t optionDirection(std::span<const uint8_t> body, size_t offset, bool swap)
{
   while (offset + 4 <= body.size()) {
      const uint16_t code = load16(&body[offset], swap);
      const uint16_t length = load16(&body[offset + 2], swap);
      offset += 4;
      if (code == kOptionEnd || length > body.size() - offset) {
         break;
      }
      if (code == kOptionFlags && length == 4) {
         // Bits 0-1: 01 inbound, 10 outbound. The capture is taken on the
         // VM's interface, so inbound frames are the ones delivered to the VM.
         switch (load32(&body[offset], swap) & 0x3u) {
         case 1: return kDirToVm;
         case 2: return kDirFromVm;
         default: return kDirUnknown;
         }
      }
      offset += (size_t{length} + 3u) & ~size_t{3};
   }
   return kDirUnknown;
}

uint8_t packetDirection(std::span<const uint8_t> body, bool swap)
{
   if (body.size() < kPacketFixed) {
      return kDirUnknown;
   }
   const uint64_t captured = load32(&body[12], swap);
   const uint64_t options = kPacketFixed + ((captured + 3) & ~uint64_t{3});
   return options <= body.size() ? optionDirection(body, static_cast<size_t>(options), swap) : kDirUnknown;
}

}  // namespace

void PcapngDirectionScanner::feed(std::span<const uint8_t> bytes)
{
   while (!bytes.empty()) {
      switch (state_) {
      case State::notPcapng:
      case State::failed:
         offset_ += bytes.size();
         return;
      case State::start:
      case State::header: {
         const size_t want = head_.size() >= 4 && load32(head_.data(), false) == kBlockSectionHeader
                                ? kSectionHeader
                                : kBlockHeader;
         const size_t take = std::min(bytes.size(), want - std::min(want, head_.size()));
         head_.insert(head_.end(), bytes.begin(), bytes.begin() + static_cast<ptrdiff_t>(take));
         bytes = bytes.subspan(take);
         offset_ += take;
         if (state_ == State::start && head_.size() >= 4) {
            if (load32(head_.data(), false) != kBlockSectionHeader) {
               state_ = State::notPcapng;
               continue;
            }
            state_ = State::header;
         }
         const size_t needed = head_.size() >= 4 && load32(head_.data(), false) == kBlockSectionHeader
                                  ? kSectionHeader
                                  : kBlockHeader;
         if (head_.size() == needed) {
            startBlock();
         }
         break;
      }
      case State::body: {
         const size_t take = static_cast<size_t>(std::min<uint64_t>(bytes.size(), bodyLeft_));
         if (keepBody_) {
            body_.insert(body_.end(), bytes.begin(), bytes.begin() + static_cast<ptrdiff_t>(take));
         }
         bytes = bytes.subspan(take);
         offset_ += take;
         bodyLeft_ -= take;
         if (bodyLeft_ == 0) {
            endBlock();
         }
         break;
      }
      }
   }
}

void PcapngDirectionScanner::startBlock()
{
   type_ = load32(head_.data(), swap_);
   if (type_ == kBlockSectionHeader) {
      // Each section states its own byte order in the first body word.
      const uint32_t magic = load32(&head_[8], false);
      if (magic != kByteOrderMagic && magic != __builtin_bswap32(kByteOrderMagic)) {
         error_ = "corrupt pcapng section header at offset " + std::to_string(blockStart_);
         state_ = State::failed;
         return;
      }
      swap_ = magic != kByteOrderMagic;
   }
   length_ = load32(&head_[4], swap_);
   const uint64_t remaining = fileSize_ ? *fileSize_ - std::min(*fileSize_, blockStart_) : UINT64_MAX;
   if (length_ < head_.size() + 4 || length_ % 4 != 0 || length_ > kMaxBlockBytes || length_ > remaining) {
      error_ = "corrupt pcapng block at offset " + std::to_string(blockStart_) + " (length " +
               std::to_string(length_) +
               (length_ > remaining ? ", " + std::to_string(remaining) + " bytes left in the file)" : ")");
      state_ = State::failed;
      return;
   }
   bodyLeft_ = length_ - head_.size();
   keepBody_ = type_ == kBlockEnhancedPacket || type_ == kBlockPacketObsolete;
   body_.clear();
   if (keepBody_) {
      body_.reserve(std::min<size_t>(bodyLeft_, kInitialBodyReserve));
   }
   state_ = State::body;
}

void PcapngDirectionScanner::endBlock()
{
   if (keepBody_) {
      // The gathered bytes end with the trailing copy of the length.
      directions_.push_back(packetDirection(std::span<const uint8_t>(body_).first(body_.size() - 4), swap_));
   } else if (type_ == kBlockSimplePacket) {
      directions_.push_back(kDirUnknown);
   }
   blockStart_ += length_;
   head_.clear();
   state_ = State::header;
}

uint8_t PcapngDirectionScanner::takeDirection()
{
   if (directions_.empty()) {
      return kDirUnknown;
   }
   const uint8_t direction = directions_.front();
   directions_.pop_front();
   return direction;
}

}  // namespace swsec::replay
