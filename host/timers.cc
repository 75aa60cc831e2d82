#include "host/timers.h"

#include "host/state.h"

#include <algorithm>
#include <cstring>
#include <limits>
#include <stdexcept>

// The record behind an orr_TimerQueue.
struct orr_TimerQueueOpaque {};

namespace swsec::host {

struct TimerService::Queue : orr_TimerQueueOpaque {
   uint64_t seq = 0;
   std::string name;
   orr_ModuleID module = ORR_INVALID_MODULE_ID;
   orr_HeapID heap = nullptr;
};

TimerService::TimerService(Violations &violations, FaultTable &faults, HeapRegistry &heaps, LockRegistry &locks,
                           Symbolizer &symbolizer)
   : violations_(violations), faults_(faults), heaps_(heaps), locks_(locks), symbolizer_(symbolizer)
{
}

TimerService::~TimerService()
{
   stop();
}

void TimerService::stop()
{
   {
      std::lock_guard guard(mutex_);
      stopping_ = true;
   }
   changed_.notify_all();
   if (realTimeThread_.joinable()) {
      realTimeThread_.join();
   }
}

std::string TimerService::describe(const Timer &timer)
{
   std::string text = "timer " + std::to_string(timer.id) + " (callback " +
                      symbolizer_.describe(reinterpret_cast<const void *>(timer.callback)) + ")";
   text += timer.queue != nullptr ? " on queue '" + timer.queue->name + "'" : " on the system queue";
   return text;
}

orr_Status TimerService::createQueue(const orr_TimerQueueProps *props, orr_TimerQueue *queue)
{
   if (auto status = faults_.hit(faultPoint("orr_TimerQueueCreate"))) {
      return *status;
   }
   if (props == nullptr || queue == nullptr || props->flags != 0) {
      return ORR_BAD_PARAM;
   }
   auto record = std::make_unique<Queue>();
   record->name.assign(props->name.name, strnlen(props->name.name, sizeof props->name.name));
   record->module = props->module;
   record->heap = props->heap;
   if (!heaps_.attach(props->heap, record.get(), "timer queue '" + record->name + "'")) {
      return ORR_INVALID_HANDLE;
   }
   std::lock_guard guard(mutex_);
   record->seq = nextSeq_++;
   *queue = record.get();
   queues_.emplace(static_cast<const orr_TimerQueueOpaque *>(record.get()), std::move(record));
   return ORR_OK;
}

void TimerService::destroyQueue(orr_TimerQueue queue)
{
   std::string problem;
   orr_HeapID heap = nullptr;
   {
      std::lock_guard guard(mutex_);
      auto found = queues_.find(queue);
      if (found == queues_.end()) {
         problem = "orr_TimerQueueDestroy: unknown timer queue " + pointerText(queue);
      } else {
         Queue *record = found->second.get();
         size_t cancelled = 0;
         for (auto timer = timers_.begin(); timer != timers_.end();) {
            if (timer->second.queue != record) {
               ++timer;
               continue;
            }
            ++cancelled;
            timer->second.queue = nullptr;
            if (timer->second.running) {
               timer->second.cancelled = true;
               ++timer;
            } else {
               pending_.erase(Key{timer->second.dueUs, timer->second.seq, timer->first});
               timer = timers_.erase(timer);
            }
         }
         if (cancelled != 0) {
            problem = "orr_TimerQueueDestroy: timer queue '" + record->name + "' destroyed with " +
                      std::to_string(cancelled) + " pending timer(s)";
         }
         heap = record->heap;
         heaps_.detach(heap, record);
         queues_.erase(found);
      }
      changed_.notify_all();
   }
   if (!problem.empty()) {
      violations_.report(std::move(problem));
   }
}

orr_Status TimerService::insert(Timer timer, orr_Timer *handle)
{
   {
      std::lock_guard guard(mutex_);
      timer.id = nextTimer_++;
      timer.seq = nextSeq_++;
      timer.dueUs += time_.nowUs();
      pending_.insert(Key{timer.dueUs, timer.seq, timer.id});
      *handle = timer.id;
      timers_.emplace(timer.id, std::move(timer));
   }
   changed_.notify_all();
   return ORR_OK;
}

orr_Status TimerService::schedule(orr_TimerQueue queue, orr_TimerCallback callback, void *data, int64_t timeoutUs,
                                  int64_t periodUs, orr_LockDomainID domain, uint32_t lockRank, orr_Timer *timer)
{
   if (auto status = faults_.hit(faultPoint("orr_TimerSchedule"))) {
      return *status;
   }
   if (callback == nullptr || timer == nullptr || timeoutUs < 0 ||
       (periodUs != ORR_TIMER_ONE_SHOT && periodUs <= 0)) {
      return ORR_BAD_PARAM;
   }
   if (!locks_.domainExists(domain)) {
      return ORR_INVALID_HANDLE;
   }
   Timer record;
   {
      std::lock_guard guard(mutex_);
      auto found = queues_.find(queue);
      if (found == queues_.end()) {
         return ORR_INVALID_HANDLE;
      }
      record.queue = found->second.get();
   }
   record.callback = callback;
   record.data = data;
   record.dueUs = timeoutUs;
   record.periodUs = periodUs == ORR_TIMER_ONE_SHOT ? 0 : periodUs;
   record.rank = lockRank;
   return insert(std::move(record), timer);
}

orr_Status TimerService::add(orr_TimerCallback callback, void *data, int64_t timeoutUs, bool periodic,
                             orr_Timer *timer)
{
   if (auto status = faults_.hit(faultPoint("orr_TimerAdd"))) {
      return *status;
   }
   // A periodic timer of period 0 would fire forever without time moving.
   if (callback == nullptr || timer == nullptr || timeoutUs < 0 || (periodic && timeoutUs == 0)) {
      return ORR_BAD_PARAM;
   }
   Timer record;
   record.callback = callback;
   record.data = data;
   record.dueUs = timeoutUs;
   record.periodUs = periodic ? timeoutUs : 0;
   return insert(std::move(record), timer);
}

void TimerService::fireDue(int64_t limitUs, bool moveClock, bool skipPeriodic)
{
   std::unique_lock guard(mutex_);
   while (!pending_.empty() && std::get<0>(*pending_.begin()) <= limitUs && !stopping_) {
      const orr_Timer id = std::get<2>(*pending_.begin());
      pending_.erase(pending_.begin());
      Timer &timer = timers_.at(id);
      if (skipPeriodic && timer.periodUs > 0) {
         // Its first tick after the limit, in one step.
         timer.dueUs += ((limitUs - timer.dueUs) / timer.periodUs + 1) * timer.periodUs;
         pending_.insert(Key{timer.dueUs, timer.seq, id});
         continue;
      }
      timer.running = true;
      timer.runner = std::this_thread::get_id();
      const orr_TimerCallback callback = timer.callback;
      void *data = timer.data;
      const std::optional<uint32_t> rank = timer.rank;
      if (moveClock) {
         time_.moveTo(timer.dueUs);
      }
      guard.unlock();
      {
         LockRegistry::CallbackScope scope(locks_, rank, "timer");
         callback(data);
      }
      guard.lock();
      auto found = timers_.find(id);
      Timer &done = found->second;
      done.running = false;
      done.runner = std::thread::id{};
      if (!done.cancelled && done.periodUs > 0) {
         // Re-armed from its due time, not from when it ran: a periodic timer
         // keeps its phase however late its callback was.
         done.dueUs += done.periodUs;
         pending_.insert(Key{done.dueUs, done.seq, id});
      } else {
         timers_.erase(found);
      }
      changed_.notify_all();
   }
}

void TimerService::advance(std::chrono::microseconds by)
{
   moveVirtual(by, false);
}

void TimerService::skipIdle(std::chrono::microseconds by)
{
   moveVirtual(by, true);
}

void TimerService::moveVirtual(std::chrono::microseconds by, bool skipPeriodic)
{
   if (!time_.isVirtual()) {
      throw std::logic_error("Clock::advance: the host runs on real time");
   }
   if (by.count() < 0) {
      throw std::invalid_argument("Clock::advance: time does not go backwards");
   }
   if (advancing_.load() == std::this_thread::get_id()) {
      fatal("virtual time advanced from inside a timer callback");
   }
   std::lock_guard guard(advanceMutex_);
   advancing_.store(std::this_thread::get_id());
   const int64_t target = time_.nowUs() + std::min<int64_t>(by.count(), std::numeric_limits<int64_t>::max() / 4);
   fireDue(target, true, skipPeriodic);
   time_.moveTo(target);
   advancing_.store(std::thread::id{});
}

void TimerService::runDue()
{
   if (advancing_.load() == std::this_thread::get_id()) {
      fatal("Clock::runDue called from inside a timer callback");
   }
   std::lock_guard guard(advanceMutex_);
   advancing_.store(std::this_thread::get_id());
   fireDue(time_.nowUs(), false);
   advancing_.store(std::thread::id{});
}

bool TimerService::removeSync(orr_Timer timer)
{
   std::unique_lock guard(mutex_);
   auto found = timers_.find(timer);
   if (found == timers_.end()) {
      return false;
   }
   Timer &record = found->second;
   if (!record.running) {
      pending_.erase(Key{record.dueUs, record.seq, timer});
      timers_.erase(found);
      changed_.notify_all();
      return true;
   }
   record.cancelled = true;
   // A callback that removes its own timer must not wait for itself.
   if (record.runner == std::this_thread::get_id()) {
      return true;
   }
   changed_.wait(guard, [&] { return !timers_.contains(timer); });
   return true;
}

void TimerService::sleep(uint64_t microseconds)
{
   locks_.requireNoSpinlockHeld("orr_WorldSleep");
   {
      std::lock_guard guard(mutex_);
      ++sleeps_;
   }
   const auto us = static_cast<int64_t>(std::min<uint64_t>(microseconds, std::numeric_limits<int64_t>::max() / 4));
   if (time_.isVirtual()) {
      // Virtual time: the sleeper moves time on and fires what falls due,
      // which is what would have happened while it slept.
      advance(std::chrono::microseconds(us));
   } else {
      std::this_thread::sleep_for(std::chrono::microseconds(us));
   }
}

void TimerService::realTimeLoop()
{
   std::unique_lock guard(mutex_);
   while (!stopping_) {
      if (pending_.empty()) {
         changed_.wait(guard);
         continue;
      }
      const int64_t due = std::get<0>(*pending_.begin());
      const int64_t now = time_.nowUs();
      if (due > now) {
         changed_.wait_for(guard, std::chrono::microseconds(due - now));
         continue;
      }
      guard.unlock();
      fireDue(time_.nowUs(), false);
      guard.lock();
   }
}

void TimerService::useRealTime()
{
   std::lock_guard advance(advanceMutex_);
   if (!time_.isVirtual()) {
      return;
   }
   time_.switchToReal();
   realTimeThread_ = std::thread([this] { realTimeLoop(); });
}

std::vector<std::string> TimerService::purge(std::string_view when)
{
   std::vector<std::string> problems;
   std::unique_lock guard(mutex_);
   std::vector<std::pair<uint64_t, orr_Timer>> order;
   for (const auto &[id, timer] : timers_) {
      order.emplace_back(timer.seq, id);
   }
   std::sort(order.begin(), order.end());
   for (const auto &[seq, id] : order) {
      auto found = timers_.find(id);
      if (found == timers_.end() || found->second.cancelled) {
         continue;
      }
      problems.push_back(std::string(when) + ": " + describe(found->second) + " is still pending");
      if (found->second.running && found->second.runner != std::this_thread::get_id()) {
         found->second.cancelled = true;
         changed_.wait(guard, [&, timer = id] { return !timers_.contains(timer); });
      } else if (!found->second.running) {
         timers_.erase(found);
      } else {
         found->second.cancelled = true;
      }
   }
   pending_.clear();
   std::vector<const Queue *> queues;
   for (const auto &[key, queue] : queues_) {
      queues.push_back(queue.get());
   }
   std::sort(queues.begin(), queues.end(), [](const Queue *a, const Queue *b) { return a->seq < b->seq; });
   for (const Queue *queue : queues) {
      problems.push_back(std::string(when) + ": timer queue '" + queue->name + "' was not destroyed");
      heaps_.detach(queue->heap, queue);
   }
   for (auto &[id, timer] : timers_) {
      timer.queue = nullptr;
   }
   queues_.clear();
   return problems;
}

std::chrono::microseconds TimerService::now() const
{
   return std::chrono::microseconds(time_.nowUs());
}

bool TimerService::isVirtual() const
{
   return time_.isVirtual();
}

size_t TimerService::pendingTimers() const
{
   std::lock_guard guard(mutex_);
   return pending_.size();
}

uint64_t TimerService::sleeps() const
{
   std::lock_guard guard(mutex_);
   return sleeps_;
}

}  // namespace swsec::host

using swsec::host::detail::requireState;

ORR_API void orr_WorldSleep(uint64_t microseconds)
{
   requireState("orr_WorldSleep").timers.sleep(microseconds);
}

ORR_API orr_Status orr_TimerQueueCreate(const orr_TimerQueueProps *props, orr_TimerQueue *queue)
{
   return requireState("orr_TimerQueueCreate").timers.createQueue(props, queue);
}

ORR_API void orr_TimerQueueDestroy(orr_TimerQueue queue)
{
   requireState("orr_TimerQueueDestroy").timers.destroyQueue(queue);
}

ORR_API orr_Status orr_TimerSchedule(orr_TimerQueue queue, orr_TimerCallback callback, void *data, int64_t timeoutUs,
                                     int64_t periodUs, uint32_t flags, orr_LockDomainID domain, uint32_t lockRank,
                                     orr_Timer *timer)
{
   // `flags` has no meaning for this host; it is accepted and ignored.
   (void)flags;
   return requireState("orr_TimerSchedule").timers.schedule(queue, callback, data, timeoutUs, periodUs, domain,
                                                            lockRank, timer);
}

ORR_API orr_Status orr_TimerAdd(orr_TimerCallback callback, void *data, int64_t timeoutUs, bool periodic,
                                uint32_t options, orr_Timer *timer)
{
   // `options` is the caller's business with the real kernel; it changes
   // nothing here.
   (void)options;
   return requireState("orr_TimerAdd").timers.add(callback, data, timeoutUs, periodic, timer);
}

ORR_API bool orr_TimerRemoveSync(orr_Timer timer)
{
   return requireState("orr_TimerRemoveSync").timers.removeSync(timer);
}
