// Output captures, written through libpcap in microsecond pcap format, the
// one every reader takes.
#include "replay/pcap_writer.h"

#include "session/error.h"

#include <pcap/pcap.h>

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

namespace swsec::replay {

namespace {

std::string systemError()
{
   return std::strerror(errno);
}

}  // namespace

PcapWriter::PcapWriter(const OutputTarget &target) : named_(target.named), path_(target.path)
{
   const std::string &path = named_;
   std::vector<char> name(path_.begin(), path_.end());
   static constexpr char kSuffix[] = ".partial-XXXXXX";
   name.insert(name.end(), kSuffix, kSuffix + sizeof kSuffix);
   const int fd = mkstemp(name.data());
   if (fd < 0) {
      throw session::InputError(path + ": cannot write: " + systemError());
   }
   tempPath_ = name.data();
   FILE *file = ::fchmod(fd, target.mode) == 0 ? fdopen(fd, "wb") : nullptr;
   if (file == nullptr) {
      const std::string error = systemError();
      ::close(fd);
      std::remove(tempPath_.c_str());
      throw session::InputError(path + ": cannot write: " + error);
   }
   dead_ = pcap_open_dead_with_tstamp_precision(DLT_EN10MB, 262144, PCAP_TSTAMP_PRECISION_MICRO);
   dumper_ = dead_ != nullptr ? pcap_dump_fopen(dead_, file) : nullptr;
   if (dumper_ == nullptr) {
      std::fclose(file);
      discard();
      throw session::InputError(path + ": cannot start a pcap file");
   }
}

PcapWriter::~PcapWriter()
{
   discard();
}

void PcapWriter::discard()
{
   if (dumper_ != nullptr) {
      pcap_dump_close(dumper_);
      dumper_ = nullptr;
   }
   if (dead_ != nullptr) {
      pcap_close(dead_);
      dead_ = nullptr;
   }
   if (!tempPath_.empty()) {
      std::remove(tempPath_.c_str());
      tempPath_.clear();
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
   FILE *file = pcap_dump_file(dumper_);
   const bool failed = pcap_dump_flush(dumper_) != 0 || std::ferror(file) != 0;
   pcap_dump_close(dumper_);   // closes the file
   dumper_ = nullptr;
   if (failed) {
      const std::string error = systemError();
      discard();
      throw session::InputError(named_ + ": write failed: " + error);
   }
   if (std::rename(tempPath_.c_str(), path_.c_str()) != 0) {
      const std::string error = systemError();
      discard();
      throw session::InputError(named_ + ": cannot write: " + error);
   }
   tempPath_.clear();
   discard();
}

}  // namespace swsec::replay
