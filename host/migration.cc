// Save and restore of a filter's state, and the slow path state requests.
#include "host/migration.h"

#include "host/sifra_records.h"
#include "host/state.h"

#include <sanitizer/asan_interface.h>

#include <algorithm>
#include <cstring>
#include <stdexcept>

namespace swsec::host {

// ---------------------------------------------------------------- GuardedBuffer

GuardedBuffer::GuardedBuffer(size_t size) : size_(size), storage_(std::make_unique<uint8_t[]>(size + 2 * kGuard))
{
   std::memset(storage_.get(), kPattern, size + 2 * kGuard);
   ASAN_POISON_MEMORY_REGION(storage_.get(), kGuard);
   ASAN_POISON_MEMORY_REGION(storage_.get() + kGuard + size, kGuard);
}

GuardedBuffer::~GuardedBuffer()
{
   ASAN_UNPOISON_MEMORY_REGION(storage_.get(), size_ + 2 * kGuard);
}

bool GuardedBuffer::contains(const void *begin, uint64_t length) const
{
   const auto *first = static_cast<const uint8_t *>(begin);
   return first >= data() && length <= size_ && static_cast<size_t>(first - data()) <= size_ - length;
}

std::optional<std::string> GuardedBuffer::check() const
{
   ASAN_UNPOISON_MEMORY_REGION(storage_.get(), kGuard);
   ASAN_UNPOISON_MEMORY_REGION(storage_.get() + kGuard + size_, kGuard);
   std::optional<std::string> problem;
   for (size_t i = 0; i < kGuard && !problem; ++i) {
      if (storage_[kGuard - 1 - i] != kPattern) {
         problem = "wrote " + std::to_string(i + 1) + " byte(s) before the buffer";
      }
   }
   for (size_t i = kGuard; i-- > 0 && !problem;) {
      if (storage_[kGuard + size_ + i] != kPattern) {
         problem = "wrote up to " + std::to_string(i + 1) + " byte(s) past the buffer's " + std::to_string(size_);
      }
   }
   ASAN_POISON_MEMORY_REGION(storage_.get(), kGuard);
   ASAN_POISON_MEMORY_REGION(storage_.get() + kGuard + size_, kGuard);
   return problem;
}

// ---------------------------------------------------------------- MigrationService

MigrationService::MigrationService(Violations &violations, FaultTable &faults, LockRegistry &locks,
                                   SifraRegistry &sifra)
   : violations_(violations), faults_(faults), locks_(locks), sifra_(sifra)
{
}

MigrationService::~MigrationService() = default;

SifraRegistry::ModuleFilter MigrationService::requireFilter(FilterId id, const char *op) const
{
   auto filter = sifra_.moduleFilter(id);
   if (!filter) {
      throw std::invalid_argument(std::string(op) + ": no filter " + std::to_string(id));
   }
   return *filter;
}

void MigrationService::checkGuards(const GuardedBuffer &buffer, const std::string &what)
{
   if (auto problem = buffer.check()) {
      violations_.report(what + ": the module " + *problem);
   }
}

void MigrationService::prefetch(FilterId id)
{
   const auto filter = requireFilter(id, "prefetch");
   if (filter.ops->prefetchSavedState != nullptr) {
      filter.ops->prefetchSavedState(filter.record);
   }
   sifra_.moduleCallReturned();
}

orr_Status MigrationService::length(FilterId id, uint64_t *length)
{
   const auto filter = requireFilter(id, "length");
   if (filter.ops->getSavedStateLen == nullptr) {
      return ORR_NOT_SUPPORTED;
   }
   const orr_Status status = filter.ops->getSavedStateLen(filter.record, length);
   sifra_.moduleCallReturned();
   return status;
}

orr_Status MigrationService::save(FilterId id, uint64_t bufferSize, std::vector<uint8_t> *blob)
{
   const auto filter = requireFilter(id, "save");
   if (filter.ops->saveState == nullptr) {
      return ORR_NOT_SUPPORTED;
   }
   if (blob == nullptr) {
      uint64_t size = bufferSize;
      const orr_Status status = filter.ops->saveState(filter.record, nullptr, &size);
      sifra_.moduleCallReturned();
      return status;
   }
   GuardedBuffer buffer(bufferSize);
   uint64_t written = bufferSize;
   const orr_Status status = filter.ops->saveState(filter.record, buffer.data(), &written);
   sifra_.moduleCallReturned();
   checkGuards(buffer, "saveState");
   blob->clear();
   if (status == ORR_OK) {
      if (written > bufferSize) {
         violations_.report("saveState: the module says it wrote " + std::to_string(written) +
                            " bytes into a buffer of " + std::to_string(bufferSize));
         written = bufferSize;
      }
      blob->assign(buffer.data(), buffer.data() + written);
   }
   return status;
}

orr_Status MigrationService::restore(FilterId id, std::span<const uint8_t> blob)
{
   const auto filter = requireFilter(id, "restore");
   if (filter.ops->restoreState == nullptr) {
      return ORR_NOT_SUPPORTED;
   }
   auto buffer = std::make_shared<GuardedBuffer>(blob.size());
   if (!blob.empty()) {
      std::memcpy(buffer->data(), blob.data(), blob.size());
   }
   {
      std::lock_guard guard(mutex_);
      restoring_ = buffer;
   }
   const orr_Status status = filter.ops->restoreState(filter.record, buffer->data(), blob.size());
   {
      std::lock_guard guard(mutex_);
      restoring_.reset();
   }
   sifra_.moduleCallReturned();
   checkGuards(*buffer, "restoreState");
   return status;
}

orr_Status MigrationService::saveAsHypervisor(FilterId id, std::vector<uint8_t> *blob, uint32_t maxPolls)
{
   prefetch(id);
   uint64_t total = 0;
   orr_Status status = length(id, &total);
   for (uint32_t poll = 1; status == ORR_NOT_READY && poll < maxPolls; ++poll) {
      deliverReplies(SIZE_MAX);
      status = length(id, &total);
   }
   if (status != ORR_OK) {
      // The hypervisor gives the save up, so the module drops what it prepared.
      (void)length(id, nullptr);
      return status;
   }
   return save(id, total, blob);
}

void MigrationService::scriptRetrieve(SlowPathStateOutcome outcome)
{
   std::lock_guard guard(mutex_);
   retrieveScript_.push_back(std::move(outcome));
}

void MigrationService::scriptRestore(SlowPathStateOutcome outcome)
{
   std::lock_guard guard(mutex_);
   restoreScript_.push_back(std::move(outcome));
}

std::vector<SlowPathStateRequest> MigrationService::requests() const
{
   std::lock_guard guard(mutex_);
   return requests_;
}

size_t MigrationService::pendingReplies() const
{
   std::lock_guard guard(mutex_);
   return pending_.size();
}

std::optional<FilterId> MigrationService::beginRequest(const char *op, orr_SifraFilterHandle handle)
{
   // The module releases its locks around a request: one held here would
   // be held across a call that may wait on another host's answer.
   if (const std::string held = locks_.heldSpinlock(); !held.empty()) {
      violations_.report(std::string(op) + ": made while holding spinlock \"" + held + "\"");
   }
   const auto id = sifra_.filterOfHandle(handle);
   if (!id) {
      violations_.report(std::string(op) + ": unknown filter handle " + pointerText(handle));
   }
   return id;
}

orr_Status MigrationService::retrieveSlowPathState(orr_SifraFilterHandle handle,
                                                   orr_SifraRetrieveSlowPathStateReply reply, void *cookie,
                                                   uint32_t timeoutMs)
{
   if (auto status = faults_.hit(faultPoint("orr_SifraRetrieveSlowPathState"))) {
      return *status;
   }
   const auto id = beginRequest("orr_SifraRetrieveSlowPathState", handle);
   if (!id) {
      return ORR_INVALID_HANDLE;
   }
   if (reply == nullptr) {
      violations_.report("orr_SifraRetrieveSlowPathState: no reply callback");
      return ORR_BAD_PARAM;
   }
   std::lock_guard guard(mutex_);
   SlowPathStateOutcome outcome;
   if (!retrieveScript_.empty()) {
      outcome = std::move(retrieveScript_.front());
      retrieveScript_.pop_front();
   }
   SlowPathStateRequest &request = requests_.emplace_back();
   request.kind = SlowPathStateRequest::Kind::retrieve;
   request.filter = *id;
   request.cookie = cookie;
   request.timeoutMs = timeoutMs;
   if (outcome.refusal && *outcome.refusal != ORR_OK) {
      return *outcome.refusal;
   }
   request.accepted = true;
   PendingReply &pending = pending_.emplace_back();
   pending.request = requests_.size() - 1;
   pending.retrieveReply = reply;
   pending.status = outcome.replyStatus;
   pending.state = std::move(outcome.state);
   return ORR_OK;
}

orr_Status MigrationService::restoreSlowPathState(orr_SifraFilterHandle handle, const void *state, uint64_t length,
                                                  orr_SifraRestoreSlowPathStateReply reply, void *cookie,
                                                  uint32_t timeoutMs)
{
   if (auto status = faults_.hit(faultPoint("orr_SifraRestoreSlowPathState"))) {
      return *status;
   }
   const auto id = beginRequest("orr_SifraRestoreSlowPathState", handle);
   if (!id) {
      return ORR_INVALID_HANDLE;
   }
   if (reply == nullptr || (state == nullptr && length != 0)) {
      violations_.report("orr_SifraRestoreSlowPathState: no reply callback or no state");
      return ORR_BAD_PARAM;
   }
   std::lock_guard guard(mutex_);
   // The module hands over bytes of the blob it is restoring; the blob is
   // kept alive for the reply, when the slow path would have read them.
   if (!restoring_ || !restoring_->contains(state, length)) {
      violations_.report("orr_SifraRestoreSlowPathState: the state lies outside the blob being restored");
      return ORR_BAD_PARAM;
   }
   SlowPathStateOutcome outcome;
   if (!restoreScript_.empty()) {
      outcome = std::move(restoreScript_.front());
      restoreScript_.pop_front();
   }
   SlowPathStateRequest &request = requests_.emplace_back();
   request.kind = SlowPathStateRequest::Kind::restore;
   request.filter = *id;
   request.cookie = cookie;
   request.timeoutMs = timeoutMs;
   const auto *bytes = static_cast<const uint8_t *>(state);
   request.state.assign(bytes, bytes + length);
   if (outcome.refusal && *outcome.refusal != ORR_OK) {
      return *outcome.refusal;
   }
   request.accepted = true;
   PendingReply &pending = pending_.emplace_back();
   pending.request = requests_.size() - 1;
   pending.restoreReply = reply;
   pending.status = outcome.replyStatus;
   pending.blob = restoring_;
   return ORR_OK;
}

size_t MigrationService::deliverReplies(size_t count)
{
   size_t delivered = 0;
   while (delivered < count) {
      PendingReply pending;
      FilterId filterId = 0;
      void *cookie = nullptr;
      {
         std::lock_guard guard(mutex_);
         if (pending_.empty()) {
            break;
         }
         pending = std::move(pending_.front());
         pending_.pop_front();
         SlowPathStateRequest &request = requests_[pending.request];
         request.replied = true;
         filterId = request.filter;
         cookie = request.cookie;
      }
      ++delivered;
      const auto filter = sifra_.moduleFilter(filterId);
      if (!filter) {
         violations_.report("slow path state reply: filter " + std::to_string(filterId) +
                            " was destroyed while a reply was owed to it");
         continue;
      }
      {
         // From the host's completion context: no module lock held.
         LockRegistry::CallbackScope scope(locks_, std::nullopt, "slow path state reply");
         if (pending.retrieveReply != nullptr) {
            // The bytes are the host's and live only during the reply.
            GuardedBuffer bytes(pending.state.size());
            if (!pending.state.empty()) {
               std::memcpy(bytes.data(), pending.state.data(), pending.state.size());
            }
            pending.retrieveReply(filter->record, cookie, pending.state.empty() ? nullptr : bytes.data(),
                                  pending.state.size(), pending.status);
            checkGuards(bytes, "slow path state retrieve reply");
         } else {
            pending.restoreReply(filter->record, cookie, pending.status);
         }
      }
      sifra_.moduleCallReturned();
      if (pending.blob) {
         checkGuards(*pending.blob, "slow path state restore");
      }
   }
   return delivered;
}

std::vector<std::string> MigrationService::purge(std::string_view when)
{
   std::vector<std::string> problems;
   std::lock_guard guard(mutex_);
   for (const PendingReply &pending : pending_) {
      const SlowPathStateRequest &request = requests_[pending.request];
      problems.push_back(std::string("a slow path state ") +
                         (request.kind == SlowPathStateRequest::Kind::retrieve ? "retrieve" : "restore") +
                         " reply to filter " + std::to_string(request.filter) + " was never delivered (" +
                         std::string(when) + ")");
   }
   pending_.clear();
   retrieveScript_.clear();
   restoreScript_.clear();
   requests_.clear();
   return problems;
}

// ---------------------------------------------------------------- SifraRegistry's side

std::optional<SifraRegistry::ModuleFilter> SifraRegistry::moduleFilter(FilterId id) const
{
   std::lock_guard guard(mutex_);
   auto found = filters_.find(id);
   if (found == filters_.end() || !found->second->created) {
      return std::nullopt;
   }
   return ModuleFilter{found->second->fastPath->info.ops, found->second->record};
}

std::optional<FilterId> SifraRegistry::filterOfHandle(orr_SifraFilterHandle handle) const
{
   std::lock_guard guard(mutex_);
   for (const auto &[id, filter] : filters_) {
      if (filter.get() == handle) {
         return id;
      }
   }
   return std::nullopt;
}

}  // namespace swsec::host

using swsec::host::detail::requireState;

ORR_API orr_Status orr_SifraRetrieveSlowPathState(orr_SifraFilterHandle handle,
                                                  orr_SifraRetrieveSlowPathStateReply reply, void *cookie,
                                                  uint32_t timeoutMs)
{
   return requireState("orr_SifraRetrieveSlowPathState").migration.retrieveSlowPathState(handle, reply, cookie, timeoutMs);
}

ORR_API orr_Status orr_SifraRestoreSlowPathState(orr_SifraFilterHandle handle, const void *state, uint64_t length,
                                                 orr_SifraRestoreSlowPathStateReply reply, void *cookie,
                                                 uint32_t timeoutMs)
{
   return requireState("orr_SifraRestoreSlowPathState")
      .migration.restoreSlowPathState(handle, state, length, reply, cookie, timeoutMs);
}
