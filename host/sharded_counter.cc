#include "host/sharded_counter.h"

#include <mutex>

namespace swsec::host {

namespace detail {

thread_local constinit __attribute__((tls_model("initial-exec"))) size_t threadShard = 0;

namespace {

std::mutex shardsMutex;
std::array<bool, kSharedShard> shardTaken{};

// Gives the thread's own shard back when the thread ends, so that the
// next thread can own it; what was counted in it stays in the sum.
struct ShardOwner {
   size_t shard = kSharedShard;
   ~ShardOwner()
   {
      if (shard != kSharedShard) {
         std::lock_guard guard(shardsMutex);
         shardTaken[shard] = false;
      }
      // Whatever this thread still counts while it ends goes to the shared shard.
      threadShard = kSharedShard + 1;
   }
};

}  // namespace

size_t takeShard()
{
   thread_local ShardOwner owner;
   {
      std::lock_guard guard(shardsMutex);
      for (size_t shard = 0; shard < shardTaken.size(); ++shard) {
         if (!shardTaken[shard]) {
            shardTaken[shard] = true;
            owner.shard = shard;
            break;
         }
      }
   }
   threadShard = owner.shard + 1;
   return owner.shard;
}

}  // namespace detail

}  // namespace swsec::host
