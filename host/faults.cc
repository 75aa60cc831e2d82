#include "host/faults.h"

#include "host/violations.h"

#include <array>
#include <stdexcept>

namespace swsec::host {

namespace {

// Every host operation that can fail. A rule for a name outside this list
// would never fire, so it is refused: that catches a misspelt name in a test.
// New fault points are added here.
constexpr std::array kFaultPoints = {
   std::string_view{"Hash_Alloc"},
   std::string_view{"Net_StrToMac"},
   std::string_view{"Nexo_NULL_Get"},
   std::string_view{"Nexo_NULL_Set"},
   std::string_view{"Nexo_ParamListAddInt"},
   std::string_view{"Nexo_ParamListGetInt32"},
   std::string_view{"Nexo_ParamListGetString"},
   std::string_view{"Nexo_ParamListGetUInt32"},
   std::string_view{"Nexo_ParamListUsedCount"},
   std::string_view{"orr_HeapAllocWithRA"},
   std::string_view{"orr_HeapCreate"},
   std::string_view{"orr_LockDomainCreate"},
   std::string_view{"orr_LogRegister"},
   std::string_view{"orr_MA2VA"},
   std::string_view{"orr_ModuleGetName"},
   std::string_view{"orr_ModuleIncUseCount"},
   std::string_view{"orr_ModuleRegister"},
   std::string_view{"orr_ModuleSetHeapID"},
   std::string_view{"orr_ModuleUnregister"},
   std::string_view{"orr_PktCopyBytesOut"},
   std::string_view{"orr_PktHeaderDataGet"},
   std::string_view{"orr_PktHeaderFind"},
   std::string_view{"orr_PlexClientPortRegister"},
   std::string_view{"orr_PlexClientPortUnregister"},
   std::string_view{"orr_PortsetAcquireByPortID"},
   std::string_view{"orr_PortsetPostMessage"},
   std::string_view{"orr_PortsetRegisterMessageCB"},
   std::string_view{"orr_SifraGetEndPointType"},
   std::string_view{"orr_SifraGetFailurePolicy"},
   std::string_view{"orr_SifraGetName"},
   std::string_view{"orr_SifraGetPortID"},
   std::string_view{"orr_SifraGetVMUUID"},
   std::string_view{"orr_SifraGetVnicIndex"},
   std::string_view{"orr_SifraPropertyRegister"},
   std::string_view{"orr_SifraRegisterFastPath"},
   std::string_view{"orr_SifraSendFilterIoctlReply"},
   std::string_view{"orr_SifraSetMinPktMappedLen"},
   std::string_view{"orr_SpinlockCreate"},
   std::string_view{"orr_StringFormat"},
   std::string_view{"orr_TimerAdd"},
   std::string_view{"orr_TimerQueueCreate"},
   std::string_view{"orr_TimerSchedule"},
};

}  // namespace

namespace {
std::atomic<uint64_t> nextGeneration{1};
}  // namespace

FaultTable::FaultTable() : generation_(nextGeneration.fetch_add(1))
{
   for (auto op : kFaultPoints) {
      index_.emplace(std::string(op), points_.size());
      points_.push_back(std::make_unique<Point>());
   }
}

size_t FaultTable::indexOf(std::string_view op) const
{
   auto found = index_.find(op);
   if (found == index_.end()) {
      throw std::invalid_argument("no fault point named '" + std::string(op) + "'");
   }
   return found->second;
}

FaultTable::Point &FaultTable::pointFor(std::string_view op)
{
   // Host operations name themselves with string literals, whose addresses
   // are stable: a small per-thread cache keyed by the address saves the
   // name lookup on every call. The table it points into belongs to one
   // Host, so the cache remembers which (by generation: a later Host may
   // live at the same address).
   struct Slot {
      uint64_t generation = 0;
      const char *name = nullptr;
      Point *point = nullptr;
   };
   thread_local __attribute__((tls_model("initial-exec"))) std::array<Slot, 64> cache{};
   Slot &slot = cache[(reinterpret_cast<uintptr_t>(op.data()) >> 3) % cache.size()];
   if (slot.generation == generation_ && slot.name == op.data()) {
      return *slot.point;
   }
   auto found = index_.find(op);
   if (found == index_.end()) {
      // A host operation that forgot to list itself: a host bug, not the module's.
      fatal("fault point '" + std::string(op) + "' is not listed");
   }
   slot = Slot{generation_, op.data(), points_[found->second].get()};
   return *slot.point;
}

void FaultTable::addRule(std::string_view op, orr_Status status, uint64_t nth, bool once)
{
   if (nth == 0) {
      throw std::invalid_argument("fault rule for " + std::string(op) + ": nth counts from 1");
   }
   Point &point = *points_[indexOf(op)];
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
      armedRules_.fetch_sub(point->rules.size());
      point->rules.clear();
   }
}

uint64_t FaultTable::calls(std::string_view op) const
{
   return static_cast<uint64_t>(points_[indexOf(op)]->calls.value());
}

std::optional<orr_Status> FaultTable::hit(std::string_view op)
{
   Point &p = pointFor(op);
   p.calls.add(1);
   if (armedRules_.load(std::memory_order_acquire) == 0) {
      return std::nullopt;
   }
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
