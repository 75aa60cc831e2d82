// Header lookup: where a frame's layer 2, 3 and 4 headers lie, found once
// from the frame's bytes when the host builds the frame.
//
// nextProto of the layer-2 entry is the ethertype (or the 802.3 length
// field) exactly as the frame carries it: the two bytes loaded from memory
// as a u16, i.e. network byte order; a reader converts it with a
// network-to-host swap before comparing with 0x0800. nextProto of a layer-3
// entry is the IP protocol number (IPv4) or next header (IPv6), a plain
// number; ARP and layer-4 entries have nextProto 0.
#pragma once

#include "platform/orr_pkt.h"

#include <array>
#include <cstdint>
#include <optional>
#include <span>

namespace swsec::host {

struct FrameHeaders {
   // Indexed by orr_PktLayer; empty where the frame has no such header or
   // its bytes are not all in the frame.
   std::array<std::optional<orr_PktHeaderEntry>, 3> entries;
};

FrameHeaders findHeaders(std::span<const uint8_t> frame);

// The header class bit of a layer (ORR_PKT_HEADER_CLASS_*): the bits of
// layers 2, 3 and 4 are consecutive.
static_assert(ORR_PKT_HEADER_CLASS_L3 == ORR_PKT_HEADER_CLASS_L2 << ORR_PKT_LAYER_3 &&
              ORR_PKT_HEADER_CLASS_L4 == ORR_PKT_HEADER_CLASS_L2 << ORR_PKT_LAYER_4);
constexpr uint32_t headerClassOf(uint32_t layer)
{
   return ORR_PKT_HEADER_CLASS_L2 << layer;
}

}  // namespace swsec::host
