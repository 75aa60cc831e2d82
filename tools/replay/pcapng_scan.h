// The per-packet direction of a pcapng file, which libpcap does not hand
// out: the bytes libpcap reads are fed here as they pass, block by block,
// so that a pipe is read once and memory stays bounded by one block.
#pragma once

#include <cstdint>
#include <deque>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace swsec::replay {

class PcapngDirectionScanner {
public:
   // The largest block taken, whatever the file says: the limit libpcap
   // itself applies to a pcapng block (16 MiB).
   static constexpr uint32_t kMaxBlockBytes = 16u << 20;

   // `fileSize`: the bytes the file holds, when known (a regular file);
   // every block length is checked against what remains of it.
   explicit PcapngDirectionScanner(std::optional<uint64_t> fileSize) : fileSize_(fileSize) {}

   // Takes the next bytes of the file. After an error the rest is ignored.
   void feed(std::span<const uint8_t> bytes);

   // The direction of the next packet block, in file order (kDirUnknown
   // when it records none, or the file is not pcapng).
   uint8_t takeDirection();

   bool isPcapng() const { return state_ != State::notPcapng && state_ != State::start; }
   // "" or what is wrong with the file (a block longer than what remains).
   const std::string &error() const { return error_; }
   uint64_t offset() const { return offset_; }

private:
   enum class State : uint8_t { start, notPcapng, header, body, failed };

   void startBlock();
   void endBlock();

   std::optional<uint64_t> fileSize_;
   State state_ = State::start;
   std::string error_;
   uint64_t offset_ = 0;        // bytes fed so far
   uint64_t blockStart_ = 0;    // offset of the block being read
   std::vector<uint8_t> head_;  // type, length (and a section's byte-order magic)
   bool swap_ = false;          // the section's byte order differs from ours
   uint32_t type_ = 0;
   uint32_t length_ = 0;
   uint64_t bodyLeft_ = 0;      // bytes of the block after its header still to come
   bool keepBody_ = false;      // a packet block: its body is gathered for the options
   std::vector<uint8_t> body_;
   std::deque<uint8_t> directions_;
};

}  // namespace swsec::replay
