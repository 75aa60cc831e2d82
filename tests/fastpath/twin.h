// Two ports of one loaded module that see the same frames: "alone" judges
// every frame, "kernel" only those the fast path program punts, its maps
// filled as the daemon fills them (the port read at start, then its
// notifications and error state after each frame and each tick).
#pragma once

#include "fastpath.h"
#include "host/host.h"

#include <chrono>
#include <span>
#include <string>

namespace swsec::testing {

class Twin {
public:
   // The host has the module loaded; the ports get IDs `firstPort` and the next.
   Twin(host::Host &host, uint32_t firstPort);
   // Writes the configuration record to both ports; false when refused.
   bool configure(std::span<const uint8_t> record);
   // One frame as captured (an outer tag in its bytes) both ways: the first
   // difference in verdict or drop counters, or empty.
   std::string judge(std::span<const uint8_t> frame, uint32_t direction);
   void advance(std::chrono::microseconds by);
   // The two ports' databases as the "vmi" nodes show them, and the
   // program's map against the kernel port's: the first difference, or empty.
   std::string databases();
   fastpath::Program &program() { return program_; }
   uint64_t decidedInKernel() const { return decided_; }

private:
   void follow();
   std::string counters();

   // The two filters, destroyed after the program's maps go.
   struct Ports {
      Ports(host::Host &host, uint32_t first);
      ~Ports();
      void release();
      host::Host &host;
      uint32_t alonePort;
      uint32_t kernelPort;
      host::FilterId alone = 0;
      host::FilterId kernel = 0;
   };

   host::Host &host_;
   Ports ports_;
   uint32_t alonePort_;
   uint32_t kernelPort_;
   host::FilterId alone_;
   host::FilterId kernel_;
   fastpath::Program program_;
   uint64_t decided_ = 0;
   uint64_t kernelGuardDrops_ = 0;
};

}  // namespace swsec::testing
