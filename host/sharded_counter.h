// A counter that threads raise and lower at once without sharing a cache
// line: each thread works on its own shard, and the value is the sum.
#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>

namespace swsec::host {

// The calling thread's shard number. The host is loaded with the program,
// so the initial-exec model is open to it: no TLS lookup call.
size_t shardOfThisThread();

class ShardedCounter {
public:
   static constexpr size_t kShards = 16;

   void add(int64_t delta)
   {
      shards_[shardOfThisThread() % kShards].value.fetch_add(delta, std::memory_order_relaxed);
   }
   // Exact once the threads that changed it have stopped (tests read it then).
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
   std::array<Shard, kShards> shards_;
};

}  // namespace swsec::host
