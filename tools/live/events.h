// What a running `swsec inline` tells: its log (its own lines and the
// module's) and the port database's notifications, kept in two bounded
// rings with sequence numbers so that control clients can follow them
// without holding anyone up.
#pragma once

#include <nlohmann/json.hpp>

#include <cstdint>
#include <deque>
#include <mutex>
#include <string>
#include <vector>

namespace swsec::live {

enum class EventKind : uint8_t { log, notification };

struct Event {
   uint64_t seq = 0;
   EventKind kind = EventKind::log;
   nlohmann::json body;   // log: time, severity, source, text; notification: time, port, event, vlan, mac, ip, authoritative
};

class EventHub {
public:
   // Events kept of each kind: old ones go first.
   static constexpr size_t kRingSize = 4096;

   EventHub();
   ~EventHub();
   EventHub(const EventHub &) = delete;
   EventHub &operator=(const EventHub &) = delete;

   // Also written to stderr, one line each, for the journal.
   void log(const std::string &severity, const std::string &source, const std::string &text);
   void notification(nlohmann::json body);

   // Events of `kind` after `seq`, oldest first.
   std::vector<Event> since(EventKind kind, uint64_t seq) const;
   uint64_t lastSeq() const;
   // Readable (an eventfd) once an event came since the last drainWake.
   int wakeFd() const { return wake_; }
   void drainWake();

private:
   void add(EventKind kind, nlohmann::json body);

   mutable std::mutex mutex_;
   uint64_t seq_ = 0;
   std::deque<Event> logs_;
   std::deque<Event> notifications_;
   int wake_ = -1;
};

// Seconds since the epoch, to the microsecond.
double wallClock();

}  // namespace swsec::live
