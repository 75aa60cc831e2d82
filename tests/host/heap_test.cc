// The module heap: size limit, per-site accounting, leaks and misuse, and
// the hash tables made on it.
#include "host_unit.h"

#include <gmock/gmock.h>

#include <algorithm>
#include <functional>

using ::testing::ElementsAre;
using ::testing::FieldsAre;
using ::testing::HasSubstr;
using ::testing::IsSupersetOf;

// Calling sites the heap must name in its reports: functions of this
// program, found in its symbol table. Their bodies differ so that the
// compiler cannot fold them into one.
volatile int heapTestSink;
extern "C" __attribute__((noinline)) void heapTestSiteA() { heapTestSink = 1; }
extern "C" __attribute__((noinline)) void heapTestSiteB() { heapTestSink = 2; }

namespace swsec::testing {
namespace {

const void *siteA() { return reinterpret_cast<const void *>(&heapTestSiteA); }
const void *siteB() { return reinterpret_cast<const void *>(&heapTestSiteB); }

using HeapTest = HostUnitTest;

TEST_F(HeapTest, CountsBySiteUpToTheMaximumAndHandsOutUnclearedBlocks)
{
   orr_HeapID heap = makeHeap("accounting", 200);
   auto *a1 = static_cast<unsigned char *>(orr_HeapAllocWithRA(heap, 100, siteA()));
   void *a2 = orr_HeapAllocWithRA(heap, 50, siteA());
   void *b1 = orr_HeapAllocWithRA(heap, 8, siteB());
   ASSERT_TRUE(a1 != nullptr && a2 != nullptr && b1 != nullptr);
   // The module clears its records itself; zeros here would hide a missing clear.
   EXPECT_EQ(std::count(a1, a1 + 100, 0), 0);
   EXPECT_EQ(orr_HeapAllocWithRA(heap, 43, siteB()), nullptr) << "158 + 43 bytes is past the maximum";
   orr_HeapFree(heap, a1);
   // Sites are named function+offset; then live bytes, live blocks, allocations.
   EXPECT_THAT(host.heap().sites(),
               IsSupersetOf({FieldsAre("heapTestSiteA+0x0", 50u, 1u, 2u), FieldsAre("heapTestSiteB+0x0", 8u, 1u, 1u)}));
   EXPECT_EQ(host.heap().liveBytes(), 58u);
   EXPECT_EQ(host.heap().liveBlocks(), 2u);
   void *last = orr_HeapAllocWithRA(heap, 142, siteB());
   EXPECT_NE(last, nullptr) << "freed bytes count again, up to the maximum itself";
   void *empty = orr_HeapAllocWithRA(heap, 0, siteB());
   EXPECT_NE(empty, nullptr) << "an empty request is still a block";
   for (void *block : {a2, b1, last, empty}) {
      orr_HeapFree(heap, block);
   }
   orr_HeapDestroy(heap);
   EXPECT_EQ(host.heap().liveBytes(), 0u);
   EXPECT_EQ(host.heap().peakBytes(), 200u);
}

// Each misuse as the violations it must raise.
TEST_F(HeapTest, LeaksAndMisuseAreReported)
{
   struct Case {
      const char *what;
      std::function<void(HeapTest &)> act;
      std::vector<std::string> violations;
   };
   const Case cases[] = {
      {"destroyed with live blocks",
       [](HeapTest &t) {
          orr_HeapID heap = t.makeHeap("leaky");
          (void)orr_HeapAllocWithRA(heap, 16, siteA());
          (void)orr_HeapAllocWithRA(heap, 16, siteA());
          (void)orr_HeapAllocWithRA(heap, 5, siteB());
          orr_HeapDestroy(heap);
       },
       {"heap 'leaky': 2 live blocks (32 bytes) allocated at heapTestSiteA+0x0",
        "heap 'leaky': 1 live block (5 bytes) allocated at heapTestSiteB+0x0"}},
      {"freed twice",
       [](HeapTest &t) {
          orr_HeapID heap = t.makeHeap("twice");
          void *block = orr_HeapAllocWithRA(heap, 24, siteA());
          void *other = orr_HeapAllocWithRA(heap, 24, siteA());
          orr_HeapFree(heap, block);
          orr_HeapFree(heap, block);
          EXPECT_EQ(t.host.heap().liveBlocks(), 1u) << "the other block is untouched";
          orr_HeapFree(heap, other);
          orr_HeapDestroy(heap);
       },
       {"is not a live block of heap 'twice'"}},
      {"freed into another heap",
       [](HeapTest &t) {
          orr_HeapID first = t.makeHeap("first");
          orr_HeapID second = t.makeHeap("second");
          void *block = orr_HeapAllocWithRA(first, 8, siteA());
          orr_HeapFree(second, block);
          orr_HeapFree(first, block);
          orr_HeapDestroy(first);
          orr_HeapDestroy(second);
       },
       {"is not a live block of heap 'second'"}},
      {"hash tables: bucket counts not a power of two, and one freed with a record linked",
       [](HeapTest &t) {
          orr_HeapID heap = t.makeHeap("hash");
          for (uint32_t count : {0u, 12u}) {
             EXPECT_EQ(Hash_Alloc(heap, count), nullptr) << count;
          }
          Hash_Table *table = Hash_Alloc(heap, 4);
          ASSERT_NE(table, nullptr);
          orr_ListLinks record{&table->buckets[3], &table->buckets[3]};
          table->buckets[3].next = table->buckets[3].prev = &record;
          Hash_Free(table);
          orr_HeapDestroy(heap);
       },
       {"", "", "1 non-empty bucket"}},
   };
   for (const Case &c : cases) {
      SCOPED_TRACE(c.what);
      c.act(*this);
      const auto violations = takeViolations();
      ASSERT_EQ(violations.size(), c.violations.size());
      for (size_t i = 0; i < violations.size(); ++i) {
         EXPECT_THAT(violations[i], HasSubstr(c.violations[i]));
      }
      EXPECT_EQ(host.heap().liveBlocks(), 0u);
   }
}

TEST(HashBytes, SpreadsSequentialKeysAndEveryByteCounts)
{
   uint32_t counts[64] = {};
   for (uint32_t key = 0; key < 6400; ++key) {
      ++counts[HashFunc_HashBytes(&key, sizeof key) & 63];
   }
   EXPECT_GT(*std::min_element(std::begin(counts), std::end(counts)), 50u);
   EXPECT_LT(*std::max_element(std::begin(counts), std::end(counts)), 150u);
   unsigned char key[15] = {1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15};   // a word, a half and 3 bytes
   const uint32_t base = HashFunc_HashBytes(key, sizeof key);
   for (size_t i = 0; i < sizeof key; ++i) {
      key[i] ^= 0x01;
      EXPECT_NE(HashFunc_HashBytes(key, sizeof key), base) << "byte " << i;
      key[i] ^= 0x01;
   }
   EXPECT_NE(HashFunc_HashBytes(key, sizeof key - 1), base) << "the length counts";
}

}  // namespace
}  // namespace swsec::testing
