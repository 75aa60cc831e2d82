#include "host/header_lookup.h"

#include "contract/frame_walk.h"

#include <algorithm>

namespace swsec::host {

namespace {

constexpr uint16_t kEtherIpv4 = 0x0800;
constexpr uint16_t kEtherArp = 0x0806;
constexpr uint16_t kEtherIpv6 = 0x86dd;
// Values up to this are an 802.3 length, not an ethertype.
constexpr uint16_t kMax8023Length = 1500;
constexpr uint32_t kArpLen = 28;
constexpr uint32_t kIpv6Len = 40;
constexpr uint32_t kUdpLen = 8;
constexpr uint32_t kTcpMinLen = 20;
constexpr uint8_t kProtoTcp = 6;
constexpr uint8_t kProtoUdp = 17;

uint16_t loadBigEndian16(std::span<const uint8_t> frame, uint32_t offset)
{
   return static_cast<uint16_t>((frame[offset] << 8) | frame[offset + 1]);
}

orr_PktHeaderEntry entryOf(uint32_t offset, uint32_t length, uint16_t nextProto)
{
   return orr_PktHeaderEntry{static_cast<uint16_t>(offset), static_cast<uint16_t>(length), nextProto,
                             static_cast<uint16_t>(offset + length)};
}

bool fits(std::span<const uint8_t> frame, uint32_t offset, uint32_t length)
{
   return offset <= frame.size() && length <= frame.size() - offset && offset + length <= 0xffff;
}

}  // namespace

FrameHeaders findHeaders(std::span<const uint8_t> frame)
{
   FrameHeaders headers;
   // The module's own walk: tags left in the bytes (beyond the one the
   // switch took into the metadata) belong to the layer-2 header, and the
   // ethertype is the one after them. A stack not walked to its end leaves
   // a TPID there, and nothing further is found.
   SwSecL2Walk walk{};
   const auto walkable = static_cast<uint32_t>(std::min<size_t>(frame.size(), 0xffff));
   if (!SwSecWalkL2(frame.data(), walkable, &walk)) {
      return headers;
   }
   const uint32_t l2Len = walk.hdrLen;
   const uint16_t etherType = walk.etherType;
   headers.entries[ORR_PKT_LAYER_2] = entryOf(0, l2Len, walk.rawType);
   if (etherType <= kMax8023Length) {
      return headers;
   }

   const uint32_t l3 = l2Len;
   uint8_t protocol = 0;
   bool transportFollows = false;
   switch (etherType) {
   case kEtherIpv4: {
      if (!fits(frame, l3, 20) || (frame[l3] >> 4) != 4) {
         return headers;
      }
      const uint32_t length = (frame[l3] & 0x0fu) * 4u;
      if (length < 20 || !fits(frame, l3, length)) {
         return headers;
      }
      protocol = frame[l3 + 9];
      headers.entries[ORR_PKT_LAYER_3] = entryOf(l3, length, protocol);
      // Only the first fragment carries the transport header.
      const uint16_t fragmentOffset = loadBigEndian16(frame, l3 + 6) & 0x1fffu;
      transportFollows = fragmentOffset == 0;
      break;
   }
   case kEtherIpv6:
      if (!fits(frame, l3, kIpv6Len) || (frame[l3] >> 4) != 6) {
         return headers;
      }
      protocol = frame[l3 + 6];
      headers.entries[ORR_PKT_LAYER_3] = entryOf(l3, kIpv6Len, protocol);
      transportFollows = true;
      break;
   case kEtherArp:
      if (fits(frame, l3, kArpLen)) {
         headers.entries[ORR_PKT_LAYER_3] = entryOf(l3, kArpLen, 0);
      }
      return headers;
   default:
      return headers;
   }
   if (!transportFollows) {
      return headers;
   }

   const uint32_t l4 = headers.entries[ORR_PKT_LAYER_3]->nextHdrOffset;
   if (protocol == kProtoUdp && fits(frame, l4, kUdpLen)) {
      headers.entries[ORR_PKT_LAYER_4] = entryOf(l4, kUdpLen, 0);
   } else if (protocol == kProtoTcp && fits(frame, l4, kTcpMinLen)) {
      const uint32_t length = (frame[l4 + 12] >> 4) * 4u;
      if (length >= kTcpMinLen && fits(frame, l4, length)) {
         headers.entries[ORR_PKT_LAYER_4] = entryOf(l4, length, 0);
      }
   }
   return headers;
}

std::optional<uint16_t> outerTagVlan(std::span<const uint8_t> frame)
{
   if (frame.size() < kEthernetHeaderLen + kVlanTagLen || !SwSecIsTagTpid(loadBigEndian16(frame, 12))) {
      return std::nullopt;
   }
   return static_cast<uint16_t>(loadBigEndian16(frame, 14) & 0x0fffu);
}

}  // namespace swsec::host
