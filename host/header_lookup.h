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

// A frame as a virtual switch hands it to a port: its outer tag (any TPID)
// taken out of the bytes into the VLAN metadata, and a runt padded with
// zeros to the Ethernet minimum, as a switch pads it. Replay and live ports
// present frames by these rules.
inline constexpr size_t kSwitchMinFrameLen = 60;
inline constexpr size_t kEthernetHeaderLen = 14;
inline constexpr size_t kVlanTagLen = 4;

// The VLAN ID of the outer tag when bytes 12-13 are a tag's TPID and the
// tag is whole; no value for an untagged frame.
std::optional<uint16_t> outerTagVlan(std::span<const uint8_t> frame);

// The length of a frame of `length` bytes once padded: a frame that holds
// an Ethernet header but is shorter than 60 bytes grows to 60.
constexpr size_t switchPaddedLength(size_t length)
{
   return length >= kEthernetHeaderLen && length < kSwitchMinFrameLen ? kSwitchMinFrameLen : length;
}

// The header class bit of a layer (ORR_PKT_HEADER_CLASS_*): the bits of
// layers 2, 3 and 4 are consecutive.
static_assert(ORR_PKT_HEADER_CLASS_L3 == ORR_PKT_HEADER_CLASS_L2 << ORR_PKT_LAYER_3 &&
              ORR_PKT_HEADER_CLASS_L4 == ORR_PKT_HEADER_CLASS_L2 << ORR_PKT_LAYER_4);
constexpr uint32_t headerClassOf(uint32_t layer)
{
   return ORR_PKT_HEADER_CLASS_L2 << layer;
}

}  // namespace swsec::host
