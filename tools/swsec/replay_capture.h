// Reading a capture file (pcap or pcapng, through libpcap) frame by frame,
// with the direction each pcapng Enhanced Packet Block records, if any.
#pragma once

#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <vector>

struct pcap;

namespace swsec::replay {

// Direction as the filter sees it: ORR_SIFRA_DIR_RX (1) is to the VM,
// ORR_SIFRA_DIR_TX (2) from it; 0 is unknown.
inline constexpr uint8_t kDirUnknown = 0;
inline constexpr uint8_t kDirToVm = 1;
inline constexpr uint8_t kDirFromVm = 2;

struct CaptureFrame {
   uint64_t index = 0;               // 1-based, as capture tools number frames
   int64_t timeNs = 0;               // capture timestamp, nanoseconds since the epoch
   std::span<const uint8_t> bytes;   // valid until the next call of next()
   uint8_t recordedDirection = kDirUnknown;
};

class CaptureReader {
public:
   // Throws ReplayError naming the file when it cannot be opened or is not
   // an Ethernet capture.
   explicit CaptureReader(const std::string &path);
   ~CaptureReader();
   CaptureReader(const CaptureReader &) = delete;
   CaptureReader &operator=(const CaptureReader &) = delete;

   // The next frame, or false at the end. Throws ReplayError on a corrupt
   // file or a frame captured shorter than it was on the wire.
   bool next(CaptureFrame &frame);

   uint64_t fileSize() const { return fileSize_; }
   uint64_t bytesRead() const { return bytesRead_; }

private:
   std::string path_;
   pcap *handle_ = nullptr;
   std::vector<uint8_t> directions_;   // per frame, from pcapng EPB flags
   uint64_t count_ = 0;
   uint64_t fileSize_ = 0;
   uint64_t bytesRead_ = 0;
};

// The direction flags of every packet block of a pcapng file, in file
// order (kDirUnknown where a block records none); empty for other formats.
// Throws ReplayError on a block that runs past the file.
std::vector<uint8_t> scanPcapngDirections(const std::string &path);

}  // namespace swsec::replay
