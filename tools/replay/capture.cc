// Capture reading: libpcap does the formats, reading through a stdio stream
// of our own whose bytes also go to the pcapng direction scanner.
#include "replay/capture.h"

#include "session/error.h"

#include <pcap/pcap.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>

namespace swsec::replay {

CaptureReader::CaptureReader(const std::string &path) : path_(path)
{
   fd_ = path == "-" ? ::dup(STDIN_FILENO) : ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
   if (fd_ < 0) {
      throw session::InputError(path + ": cannot read capture: " + std::strerror(errno));
   }
   struct stat st {};
   if (::fstat(fd_, &st) == 0 && S_ISREG(st.st_mode)) {
      fileSize_ = static_cast<uint64_t>(st.st_size);
      identity_ = FileIdentity{st.st_dev, st.st_ino};
      scanner_ = PcapngDirectionScanner(fileSize_);
   } else if (::fstat(fd_, &st) == 0 && S_ISDIR(st.st_mode)) {
      ::close(fd_);
      fd_ = -1;
      throw session::InputError(path + ": cannot read capture: it is a directory");
   }
   const cookie_io_functions_t io{readCookie, nullptr, nullptr, closeCookie};
   FILE *stream = fopencookie(this, "r", io);
   if (stream == nullptr) {
      ::close(fd_);
      fd_ = -1;
      throw session::InputError(path + ": cannot read capture: " + std::strerror(errno));
   }
   std::array<char, PCAP_ERRBUF_SIZE> error{};
   handle_ = pcap_fopen_offline_with_tstamp_precision(stream, PCAP_TSTAMP_PRECISION_NANO, error.data());
   if (handle_ == nullptr) {
      std::fclose(stream);   // closes the descriptor too
      throw session::InputError(path + ": cannot read capture: " +
                        (scanner_.error().empty() ? std::string(error.data()) : scanner_.error()));
   }
   const int linkType = pcap_datalink(handle_);
   if (linkType != DLT_EN10MB) {
      const char *name = pcap_datalink_val_to_name(linkType);
      const std::string named = name != nullptr ? name : std::to_string(linkType);
      pcap_close(handle_);
      handle_ = nullptr;
      throw session::InputError(path + ": not an Ethernet capture (link type " + named + ")");
   }
}

CaptureReader::~CaptureReader()
{
   if (handle_ != nullptr) {
      pcap_close(handle_);
   }
}

ssize_t CaptureReader::readCookie(void *cookie, char *buffer, size_t size)
{
   auto *reader = static_cast<CaptureReader *>(cookie);
   // A block the scanner refused ends the stream here: libpcap then sees a
   // short file, and the scanner's error is the one reported.
   if (!reader->scanner_.error().empty()) {
      return -1;
   }
   ssize_t got;
   do {
      got = ::read(reader->fd_, buffer, size);
   } while (got < 0 && errno == EINTR);
   if (got > 0) {
      reader->scanner_.feed({reinterpret_cast<const uint8_t *>(buffer), static_cast<size_t>(got)});
   }
   return got;
}

int CaptureReader::closeCookie(void *cookie)
{
   auto *reader = static_cast<CaptureReader *>(cookie);
   const int rc = reader->fd_ >= 0 ? ::close(reader->fd_) : 0;
   reader->fd_ = -1;
   return rc;
}

void CaptureReader::fail(const std::string &what)
{
   throw session::InputError(path_ + ": " + (scanner_.error().empty() ? what : scanner_.error()));
}

bool CaptureReader::next(CaptureFrame &frame)
{
   pcap_pkthdr *header = nullptr;
   const u_char *data = nullptr;
   const int rc = pcap_next_ex(handle_, &header, &data);
   if (!scanner_.error().empty()) {
      fail("");
   }
   if (rc == PCAP_ERROR_BREAK) {
      return false;
   }
   if (rc != 1) {
      fail("corrupt capture after frame " + std::to_string(count_) + ": " + pcap_geterr(handle_));
   }
   ++count_;
   if (header->caplen < header->len) {
      fail("frame " + std::to_string(count_) + " is truncated (" + std::to_string(header->caplen) + " of " +
           std::to_string(header->len) + " bytes captured)");
   }
   frame.index = count_;
   // tv_usec holds nanoseconds at nanosecond precision. The product is
   // checked: a pcapng timestamp can be any 64-bit count of its units.
   int64_t ns = 0;
   frame.timeInRange = !__builtin_mul_overflow(static_cast<int64_t>(header->ts.tv_sec), int64_t{1'000'000'000}, &ns) &&
                       !__builtin_add_overflow(ns, static_cast<int64_t>(header->ts.tv_usec), &ns) &&
                       ns <= kMaxCaptureTimeNs && ns >= -kMaxCaptureTimeNs;
   frame.timeNs = frame.timeInRange ? ns : 0;
   frame.bytes = {data, header->caplen};
   frame.recordedDirection = scanner_.takeDirection();
   return true;
}

}  // namespace swsec::replay
