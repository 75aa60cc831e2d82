// The port database's records: replacement on add, the size limit, the
// hash table's life, with the messages each change posts. Ageing is the
// lifetimes capture's (tests/data), judged against the reference model.
#include "unit/hand_made_port.h"

namespace swsec::testing {
namespace {

uint8_t authOf(uint8_t method)
{
   return (method & SwSecDiscAuthoritativeMask) != 0 ? 1 : 0;
}

using PortDbRecordsTest = HandMadePortTest;

struct ReplacementRow {
   uint8_t existing;
   uint8_t added;
   bool replaces;
};

TEST_F(PortDbRecordsTest, add_of_a_known_key_follows_the_replacement_table)
{
   const ReplacementRow rows[] = {
      {kStatic, kStatic, false}, {kStatic, kDhcp, false}, {kStatic, kTofu, false},
      {kStatic, kArp, false},    {kDhcp, kStatic, true},  {kDhcp, kDhcp, false},
      {kDhcp, kTofu, false},     {kDhcp, kArp, false},    {kTofu, kStatic, true},
      {kTofu, kDhcp, true},      {kTofu, kTofu, false},   {kTofu, kArp, false},
      {kArp, kStatic, true},     {kArp, kDhcp, true},     {kArp, kTofu, false},
      {kArp, kArp, false},
   };
   // Each row with the key alone, and with a neighbour so that the hash table is in play.
   for (bool withNeighbour : {false, true}) {
      for (const auto &row : rows) {
         SCOPED_TRACE(::testing::Message() << "existing " << int(row.existing) << " new "
                                           << int(row.added) << " neighbour " << withNeighbour);
         const Key key{5, 0x11, 0x21};
         const Key neighbour{5, 0x12, 0x22};
         if (withNeighbour) {
            ASSERT_EQ(add(neighbour, kArp), 0);
         }
         ASSERT_EQ(add(key, row.existing), 0);
         notices();

         EXPECT_EQ(add(key, row.added), row.replaces ? 0 : -1);

         ASSERT_NE(find(key), nullptr);
         EXPECT_EQ(find(key)->discoveryMethod, row.replaces ? row.added : row.existing);
         if (row.replaces) {
            EXPECT_EQ(notices(), (std::vector<Notice>{removed(key, authOf(row.existing)),
                                                      added(key, authOf(row.added))}));
         } else {
            EXPECT_TRUE(notices().empty());
         }
         EXPECT_EQ(ctx_.numVmiEntries, withNeighbour ? 2u : 1u);
         expectCountersAgree();
         if (withNeighbour) {
            EXPECT_NE(find(neighbour), nullptr);
         }

         while (!SifraGenericListIsEmpty(&ctx_.portDbList)) {
            SwSecDelVmi(&ctx_, SwSecVmiFromListLinks(ctx_.portDbList.next));
         }
         EXPECT_EQ(ctx_.sparePortDbHash, nullptr) << "freed, not parked, outside a replacement";
         notices();
      }
   }
}

TEST_F(PortDbRecordsTest, replacement_needs_no_allocation_even_at_two_entries)
{
   ASSERT_EQ(add({1, 1, 1}, kArp), 0);
   ASSERT_EQ(add({1, 2, 2}, kTofu), 0);
   SwSecVmi *vmi = newVmi({1, 1, 1}, kDhcp, 0, 5);
   host().faults().failFrom("orr_HeapAllocWithRA", ORR_NO_MEMORY);
   host().faults().failFrom("Hash_Alloc", ORR_NO_MEMORY);

   const int added = SwSecAddVmi(&ctx_, vmi);

   host().faults().clear();
   ASSERT_EQ(added, 0);
   EXPECT_EQ(find({1, 1, 1}), vmi);
   EXPECT_NE(find({1, 2, 2}), nullptr);
   expectCountersAgree();
   SwSecDelVmi(&ctx_, vmi);
   EXPECT_EQ(ctx_.totalClientIdLen, 0u) << "the client ID is counted and taken back";
}

TEST_F(PortDbRecordsTest, the_entry_beyond_the_port_size_is_refused)
{
   for (uint8_t i = 1; i <= 32; i++) {
      ASSERT_EQ(add({1, i, i}, kArp), 0);
   }
   notices();

   EXPECT_EQ(add({1, 33, 33}, kDhcp), -1);

   EXPECT_EQ(ctx_.numVmiEntries, 32u);
   EXPECT_EQ(find({1, 33, 33}), nullptr);
   EXPECT_TRUE(notices().empty());
   EXPECT_TRUE(logged("port-7: Exceeding the max portDbSize 32"));
   // A replacement still fits: it removes first.
   EXPECT_EQ(add({1, 32, 32}, kDhcp), 0);
   EXPECT_EQ(ctx_.numVmiEntries, 32u);
   expectCountersAgree();
}

TEST_F(PortDbRecordsTest, a_failed_hash_table_refuses_the_second_entry_and_keeps_the_first)
{
   ASSERT_EQ(add({1, 1, 1}, kDhcp), 0);
   notices();
   host().faults().failOnce("Hash_Alloc", ORR_NO_MEMORY);

   EXPECT_EQ(add({1, 2, 2}, kArp), -1);

   EXPECT_EQ(ctx_.numVmiEntries, 1u);
   EXPECT_EQ(ctx_.portDbHash, nullptr);
   EXPECT_NE(find({1, 1, 1}), nullptr);
   EXPECT_TRUE(notices().empty());
   EXPECT_EQ(add({1, 2, 2}, kArp), 0);
   expectCountersAgree();
}

}  // namespace
}  // namespace swsec::testing
