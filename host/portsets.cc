#include "host/portsets.h"

#include "host/state.h"

#include <algorithm>
#include <cstring>
#include <deque>
#include <shared_mutex>
#include <stdexcept>

// The record behind the platform's portset type.
struct orr_Portset {};

namespace swsec::host {

struct PortsetService::Record : orr_Portset {
   std::string name;
   std::shared_mutex lock;   // the portset lock
};

namespace {

std::atomic<uint64_t> nextGeneration{1};

// A message posted and not yet delivered: the header and payload copied.
struct QueuedMessage {
   const orr_Portset *portset = nullptr;
   uint32_t portID = 0;
   uint64_t msgClass = 0;
   std::vector<uint64_t> storage;   // 8-byte aligned header + payload

   const orr_PortsetMessageHeader *header() const
   {
      return reinterpret_cast<const orr_PortsetMessageHeader *>(storage.data());
   }
};

// The calling thread's portset holds and queued messages, for the host that
// made them (a later host starts the thread afresh).
struct ThreadPortsets {
   uint64_t generation = 0;
   std::vector<std::pair<const orr_Portset *, orr_PortsetHold>> holds;
   std::deque<QueuedMessage> queue;
   bool delivering = false;
};
thread_local __attribute__((tls_model("initial-exec"))) ThreadPortsets threadPortsetsOfHost;

// Payloads beyond this are taken for a corrupt header, not copied.
constexpr uint64_t kMaxPayload = 1u << 20;

}  // namespace

static ThreadPortsets &threadPortsets(uint64_t generation)
{
   ThreadPortsets &thread = threadPortsetsOfHost;
   if (thread.generation != generation) {
      thread = ThreadPortsets{};
      thread.generation = generation;
   }
   return thread;
}

PortsetService::PortsetService(Violations &violations, FaultTable &faults, LockRegistry &locks)
   : violations_(violations), faults_(faults), locks_(locks), generation_(nextGeneration++),
     listeners_(violations, faults)
{
   locks_.setQuiescentHook([this] { deliverIfQuiescent(); });
}

PortsetService::~PortsetService()
{
   locks_.setQuiescentHook(nullptr);
}

PortsetService::Record *PortsetService::checked(const orr_Portset *portset, const char *op) const
{
   std::lock_guard guard(mutex_);
   for (const auto &[name, record] : portsets_) {
      if (record.get() == portset) {
         return record.get();
      }
   }
   fatal(std::string(op) + ": unknown portset " + pointerText(portset));
}

orr_Portset *PortsetService::addPortset(std::string_view name)
{
   std::lock_guard guard(mutex_);
   if (portsets_.contains(name)) {
      throw std::invalid_argument("portset '" + std::string(name) + "' exists");
   }
   auto record = std::make_unique<Record>();
   record->name = name;
   Record *result = record.get();
   portsets_.emplace(std::string(name), std::move(record));
   return result;
}

void PortsetService::addPort(std::string_view portset, uint32_t portID)
{
   std::lock_guard guard(mutex_);
   auto found = portsets_.find(portset);
   if (found == portsets_.end()) {
      throw std::invalid_argument("no portset '" + std::string(portset) + "'");
   }
   if (portID == 0 || ports_.contains(portID)) {
      throw std::invalid_argument("port ID " + std::to_string(portID) + " is 0 or in use");
   }
   ports_.emplace(portID, found->second.get());
}

orr_Portset *PortsetService::portset(std::string_view name) const
{
   std::lock_guard guard(mutex_);
   auto found = portsets_.find(name);
   return found == portsets_.end() ? nullptr : found->second.get();
}

orr_Portset *PortsetService::portsetOfPort(uint32_t portID) const
{
   std::lock_guard guard(mutex_);
   auto found = ports_.find(portID);
   return found == ports_.end() ? nullptr : found->second;
}

orr_Status PortsetService::acquireByPortID(uint32_t portID, uint32_t flags, orr_PortsetHandle *handle)
{
   if (auto status = faults_.hit(faultPoint("orr_PortsetAcquireByPortID"))) {
      return *status;
   }
   if (handle == nullptr || flags != ORR_PORTSET_ACQUIRE_SHARED) {
      return ORR_BAD_PARAM;
   }
   std::lock_guard guard(mutex_);
   auto found = ports_.find(portID);
   if (found == ports_.end()) {
      return ORR_NOT_FOUND;
   }
   const uint64_t id = nextAcquisition_++;
   acquisitions_.emplace(id, found->second);
   *handle = orr_PortsetHandle{found->second, id};
   return ORR_OK;
}

void PortsetService::release(orr_PortsetHandle *handle)
{
   {
      std::lock_guard guard(mutex_);
      auto found = handle == nullptr ? acquisitions_.end() : acquisitions_.find(handle->reserved);
      if (found != acquisitions_.end() && found->second == handle->portset) {
         acquisitions_.erase(found);
         *handle = orr_PortsetHandle{};
         return;
      }
   }
   violations_.report("orr_PortsetRelease: " + pointerText(handle) + " is not a hold on a portset");
}

uint64_t PortsetService::outstandingAcquisitions() const
{
   std::lock_guard guard(mutex_);
   return acquisitions_.size();
}

orr_PortsetHold PortsetService::holdState(const orr_Portset *portset)
{
   for (const auto &[held, hold] : threadPortsets(generation_).holds) {
      if (held == portset) {
         return hold;
      }
   }
   return ORR_PORTSET_HOLD_NONE;
}

void PortsetService::lockShared(orr_Portset *portset)
{
   Record *record = checked(portset, "orr_PortsetLockShared");
   if (holdState(portset) != ORR_PORTSET_HOLD_NONE) {
      fatal("orr_PortsetLockShared: portset '" + record->name + "' is already held by this thread");
   }
   record->lock.lock_shared();
   threadPortsets(generation_).holds.emplace_back(portset, ORR_PORTSET_HOLD_SHARED);
}

void PortsetService::unlockShared(orr_Portset *portset)
{
   Record *record = checked(portset, "orr_PortsetUnlockShared");
   auto &holds = threadPortsets(generation_).holds;
   auto hold = std::find_if(holds.begin(), holds.end(), [&](const auto &h) { return h.first == portset; });
   if (hold == holds.end() || hold->second != ORR_PORTSET_HOLD_SHARED) {
      fatal("orr_PortsetUnlockShared: portset '" + record->name + "' is not held shared by this thread");
   }
   holds.erase(hold);
   record->lock.unlock_shared();
   deliverIfQuiescent();
}

void PortsetService::unlockExclusive(orr_Portset *portset)
{
   Record *record = checked(portset, "orr_PortsetUnlockExcl");
   auto &holds = threadPortsets(generation_).holds;
   auto hold = std::find_if(holds.begin(), holds.end(), [&](const auto &h) { return h.first == portset; });
   if (hold == holds.end() || hold->second != ORR_PORTSET_HOLD_EXCL) {
      fatal("orr_PortsetUnlockExcl: portset '" + record->name + "' is not held exclusive by this thread");
   }
   holds.erase(hold);
   record->lock.unlock_shared();
   deliverIfQuiescent();
}

orr_Status PortsetService::post(orr_Portset *portset, uint32_t portID, uint64_t msgClass,
                                const orr_PortsetMessageHeader *message)
{
   if (auto status = faults_.hit(faultPoint("orr_PortsetPostMessage"))) {
      return *status;
   }
   Record *record = checked(portset, "orr_PortsetPostMessage");
   if (message == nullptr || message->payloadLength > kMaxPayload) {
      return ORR_BAD_PARAM;
   }
   auto &thread = threadPortsets(generation_);
   auto hold = std::find_if(thread.holds.begin(), thread.holds.end(), [&](const auto &h) { return h.first == portset; });
   if (hold == thread.holds.end()) {
      violations_.report("orr_PortsetPostMessage: posted on portset '" + record->name +
                         "' without holding its lock");
      return ORR_FAILURE;
   }
   if (hold->second == ORR_PORTSET_HOLD_SHARED && upgradeNextPost_.exchange(false)) {
      hold->second = ORR_PORTSET_HOLD_EXCL;
   }

   const size_t size = sizeof(orr_PortsetMessageHeader) + static_cast<size_t>(message->payloadLength);
   QueuedMessage queued{portset, portID, msgClass, std::vector<uint64_t>((size + 7) / 8)};
   std::memcpy(queued.storage.data(), message, size);
   const auto *bytes = reinterpret_cast<const uint8_t *>(message);
   PostedMessage record_{record->name, portID, msgClass,
                         std::string(message->name, strnlen(message->name, sizeof(message->name))),
                         std::vector<uint8_t>(bytes + sizeof(orr_PortsetMessageHeader), bytes + size)};
   {
      std::lock_guard guard(mutex_);
      posted_.push_back(std::move(record_));
   }
   thread.queue.push_back(std::move(queued));
   ++pending_;
   return ORR_OK;
}

void PortsetService::deliverIfQuiescent()
{
   auto &thread = threadPortsets(generation_);
   if (thread.delivering || thread.queue.empty() || !thread.holds.empty() || !locks_.threadHoldsNothing()) {
      return;
   }
   thread.delivering = true;
   while (!thread.queue.empty()) {
      QueuedMessage message = std::move(thread.queue.front());
      thread.queue.pop_front();
      --pending_;
      // Listeners run as callbacks: with no lock of the poster, not sleeping.
      LockRegistry::CallbackScope scope(locks_, std::nullopt, "portset message callback");
      listeners_.deliver(message.portset, message.portID, message.msgClass, message.header());
   }
   thread.delivering = false;
}

std::vector<std::string> PortsetService::purge(std::string_view when)
{
   std::vector<std::string> problems = listeners_.purge(when);
   std::lock_guard guard(mutex_);
   for (const auto &[id, record] : acquisitions_) {
      problems.push_back(std::string(when) + ": a hold on portset '" + record->name + "' was not released");
   }
   acquisitions_.clear();
   return problems;
}

std::vector<MessageListenerInfo> PortsetService::listeners() const
{
   return listeners_.listeners();
}

std::vector<PostedMessage> PortsetService::posted() const
{
   std::lock_guard guard(mutex_);
   return posted_;
}

std::vector<PostedMessage> PortsetService::takePosted()
{
   std::vector<PostedMessage> taken;
   std::lock_guard guard(mutex_);
   taken.swap(posted_);
   return taken;
}

void PortsetService::clearPosted()
{
   std::lock_guard guard(mutex_);
   posted_.clear();
}

size_t PortsetService::pendingDeliveries() const
{
   return pending_.load();
}

void PortsetService::upgradeHoldOnNextPost()
{
   upgradeNextPost_ = true;
}

}  // namespace swsec::host

using swsec::host::detail::requireState;

ORR_API orr_Status orr_PortsetAcquireByPortID(uint32_t portID, uint32_t flags, orr_PortsetHandle *handle)
{
   return requireState("orr_PortsetAcquireByPortID").portsets.acquireByPortID(portID, flags, handle);
}

ORR_API void orr_PortsetRelease(orr_PortsetHandle *handle)
{
   requireState("orr_PortsetRelease").portsets.release(handle);
}

ORR_API orr_Status orr_PortsetPostMessage(orr_Portset *portset, uint32_t portID, uint64_t msgClass,
                                          const orr_PortsetMessageHeader *message)
{
   return requireState("orr_PortsetPostMessage").portsets.post(portset, portID, msgClass, message);
}

ORR_API orr_PortsetHold orr_PortsetHoldState(const orr_Portset *portset)
{
   return requireState("orr_PortsetHoldState").portsets.holdState(portset);
}

ORR_API void orr_PortsetLockShared(orr_Portset *portset)
{
   requireState("orr_PortsetLockShared").portsets.lockShared(portset);
}

ORR_API void orr_PortsetUnlockShared(orr_Portset *portset)
{
   requireState("orr_PortsetUnlockShared").portsets.unlockShared(portset);
}

ORR_API void orr_PortsetUnlockExcl(orr_Portset *portset)
{
   requireState("orr_PortsetUnlockExcl").portsets.unlockExclusive(portset);
}
