// Frames that may renew a lease in place. The module extends a binding's
// lease on a DHCP ACK (or a DHCPv6 Reply) for an address the port already
// holds without a port database notification, so the daemon takes every
// such frame passed to the VM as a change of the port's saved state.
#pragma once

#include <cstdint>
#include <span>

namespace swsec::live {

// Whether `frame` (an Ethernet frame, tags in its bytes or not) is UDP from
// a DHCP server port (67, or 547 right behind the IPv6 header).
bool fromDhcpServer(std::span<const uint8_t> frame);

}  // namespace swsec::live
