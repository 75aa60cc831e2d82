// Two ports of one loaded module that see the same frames: "alone" judges
// every frame, "kernel" only those the fast path program punts, its maps
// kept by a Mirror as the daemon keeps them.
#pragma once

#include "fastpath.h"
#include "port_mirror.h"
#include "session/config_file.h"

#include <chrono>
#include <optional>
#include <span>
#include <string>

namespace swsec::testing {

class Twin {
public:
   // The host has the module loaded; the ports get IDs `firstPort` and the next.
   Twin(host::Host &host, uint32_t firstPort);
   ~Twin();
   // Writes the configuration to both ports, the IPv6 agent's record too
   // where it has IPv6 keys (the agent made on both ports at the first);
   // false when refused.
   bool configure(const session::PortSecurityConfig &config);
   // One frame as captured (an outer tag in its bytes) both ways: the first
   // difference in verdict or drop counters, or empty.
   std::string judge(std::span<const uint8_t> frame, uint32_t direction);
   void advance(std::chrono::microseconds by);
   // The two ports' "vmi" nodes, and the program's map against the kernel
   // port's database: the first difference, or empty.
   std::string databases();

private:
   void dropFilters();
   std::string counters();

   host::Host &host_;
   uint32_t alonePort_;
   uint32_t kernelPort_;
   fastpath::Program program_;
   host::FilterId alone_ = 0;
   host::FilterId kernel_ = 0;
   host::FilterId alone6_ = 0;   // the IPv6 agent's filters, 0 until a configuration has IPv6 keys
   host::FilterId kernel6_ = 0;
   std::optional<fastpath::Mirror> mirror_;
   fastpath::Counters base_;   // the program's counts when the module's counters were cleared
};

}  // namespace swsec::testing
