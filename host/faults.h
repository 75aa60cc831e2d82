// Fault points: every host operation that can fail asks the fault table
// first, so a test can make the n-th call of any of them fail.
#pragma once

#include "host/host.h"
#include "host/sharded_counter.h"

#include <array>
#include <atomic>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <memory>
#include <vector>

namespace swsec::host {

class FaultTable final : public Faults {
public:
   FaultTable();

   // Faults
   void failOnce(std::string_view op, orr_Status status, uint64_t nth) override;
   void failFrom(std::string_view op, orr_Status status, uint64_t nth) override;
   void clear() override;
   uint64_t calls(std::string_view op) const override;

   // Counts one call of `op`; the status to fail it with, when a rule says so.
   // `op` must be a string literal: its address keys a per-thread cache.
   std::optional<orr_Status> hit(std::string_view op);

private:
   struct Rule {
      orr_Status status;
      uint64_t firstCall;   // absolute call number
      bool once;
   };
   // Points are made once, in a fixed order, and never added or removed:
   // `hit` reads the table without the lock. Calls are counted atomically;
   // rules are read and changed under the lock, and only looked at while
   // some rule is armed, so the frame path pays one uncontended atomic add
   // and one load.
   // Calls are counted in per-thread shards, so that threads judging
   // frames at once do not share a counter.
   struct Point {
      ShardedCounter calls;
      std::vector<Rule> rules;
   };

   void addRule(std::string_view op, orr_Status status, uint64_t nth, bool once);
   size_t indexOf(std::string_view op) const;   // throws for an unknown name
   Point &pointFor(std::string_view op);        // the caller's op is a string literal

   mutable std::mutex mutex_;
   std::map<std::string, size_t, std::less<>> index_;
   std::vector<std::unique_ptr<Point>> points_;
   std::atomic<uint64_t> armedRules_{0};
   // Tells this table from an earlier one made at the same address.
   const uint64_t generation_;
};

}  // namespace swsec::host
