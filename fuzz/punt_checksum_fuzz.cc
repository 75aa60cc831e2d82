// Frames the kernel fast path punted, their checksum completed before they
// go on: no byte past the frame is read (ASan), only the two bytes of a TCP
// or UDP checksum change, and a checksum written verifies over the
// pseudo-header (IPv4 or IPv6) and the segment.
#include "live/kernel_path.h"

#include <cstdint>
#include <cstdlib>
#include <vector>

namespace {

uint32_t words(const uint8_t *bytes, size_t length, uint32_t sum)
{
   for (size_t i = 0; i < length; i += 2) {
      sum += static_cast<uint32_t>(bytes[i] << 8 | (i + 1 < length ? bytes[i + 1] : 0));
   }
   return sum;
}

bool verifies(const std::vector<uint8_t> &frame)
{
   const size_t l3 = 14;
   const bool ipv6 = frame[12] == 0x86 && frame[13] == 0xdd;
   const size_t headerLen = ipv6 ? 40 : static_cast<size_t>(frame[l3] & 0x0f) * 4;
   const size_t l4Len = ipv6 ? static_cast<size_t>(frame[l3 + 4] << 8 | frame[l3 + 5])
                             : static_cast<size_t>(frame[l3 + 2] << 8 | frame[l3 + 3]) - headerLen;
   uint32_t sum = (ipv6 ? words(frame.data() + l3 + 8, 32, 0) : words(frame.data() + l3 + 12, 8, 0)) +
                  frame[l3 + (ipv6 ? 6 : 9)] + static_cast<uint32_t>(l4Len);
   sum = words(frame.data() + l3 + headerLen, l4Len, sum);
   while (sum >> 16 != 0) {
      sum = (sum & 0xffff) + (sum >> 16);
   }
   return sum == 0xffff;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
   std::vector<uint8_t> frame(data, data + size);
   swsec::live::completeChecksum(frame);
   size_t changed = 0;
   for (size_t i = 0; i < size; ++i) {
      changed += frame[i] != data[i] ? 1 : 0;
   }
   if (frame.size() != size || changed > 2 || (changed != 0 && !verifies(frame))) {
      std::abort();
   }
   return 0;
}
