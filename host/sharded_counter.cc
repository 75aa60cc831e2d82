#include "host/sharded_counter.h"

namespace swsec::host {

namespace {
std::atomic<size_t> nextShard{0};
}  // namespace

size_t shardOfThisThread()
{
   thread_local __attribute__((tls_model("initial-exec"))) size_t shard = nextShard.fetch_add(1);
   return shard;
}

}  // namespace swsec::host
