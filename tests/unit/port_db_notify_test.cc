// Port database messages on the portset.
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

}  // namespace
}  // namespace swsec::testing
