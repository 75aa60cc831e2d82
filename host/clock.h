// The host's time: virtual by default (it moves only when told), or the
// real steady clock. Uptime, timer cycles and cycles per second all derive
// from the one time base.
#pragma once

#include "platform/orr_time.h"

#include <atomic>
#include <chrono>
#include <cstdint>

namespace swsec::host {

class TimeBase {
public:
   // Uptime when the host is made: never 0, so that "0" is never "now".
   static constexpr int64_t kUptimeAtStartUs = 1000LL * 1000 * 1000;
   // Deliberately not a round number: a mix-up of cycles, microseconds and
   // seconds shows as a wrong result instead of a coincidentally right one.
   static constexpr uint64_t kCyclesPerSecond = 2'394'000'000ULL;
   static constexpr uint64_t kCyclesPerMicrosecond = kCyclesPerSecond / 1'000'000;
   static_assert(kCyclesPerSecond % 1'000'000 == 0);

   TimeBase() = default;

   // Microseconds since the host was made.
   int64_t nowUs() const;
   bool isVirtual() const { return virtual_.load(std::memory_order_acquire); }
   // Virtual time only; time never goes backwards.
   void moveTo(int64_t us);
   // From now on the steady clock drives time, continuing from where virtual
   // time stood.
   void switchToReal();

   orr_TimeVal uptime() const;
   uint64_t cycles() const;

private:
   std::atomic<bool> virtual_{true};
   std::atomic<int64_t> virtualNowUs_{0};
   std::chrono::steady_clock::time_point realStart_{};
   int64_t realBaseUs_ = 0;
};

}  // namespace swsec::host
