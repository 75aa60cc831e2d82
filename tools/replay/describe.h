// One line saying what a frame is (ARP, DHCP message type, IPv4 addresses,
// BPDU, ...), read within the bytes given.
#pragma once

#include "session/serializer.h"

#include <cstdint>
#include <span>
#include <string>

namespace swsec::replay {

std::string describeFrame(std::span<const uint8_t> bytes);

inline constexpr uint8_t kDhcpAck = 5;

// What a frame is, as far as telling apart the checks that count nothing
// needs: its destination, its UDP source port, its DHCP message type.
struct FrameFacts {
   bool bpduDestination = false;   // 01:80:c2:00:00:00 or 01:00:0c:cc:cc:cd
   uint16_t udpSourcePort = 0;     // 0: not UDP over IPv4 or IPv6
   uint8_t dhcpMessageType = 0;    // option 53 of a BOOTP payload, 0: none
};
FrameFacts frameFacts(std::span<const uint8_t> bytes);

// "02:00:5e:c0:00:01" and "192.0.2.1" from raw bytes.
using session::ipText;
using session::macText;

// The 802.1Q VLAN ID of a tagged frame, 0 for an untagged one.
uint16_t frameVlan(std::span<const uint8_t> bytes);

}  // namespace swsec::replay
