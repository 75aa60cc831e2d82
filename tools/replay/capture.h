// Reading a capture file (pcap or pcapng, through libpcap) frame by frame,
// with the direction each pcapng packet block records, if any. The file is
// read once, in order, so a pipe or "-" (standard input) works as a file does.
#pragma once

#include "replay/pcapng_scan.h"

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>

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
   bool timeInRange = true;          // false: the timestamp does not fit (timeNs is then 0)
   std::span<const uint8_t> bytes;   // valid until the next call of next()
   uint8_t recordedDirection = kDirUnknown;
};

// Timestamps are kept within +-2^62 ns (about 146 years either side of
// 1970), so that the difference of any two fits in 64 bits.
inline constexpr int64_t kMaxCaptureTimeNs = int64_t{1} << 62;

// The identity of a file, to tell that two paths name the same one.
struct FileIdentity {
   dev_t device = 0;
   ino_t inode = 0;
   bool operator==(const FileIdentity &) const = default;
};

class CaptureReader {
public:
   // Throws session::InputError naming the file when it cannot be opened or is not
   // an Ethernet capture. "-" is standard input.
   explicit CaptureReader(const std::string &path);
   ~CaptureReader();
   CaptureReader(const CaptureReader &) = delete;
   CaptureReader &operator=(const CaptureReader &) = delete;

   // The next frame, or false at the end. Throws session::InputError on a corrupt
   // file or a frame captured shorter than it was on the wire.
   bool next(CaptureFrame &frame);

   uint64_t fileSize() const { return fileSize_; }   // 0 when unknown (a pipe)
   uint64_t bytesRead() const { return scanner_.offset(); }
   // The file's identity when it is a regular file.
   std::optional<FileIdentity> identity() const { return identity_; }

private:
   static ssize_t readCookie(void *cookie, char *buffer, size_t size);
   static int closeCookie(void *cookie);
   [[noreturn]] void fail(const std::string &what);

   std::string path_;
   int fd_ = -1;
   pcap *handle_ = nullptr;
   PcapngDirectionScanner scanner_{std::nullopt};
   uint64_t count_ = 0;
   uint64_t fileSize_ = 0;
   std::optional<FileIdentity> identity_;
};

}  // namespace swsec::replay
