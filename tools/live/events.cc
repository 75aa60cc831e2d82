// The event rings of a running inline.
#include "live/events.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <system_error>

namespace swsec::live {

double wallClock()
{
   const auto now = std::chrono::system_clock::now().time_since_epoch();
   return static_cast<double>(std::chrono::duration_cast<std::chrono::microseconds>(now).count()) / 1e6;
}

EventHub::EventHub()
{
   wake_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
   if (wake_ < 0) {
      throw std::system_error(errno, std::generic_category(), "eventfd");
   }
}

EventHub::~EventHub()
{
   close(wake_);
}

void EventHub::log(const std::string &severity, const std::string &source, const std::string &text)
{
   std::fprintf(stderr, "swsec inline: %s%s%s\n", severity == "error" ? "error: " : "",
                source == "module" ? "module: " : "", text.c_str());
   add(EventKind::log, {{"time", wallClock()}, {"severity", severity}, {"source", source}, {"text", text}});
}

void EventHub::notification(nlohmann::json body)
{
   add(EventKind::notification, std::move(body));
}

void EventHub::add(EventKind kind, nlohmann::json body)
{
   {
      std::lock_guard guard(mutex_);
      std::deque<Event> &ring = kind == EventKind::log ? logs_ : notifications_;
      if (ring.size() == kRingSize) {
         ring.pop_front();
      }
      ring.push_back(Event{++seq_, kind, std::move(body)});
   }
   const uint64_t one = 1;
   // A full counter already wakes the reader.
   (void)!write(wake_, &one, sizeof one);
}

std::vector<Event> EventHub::since(EventKind kind, uint64_t seq) const
{
   std::lock_guard guard(mutex_);
   const std::deque<Event> &ring = kind == EventKind::log ? logs_ : notifications_;
   std::vector<Event> events;
   for (const Event &event : ring) {
      if (event.seq > seq) {
         events.push_back(event);
      }
   }
   return events;
}

uint64_t EventHub::lastSeq() const
{
   std::lock_guard guard(mutex_);
   return seq_;
}

void EventHub::drainWake()
{
   uint64_t count = 0;
   (void)!read(wake_, &count, sizeof count);
}

}  // namespace swsec::live
