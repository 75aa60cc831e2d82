// Slow paths of the Sifra registry as the hypervisor drives them: their
// registration and withdrawal through the fast path operations, and the
// requests the module makes about a filter's slow path, answered as a test
// scripts them.
//
// An asynchronous request that the host accepts becomes an owed reply: a
// closure that calls the module's reply callback with the filter's record,
// the request's cookie and the outcome. Every asynchronous request kind
// (set today; the state fetch and restore of a migration alike) goes
// through accept() and is delivered by deliverReplies(), which checks the
// contract the same way for all of them.
#pragma once

#include "host/faults.h"
#include "host/host.h"
#include "host/locks.h"
#include "host/violations.h"

#include <deque>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

namespace swsec::host {

class SifraRegistry;

class SlowPathDriver final : public SlowPaths {
public:
   SlowPathDriver(SifraRegistry &registry, Violations &violations, FaultTable &faults, LockRegistry &locks);
   ~SlowPathDriver() override;

   // Platform operations.
   orr_Status setSlowPath(orr_SifraFilterHandle handle, uint32_t slowPathID, orr_SifraSetSlowPathCB callback,
                          void *cookie, int32_t timeoutMs);
   orr_Status clearSlowPath(orr_SifraFilterHandle handle);

   // The registry's side. A filter destroyed for good: replies still owed
   // to it are lost (a violation).
   void filterGone(FilterId id);
   // Withdraws every slow path of a fast path that is going away, calling
   // again (delivering owed replies, moving virtual time) while busy.
   void withdrawAllOf(const void *fastPath);
   // After a facade call into the module: delivers with auto-delivery on.
   void afterModuleCall();
   // Reports and forgets slow paths and owed replies still present.
   std::vector<std::string> purge(std::string_view when);

   // SlowPaths
   orr_Status registerSlowPath(std::string_view agent, uint32_t id) override;
   orr_Status unregisterSlowPath(uint32_t id) override;
   size_t retryWithdrawals() override;
   std::vector<SlowPathInfo> registered() const override;
   void scriptReplies(SlowPathRequestKind kind, std::vector<orr_Status> statuses) override;
   void setDefaultReply(SlowPathRequestKind kind, orr_Status status) override;
   void onRequest(std::function<void(const SlowPathRequest &)> hook) override;
   std::vector<PendingReply> pendingReplies() const override;
   size_t deliverReplies(std::optional<FilterId> filter) override;
   void setAutoDeliver(bool on) override;
   std::vector<SlowPathRequest> requests() const override;
   void clearRequests() override;

private:
   // Calls the module's reply callback: the filter's record and the outcome.
   using Delivery = std::function<void(orr_SifraFilter record, orr_Status status)>;
   struct Owed {
      uint64_t seq = 0;
      PendingReply reply;
      Delivery deliver;
   };
   struct SlowPath {
      uint64_t seq = 0;
      SlowPathInfo info;
      const void *fastPath = nullptr;
      const orr_SifraFastPathOps *ops = nullptr;
      bool calling = false;   // an unregister call is running
   };
   struct Script {
      std::deque<orr_Status> next;
      orr_Status fallback = ORR_OK;
   };

   // The checks every request makes first: no spinlock held, a known
   // filter. The filter's ID, or nothing (reported).
   std::optional<FilterId> requestingFilter(orr_SifraFilterHandle handle, const char *op);
   // Accepts an asynchronous request: one reply owed, its status scripted.
   void accept(SlowPathRequest &request, Delivery deliver);
   void record(const SlowPathRequest &request);
   // One unregister call; false when another thread is making one.
   std::optional<orr_Status> callUnregister(uint32_t id);

   SifraRegistry &registry_;
   Violations &violations_;
   FaultTable &faults_;
   LockRegistry &locks_;

   mutable std::mutex mutex_;
   uint64_t nextSeq_ = 1;
   std::map<uint32_t, SlowPath> slowPaths_;
   std::deque<Owed> owed_;
   std::map<SlowPathRequestKind, Script> scripts_;
   std::vector<SlowPathRequest> requests_;
   std::function<void(const SlowPathRequest &)> hook_;
   bool autoDeliver_ = false;
};

}  // namespace swsec::host
