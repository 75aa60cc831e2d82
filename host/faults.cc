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

FaultTable::FaultTable()
{
   for (auto op : kFaultPoints) {
      points_.emplace(std::string(op), Point{});
   }
}

void FaultTable::addRule(std::string_view op, orr_Status status, uint64_t nth, bool once)
{
   if (nth == 0) {
      throw std::invalid_argument("fault rule for " + std::string(op) + ": nth counts from 1");
   }
   std::lock_guard guard(mutex_);
   auto point = points_.find(op);
   if (point == points_.end()) {
      throw std::invalid_argument("no fault point named '" + std::string(op) + "'");
   }
   point->second.rules.push_back(Rule{status, point->second.calls + nth, once});
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
   for (auto &[name, point] : points_) {
      point.rules.clear();
   }
}

uint64_t FaultTable::calls(std::string_view op) const
{
   std::lock_guard guard(mutex_);
   auto point = points_.find(op);
   if (point == points_.end()) {
      throw std::invalid_argument("no fault point named '" + std::string(op) + "'");
   }
   return point->second.calls;
}

std::optional<orr_Status> FaultTable::hit(std::string_view op)
{
   std::lock_guard guard(mutex_);
   auto point = points_.find(op);
   if (point == points_.end()) {
      // A host operation that forgot to list itself: a host bug, not the module's.
      fatal("fault point '" + std::string(op) + "' is not listed");
   }
   Point &p = point->second;
   ++p.calls;
   // The first rule that applies decides; a spent one-shot rule is dropped.
   for (auto rule = p.rules.begin(); rule != p.rules.end(); ++rule) {
      if (rule->once && rule->firstCall == p.calls) {
         orr_Status status = rule->status;
         p.rules.erase(rule);
         return status;
      }
      if (!rule->once && p.calls >= rule->firstCall) {
         return rule->status;
      }
   }
   std::erase_if(p.rules, [&](const Rule &r) { return r.once && r.firstCall < p.calls; });
   return std::nullopt;
}

}  // namespace swsec::host
