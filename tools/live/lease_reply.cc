#include "live/lease_reply.h"

#include "contract/frame_walk.h"

namespace swsec::live {
namespace {

constexpr uint8_t kUdp = 17;
constexpr uint16_t kDhcpServerPort = 67;
constexpr uint16_t kDhcpv6ServerPort = 547;

uint16_t be16(const uint8_t *bytes)
{
   return static_cast<uint16_t>(bytes[0] << 8 | bytes[1]);
}

}  // namespace

bool fromDhcpServer(std::span<const uint8_t> frame)
{
   SwSecL2Walk walk;
   if (!SwSecWalkL2(frame.data(), static_cast<uint32_t>(frame.size()), &walk)) {
      return false;
   }
   const std::span<const uint8_t> l3 = frame.subspan(walk.hdrLen);
   if (walk.etherType == 0x0800) {
      // A later fragment has no UDP header where the first one has it.
      if (l3.size() < 20 || (l3[0] >> 4) != 4 || l3[9] != kUdp || (be16(&l3[6]) & 0x1fff) != 0) {
         return false;
      }
      const size_t headerLen = (l3[0] & 0x0fu) * 4u;
      return headerLen >= 20 && l3.size() >= headerLen + 8 && be16(&l3[headerLen]) == kDhcpServerPort;
   }
   if (walk.etherType == 0x86dd) {
      return l3.size() >= 48 && l3[6] == kUdp && be16(&l3[40]) == kDhcpv6ServerPort;
   }
   return false;
}

}  // namespace swsec::live
