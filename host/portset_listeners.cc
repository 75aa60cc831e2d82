#include "host/portset_listeners.h"

#include "host/state.h"

#include <algorithm>

namespace swsec::host {

PortsetListeners::PortsetListeners(Violations &violations, FaultTable &faults)
   : violations_(violations), faults_(faults)
{
}

orr_Status PortsetListeners::registerListener(orr_Portset *portset, uint32_t portID, uint64_t msgClass,
                                              orr_PortsetMessageCB callback, void *priv,
                                              orr_PortsetMessageCBHandle *handle)
{
   if (auto status = faults_.hit(faultPoint("orr_PortsetRegisterMessageCB"))) {
      return *status;
   }
   if (callback == nullptr || handle == nullptr) {
      return ORR_BAD_PARAM;
   }
   std::lock_guard guard(mutex_);
   const orr_PortsetMessageCBHandle id = nextHandle_++;
   listeners_.emplace(id, MessageListenerInfo{id, portset, portID, msgClass, callback, priv});
   *handle = id;
   return ORR_OK;
}

void PortsetListeners::unregisterListener(orr_PortsetMessageCBHandle handle)
{
   {
      std::unique_lock guard(mutex_);
      if (listeners_.erase(handle) != 0) {
         // A callback that unregisters itself cannot wait for its own end.
         const auto self = std::this_thread::get_id();
         callEnded_.wait(guard, [&] {
            auto [first, last] = running_.equal_range(handle);
            return std::all_of(first, last, [&](const auto &call) { return call.second == self; });
         });
         return;
      }
   }
   violations_.report("orr_PortsetUnregisterMessageCB: unknown listener " + std::to_string(handle));
}

std::vector<std::string> PortsetListeners::purge(std::string_view when)
{
   std::lock_guard guard(mutex_);
   std::vector<std::string> problems;
   for (const auto &[id, listener] : listeners_) {
      problems.push_back(std::string(when) + ": portset message listener " + std::to_string(id) + " for class " +
                         std::to_string(listener.msgClass) + " is still registered");
   }
   listeners_.clear();
   return problems;
}

std::vector<MessageListenerInfo> PortsetListeners::listeners() const
{
   std::lock_guard guard(mutex_);
   std::vector<MessageListenerInfo> result;
   for (const auto &[id, listener] : listeners_) {
      result.push_back(listener);
   }
   return result;
}

void PortsetListeners::deliver(const orr_Portset *portset, uint32_t portID, uint64_t msgClass,
                               const orr_PortsetMessageHeader *message)
{
   std::vector<orr_PortsetMessageCBHandle> targets;
   {
      std::lock_guard guard(mutex_);
      for (const auto &[id, listener] : listeners_) {
         if ((listener.portset == nullptr || listener.portset == portset) &&
             (listener.portID == 0 || listener.portID == portID) && listener.msgClass == msgClass) {
            targets.push_back(id);
         }
      }
   }
   const auto self = std::this_thread::get_id();
   for (orr_PortsetMessageCBHandle id : targets) {
      orr_PortsetMessageCB callback = nullptr;
      std::multimap<orr_PortsetMessageCBHandle, std::thread::id>::iterator call;
      {
         std::lock_guard guard(mutex_);
         auto listener = listeners_.find(id);
         if (listener == listeners_.end()) {
            continue;
         }
         callback = listener->second.callback;
         call = running_.emplace(id, self);
      }
      callback(portID, msgClass, message);
      {
         std::lock_guard guard(mutex_);
         running_.erase(call);
      }
      callEnded_.notify_all();
   }
}

}  // namespace swsec::host

using swsec::host::detail::requireState;

ORR_API orr_Status orr_PortsetRegisterMessageCB(orr_Portset *portset, uint32_t portID, uint64_t msgClass,
                                                orr_PortsetMessageCB callback, void *priv,
                                                orr_PortsetMessageCBHandle *handle)
{
   return requireState("orr_PortsetRegisterMessageCB")
      .portsets.registrations().registerListener(portset, portID, msgClass, callback, priv, handle);
}

ORR_API void orr_PortsetUnregisterMessageCB(orr_PortsetMessageCBHandle handle)
{
   requireState("orr_PortsetUnregisterMessageCB").portsets.registrations().unregisterListener(handle);
}
