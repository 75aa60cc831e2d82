#include "host/faults.h"

#include "host/violations.h"

#include <array>
#include <stdexcept>

namespace swsec::host {

size_t FaultTable::indexOf(std::string_view op) const
{
   for (size_t index = 0; index < kFaultPoints.size(); ++index) {
      if (kFaultPoints[index] == op) {
         return index;
      }
   }
   throw std::invalid_argument("no fault point named '" + std::string(op) + "'");
}

void FaultTable::addRule(std::string_view op, orr_Status status, uint64_t nth, bool once)
{
   if (nth == 0) {
      throw std::invalid_argument("fault rule for " + std::string(op) + ": nth counts from 1");
   }
   Point &point = points_[indexOf(op)];
   std::lock_guard guard(mutex_);
   point.rules.push_back(Rule{status, static_cast<uint64_t>(point.calls.value()) + nth, once});
   armedRules_.fetch_add(1);
}

void FaultTable::failOnce(std::string_view op, orr_Status status, uint64_t nth)
{
   addRule(op, status, nth, true);
}

void FaultTable::failFrom(std::string_view op, orr_Status status, uint64_t nth)
{
   addRule(op, status, nth, false);
}

void FaultTable::clear()
{
   std::lock_guard guard(mutex_);
   for (auto &point : points_) {
      armedRules_.fetch_sub(point.rules.size());
      point.rules.clear();
   }
}

uint64_t FaultTable::calls(std::string_view op) const
{
   return static_cast<uint64_t>(points_[indexOf(op)].calls.value());
}

std::optional<orr_Status> FaultTable::ruleFor(Point &p)
{
   // With a rule armed the count must be exact: the call's number is taken
   // under the lock, which every counted call then passes through.
   std::lock_guard guard(mutex_);
   const auto call = static_cast<uint64_t>(p.calls.value());
   // The first rule that applies decides; a spent one-shot rule is dropped.
   for (auto rule = p.rules.begin(); rule != p.rules.end(); ++rule) {
      if (rule->once && rule->firstCall == call) {
         orr_Status status = rule->status;
         p.rules.erase(rule);
         armedRules_.fetch_sub(1);
         return status;
      }
      if (!rule->once && call >= rule->firstCall) {
         return rule->status;
      }
   }
   const size_t before = p.rules.size();
   std::erase_if(p.rules, [&](const Rule &r) { return r.once && r.firstCall < call; });
   armedRules_.fetch_sub(before - p.rules.size());
   return std::nullopt;
}

}  // namespace swsec::host
