// The addresses of the scene most module and unit tests play: a VM, a peer
// on its network and the DHCP server.
#pragma once

#include "support/frames.h"

namespace swsec::testing {

inline const Mac kVmMac = Mac::parse("02:00:00:00:00:01");
inline const Mac kPeerMac = Mac::parse("02:00:00:00:00:02");
inline const Mac kServerMac = Mac::parse("02:00:00:00:00:fe");
inline const Ip4 kVmIp = Ip4::parse("10.0.0.5");
inline const Ip4 kPeerIp = Ip4::parse("10.0.0.9");
inline const Ip4 kServerIp = Ip4::parse("10.0.0.254");

}  // namespace swsec::testing
