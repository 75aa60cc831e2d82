#include "host/clock.h"

#include "host/state.h"

namespace swsec::host {

int64_t TimeBase::nowUs() const
{
   if (isVirtual()) {
      return virtualNowUs_.load(std::memory_order_acquire);
   }
   auto elapsed = std::chrono::steady_clock::now() - realStart_;
   return realBaseUs_ + std::chrono::duration_cast<std::chrono::microseconds>(elapsed).count();
}

void TimeBase::moveTo(int64_t us)
{
   int64_t now = virtualNowUs_.load(std::memory_order_acquire);
   while (us > now && !virtualNowUs_.compare_exchange_weak(now, us, std::memory_order_acq_rel)) {
   }
}

void TimeBase::switchToReal()
{
   if (!isVirtual()) {
      return;
   }
   realBaseUs_ = virtualNowUs_.load(std::memory_order_acquire);
   realStart_ = std::chrono::steady_clock::now();
   virtual_.store(false, std::memory_order_release);
}

orr_TimeVal TimeBase::uptime() const
{
   const int64_t us = kUptimeAtStartUs + nowUs();
   return orr_TimeVal{us / 1'000'000, us % 1'000'000};
}

uint64_t TimeBase::cycles() const
{
   return static_cast<uint64_t>(kUptimeAtStartUs + nowUs()) * kCyclesPerMicrosecond;
}

}  // namespace swsec::host

using swsec::host::TimeBase;
using swsec::host::detail::requireState;

ORR_API void orr_GetUptime(orr_TimeVal *uptime)
{
   auto &state = requireState("orr_GetUptime");
   if (uptime != nullptr) {
      *uptime = state.timers.time().uptime();
   }
}

ORR_API uint64_t orr_GetTimerCycles(void)
{
   return requireState("orr_GetTimerCycles").timers.time().cycles();
}

ORR_API uint64_t orr_TimerCyclesPerSecond(void)
{
   (void)requireState("orr_TimerCyclesPerSecond");
   return TimeBase::kCyclesPerSecond;
}
