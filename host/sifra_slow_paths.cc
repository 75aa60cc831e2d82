#include "host/sifra_slow_paths.h"

#include "host/sifra_registry.h"
#include "host/state.h"

#include <algorithm>
#include <stdexcept>

namespace swsec::host {

namespace {

// Enough for a module that answers busy while a few rounds of replies go by.
constexpr uint32_t kMaxWithdrawCalls = 1000;

const char *kindText(SlowPathRequestKind kind)
{
   switch (kind) {
   case SlowPathRequestKind::Set:
      return "set";
   case SlowPathRequestKind::Clear:
      return "clear";
   }
   return "?";
}

}  // namespace

SlowPathDriver::SlowPathDriver(SifraRegistry &registry, Violations &violations, FaultTable &faults,
                               LockRegistry &locks)
   : registry_(registry), violations_(violations), faults_(faults), locks_(locks)
{
}

SlowPathDriver::~SlowPathDriver() = default;

// ---------------------------------------------------------------- requests

std::optional<FilterId> SlowPathDriver::requestingFilter(orr_SifraFilterHandle handle, const char *op)
{
   // A request waits for the host's answer: the caller must hold no spinlock.
   if (const std::string held = locks_.heldSpinlock(); !held.empty()) {
      violations_.report(std::string(op) + ": request made while holding spinlock '" + held + "'");
   }
   auto id = registry_.filterIdOf(handle);
   if (!id) {
      violations_.report(std::string(op) + ": unknown filter handle " + pointerText(handle));
   }
   return id;
}

void SlowPathDriver::record(const SlowPathRequest &request)
{
   std::function<void(const SlowPathRequest &)> hook;
   {
      std::lock_guard guard(mutex_);
      requests_.push_back(request);
      hook = hook_;
   }
   if (hook) {
      hook(request);
   }
}

void SlowPathDriver::accept(SlowPathRequest &request, Delivery deliver)
{
   std::string problem;
   {
      std::lock_guard guard(mutex_);
      const bool owedAlready = std::any_of(owed_.begin(), owed_.end(), [&](const Owed &owed) {
         return owed.reply.filter == request.filter && owed.reply.kind == request.kind;
      });
      if (owedAlready) {
         problem = std::string("Sifra slow path: a second ") + kindText(request.kind) +
                   " request for filter " + std::to_string(request.filter) + " while its reply is owed";
      }
      Script &script = scripts_[request.kind];
      orr_Status status = script.fallback;
      if (!script.next.empty()) {
         status = script.next.front();
         script.next.pop_front();
      }
      owed_.push_back(Owed{nextSeq_++, PendingReply{request.kind, request.filter, request.slowPathID, status},
                           std::move(deliver)});
   }
   if (!problem.empty()) {
      violations_.report(std::move(problem));
   }
   request.result = ORR_OK;
}

orr_Status SlowPathDriver::setSlowPath(orr_SifraFilterHandle handle, uint32_t slowPathID,
                                       orr_SifraSetSlowPathCB callback, void *cookie, int32_t timeoutMs)
{
   auto filter = requestingFilter(handle, "orr_SifraSetSlowPath");
   if (!filter) {
      return ORR_INVALID_HANDLE;
   }
   SlowPathRequest request{SlowPathRequestKind::Set, *filter, slowPathID, timeoutMs, ORR_OK};
   if (callback == nullptr) {
      request.result = ORR_BAD_PARAM;
   } else if (auto status = faults_.hit(faultPoint("orr_SifraSetSlowPath"))) {
      request.result = *status;
   } else {
      accept(request, [callback, cookie](orr_SifraFilter record, orr_Status outcome) {
         callback(record, cookie, outcome);
      });
   }
   record(request);
   return request.result;
}

orr_Status SlowPathDriver::clearSlowPath(orr_SifraFilterHandle handle)
{
   auto filter = requestingFilter(handle, "orr_SifraClearSlowPath");
   if (!filter) {
      return ORR_INVALID_HANDLE;
   }
   SlowPathRequest request{SlowPathRequestKind::Clear, *filter, 0, 0, ORR_OK};
   if (auto status = faults_.hit(faultPoint("orr_SifraClearSlowPath"))) {
      request.result = *status;
   } else {
      registry_.setHostSlowPath(*filter, std::nullopt);
   }
   record(request);
   return request.result;
}

// ---------------------------------------------------------------- replies

size_t SlowPathDriver::deliverReplies(std::optional<FilterId> filter)
{
   // The module's reply callback takes its own spinlocks: the deliverer
   // holds none and runs no callback. (A sleeping mutex is allowed: the
   // module's teardown holds one while the fast path's withdrawal completes
   // the requests still owed, which a real host does on another CPU.)
   if (locks_.inAtomicContext()) {
      violations_.report("slow path replies delivered from a context that holds a spinlock or runs a callback");
      return 0;
   }
   uint64_t limit = 0;
   {
      std::lock_guard guard(mutex_);
      limit = nextSeq_;
   }
   size_t delivered = 0;
   for (;;) {
      Owed owed;
      orr_SifraFilter record = nullptr;
      {
         std::lock_guard guard(mutex_);
         // A filter whose creation has not returned yet has no record to
         // give: its replies wait.
         auto next = std::find_if(owed_.begin(), owed_.end(), [&](const Owed &candidate) {
            if (candidate.seq >= limit || (filter && candidate.reply.filter != *filter)) {
               return false;
            }
            record = registry_.createdRecordOf(candidate.reply.filter);
            return record != nullptr;
         });
         if (next == owed_.end()) {
            break;
         }
         owed = std::move(*next);
         owed_.erase(next);
      }
      if (owed.reply.kind == SlowPathRequestKind::Set && owed.reply.status == ORR_OK) {
         registry_.setHostSlowPath(owed.reply.filter, owed.reply.slowPathID);
      }
      {
         LockRegistry::CallbackScope scope(locks_, std::nullopt, "slow path reply");
         owed.deliver(record, owed.reply.status);
      }
      ++delivered;
   }
   return delivered;
}

void SlowPathDriver::afterModuleCall()
{
   bool deliver = false;
   {
      std::lock_guard guard(mutex_);
      deliver = autoDeliver_ && !owed_.empty();
   }
   if (deliver && locks_.threadHoldsNothing()) {
      (void)deliverReplies(std::nullopt);
   }
}

void SlowPathDriver::filterGone(FilterId id)
{
   size_t lost = 0;
   {
      std::lock_guard guard(mutex_);
      lost = std::erase_if(owed_, [&](const Owed &owed) { return owed.reply.filter == id; });
   }
   if (lost != 0) {
      violations_.report("filter " + std::to_string(id) + " destroyed while " + std::to_string(lost) +
                         " slow path reply(s) were owed to it: the replies are lost");
   }
}

std::vector<PendingReply> SlowPathDriver::pendingReplies() const
{
   std::lock_guard guard(mutex_);
   std::vector<PendingReply> result;
   for (const Owed &owed : owed_) {
      result.push_back(owed.reply);
   }
   return result;
}

void SlowPathDriver::scriptReplies(SlowPathRequestKind kind, std::vector<orr_Status> statuses)
{
   std::lock_guard guard(mutex_);
   Script &script = scripts_[kind];
   script.next.insert(script.next.end(), statuses.begin(), statuses.end());
}

void SlowPathDriver::setDefaultReply(SlowPathRequestKind kind, orr_Status status)
{
   std::lock_guard guard(mutex_);
   scripts_[kind].fallback = status;
}

void SlowPathDriver::onRequest(std::function<void(const SlowPathRequest &)> hook)
{
   std::lock_guard guard(mutex_);
   hook_ = std::move(hook);
}

void SlowPathDriver::setAutoDeliver(bool on)
{
   std::lock_guard guard(mutex_);
   autoDeliver_ = on;
}

std::vector<SlowPathRequest> SlowPathDriver::requests() const
{
   std::lock_guard guard(mutex_);
   return requests_;
}

void SlowPathDriver::clearRequests()
{
   std::lock_guard guard(mutex_);
   requests_.clear();
}

// ---------------------------------------------------------------- registration

orr_Status SlowPathDriver::registerSlowPath(std::string_view agent, uint32_t id)
{
   auto fastPath = registry_.fastPathRef(agent);
   if (!fastPath) {
      throw std::invalid_argument("registerSlowPath: no fast path '" + std::string(agent) + "'");
   }
   {
      std::lock_guard guard(mutex_);
      if (slowPaths_.contains(id)) {
         throw std::invalid_argument("registerSlowPath: slow path " + std::to_string(id) + " is registered");
      }
   }
   const orr_SifraFastPathOps *ops = fastPath->info.ops;
   if (ops->registerSlowPath == nullptr) {
      return ORR_NOT_SUPPORTED;
   }
   orr_SifraSlowPath record = nullptr;
   const orr_Status status = ops->registerSlowPath(fastPath->info.agent, id, &record);
   if (status == ORR_OK) {
      std::lock_guard guard(mutex_);
      SlowPath &slowPath = slowPaths_[id];
      slowPath.seq = nextSeq_++;
      slowPath.info = SlowPathInfo{id, fastPath->info.name, record, false, 0};
      slowPath.fastPath = fastPath->key;
      slowPath.ops = ops;
   }
   registry_.afterModuleCall();
   return status;
}

std::optional<orr_Status> SlowPathDriver::callUnregister(uint32_t id)
{
   const orr_SifraFastPathOps *ops = nullptr;
   orr_SifraSlowPath record = nullptr;
   {
      std::lock_guard guard(mutex_);
      auto found = slowPaths_.find(id);
      if (found == slowPaths_.end()) {
         throw std::invalid_argument("unregisterSlowPath: no slow path " + std::to_string(id));
      }
      // The hypervisor makes one call at a time for a slow path: the record
      // may be freed by the call that succeeds.
      if (found->second.calling) {
         return std::nullopt;
      }
      found->second.calling = true;
      ++found->second.info.unregisterCalls;
      ops = found->second.ops;
      record = found->second.info.record;
   }
   const orr_Status status = ops->unregisterSlowPath != nullptr ? ops->unregisterSlowPath(record) : ORR_OK;
   {
      std::lock_guard guard(mutex_);
      SlowPath &slowPath = slowPaths_.at(id);
      slowPath.calling = false;
      if (status == ORR_BUSY) {
         slowPath.info.withdrawing = true;
      } else {
         slowPaths_.erase(id);
      }
   }
   registry_.afterModuleCall();
   return status;
}

orr_Status SlowPathDriver::unregisterSlowPath(uint32_t id)
{
   return callUnregister(id).value_or(ORR_BUSY);
}

size_t SlowPathDriver::retryWithdrawals()
{
   std::vector<std::pair<uint64_t, uint32_t>> withdrawing;
   {
      std::lock_guard guard(mutex_);
      for (const auto &[id, slowPath] : slowPaths_) {
         if (slowPath.info.withdrawing) {
            withdrawing.emplace_back(slowPath.seq, id);
         }
      }
   }
   std::sort(withdrawing.begin(), withdrawing.end());
   size_t busy = 0;
   for (const auto &[seq, id] : withdrawing) {
      busy += callUnregister(id).value_or(ORR_BUSY) == ORR_BUSY;
   }
   return busy;
}

std::vector<SlowPathInfo> SlowPathDriver::registered() const
{
   std::lock_guard guard(mutex_);
   std::vector<std::pair<uint64_t, SlowPathInfo>> ordered;
   for (const auto &[id, slowPath] : slowPaths_) {
      ordered.emplace_back(slowPath.seq, slowPath.info);
   }
   std::sort(ordered.begin(), ordered.end(), [](const auto &a, const auto &b) { return a.first < b.first; });
   std::vector<SlowPathInfo> result;
   for (auto &[seq, info] : ordered) {
      result.push_back(std::move(info));
   }
   return result;
}

void SlowPathDriver::withdrawAllOf(const void *fastPath)
{
   std::vector<std::pair<uint64_t, uint32_t>> ids;
   {
      std::lock_guard guard(mutex_);
      for (const auto &[id, slowPath] : slowPaths_) {
         if (slowPath.fastPath == fastPath) {
            ids.emplace_back(slowPath.seq, id);
         }
      }
   }
   std::sort(ids.begin(), ids.end());
   for (const auto &[seq, id] : ids) {
      orr_Status status = ORR_BUSY;
      uint32_t calls = 0;
      while (status == ORR_BUSY && calls < kMaxWithdrawCalls) {
         if (calls != 0) {
            (void)deliverReplies(std::nullopt);
            registry_.stepTime();
         }
         ++calls;
         status = callUnregister(id).value_or(ORR_BUSY);
      }
      if (status == ORR_BUSY) {
         std::lock_guard guard(mutex_);
         slowPaths_.erase(id);
         violations_.report("orr_SifraUnregisterFastPath: slow path " + std::to_string(id) +
                            " could not be unregistered after " + std::to_string(calls) + " calls");
      }
   }
}

std::vector<std::string> SlowPathDriver::purge(std::string_view when)
{
   std::lock_guard guard(mutex_);
   std::vector<std::string> problems;
   for (const auto &[id, slowPath] : slowPaths_) {
      problems.push_back(std::string(when) + ": slow path " + std::to_string(id) + " is still registered");
   }
   for (const Owed &owed : owed_) {
      problems.push_back(std::string(when) + ": a " + kindText(owed.reply.kind) + " reply to filter " +
                         std::to_string(owed.reply.filter) + " is still owed");
   }
   slowPaths_.clear();
   owed_.clear();
   return problems;
}

}  // namespace swsec::host

using swsec::host::detail::requireState;

ORR_API orr_Status orr_SifraSetSlowPath(orr_SifraFilterHandle handle, uint32_t slowPathID,
                                        orr_SifraSetSlowPathCB callback, void *cookie, int32_t timeoutMs)
{
   return requireState("orr_SifraSetSlowPath")
      .sifra.slowPathDriver()
      .setSlowPath(handle, slowPathID, callback, cookie, timeoutMs);
}

ORR_API orr_Status orr_SifraClearSlowPath(orr_SifraFilterHandle handle)
{
   return requireState("orr_SifraClearSlowPath").sifra.slowPathDriver().clearSlowPath(handle);
}
