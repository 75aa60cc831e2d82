// Fault points: every host operation that can fail asks the fault table
// first, so a test can make the n-th call of any of them fail.
#pragma once

#include "host/host.h"

#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
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
   std::optional<orr_Status> hit(std::string_view op);

private:
   struct Rule {
      orr_Status status;
      uint64_t firstCall;   // absolute call number
      bool once;
   };
   struct Point {
      uint64_t calls = 0;
      std::vector<Rule> rules;
   };

   void addRule(std::string_view op, orr_Status status, uint64_t nth, bool once);

   mutable std::mutex mutex_;
   std::map<std::string, Point, std::less<>> points_;
};

}  // namespace swsec::host
