// A port of the loaded module, enforcing, with the given bindings as static
// entries, and the frame lists it judges: built once by the host, handed to
// the module's processPackets directly so that a timed loop measures the
// module and not the host's list building.
#pragma once

#include "frame_mix.h"

#include "host/host.h"

#include <array>
#include <cstdint>
#include <memory>
#include <vector>

namespace swsec::bench {

class ModulePort {
public:
   // Adds port `portId` to the portset "vs0" (made on first use) and
   // configures it as examples/enforcing.json does, with the bindings as
   // static entries; without `arpLimits`, ARP rate limiting is off (so that
   // a mix with ARP frames judged again and again is judged alike).
   // Throws std::runtime_error when the module refuses.
   ModulePort(host::Host &host, uint32_t portId, const std::vector<Binding> &bindings, bool arpLimits);
   // The IPv6 agent's port instead, every feature on an untrusted port (ND
   // rate limiting with `arpLimits`), each binding's MAC bound to its
   // ipv6Of address.
   struct Ipv6 {};
   ModulePort(Ipv6, host::Host &host, uint32_t portId, const std::vector<Binding> &bindings, bool arpLimits);
   ~ModulePort();
   ModulePort(const ModulePort &) = delete;
   ModulePort &operator=(const ModulePort &) = delete;

   std::unique_ptr<host::FrameList> makeList(const std::vector<MixFrame> &frames) const;

   // The module's processPackets on the list, frames from the VM.
   orr_Status judge(host::FrameList &list) const
   {
      return ops_->processPackets(record_, list.list(), ORR_SIFRA_DIR_TX);
   }

   // Module heap bytes the port holds: its filter, context and database.
   uint64_t heapBytes() const { return heapBytes_; }

   // The IPv6 address a binding's IPv4 address stands for on the IPv6 port.
   static std::array<uint8_t, 16> ipv6Of(const Binding &binding);

private:
   void attach(const char *agent);

   host::Host &host_;
   host::FilterId id_ = 0;
   const orr_SifraFastPathOps *ops_ = nullptr;
   orr_SifraFilter record_ = nullptr;
   uint32_t minMappedLen_ = 0;
   uint64_t heapBytes_ = 0;
};

}  // namespace swsec::bench
