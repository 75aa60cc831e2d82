#include "host/locks.h"

#include "host/lean.h"
#include "host/state.h"

#include <algorithm>
#include <cstring>
#include <span>

// The record behind an orr_Spinlock.
struct orr_SpinlockOpaque {};

namespace swsec::host {

namespace {

constexpr uint64_t kLiveLock = 0x6b63'6f6c'6e69'7073ull;
constexpr uint64_t kDestroyedLock = ~kLiveLock;

}  // namespace

struct LockRegistry::Spinlock : orr_SpinlockOpaque {
   // Tells a live lock from a destroyed one without the registry's lock, on
   // every acquisition; destroyed records are kept, so the check is safe.
   std::atomic<uint64_t> magic{kLiveLock};
   uint64_t seq = 0;
   std::string name;
   orr_SpinlockType type = ORR_SPINLOCK_PLAIN;
   uint32_t rank = 0;
   orr_LockDomainID domain = ORR_INVALID_LOCK_DOMAIN;
   orr_HeapID heap = nullptr;
   std::mutex plain;
   std::shared_mutex readerWriter;
   std::atomic<uint64_t> acquisitions{0};
   std::atomic<uint32_t> holders{0};
};

struct LockRegistry::Domain {
   uint64_t seq = 0;
   std::string name;
   orr_ModuleID module = ORR_INVALID_MODULE_ID;
   orr_HeapID heap = nullptr;
   uint32_t liveLocks = 0;
};

struct LockRegistry::MutexEntry {
   std::mutex mutex;
   std::atomic<std::thread::id> owner{};
};

struct LockRegistry::CallbackScope::Saved {
   std::vector<Hold> holds;
};

namespace {

std::atomic<uint64_t> nextGeneration{1};

// The locks the calling thread holds, for the host that made them. A host
// made after a test that died holding a lock starts the thread afresh.
struct ThreadHolds {
   uint64_t generation = 0;
   std::vector<LockRegistry::Hold> holds;
};
// The host is loaded with the program: the initial-exec model is open to
// it, so no TLS lookup call on every lock operation.
thread_local __attribute__((tls_model("initial-exec"))) ThreadHolds threadHoldsOfHost;

const char *modeText(LockRegistry::HoldKind kind)
{
   switch (kind) {
   case LockRegistry::HoldKind::Read:
      return "for reading";
   case LockRegistry::HoldKind::Write:
      return "for writing";
   default:
      return "";
   }
}

// Holds that forbid sleeping.
bool isSpinning(LockRegistry::HoldKind kind)
{
   return kind != LockRegistry::HoldKind::Mutex;
}

// Holds that take part in rank checks.
bool isRanked(LockRegistry::HoldKind kind)
{
   return kind != LockRegistry::HoldKind::Mutex && kind != LockRegistry::HoldKind::Context;
}

std::string quoted(std::string_view name)
{
   return "'" + std::string(name) + "'";
}

}  // namespace

LockRegistry::LockRegistry(Violations &violations, FaultTable &faults, HeapRegistry &heaps)
   : violations_(violations), faults_(faults), heaps_(heaps), generation_(nextGeneration++)
{
}

LockRegistry::~LockRegistry()
{
   // A lock still held cannot be destroyed; its record is left behind (a
   // test that failed half way may leave one).
   for (auto &[key, lock] : locks_) {
      if (lock->holders.load() != 0) {
         (void)lock.release();
      }
   }
   for (auto &[address, entry] : mutexes_) {
      if (entry->owner.load() != std::thread::id{}) {
         (void)entry.release();
      }
   }
}

std::vector<LockRegistry::Hold> &LockRegistry::threadHolds()
{
   ThreadHolds &thread = threadHoldsOfHost;
   if (thread.generation != generation_) {
      thread.generation = generation_;
      thread.holds.clear();
   }
   return thread.holds;
}

LockRegistry::Spinlock *LockRegistry::findLock(orr_Spinlock lock) const
{
   auto *record = static_cast<Spinlock *>(lock);
   if (lock == nullptr || (!kLeanHost && record->magic.load(std::memory_order_relaxed) != kLiveLock)) {
      return nullptr;
   }
   return record;
}

orr_Status LockRegistry::createDomain(orr_ModuleID module, orr_HeapID heap, const orr_Name *name,
                                      orr_LockDomainID *domain)
{
   if (auto status = faults_.hit(faultPoint("orr_LockDomainCreate"))) {
      return *status;
   }
   if (name == nullptr || domain == nullptr) {
      return ORR_BAD_PARAM;
   }
   auto record = std::make_unique<Domain>();
   record->name.assign(name->name, strnlen(name->name, sizeof name->name));
   record->module = module;
   record->heap = heap;
   std::unique_lock guard(mutex_);
   if (!heaps_.attach(heap, record.get(), "lock domain '" + record->name + "'")) {
      return ORR_INVALID_HANDLE;
   }
   record->seq = nextSeq_++;
   *domain = nextDomain_++;
   domains_.emplace(*domain, std::move(record));
   return ORR_OK;
}

void LockRegistry::destroyDomain(orr_LockDomainID domain)
{
   std::string problem;
   {
      std::unique_lock guard(mutex_);
      auto found = domains_.find(domain);
      if (found == domains_.end()) {
         problem = "orr_LockDomainDestroy: unknown lock domain " + std::to_string(domain);
      } else {
         if (found->second->liveLocks != 0) {
            problem = "orr_LockDomainDestroy: lock domain '" + found->second->name + "' still has " +
                      std::to_string(found->second->liveLocks) + " live spinlock(s)";
         }
         heaps_.detach(found->second->heap, found->second.get());
         domains_.erase(found);
      }
   }
   if (!problem.empty()) {
      violations_.report(std::move(problem));
   }
}

bool LockRegistry::domainExists(orr_LockDomainID domain) const
{
   std::shared_lock guard(mutex_);
   return domains_.contains(domain);
}

orr_Status LockRegistry::createSpinlock(const orr_SpinlockProps *props, orr_Spinlock *lock)
{
   if (auto status = faults_.hit(faultPoint("orr_SpinlockCreate"))) {
      return *status;
   }
   if (props == nullptr || lock == nullptr ||
       (props->type != ORR_SPINLOCK_PLAIN && props->type != ORR_SPINLOCK_RW)) {
      return ORR_BAD_PARAM;
   }
   auto record = std::make_unique<Spinlock>();
   record->name.assign(props->name.name, strnlen(props->name.name, sizeof props->name.name));
   record->type = props->type;
   record->rank = props->rank;
   record->domain = props->domain;
   record->heap = props->heap;
   std::unique_lock guard(mutex_);
   auto domain = domains_.find(props->domain);
   if (domain == domains_.end()) {
      return ORR_INVALID_HANDLE;
   }
   if (!heaps_.attach(props->heap, record.get(), "spinlock '" + record->name + "'")) {
      return ORR_INVALID_HANDLE;
   }
   ++domain->second->liveLocks;
   record->seq = nextSeq_++;
   *lock = record.get();
   locks_.emplace(static_cast<const orr_SpinlockOpaque *>(record.get()), std::move(record));
   return ORR_OK;
}

void LockRegistry::destroySpinlock(orr_Spinlock lock)
{
   std::string problem;
   {
      std::unique_lock guard(mutex_);
      auto found = locks_.find(lock);
      if (found == locks_.end()) {
         problem = "orr_SpinlockDestroy: unknown spinlock " + pointerText(lock);
      } else {
         Spinlock &record = *found->second;
         if (record.holders.load() != 0) {
            fatal("orr_SpinlockDestroy: " + quoted(record.name) + " (rank " + std::to_string(record.rank) +
                  ") is destroyed while held");
         }
         auto domain = domains_.find(record.domain);
         if (domain != domains_.end()) {
            --domain->second->liveLocks;
         }
         heaps_.detach(record.heap, &record);
         record.magic.store(kDestroyedLock, std::memory_order_relaxed);
         destroyedLocks_.push_back(std::move(found->second));
         if (destroyedLocks_.size() > kDestroyedLocksKept) {
            destroyedLocks_.pop_front();
         }
         locks_.erase(found);
      }
   }
   if (!problem.empty()) {
      violations_.report(std::move(problem));
   }
}

void LockRegistry::acquire(orr_Spinlock lock, Mode mode, const char *op)
{
   Spinlock *record = findLock(lock);
   if (record == nullptr) {
      fatal(std::string(op) + ": unknown spinlock " + pointerText(lock));
   }
   const bool wantsRW = mode != Mode::Plain;
   if (wantsRW != (record->type == ORR_SPINLOCK_RW)) {
      fatal(std::string(op) + " on " + (wantsRW ? "plain" : "reader-writer") + " spinlock " + quoted(record->name));
   }
   auto &holds = threadHolds();
   const Hold *highest = nullptr;
   // The lean host takes the rank order on trust (every test checks it).
   for (const Hold &hold : kLeanHost ? std::span<const Hold>{} : std::span<const Hold>{holds}) {
      if (hold.object == record) {
         fatal(std::string(op) + ": " + quoted(record->name) + " (rank " + std::to_string(record->rank) +
               ") is already held by this thread");
      }
      if (isRanked(hold.kind) && hold.rank >= record->rank && (highest == nullptr || hold.rank > highest->rank)) {
         highest = &hold;
      }
   }
   if (highest != nullptr) {
      fatal("lock rank violation: taking " + quoted(record->name) + " (rank " + std::to_string(record->rank) +
            ") while holding " + quoted(highest->name) + " (rank " + std::to_string(highest->rank) + ")");
   }
   HoldKind kind = HoldKind::Plain;
   switch (mode) {
   case Mode::Plain:
      record->plain.lock();
      break;
   case Mode::Read:
      record->readerWriter.lock_shared();
      kind = HoldKind::Read;
      break;
   case Mode::Write:
      record->readerWriter.lock();
      kind = HoldKind::Write;
      break;
   }
   ++record->holders;
   if constexpr (!kLeanHost) {
      ++record->acquisitions;   // for the host's lock listing
   }
   holds.push_back(Hold{record, kind, record->rank, record->name});
}

void LockRegistry::release(orr_Spinlock lock, Mode mode, const char *op)
{
   Spinlock *record = findLock(lock);
   if (record == nullptr) {
      fatal(std::string(op) + ": unknown spinlock " + pointerText(lock));
   }
   const bool wantsRW = mode != Mode::Plain;
   if (wantsRW != (record->type == ORR_SPINLOCK_RW)) {
      fatal(std::string(op) + " on " + (wantsRW ? "plain" : "reader-writer") + " spinlock " + quoted(record->name));
   }
   auto &holds = threadHolds();
   auto hold = std::find_if(holds.begin(), holds.end(), [&](const Hold &h) { return h.object == record; });
   if (hold == holds.end()) {
      fatal(std::string(op) + ": " + quoted(record->name) + " is not held by this thread");
   }
   const HoldKind expected = mode == Mode::Plain ? HoldKind::Plain : mode == Mode::Read ? HoldKind::Read : HoldKind::Write;
   if (hold->kind != expected) {
      fatal(std::string(op) + ": " + quoted(record->name) + " is held " + modeText(hold->kind));
   }
   // Locks may be released in any order; only taking them is ordered.
   holds.erase(hold);
   --record->holders;
   switch (mode) {
   case Mode::Plain:
      record->plain.unlock();
      break;
   case Mode::Read:
      record->readerWriter.unlock_shared();
      break;
   case Mode::Write:
      record->readerWriter.unlock();
      break;
   }
   if (holds.empty() && quiescentHook_) {
      quiescentHook_();
   }
}

void LockRegistry::setQuiescentHook(std::function<void()> hook)
{
   quiescentHook_ = std::move(hook);
}

bool LockRegistry::threadHoldsNothing()
{
   return threadHolds().empty();
}

std::string LockRegistry::heldSpinlock()
{
   for (const Hold &hold : threadHolds()) {
      if (hold.kind == HoldKind::Plain || hold.kind == HoldKind::Read || hold.kind == HoldKind::Write) {
         return std::string(hold.name);
      }
   }
   return {};
}

bool LockRegistry::inAtomicContext()
{
   const auto &holds = threadHolds();
   return std::any_of(holds.begin(), holds.end(), [](const Hold &hold) { return isSpinning(hold.kind); });
}

void LockRegistry::requireNoSpinlockHeld(const char *op)
{
   for (const Hold &hold : threadHolds()) {
      if (hold.kind == HoldKind::Context) {
         fatal(std::string(op) + " inside a callback run as " + quoted(hold.name) + ", which may not sleep");
      }
      if (isSpinning(hold.kind)) {
         fatal(std::string(op) + " while holding spinlock " + quoted(hold.name) + " (rank " +
               std::to_string(hold.rank) + ")");
      }
   }
}

void LockRegistry::lockMutex(orr_Mutex *mutex)
{
   if (mutex == nullptr) {
      fatal("orr_MutexLock: null mutex");
   }
   requireNoSpinlockHeld("orr_MutexLock");
   MutexEntry *entry = nullptr;
   {
      std::lock_guard guard(mutexTableMutex_);
      auto &slot = mutexes_[mutex];
      if (!slot) {
         slot = std::make_unique<MutexEntry>();
      }
      entry = slot.get();
   }
   const std::string_view name = mutex->name != nullptr ? std::string_view(mutex->name) : "unnamed mutex";
   if (entry->owner.load() == std::this_thread::get_id()) {
      fatal("orr_MutexLock: mutex " + quoted(name) + " is already held by this thread");
   }
   entry->mutex.lock();
   entry->owner.store(std::this_thread::get_id());
   threadHolds().push_back(Hold{mutex, HoldKind::Mutex, 0, name});
}

void LockRegistry::unlockMutex(orr_Mutex *mutex)
{
   if (mutex == nullptr) {
      fatal("orr_MutexUnlock: null mutex");
   }
   MutexEntry *entry = nullptr;
   {
      std::lock_guard guard(mutexTableMutex_);
      auto found = mutexes_.find(mutex);
      entry = found == mutexes_.end() ? nullptr : found->second.get();
   }
   const std::string_view name = mutex->name != nullptr ? std::string_view(mutex->name) : "unnamed mutex";
   if (entry == nullptr || entry->owner.load() != std::this_thread::get_id()) {
      fatal("orr_MutexUnlock: mutex " + quoted(name) + " is not held by this thread");
   }
   auto &holds = threadHolds();
   std::erase_if(holds, [&](const Hold &h) { return h.object == mutex; });
   entry->owner.store(std::thread::id{});
   entry->mutex.unlock();
}

LockRegistry::CallbackScope::CallbackScope(LockRegistry &locks, std::optional<uint32_t> rank, std::string what)
   : locks_(locks), what_(std::move(what)), saved_(std::make_unique<Saved>())
{
   auto &holds = locks_.threadHolds();
   saved_->holds.swap(holds);
   holds.push_back(Hold{this, rank ? HoldKind::Callback : HoldKind::Context, rank.value_or(0), what_});
}

LockRegistry::CallbackScope::~CallbackScope()
{
   auto &holds = locks_.threadHolds();
   for (const Hold &hold : holds) {
      if (hold.object != this) {
         fatal("callback run as " + quoted(what_) + " returned holding " + quoted(hold.name));
      }
   }
   holds.swap(saved_->holds);
   if (holds.empty() && locks_.quiescentHook_) {
      locks_.quiescentHook_();
   }
}

std::vector<std::string> LockRegistry::purge(std::string_view when)
{
   std::vector<std::string> problems;
   {
      std::unique_lock guard(mutex_);
      std::vector<const Spinlock *> live;
      for (const auto &[key, lock] : locks_) {
         live.push_back(lock.get());
      }
      std::sort(live.begin(), live.end(), [](const Spinlock *a, const Spinlock *b) { return a->seq < b->seq; });
      for (const Spinlock *lock : live) {
         problems.push_back(std::string(when) + ": spinlock " + quoted(lock->name) + " (rank " +
                            std::to_string(lock->rank) + ") was not destroyed" +
                            (lock->holders.load() != 0 ? " and is held" : ""));
         heaps_.detach(lock->heap, lock);
      }
      // A lock still held cannot be destroyed safely; such a record is left behind.
      for (auto &[key, lock] : locks_) {
         if (lock->holders.load() != 0) {
            (void)lock.release();
         }
      }
      locks_.clear();
      std::vector<const Domain *> domains;
      for (const auto &[id, domain] : domains_) {
         domains.push_back(domain.get());
      }
      std::sort(domains.begin(), domains.end(), [](const Domain *a, const Domain *b) { return a->seq < b->seq; });
      for (const Domain *domain : domains) {
         problems.push_back(std::string(when) + ": lock domain " + quoted(domain->name) + " was not destroyed");
         heaps_.detach(domain->heap, domain);
      }
      domains_.clear();
   }
   std::lock_guard guard(mutexTableMutex_);
   for (auto entry = mutexes_.begin(); entry != mutexes_.end();) {
      if (entry->second->owner.load() != std::thread::id{}) {
         const char *name = entry->first->name;
         problems.push_back(std::string(when) + ": mutex " + quoted(name != nullptr ? name : "unnamed mutex") +
                            " is still locked");
         (void)entry->second.release();
      }
      entry = mutexes_.erase(entry);
   }
   return problems;
}

std::vector<LockInfo> LockRegistry::live() const
{
   std::shared_lock guard(mutex_);
   std::vector<std::pair<uint64_t, LockInfo>> ordered;
   for (const auto &[key, lock] : locks_) {
      ordered.emplace_back(lock->seq, LockInfo{lock->name, lock->type, lock->rank, lock->acquisitions.load()});
   }
   std::sort(ordered.begin(), ordered.end(), [](const auto &a, const auto &b) { return a.first < b.first; });
   std::vector<LockInfo> result;
   for (auto &[seq, info] : ordered) {
      result.push_back(std::move(info));
   }
   return result;
}

std::vector<std::string> LockRegistry::domains() const
{
   std::shared_lock guard(mutex_);
   std::vector<std::pair<uint64_t, std::string>> ordered;
   for (const auto &[id, domain] : domains_) {
      ordered.emplace_back(domain->seq, domain->name);
   }
   std::sort(ordered.begin(), ordered.end());
   std::vector<std::string> result;
   for (auto &[seq, name] : ordered) {
      result.push_back(std::move(name));
   }
   return result;
}

}  // namespace swsec::host

using swsec::host::LockRegistry;
using swsec::host::detail::requireState;

ORR_API orr_Status orr_LockDomainCreate(orr_ModuleID module, orr_HeapID heap, const orr_Name *name,
                                        orr_LockDomainID *domain)
{
   return requireState("orr_LockDomainCreate").locks.createDomain(module, heap, name, domain);
}

ORR_API void orr_LockDomainDestroy(orr_LockDomainID domain)
{
   requireState("orr_LockDomainDestroy").locks.destroyDomain(domain);
}

ORR_API orr_Status orr_SpinlockCreate(const orr_SpinlockProps *props, orr_Spinlock *lock)
{
   return requireState("orr_SpinlockCreate").locks.createSpinlock(props, lock);
}

ORR_API void orr_SpinlockDestroy(orr_Spinlock lock)
{
   requireState("orr_SpinlockDestroy").locks.destroySpinlock(lock);
}

ORR_API void orr_SpinlockLock(orr_Spinlock lock)
{
   requireState("orr_SpinlockLock").locks.acquire(lock, LockRegistry::Mode::Plain, "orr_SpinlockLock");
}

ORR_API void orr_SpinlockUnlock(orr_Spinlock lock)
{
   requireState("orr_SpinlockUnlock").locks.release(lock, LockRegistry::Mode::Plain, "orr_SpinlockUnlock");
}

ORR_API void orr_SpinlockReadLock(orr_Spinlock lock)
{
   requireState("orr_SpinlockReadLock").locks.acquire(lock, LockRegistry::Mode::Read, "orr_SpinlockReadLock");
}

ORR_API void orr_SpinlockReadUnlock(orr_Spinlock lock)
{
   requireState("orr_SpinlockReadUnlock").locks.release(lock, LockRegistry::Mode::Read, "orr_SpinlockReadUnlock");
}

ORR_API void orr_SpinlockWriteLock(orr_Spinlock lock)
{
   requireState("orr_SpinlockWriteLock").locks.acquire(lock, LockRegistry::Mode::Write, "orr_SpinlockWriteLock");
}

ORR_API void orr_SpinlockWriteUnlock(orr_Spinlock lock)
{
   requireState("orr_SpinlockWriteUnlock").locks.release(lock, LockRegistry::Mode::Write, "orr_SpinlockWriteUnlock");
}

ORR_API void orr_MutexLock(orr_Mutex *mutex)
{
   requireState("orr_MutexLock").locks.lockMutex(mutex);
}

ORR_API void orr_MutexUnlock(orr_Mutex *mutex)
{
   requireState("orr_MutexUnlock").locks.unlockMutex(mutex);
}
