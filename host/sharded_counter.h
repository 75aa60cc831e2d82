// A counter that threads raise and lower at once without sharing a cache
// line or a locked instruction: a thread owns a shard while it lives and
// adds to it with a plain load and store; the value is the sum. Threads
// beyond the number of shards share the last one, with atomic adds.
#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>

namespace swsec::host {

inline constexpr size_t kCounterShards = 16;
// The shard that threads without one of their own share.
inline constexpr size_t kSharedShard = kCounterShards - 1;

namespace detail {

// The calling thread's shard plus one, 0 until it takes one. The host is
// loaded with the program, so the initial-exec model is open to it: no TLS
// lookup call.
extern thread_local constinit __attribute__((tls_model("initial-exec"))) size_t threadShard;
size_t takeShard();

}  // namespace detail

inline size_t shardOfThisThread()
{
   const size_t shard = detail::threadShard;
   return shard != 0 ? shard - 1 : detail::takeShard();
}

class ShardedCounter {
public:
   void add(int64_t delta)
   {
      const size_t shard = shardOfThisThread();
      std::atomic<int64_t> &value = shards_[shard].value;
      if (shard != kSharedShard) [[likely]] {
         // Only this thread writes this shard.
         value.store(value.load(std::memory_order_relaxed) + delta, std::memory_order_relaxed);
      } else {
         value.fetch_add(delta, std::memory_order_relaxed);
      }
   }
   // Adds when the calling thread owns a shard already; false, with
   // nothing added, when it must go through add().
   bool tryAddToOwnShard(int64_t delta)
   {
      const size_t shard = detail::threadShard;
      if (shard == 0 || shard - 1 == kSharedShard) [[unlikely]] {
         return false;
      }
      std::atomic<int64_t> &value = shards_[shard - 1].value;
      value.store(value.load(std::memory_order_relaxed) + delta, std::memory_order_relaxed);
      return true;
   }
   // Exact once the threads that changed it have stopped or synchronised
   // with the reader (tests read it then).
   int64_t value() const
   {
      int64_t sum = 0;
      for (const Shard &shard : shards_) {
         sum += shard.value.load(std::memory_order_relaxed);
      }
      return sum;
   }

private:
   struct alignas(64) Shard {
      std::atomic<int64_t> value{0};
   };
   std::array<Shard, kCounterShards> shards_;
};

}  // namespace swsec::host
