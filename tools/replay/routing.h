// Which port a captured frame goes through, and in which direction, when a
// capture holds several VMs (a capture taken on a bridge): from a VM's
// port when a VM sent it, to a VM's port when it is for that VM, to every
// port when the network broadcasts it.
#pragma once

#include "replay/capture.h"

#include <array>
#include <cstdint>
#include <span>
#include <vector>

namespace swsec::replay {

struct Delivery {
   uint16_t port = 0;
   uint8_t direction = kDirUnknown;
};

struct Route {
   enum class Kind : uint8_t {
      delivered,     // `first` holds the deliveries
      unassigned,    // for no port's VM (several ports)
      spoofedSource, // a VM sent it (not a network MAC) but which one is unknown (several ports)
      noDirection,   // one port, no MAC known and no recorded direction
   };
   Kind kind = Kind::delivered;
   // Handed over first: the sender's port, or the receivers of a frame
   // from the network.
   std::vector<Delivery> first;
   // The receiving VMs' ports of a frame one VM sent to others over the
   // bridge, handed over only if the sender's port passed it.
   std::vector<Delivery> onward;
};

class FrameRouter {
public:
   // `portMacs[i]`: the MACs of port i's VM.
   FrameRouter(std::vector<std::vector<std::array<uint8_t, 6>>> portMacs,
               std::vector<std::array<uint8_t, 6>> networkMacs);

   // `route` is overwritten; its vectors keep their memory between frames.
   void route(std::span<const uint8_t> bytes, uint8_t recordedDirection, Route &route) const;

   // Whether port i's MAC m appeared as a source or destination so far.
   bool seen(size_t port, size_t mac) const { return seen_[port][mac] != 0; }

private:
   uint16_t portOf(const uint8_t *mac) const;
   bool fromNetwork(const uint8_t *mac) const;
   void toAllBut(uint16_t sender, std::vector<Delivery> &out) const;
   void toReceivers(uint16_t receiver, bool group, Route &route) const;

   std::vector<std::vector<std::array<uint8_t, 6>>> portMacs_;
   std::vector<std::array<uint8_t, 6>> networkMacs_;
   mutable std::vector<std::vector<uint8_t>> seen_;
};

}  // namespace swsec::replay
