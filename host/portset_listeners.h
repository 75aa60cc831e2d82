// Portset message listeners: who listens to what, and the calls of their
// callbacks in progress (unregistering waits for them to end).
#pragma once

#include "host/faults.h"
#include "host/host.h"
#include "host/violations.h"

#include <condition_variable>
#include <map>
#include <thread>
#include <mutex>
#include <string>
#include <vector>

namespace swsec::host {

class PortsetListeners {
public:
   PortsetListeners(Violations &violations, FaultTable &faults);

   // Platform operations.
   orr_Status registerListener(orr_Portset *portset, uint32_t portID, uint64_t msgClass,
                               orr_PortsetMessageCB callback, void *priv, orr_PortsetMessageCBHandle *handle);
   void unregisterListener(orr_PortsetMessageCBHandle handle);

   // Reports and removes listeners still registered.
   std::vector<std::string> purge(std::string_view when);

   std::vector<MessageListenerInfo> listeners() const;

   // Calls every listener of the message, one after the other, outside the
   // registry's lock; a listener unregistered meanwhile is not called.
   void deliver(const orr_Portset *portset, uint32_t portID, uint64_t msgClass,
                const orr_PortsetMessageHeader *message);

private:
   Violations &violations_;
   FaultTable &faults_;

   mutable std::mutex mutex_;
   orr_PortsetMessageCBHandle nextHandle_ = 0x100;
   // Handles only grow, so the map's order is registration order.
   std::map<orr_PortsetMessageCBHandle, MessageListenerInfo> listeners_;
   // Calls in progress by listener, and the threads making them.
   std::multimap<orr_PortsetMessageCBHandle, std::thread::id> running_;
   std::condition_variable callEnded_;
};

}  // namespace swsec::host
