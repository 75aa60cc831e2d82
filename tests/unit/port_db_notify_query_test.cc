// Port database messages on the portset, and the formats a database is
// read out in.
#include "unit/hand_made_port.h"

namespace swsec::testing {
namespace {

std::vector<Notice> *delivered = nullptr;

void collect(uint32_t portID, uint64_t msgClass, const orr_PortsetMessageHeader *message)
{
   EXPECT_EQ(portID, 7u);
   EXPECT_EQ(msgClass, SWSEC_PORTSET_MSG_PORTDB);
   EXPECT_EQ(message->payloadLength, 40u);
   delivered->push_back(decodeNotice(message->name, reinterpret_cast<const uint8_t *>(message + 1)));
}

class PortDbNotifyTest : public HandMadePortTest {
protected:
   void SetUp() override
   {
      HandMadePortTest::SetUp();
      delivered = &delivered_;
      ASSERT_EQ(orr_PortsetRegisterMessageCB(ctx_.portset, kPortId, SWSEC_PORTSET_MSG_PORTDB, collect,
                                             nullptr, &listener_),
                ORR_OK);
   }
   void TearDown() override
   {
      orr_PortsetUnregisterMessageCB(listener_);
      HandMadePortTest::TearDown();
      delivered = nullptr;
   }

   std::vector<Notice> delivered_;
   orr_PortsetMessageCBHandle listener_ = 0;
};

TEST_F(PortDbNotifyTest, a_listener_hears_every_change_once_in_order)
{
   ASSERT_EQ(add({1, 1, 1}, kArp), 0);
   ASSERT_EQ(add({1, 1, 1}, SwSecDiscDhcpSnooping), 0);
   ASSERT_EQ(add({2, 2, 2}, kStatic), 0);
   SwSecDelVmi(&ctx_, find({1, 1, 1}));

   EXPECT_EQ(delivered_, (std::vector<Notice>{added({1, 1, 1}, 0), removed({1, 1, 1}, 0),
                                              added({1, 1, 1}, 1), added({2, 2, 2}, 1),
                                              removed({1, 1, 1}, 1)}));
   EXPECT_EQ(notices().size(), 5u);
   EXPECT_EQ(orr_PortsetHoldState(ctx_.portset), ORR_PORTSET_HOLD_NONE);
}

TEST_F(PortDbNotifyTest, a_failed_post_is_logged_and_leaves_the_change_and_the_portset_free)
{
   host().faults().failOnce("orr_PortsetPostMessage", ORR_NO_MEMORY);

   EXPECT_EQ(add({1, 1, 1}, kArp), 0);

   EXPECT_NE(find({1, 1, 1}), nullptr);
   EXPECT_TRUE(logged("port-7: Could not post message:7:portdb.entry.added:Out of memory"));
   EXPECT_EQ(orr_PortsetHoldState(ctx_.portset), ORR_PORTSET_HOLD_NONE);
   EXPECT_TRUE(delivered_.empty());
   // The next change is announced again.
   SwSecDelVmi(&ctx_, find({1, 1, 1}));
   EXPECT_EQ(delivered_, (std::vector<Notice>{removed({1, 1, 1}, 0)}));
}

TEST_F(PortDbNotifyTest, a_caller_holding_the_portset_keeps_its_hold_and_one_turned_exclusive_is_released_as_such)
{
   orr_PortsetLockShared(ctx_.portset);
   ASSERT_EQ(add({1, 1, 1}, kArp), 0);
   EXPECT_EQ(orr_PortsetHoldState(ctx_.portset), ORR_PORTSET_HOLD_SHARED);
   EXPECT_TRUE(delivered_.empty());
   EXPECT_EQ(host().portsets().pendingDeliveries(), 1u);
   orr_PortsetUnlockShared(ctx_.portset);
   EXPECT_EQ(delivered_, (std::vector<Notice>{added({1, 1, 1}, 0)}));

   // A hold the post turned exclusive.
   host().portsets().upgradeHoldOnNextPost();
   ASSERT_EQ(add({1, 2, 2}, kArp), 0);
   EXPECT_EQ(orr_PortsetHoldState(ctx_.portset), ORR_PORTSET_HOLD_NONE);
   EXPECT_EQ(delivered_.back(), added({1, 2, 2}, 0));
}

class PortDbQueryTest : public HandMadePortTest {
protected:
   // Two statics and three ARP entries, interleaved in list order: even MACs are static.
   void fillFive()
   {
      for (uint8_t i = 1; i <= 5; i++) {
         ASSERT_EQ(add({1, i, i}, i % 2 == 0 ? kStatic : kArp, 1000), 0);
      }
   }
};

TEST_F(PortDbQueryTest, each_format_writes_the_selected_entries_in_list_order)
{
   fillFive();
   struct Row {
      uint8_t mask;
      std::vector<uint8_t> macs;
   };
   const Row rows[] = {{SwSecDiscAuthoritativeMask, {2, 4}},
                       {SwSecDiscNonAuthoritativeMask, {1, 3, 5}},
                       {SwSecDiscAllMask, {1, 2, 3, 4, 5}}};
   for (const Row &row : rows) {
      SCOPED_TRACE(int(row.mask));
      const size_t n = row.macs.size();
      // One record more than needed, filled with a canary, shows nothing is written past the end.
      std::vector<uint8_t> entries(32 * (n + 1), 0xee);
      std::vector<uint8_t> keys(12 * (n + 1), 0xee);
      std::vector<SwSecVmi> vmis(n + 1);
      SwSecQueryPortDb(&ctx_, entries.data(), SWSEC_QUERY_ENTRY, row.mask);
      SwSecQueryPortDb(&ctx_, keys.data(), SWSEC_QUERY_KEY, row.mask);
      SwSecQueryPortDb(&ctx_, vmis.data(), SWSEC_QUERY_VMI, row.mask);
      for (size_t i = 0; i < n; i++) {
         const Key want{1, row.macs[i], row.macs[i]};
         // An entry is a message's payload after its operation and count.
         std::array<uint8_t, 40> payload{0, 0, 0, 0, 1};
         std::memcpy(payload.data() + 8, entries.data() + 32 * i, 32);
         EXPECT_EQ(decodeNotice("", payload.data()), (Notice{"", 0, want, uint8_t(row.macs[i] % 2 == 0)}));
         SwSecVmiKey key{};
         std::memcpy(&key, keys.data() + 12 * i, 12);
         const SwSecVmiKey wantKey = want.raw();
         EXPECT_EQ(std::memcmp(&key, &wantKey, 12), 0);
         EXPECT_EQ(keyOf(&vmis[i]), want);
         EXPECT_EQ(vmis[i].discoveryMethod, row.macs[i] % 2 == 0 ? kStatic : kArp);
      }
      EXPECT_EQ(entries[32 * n], 0xee);
      EXPECT_EQ(keys[12 * n], 0xee);
   }
}

}  // namespace
}  // namespace swsec::testing
