// Portsets (virtual switches) and their ports, holds on them, the portset
// lock as a poster of messages sees it, and message posting.
//
// A message is never delivered under the poster's locks: a post is queued
// on the posting thread and delivered on that thread once it holds nothing
// (no spinlock, no portset lock, no callback context) — when the lock layer
// sees its last lock go, when it lets go of the portset lock, or when the
// facade's call into the module returns.
//
// The portset lock is modelled per thread (a thread stands for a CPU): a
// thread holds it shared or exclusive or not at all. The shared hold is a
// real reader hold of the portset's lock, outside the rank order; a post
// may turn it exclusive (upgradeHoldOnNextPost), which then stays a reader
// hold underneath, so nothing else changes.
#pragma once

#include "host/faults.h"
#include "host/host.h"
#include "host/locks.h"
#include "host/portset_listeners.h"
#include "host/violations.h"

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace swsec::host {

class PortsetService final : public Portsets {
public:
   PortsetService(Violations &violations, FaultTable &faults, LockRegistry &locks);
   ~PortsetService() override;

   struct Record;

   PortsetListeners &registrations() { return listeners_; }

   // Platform operations.
   orr_Status acquireByPortID(uint32_t portID, uint32_t flags, orr_PortsetHandle *handle);
   void release(orr_PortsetHandle *handle);
   orr_PortsetHold holdState(const orr_Portset *portset);
   void lockShared(orr_Portset *portset);
   void unlockShared(orr_Portset *portset);
   void unlockExclusive(orr_Portset *portset);
   orr_Status post(orr_Portset *portset, uint32_t portID, uint64_t msgClass, const orr_PortsetMessageHeader *message);

   // The portset that holds a port, or null.
   orr_Portset *portsetOfPort(uint32_t portID) const;
   // Delivers the calling thread's queued messages if it holds nothing.
   void deliverIfQuiescent();

   // Reports and removes listeners and holds still present.
   std::vector<std::string> purge(std::string_view when);

   // Portsets
   std::vector<MessageListenerInfo> listeners() const override;
   orr_Portset *addPortset(std::string_view name) override;
   void addPort(std::string_view portset, uint32_t portID) override;
   orr_Portset *portset(std::string_view name) const override;
   uint64_t outstandingAcquisitions() const override;
   std::vector<PostedMessage> posted() const override;
   std::vector<PostedMessage> takePosted() override;
   void clearPosted() override;
   size_t pendingDeliveries() const override;
   void upgradeHoldOnNextPost() override;

private:
   Record *checked(const orr_Portset *portset, const char *op) const;

   Violations &violations_;
   FaultTable &faults_;
   LockRegistry &locks_;
   const uint64_t generation_;
   PortsetListeners listeners_;

   mutable std::mutex mutex_;
   std::map<std::string, std::unique_ptr<Record>, std::less<>> portsets_;
   std::map<uint32_t, Record *> ports_;
   uint64_t nextAcquisition_ = 1;
   std::map<uint64_t, const Record *> acquisitions_;
   std::vector<PostedMessage> posted_;
   std::atomic<size_t> pending_{0};
   std::atomic<bool> upgradeNextPost_{false};
};

}  // namespace swsec::host
