/*
 * Where a frame's layer-3 header starts: past the Ethernet header and the
 * VLAN tags still in its bytes. The port's checks and the host's header
 * lookup take this one walk, so that both read the same ethertype at the
 * same offset (a check that looked at bytes 12-13 while the lookup skipped
 * a tag let stacked-tag ARP past inspection).
 *
 * Wire contract: freestanding, shared by the module, the host and the tools.
 */
#pragma once

#include <cstdint>

constexpr uint32_t SWSEC_ETH_HDR_LEN = 14;
constexpr uint32_t SWSEC_ETH_TYPE_OFFSET = 12;
constexpr uint32_t SWSEC_VLAN_TAG_LEN = 4;
/*
 * Tags walked at most. With four, an ARP header behind them still ends
 * within the 66 bytes a port has mapped (14 + 16 + 28 = 58).
 */
constexpr uint32_t SWSEC_MAX_TAGS = 4;

/* Tag protocol identifiers: 802.1Q, 802.1ad and the older stacking 0x9100. */
static inline bool SwSecIsTagTpid(uint16_t type)
{
   return type == 0x8100 || type == 0x88a8 || type == 0x9100;
}

struct SwSecL2Walk {
   uint32_t hdrLen;      /* the Ethernet header with the tags walked */
   uint16_t etherType;   /* the type after them, host order; a TPID when the walk stopped short */
   uint16_t rawType;     /* the same two bytes as they lie in memory (network order) */
   uint32_t numTags;
};

/*
 * Walks the Ethernet header and up to SWSEC_MAX_TAGS tags of a frame of
 * `len` bytes; false when it is shorter than an Ethernet header. A stack
 * deeper than the limit, or a tag cut short by the frame's end, leaves
 * `etherType` a TPID: nothing behind it was looked at.
 */
static inline bool SwSecWalkL2(const uint8_t *frame, uint32_t len, SwSecL2Walk *walk)
{
   if (len < SWSEC_ETH_HDR_LEN) {
      return false;
   }
   uint32_t typeOffset = SWSEC_ETH_TYPE_OFFSET;
   uint32_t numTags = 0;
   uint16_t type = static_cast<uint16_t>(frame[typeOffset] << 8 | frame[typeOffset + 1]);
   while (SwSecIsTagTpid(type) && numTags < SWSEC_MAX_TAGS &&
          typeOffset + SWSEC_VLAN_TAG_LEN + 2 <= len) {
      typeOffset += SWSEC_VLAN_TAG_LEN;
      numTags++;
      type = static_cast<uint16_t>(frame[typeOffset] << 8 | frame[typeOffset + 1]);
   }
   walk->hdrLen = typeOffset + 2;
   walk->etherType = type;
   __builtin_memcpy(&walk->rawType, frame + typeOffset, sizeof(walk->rawType));
   walk->numTags = numTags;
   return true;
}
