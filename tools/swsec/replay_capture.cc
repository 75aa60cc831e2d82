// Capture reading: libpcap does the formats; a small scan of pcapng blocks
// adds the per-packet direction that libpcap does not hand out.
#include "replay_capture.h"

#include "replay_error.h"

#include <pcap/pcap.h>

#include <array>
#include <cstring>
#include <fstream>

namespace swsec::replay {

namespace {

constexpr uint32_t kBlockSectionHeader = 0x0A0D0D0A;
constexpr uint32_t kBlockPacketObsolete = 0x00000002;
constexpr uint32_t kBlockSimplePacket = 0x00000003;
constexpr uint32_t kBlockEnhancedPacket = 0x00000006;
constexpr uint32_t kByteOrderMagic = 0x1A2B3C4D;
constexpr uint16_t kOptionEnd = 0;
constexpr uint16_t kOptionFlags = 2;   // epb_flags (and pack_flags of the obsolete block)

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
uint8_t optionDirection(const std::vector<uint8_t> &body, size_t offset, bool swap)
{
   while (offset + 4 <= body.size()) {
      const uint16_t code = load16(&body[offset], swap);
      const uint16_t length = load16(&body[offset + 2], swap);
      offset += 4;
      if (code == kOptionEnd || offset + length > body.size()) {
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
      offset += (length + 3u) & ~size_t{3};
   }
   return kDirUnknown;
}

}  // namespace

std::vector<uint8_t> scanPcapngDirections(const std::string &path)
{
   std::vector<uint8_t> directions;
   std::ifstream in(path, std::ios::binary);
   std::array<uint8_t, 8> head{};
   if (!in.read(reinterpret_cast<char *>(head.data()), head.size()) ||
       load32(head.data(), false) != kBlockSectionHeader) {
      return directions;
   }
   in.seekg(0);
   bool swap = false;
   std::vector<uint8_t> body;
   for (;;) {
      if (!in.read(reinterpret_cast<char *>(head.data()), head.size())) {
         break;   // the end; a short header is libpcap's to report
      }
      uint32_t type = load32(head.data(), swap);
      if (type == kBlockSectionHeader) {
         // Each section states its own byte order in the first body word.
         std::array<uint8_t, 4> magic{};
         if (!in.read(reinterpret_cast<char *>(magic.data()), magic.size())) {
            break;
         }
         swap = load32(magic.data(), false) != kByteOrderMagic;
         in.seekg(-4, std::ios::cur);
      }
      const uint32_t length = load32(&head[4], swap);
      if (length < 12 || length % 4 != 0) {
         throw ReplayError(path + ": corrupt pcapng block (length " + std::to_string(length) + ")");
      }
      body.resize(length - 12);
      if (!in.read(reinterpret_cast<char *>(body.data()), static_cast<std::streamsize>(body.size())) ||
          !in.seekg(4, std::ios::cur)) {
         break;
      }
      if (type == kBlockEnhancedPacket && body.size() >= 20) {
         const uint32_t captured = load32(&body[12], swap);
         const size_t options = 20 + ((size_t{captured} + 3) & ~size_t{3});
         directions.push_back(options <= body.size() ? optionDirection(body, options, swap) : kDirUnknown);
      } else if (type == kBlockPacketObsolete && body.size() >= 20) {
         const uint32_t captured = load32(&body[12], swap);
         const size_t options = 20 + ((size_t{captured} + 3) & ~size_t{3});
         directions.push_back(options <= body.size() ? optionDirection(body, options, swap) : kDirUnknown);
      } else if (type == kBlockSimplePacket) {
         directions.push_back(kDirUnknown);
      }
   }
   return directions;
}

CaptureReader::CaptureReader(const std::string &path) : path_(path)
{
   std::array<char, PCAP_ERRBUF_SIZE> error{};
   handle_ = pcap_open_offline_with_tstamp_precision(path.c_str(), PCAP_TSTAMP_PRECISION_NANO, error.data());
   if (handle_ == nullptr) {
      throw ReplayError(path + ": cannot read capture: " + error.data());
   }
   if (pcap_datalink(handle_) != DLT_EN10MB) {
      const char *name = pcap_datalink_val_to_name(pcap_datalink(handle_));
      pcap_close(handle_);
      throw ReplayError(path + ": not an Ethernet capture (link type " +
                        (name != nullptr ? name : std::to_string(pcap_datalink(handle_))) + ")");
   }
   try {
      directions_ = scanPcapngDirections(path);
   } catch (...) {
      pcap_close(handle_);
      throw;
   }
   std::ifstream size(path, std::ios::binary | std::ios::ate);
   fileSize_ = size ? static_cast<uint64_t>(size.tellg()) : 0;
}

CaptureReader::~CaptureReader()
{
   pcap_close(handle_);
}

bool CaptureReader::next(CaptureFrame &frame)
{
   pcap_pkthdr *header = nullptr;
   const u_char *data = nullptr;
   const int rc = pcap_next_ex(handle_, &header, &data);
   if (rc == PCAP_ERROR_BREAK) {
      return false;
   }
   if (rc != 1) {
      throw ReplayError(path_ + ": corrupt capture after frame " + std::to_string(count_) + ": " +
                        pcap_geterr(handle_));
   }
   ++count_;
   if (header->caplen < header->len) {
      throw ReplayError(path_ + ": frame " + std::to_string(count_) + " is truncated (" +
                        std::to_string(header->caplen) + " of " + std::to_string(header->len) +
                        " bytes captured)");
   }
   frame.index = count_;
   frame.timeNs = static_cast<int64_t>(header->ts.tv_sec) * 1'000'000'000 + static_cast<int64_t>(header->ts.tv_usec);
   frame.bytes = {data, header->caplen};
   frame.recordedDirection = count_ <= directions_.size() ? directions_[count_ - 1] : kDirUnknown;
   bytesRead_ += header->caplen + 16u;
   return true;
}

}  // namespace swsec::replay
