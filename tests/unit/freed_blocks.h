// Copies of chosen module heap blocks as they were at the moment they were
// freed, so that a test can see what the module left in a record just
// before giving it back (its released magic, the order of releases).
//
// The unit test program puts a pass-through orr_HeapFree in front of the
// host's: every free goes on to the host unchanged; only blocks a test
// watches are copied first.
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

namespace swsec::testing::freedBlocks {

struct Block {
   const void *address;
   std::vector<uint8_t> bytes;   // the first `size` bytes at the free
};

// Copies the first `size` bytes of `block` when it is freed.
void watch(const void *block, size_t size);
// Watched blocks freed since the last clear, in order.
std::vector<Block> freed();
// Forgets watched and freed blocks.
void clear();

}  // namespace swsec::testing::freedBlocks
