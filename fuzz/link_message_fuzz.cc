// Routing socket datagrams as the daemon reads them: the walk reads no byte
// past the datagram (ASan) whatever its lengths say, and every event it
// hands out names what it read.
#include "live/rtnetlink.h"

#include <cstdint>
#include <span>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
   // A copy of exactly `size` bytes, so that a read past it is caught.
   const std::vector<uint8_t> bytes(data, data + size);
   size_t malformed = 0;
   size_t total = 0;
   for (const auto &event : swsec::live::parseLinkMessages(std::span<const uint8_t>(bytes), &malformed)) {
      total += event.name.size() + event.kind.size() + event.mac.size();
      (void)swsec::live::watchAction(event, 4, "vnet*", false);
   }
   return total > size ? 1 : 0;
}
