// Frames are routed as the bridge the capture was taken on forwarded them.
// Recorded directions (pcapng flags) come from a capture on one VM's
// interface and are taken as they are; without them the source MAC says
// who sent a frame, and --network-mac says which sources are the network.
#include "replay/routing.h"

#include <cstring>

namespace swsec::replay {

namespace {

constexpr size_t kMacBytes = 6;
constexpr uint16_t kNone = UINT16_MAX;

}  // namespace

FrameRouter::FrameRouter(std::vector<std::vector<std::array<uint8_t, 6>>> portMacs,
                         std::vector<std::array<uint8_t, 6>> networkMacs)
   : portMacs_(std::move(portMacs)), networkMacs_(std::move(networkMacs))
{
   for (const auto &macs : portMacs_) {
      seen_.emplace_back(macs.size(), 0);
   }
}

uint16_t FrameRouter::portOf(const uint8_t *mac) const
{
   for (size_t port = 0; port < portMacs_.size(); ++port) {
      for (size_t i = 0; i < portMacs_[port].size(); ++i) {
         if (std::memcmp(portMacs_[port][i].data(), mac, kMacBytes) == 0) {
            seen_[port][i] = 1;
            return static_cast<uint16_t>(port);
         }
      }
   }
   return kNone;
}

bool FrameRouter::fromNetwork(const uint8_t *mac) const
{
   for (const auto &network : networkMacs_) {
      if (std::memcmp(network.data(), mac, kMacBytes) == 0) {
         return true;
      }
   }
   return false;
}

void FrameRouter::toAllBut(uint16_t sender, std::vector<Delivery> &out) const
{
   for (size_t port = 0; port < portMacs_.size(); ++port) {
      if (port != sender) {
         out.push_back({static_cast<uint16_t>(port), kDirToVm});
      }
   }
}

void FrameRouter::route(std::span<const uint8_t> bytes, uint8_t recordedDirection, Route &route) const
{
   route.kind = Route::Kind::delivered;
   route.first.clear();
   route.onward.clear();
   const bool single = portMacs_.size() == 1;
   if (bytes.size() < 2 * kMacBytes) {
      // Too short to have addresses: only a recorded direction places it.
      if (single && recordedDirection != kDirUnknown) {
         route.first.push_back({0, recordedDirection});
      } else {
         route.kind = single ? Route::Kind::noDirection : Route::Kind::unassigned;
      }
      return;
   }
   const uint8_t *destination = bytes.data();
   const uint8_t *source = bytes.data() + kMacBytes;
   const bool group = (destination[0] & 1u) != 0;   // broadcast or multicast
   const uint16_t sender = portOf(source);
   const uint16_t receiver = portOf(destination);

   if (recordedDirection == kDirFromVm) {
      const uint16_t port = sender != kNone ? sender : (single ? 0 : kNone);
      if (port == kNone) {
         route.kind = Route::Kind::spoofedSource;
      } else {
         route.first.push_back({port, kDirFromVm});
      }
      return;
   }
   if (recordedDirection == kDirToVm) {
      toReceivers(receiver, group, route);
      return;
   }

   if (single && portMacs_[0].empty() && networkMacs_.empty()) {
      route.kind = Route::Kind::noDirection;
      return;
   }
   const bool network = fromNetwork(source);
   uint16_t from = network ? kNone : sender;
   if (from == kNone && !network && !networkMacs_.empty()) {
      // Not the network, so a VM, whatever source MAC it claims.
      if (!single) {
         route.kind = Route::Kind::spoofedSource;
         return;
      }
      from = 0;
   }
   if (from != kNone) {
      route.first.push_back({from, kDirFromVm});
      if (receiver != kNone && receiver != from) {
         route.onward.push_back({receiver, kDirToVm});
      } else if (group) {
         toAllBut(from, route.onward);
      }
      return;
   }
   toReceivers(receiver, group, route);
}

// A frame for the VMs: its receiver's port, every port for a broadcast; with
// one VM, everything it did not send is for it (as --vm-mac always had it).
void FrameRouter::toReceivers(uint16_t receiver, bool group, Route &route) const
{
   if (receiver != kNone) {
      route.first.push_back({receiver, kDirToVm});
   } else if (group) {
      toAllBut(kNone, route.first);
   } else if (portMacs_.size() == 1) {
      route.first.push_back({0, kDirToVm});
   } else {
      route.kind = Route::Kind::unassigned;
   }
}

}  // namespace swsec::replay
