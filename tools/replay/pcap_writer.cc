// Output captures, written through libpcap in microsecond pcap format, the
// one every reader takes.
#include "replay/pcap_writer.h"

#include "session/error.h"

#include <pcap/pcap.h>

#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

namespace swsec::replay {

PcapWriter::PcapWriter(const OutputTarget &target) : file_(target.path, target.mode, target.named)
{
   // libpcap closes the stream it writes to; the writer keeps its own descriptor
   // to sync and rename by.
   const int fd = ::dup(file_.fd());
   FILE *stream = fd >= 0 ? fdopen(fd, "wb") : nullptr;
   if (stream == nullptr) {
      const std::string error = std::strerror(errno);
      if (fd >= 0) {
         ::close(fd);
      }
      throw session::InputError(target.named + ": cannot write: " + error);
   }
   dead_ = pcap_open_dead_with_tstamp_precision(DLT_EN10MB, 262144, PCAP_TSTAMP_PRECISION_MICRO);
   dumper_ = dead_ != nullptr ? pcap_dump_fopen(dead_, stream) : nullptr;
   if (dumper_ == nullptr) {
      std::fclose(stream);
      closeDumper();
      throw session::InputError(target.named + ": cannot start a pcap file");
   }
}

PcapWriter::~PcapWriter()
{
   closeDumper();
}

void PcapWriter::closeDumper()
{
   if (dumper_ != nullptr) {
      pcap_dump_close(dumper_);
      dumper_ = nullptr;
   }
   if (dead_ != nullptr) {
      pcap_close(dead_);
      dead_ = nullptr;
   }
}
void PcapWriter::write(int64_t timeNs, std::span<const uint8_t> bytes)
{
   pcap_pkthdr header{};
   // Floor division, so that a time before 1970 keeps microseconds in 0..999999.
   const int64_t micros = timeNs / 1000 - (timeNs % 1000 < 0 ? 1 : 0);
   header.ts.tv_sec = static_cast<time_t>(micros / 1'000'000 - (micros % 1'000'000 < 0 ? 1 : 0));
   header.ts.tv_usec = static_cast<suseconds_t>(micros - static_cast<int64_t>(header.ts.tv_sec) * 1'000'000);
   header.caplen = static_cast<bpf_u_int32>(bytes.size());
   header.len = header.caplen;
   pcap_dump(reinterpret_cast<u_char *>(dumper_), &header, bytes.data());
}

void PcapWriter::commit()
{
   FILE *stream = pcap_dump_file(dumper_);
   const bool failed = pcap_dump_flush(dumper_) != 0 || std::ferror(stream) != 0;
   const std::string error = std::strerror(errno);
   closeDumper();
   if (failed) {
      throw session::InputError(file_.named() + ": write failed: " + error);
   }
   file_.commit();
}

}  // namespace swsec::replay
