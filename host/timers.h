// Timer queues and timers, fired in due-time order: on the thread that
// advances virtual time, or on a host thread once real time is in use.
#pragma once

#include "host/clock.h"
#include "host/faults.h"
#include "host/heap.h"
#include "host/host.h"
#include "host/locks.h"
#include "host/symbolizer.h"
#include "host/violations.h"

#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

namespace swsec::host {

class TimerService final : public Clock {
public:
   TimerService(Violations &violations, FaultTable &faults, HeapRegistry &heaps, LockRegistry &locks,
                Symbolizer &symbolizer);
   ~TimerService() override;

   TimeBase &time() { return time_; }
   // Stops the real-time thread, if any; no timer fires after this returns.
   void stop();

   // Platform operations.
   orr_Status createQueue(const orr_TimerQueueProps *props, orr_TimerQueue *queue);
   void destroyQueue(orr_TimerQueue queue);
   orr_Status schedule(orr_TimerQueue queue, orr_TimerCallback callback, void *data, int64_t timeoutUs,
                       int64_t periodUs, orr_LockDomainID domain, uint32_t lockRank, orr_Timer *timer);
   orr_Status add(orr_TimerCallback callback, void *data, int64_t timeoutUs, bool periodic, orr_Timer *timer);
   bool removeSync(orr_Timer timer);
   void sleep(uint64_t microseconds);

   // Reports and cancels pending timers and live queues (waiting for a
   // callback that is running on another thread).
   std::vector<std::string> purge(std::string_view when);

   // Clock
   void advance(std::chrono::microseconds by) override;
   void skipIdle(std::chrono::microseconds by) override;
   void runDue() override;
   std::chrono::microseconds now() const override;
   void useRealTime() override;
   bool isVirtual() const override;
   size_t pendingTimers() const override;
   uint64_t sleeps() const override;

   struct Queue;

private:
   struct Timer {
      orr_Timer id = 0;
      Queue *queue = nullptr;          // null: the system queue (orr_TimerAdd)
      orr_TimerCallback callback = nullptr;
      void *data = nullptr;
      int64_t dueUs = 0;
      int64_t periodUs = 0;            // 0: one shot
      std::optional<uint32_t> rank;    // the pseudo-lock the callback runs under
      uint64_t seq = 0;                // order of addition, for equal due times
      bool running = false;
      bool cancelled = false;
      std::thread::id runner;
   };
   using Key = std::tuple<int64_t, uint64_t, orr_Timer>;

   orr_Status insert(Timer timer, orr_Timer *handle);
   // Fires every pending timer due at or before `limitUs`, in order; with
   // `moveClock`, virtual time steps to each timer's due time as it fires;
   // with `skipPeriodic`, periodic timers are re-armed past `limitUs`
   // instead of fired.
   void fireDue(int64_t limitUs, bool moveClock, bool skipPeriodic = false);
   void moveVirtual(std::chrono::microseconds by, bool skipPeriodic);
   void realTimeLoop();
   std::string describe(const Timer &timer);

   Violations &violations_;
   FaultTable &faults_;
   HeapRegistry &heaps_;
   LockRegistry &locks_;
   Symbolizer &symbolizer_;
   TimeBase time_;

   mutable std::mutex mutex_;
   std::condition_variable changed_;
   uint64_t nextSeq_ = 1;
   orr_Timer nextTimer_ = 0x1000;
   std::map<const orr_TimerQueueOpaque *, std::unique_ptr<Queue>> queues_;
   std::map<orr_Timer, Timer> timers_;
   std::set<Key> pending_;
   uint64_t sleeps_ = 0;
   std::mutex advanceMutex_;
   std::atomic<std::thread::id> advancing_{};
   bool stopping_ = false;
   std::thread realTimeThread_;
};

}  // namespace swsec::host
