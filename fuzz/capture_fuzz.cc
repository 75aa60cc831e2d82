// Capture files as an attacker writes them, read as `swsec replay` reads
// them: the whole file through libpcap and the pcapng direction scanner
// from a file of known size, and the scanner alone as from a pipe, fed in
// pieces whose sizes the input's first byte picks. Every length the file
// states is bounded by what remains of it; the run's RSS limit catches an
// allocation sized by a length that was not. Each frame is described as the
// verbose report describes a dropped one.
#include "replay/capture.h"
#include "replay/describe.h"
#include "session/error.h"
#include "replay/pcapng_scan.h"

#include <sys/mman.h>
#include <unistd.h>

#include <cstdint>
#include <string>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
   const int fd = memfd_create("capture", MFD_CLOEXEC);
   if (fd < 0) {
      return 0;
   }
   if (size == 0 || ::write(fd, data, size) == static_cast<ssize_t>(size)) {
      try {
         swsec::replay::CaptureReader reader("/proc/self/fd/" + std::to_string(fd));
         swsec::replay::CaptureFrame frame;
         uint64_t bytes = 0;
         while (reader.next(frame)) {
            for (uint8_t byte : frame.bytes) {
               bytes += byte;   // every byte handed out is readable
            }
            // As the verbose report describes a dropped frame, within its bytes.
            bytes += swsec::replay::describeFrame(frame.bytes).size();
         }
         (void)bytes;
      } catch (const swsec::session::InputError &) {
         // Refused with a message: what a hostile file should get.
      }
   }
   ::close(fd);

   swsec::replay::PcapngDirectionScanner piped(std::nullopt);
   const size_t piece = size != 0 ? size_t{data[0]} % 64 + 1 : 1;
   for (size_t at = 0; at < size; at += piece) {
      piped.feed({data + at, std::min(piece, size - at)});
      (void)piped.takeDirection();
   }
   return 0;
}
