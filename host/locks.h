// Lock domains, spinlocks (plain and reader-writer) and sleeping mutexes,
// with the checks a real kernel makes only by crashing or hanging:
//
//  - a thread takes spinlocks in strictly increasing rank, across every
//    domain (a timer callback starts out holding a pseudo-lock "timer" of
//    its rank);
//  - a thread unlocks only what it holds, in the mode it holds it, never
//    takes a lock twice, never destroys a held lock, never uses a plain
//    operation on a reader-writer lock or the reverse;
//  - nothing sleeps (orr_WorldSleep, orr_MutexLock) while holding a spinlock.
//
// Each of these aborts with a message naming the locks. The locks really
// exclude (std::mutex, std::shared_mutex), so ThreadSanitizer sees them.
#pragma once

#include "host/faults.h"
#include "host/heap.h"
#include "host/host.h"
#include "host/violations.h"

#include <atomic>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <shared_mutex>
#include <string>
#include <string_view>
#include <thread>
#include <unordered_map>
#include <vector>

namespace swsec::host {

class LockRegistry final : public Locks {
public:
   enum class Mode { Plain, Read, Write };

   LockRegistry(Violations &violations, FaultTable &faults, HeapRegistry &heaps);
   ~LockRegistry() override;

   // Platform operations.
   orr_Status createDomain(orr_ModuleID module, orr_HeapID heap, const orr_Name *name, orr_LockDomainID *domain);
   void destroyDomain(orr_LockDomainID domain);
   bool domainExists(orr_LockDomainID domain) const;
   orr_Status createSpinlock(const orr_SpinlockProps *props, orr_Spinlock *lock);
   void destroySpinlock(orr_Spinlock lock);
   void acquire(orr_Spinlock lock, Mode mode, const char *op);
   void release(orr_Spinlock lock, Mode mode, const char *op);
   void lockMutex(orr_Mutex *mutex);
   void unlockMutex(orr_Mutex *mutex);

   // Called on a thread whose last lock (or callback context) has just been
   // let go: work deferred until the thread holds nothing runs there. Set
   // once, before any other thread uses the registry.
   void setQuiescentHook(std::function<void()> hook);
   // True when the calling thread holds no lock and runs no callback.
   bool threadHoldsNothing();

   // The name of a spinlock the calling thread holds (callback contexts do
   // not count); empty when it holds none.
   std::string heldSpinlock();
   // True when the calling thread holds a spinlock or runs a callback (a
   // context that may not sleep); sleeping mutexes do not count.
   bool inAtomicContext();

   // Aborts when the calling thread holds a spinlock (or runs a timer
   // callback, which counts as one): `op` is about to sleep.
   void requireNoSpinlockHeld(const char *op);

   // While alive, the calling thread runs a callback outside its caller's
   // context: it starts with no lock, may not sleep, and must have released
   // all it took when it returns. With a rank, it runs "as if holding a
   // lock" named `what` of that rank, so it may take only higher ranks.
   class CallbackScope {
   public:
      CallbackScope(LockRegistry &locks, std::optional<uint32_t> rank, std::string what);
      ~CallbackScope();
      CallbackScope(const CallbackScope &) = delete;
      CallbackScope &operator=(const CallbackScope &) = delete;

   private:
      LockRegistry &locks_;
      std::string what_;
      struct Saved;
      std::unique_ptr<Saved> saved_;
   };

   // Reports and removes domains, spinlocks and held mutexes still present.
   std::vector<std::string> purge(std::string_view when);

   // Locks
   std::vector<LockInfo> live() const override;
   std::vector<std::string> domains() const override;

   struct Spinlock;
   struct Domain;
   struct MutexEntry;
   // Callback: a ranked callback context; Context: an unranked one.
   enum class HoldKind { Plain, Read, Write, Callback, Context, Mutex };
   struct Hold {
      const void *object = nullptr;
      HoldKind kind = HoldKind::Plain;
      uint32_t rank = 0;
      std::string_view name;   // the lock's own name, alive while it is held
   };

private:
   std::vector<Hold> &threadHolds();
   Spinlock *findLock(orr_Spinlock lock) const;

   Violations &violations_;
   FaultTable &faults_;
   HeapRegistry &heaps_;
   const uint64_t generation_;
   std::function<void()> quiescentHook_;

   mutable std::shared_mutex mutex_;
   uint64_t nextSeq_ = 1;
   orr_LockDomainID nextDomain_ = 0x100;
   std::map<orr_LockDomainID, std::unique_ptr<Domain>> domains_;
   std::map<const orr_SpinlockOpaque *, std::unique_ptr<Spinlock>> locks_;
   // Destroyed locks' records, kept so that a stale handle is recognised:
   // the latest kDestroyedLocksKept, as a quarantine, so that a daemon whose
   // ports come and go for months does not grow by a record each time. A
   // handle used after that many later destroys is no longer told apart.
   static constexpr size_t kDestroyedLocksKept = 4096;
   std::deque<std::unique_ptr<Spinlock>> destroyedLocks_;

   std::mutex mutexTableMutex_;
   std::unordered_map<const orr_Mutex *, std::unique_ptr<MutexEntry>> mutexes_;
};

}  // namespace swsec::host
