// The module heap: size limit, per-site accounting, leaks at destruction,
// and the hash tables that live on it.
#include "host_unit.h"

#include <gmock/gmock.h>

#include <algorithm>
#include <array>
#include <cstring>

using ::testing::Contains;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::FieldsAre;
using ::testing::IsSupersetOf;
using ::testing::NotNull;
using ::testing::HasSubstr;

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

TEST_F(HeapTest, AccountsLiveBlocksAndBytesPerCallingSite)
{
   orr_HeapID heap = makeHeap("accounting");
   void *a1 = orr_HeapAllocWithRA(heap, 100, siteA());
   void *a2 = orr_HeapAllocWithRA(heap, 50, siteA());
   void *b1 = orr_HeapAllocWithRA(heap, 8, siteB());
   ASSERT_THAT((std::array{a1, a2, b1}), Each(NotNull()));
   orr_HeapFree(heap, a1);

   // Sites are named function+offset; then live bytes, live blocks, allocations.
   EXPECT_THAT(host.heap().sites(),
               IsSupersetOf({FieldsAre("heapTestSiteA+0x0", 50u, 1u, 2u), FieldsAre("heapTestSiteB+0x0", 8u, 1u, 1u)}));
   EXPECT_EQ(host.heap().liveBytes(), 58u);
   EXPECT_EQ(host.heap().liveBlocks(), 2u);
   EXPECT_EQ(host.heap().peakBytes(), 158u);

   orr_HeapFree(heap, a2);
   orr_HeapFree(heap, b1);
   orr_HeapDestroy(heap);
   EXPECT_EQ(host.heap().liveBytes(), 0u);
   EXPECT_EQ(host.heap().peakBytes(), 158u);
}

TEST_F(HeapTest, RefusesAllocationsBeyondTheMaximumSize)
{
   orr_HeapID heap = makeHeap("small", 100);
   void *first = orr_HeapAllocWithRA(heap, 60, siteA());
   ASSERT_NE(first, nullptr);
   EXPECT_EQ(orr_HeapAllocWithRA(heap, 41, siteA()), nullptr);
   void *second = orr_HeapAllocWithRA(heap, 40, siteA());
   ASSERT_NE(second, nullptr);
   EXPECT_EQ(orr_HeapAllocWithRA(heap, 1, siteA()), nullptr);
   orr_HeapFree(heap, first);
   void *third = orr_HeapAllocWithRA(heap, 60, siteA());
   EXPECT_NE(third, nullptr) << "freed bytes are available again";
   orr_HeapFree(heap, second);
   orr_HeapFree(heap, third);
   orr_HeapDestroy(heap);
}

TEST_F(HeapTest, FreshBlocksAreNotZeroFilledAndAnEmptyRequestIsStillABlock)
{
   // The module promises zero-filled records by clearing them itself; a
   // heap that happened to return zeros would hide a missing clear.
   orr_HeapID heap = makeHeap("fresh");
   auto *block = static_cast<unsigned char *>(orr_HeapAllocWithRA(heap, 32, siteA()));
   void *empty = orr_HeapAllocWithRA(heap, 0, siteA());
   ASSERT_THAT((std::array<void *, 2>{block, empty}), Each(NotNull()));
   EXPECT_EQ(std::count(block, block + 32, 0), 0);
   EXPECT_EQ(host.heap().liveBlocks(), 2u);
   orr_HeapFree(heap, block);
   orr_HeapFree(heap, empty);
   orr_HeapDestroy(heap);
}

TEST_F(HeapTest, DestroyWithLiveBlocksReportsThemBySite)
{
   orr_HeapID heap = makeHeap("leaky");
   ASSERT_NE(orr_HeapAllocWithRA(heap, 16, siteA()), nullptr);
   ASSERT_NE(orr_HeapAllocWithRA(heap, 16, siteA()), nullptr);
   ASSERT_NE(orr_HeapAllocWithRA(heap, 5, siteB()), nullptr);
   orr_HeapDestroy(heap);

   EXPECT_THAT(takeViolations(),
               ElementsAre(HasSubstr("heap 'leaky': 2 live blocks (32 bytes) allocated at heapTestSiteA+0x0"),
                           HasSubstr("heap 'leaky': 1 live block (5 bytes) allocated at heapTestSiteB+0x0")));
   EXPECT_EQ(host.heap().liveBytes(), 0u);
   EXPECT_EQ(host.heap().liveBlocks(), 0u);
}

TEST_F(HeapTest, FreeingABlockTwiceIsAViolation)
{
   orr_HeapID heap = makeHeap("twice");
   void *block = orr_HeapAllocWithRA(heap, 24, siteA());
   void *other = orr_HeapAllocWithRA(heap, 24, siteA());
   orr_HeapFree(heap, block);
   orr_HeapFree(heap, block);
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("is not a live block of heap 'twice'")));
   EXPECT_EQ(host.heap().liveBlocks(), 1u) << "the other block is untouched";
   orr_HeapFree(heap, other);
   orr_HeapDestroy(heap);
}

TEST_F(HeapTest, FreeingIntoTheWrongHeapIsAViolation)
{
   orr_HeapID first = makeHeap("first");
   orr_HeapID second = makeHeap("second");
   void *block = orr_HeapAllocWithRA(first, 8, siteA());
   orr_HeapFree(second, block);
   EXPECT_EQ(takeViolations().size(), 1u);
   orr_HeapFree(first, block);
   orr_HeapDestroy(first);
   orr_HeapDestroy(second);
}

TEST_F(HeapTest, DestroyingAHeapBeforeAnObjectMadeOnItIsAViolation)
{
   orr_HeapID heap = makeHeap("owner");
   orr_LogProps props{};
   orr_NameInitialize(&props.name, "component");
   props.heap = heap;
   orr_LogHandle log = nullptr;
   ASSERT_EQ(orr_LogRegister(&props, &log), ORR_OK);
   orr_HeapDestroy(heap);
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("heap 'owner' destroyed before log 'component'")));
   orr_LogUnregister(log);
}

TEST_F(HeapTest, CreateRefusesWhatItCannotHonour)
{
   struct Case {
      const char *what;
      uint32_t kind;
      uint32_t initialSize;
      uint32_t maximumSize;
      uint32_t flags;
      orr_Status expected;
   };
   const Case cases[] = {
      {"unknown kind", 1, 0, 4096, 0, ORR_NOT_SUPPORTED},
      {"initial above maximum", 0, 8192, 4096, 0, ORR_BAD_PARAM},
      {"unknown flags", 0, 0, 4096, 1, ORR_BAD_PARAM},
      {"initial equal to maximum", 0, 4096, 4096, 0, ORR_OK},
   };
   for (const auto &c : cases) {
      orr_HeapProps props{};
      props.kind = c.kind;
      orr_NameInitialize(&props.name, c.what);
      props.initialSize = c.initialSize;
      props.maximumSize = c.maximumSize;
      props.flags = c.flags;
      orr_HeapID heap = nullptr;
      EXPECT_EQ(orr_HeapCreate(&props, &heap), c.expected) << c.what;
      if (heap != nullptr) {
         orr_HeapDestroy(heap);
      }
   }
}

// ---------------------------------------------------------------- hash tables

using HashTableTest = HostUnitTest;

TEST_F(HashTableTest, TableComesFromTheHeapWithEmptyBuckets)
{
   orr_HeapID heap = makeHeap("hash");
   Hash_Table *table = Hash_Alloc(heap, 8);
   ASSERT_NE(table, nullptr);
   EXPECT_EQ(table->numBuckets, 8u);
   EXPECT_EQ(table->bucketMask, 7u);
   for (uint32_t i = 0; i < 8; ++i) {
      EXPECT_EQ(table->buckets[i].next, &table->buckets[i]);
      EXPECT_EQ(table->buckets[i].prev, &table->buckets[i]);
   }
   EXPECT_THAT(host.heap().sites(),
               Contains(FieldsAre("Hash_Alloc", ::testing::_, 1u, ::testing::_)));
   Hash_Free(table);
   EXPECT_EQ(host.heap().liveBlocks(), 0u);
   orr_HeapDestroy(heap);
}

TEST_F(HashTableTest, BucketCountsOtherThanPowersOfTwoAndTablesTooBigForTheHeapAreRefused)
{
   orr_HeapID heap = makeHeap("hash");
   for (uint32_t count : {0u, 3u, 12u}) {
      EXPECT_EQ(Hash_Alloc(heap, count), nullptr) << count;
   }
   EXPECT_EQ(takeViolations().size(), 3u);
   orr_HeapID tiny = makeHeap("tiny", 64);
   EXPECT_EQ(Hash_Alloc(tiny, 64), nullptr);
   orr_HeapDestroy(tiny);
   orr_HeapDestroy(heap);
}

TEST_F(HashTableTest, FreeingATableWithLinkedRecordsIsAViolation)
{
   orr_HeapID heap = makeHeap("hash");
   Hash_Table *table = Hash_Alloc(heap, 4);
   ASSERT_NE(table, nullptr);
   orr_ListLinks record;
   orr_ListLinks &head = table->buckets[3];
   record.prev = &head;
   record.next = &head;
   head.next = &record;
   head.prev = &record;
   Hash_Free(table);
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("1 non-empty bucket")));
   orr_HeapDestroy(heap);
}

TEST(HashBytes, SpreadsSequentialKeysEvenlyOverBuckets)
{
   constexpr uint32_t kBuckets = 64;
   constexpr uint32_t kKeys = 6400;
   uint32_t counts[kBuckets] = {};
   for (uint32_t key = 0; key < kKeys; ++key) {
      ++counts[HashFunc_HashBytes(&key, sizeof key) & (kBuckets - 1)];
   }
   for (uint32_t bucket = 0; bucket < kBuckets; ++bucket) {
      EXPECT_GT(counts[bucket], 50u) << bucket;
      EXPECT_LT(counts[bucket], 150u) << bucket;
   }
}

TEST(HashBytes, EveryByteOfTheKeyCounts)
{
   unsigned char key[16] = {1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16};
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
