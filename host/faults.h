// Fault points: every host operation that can fail asks the fault table
// first, so a test can make the n-th call of any of them fail.
#pragma once

#include "host/host.h"
#include "host/lean.h"
#include "host/sharded_counter.h"

#include <array>
#include <atomic>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace swsec::host {

// Every host operation that can fail. A rule for a name outside this list
// would never fire, so it is refused: that catches a misspelt name in a test.
// New fault points are added here.
inline constexpr std::array kFaultPoints = {
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
   std::string_view{"orr_SifraClearSlowPath"},
   std::string_view{"orr_SifraGetEndPointType"},
   std::string_view{"orr_SifraGetFailurePolicy"},
   std::string_view{"orr_SifraGetName"},
   std::string_view{"orr_SifraGetPortID"},
   std::string_view{"orr_SifraGetVMUUID"},
   std::string_view{"orr_SifraGetVnicIndex"},
   std::string_view{"orr_SifraPropertyRegister"},
   std::string_view{"orr_SifraRegisterFastPath"},
   std::string_view{"orr_SifraRestoreSlowPathState"},
   std::string_view{"orr_SifraRetrieveSlowPathState"},
   std::string_view{"orr_SifraSendFilterIoctlReply"},
   std::string_view{"orr_SifraSetMinPktMappedLen"},
   std::string_view{"orr_SifraSetSlowPath"},
   std::string_view{"orr_SpinlockCreate"},
   std::string_view{"orr_StringFormat"},
   std::string_view{"orr_TimerAdd"},
   std::string_view{"orr_TimerQueueCreate"},
   std::string_view{"orr_TimerSchedule"},
};

// The index of a fault point, found while compiling: a host operation
// naming a point that is not listed does not build.
consteval size_t faultPoint(std::string_view name)
{
   for (size_t index = 0; index < kFaultPoints.size(); ++index) {
      if (kFaultPoints[index] == name) {
         return index;
      }
   }
   throw "fault point not listed in kFaultPoints";
}

class FaultTable final : public Faults {
public:
   // Faults
   void failOnce(std::string_view op, orr_Status status, uint64_t nth) override;
   void failFrom(std::string_view op, orr_Status status, uint64_t nth) override;
   void clear() override;
   uint64_t calls(std::string_view op) const override;

   // Counts one call of the point (an index from faultPoint); the status to
   // fail it with, when a rule says so. The frame path calls this for every
   // header lookup, so the common case is a per-thread count and one load.
   // The lean host counts calls only while a rule is armed (a rule's n-th
   // call counts from its arming, so rules behave alike; `calls` does not).
   std::optional<orr_Status> hit(size_t point)
   {
      Point &p = points_[point];
      if constexpr (kLeanHost) {
         if (armedRules_.load(std::memory_order_acquire) == 0) [[likely]] {
            return std::nullopt;
         }
      }
      p.calls.add(1);
      if (armedRules_.load(std::memory_order_acquire) == 0) [[likely]] {
         return std::nullopt;
      }
      return ruleFor(p);
   }
   // The frame path's quick count: counts the call and says true when no
   // rule is armed and the thread has its own counter shard; otherwise
   // counts nothing and says false, and the caller takes its full path
   // through hit().
   bool countQuietly(size_t point)
   {
      if constexpr (kLeanHost) {
         return armedRules_.load(std::memory_order_acquire) == 0;
      }
      return armedRules_.load(std::memory_order_acquire) == 0 && points_[point].calls.tryAddToOwnShard(1);
   }
   // The same for an operation that passes its name along (looked up by name).
   std::optional<orr_Status> hit(std::string_view op) { return hit(indexOf(op)); }

private:
   struct Rule {
      orr_Status status;
      uint64_t firstCall;   // absolute call number
      bool once;
   };
   // The points are fixed, so `hit` reads the table without the lock. Calls
   // are counted in per-thread shards; rules are read and changed under the
   // lock, and only looked at while some rule is armed.
   struct Point {
      ShardedCounter calls;
      std::vector<Rule> rules;
   };

   void addRule(std::string_view op, orr_Status status, uint64_t nth, bool once);
   size_t indexOf(std::string_view op) const;   // throws for an unknown name
   std::optional<orr_Status> ruleFor(Point &point);

   mutable std::mutex mutex_;
   std::array<Point, kFaultPoints.size()> points_;
   std::atomic<uint64_t> armedRules_{0};
};

}  // namespace swsec::host
