// The frame loop's upgrade from the shared to the exclusive configLock,
// judged by a test double of the per-packet policy (a link seam: this
// program defines SwSecProcessPkt, so the module's policy is not linked).
#include "unit/hand_made_port.h"

#include "swsec/swsec_filter.h"
#include "swsec/swsec_pkt_info.h"
#include "swsec/swsec_policy.h"

#include <gmock/gmock.h>

#include <utility>
#include <vector>

using ::testing::ElementsAre;
using ::testing::Pair;

namespace swsec::testing {
namespace {

// How the double answers a frame, chosen by the last byte of its source MAC.
struct PolicyDouble {
   uint8_t busyTag = 0;      // ORR_BUSY while only the shared lock is held
   uint8_t failTag = 0;      // ORR_NO_MEMORY (with a drop verdict) under the exclusive lock
   std::vector<std::pair<uint8_t, bool>> calls;   // tag, readLocked
};
PolicyDouble policy;

}  // namespace
}  // namespace swsec::testing

// Test double: odd tags are dropped, even ones passed.
orr_Status SwSecProcessPkt(SwSecContext *, orr_Pkt *, SwSecPktInfo *info, uint32_t, uint32_t *verdict)
{
   auto &p = swsec::testing::policy;
   const uint8_t tag = info->ethHdr[11];
   p.calls.emplace_back(tag, info->readLocked != 0);
   if (tag == p.busyTag && info->readLocked != 0) {
      return ORR_BUSY;
   }
   if (tag == p.failTag && info->readLocked == 0) {
      *verdict = SwSecVerdictDrop;
      return ORR_NO_MEMORY;
   }
   *verdict = (tag & 1) != 0 ? SwSecVerdictDrop : SwSecVerdictPass;
   return ORR_OK;
}

namespace swsec::testing {
namespace {

class FrameLoopTest : public HandMadePortTest {
protected:
   void SetUp() override
   {
      HandMadePortTest::SetUp();
      policy = {};
      filter_.agentData = &ctx_;
      ctx_.config.featuresEnabled = SwSecFeatureBpduFilter;
   }

   // Frames tagged by the last byte of their source MAC.
   std::vector<size_t> run(const std::vector<uint8_t> &tags)
   {
      std::vector<host::FrameSpec> frameSpecs;
      for (uint8_t tag : tags) {
         const UdpFrame frame{.src = Mac{{2, 0, 0, 0, 0, tag}}, .dst = Mac{{2, 0, 0, 0, 0, 0xee}}};
         frameSpecs.push_back({.bytes = udpFrame(frame)});
      }
      auto list = host().frames().makeList(frameSpecs);
      EXPECT_EQ(SwSecProcessPackets(&filter_, list->list(), SwSecDirectionTx), ORR_OK);
      EXPECT_EQ(host().frames().outstandingMappings(), 0u);
      EXPECT_EQ(list->released(), tags.size() - list->kept().size());
      return list->kept();
   }

};

TEST_F(FrameLoopTest, a_frame_that_asks_for_the_write_lock_finishes_the_list_under_it)
{
   policy.busyTag = 4;
   // The host aborts if the loop releases a lock mode it does not hold.
   EXPECT_THAT(run({1, 2, 4, 5, 6}), ElementsAre(1u, 2u, 4u));
   EXPECT_THAT(policy.calls, ElementsAre(Pair(1, true), Pair(2, true), Pair(4, true), Pair(4, false),
                                         Pair(5, false), Pair(6, false)));
   // The lock is free again: a writer gets it.
   orr_SpinlockWriteLock(ctx_.configLock);
   orr_SpinlockWriteUnlock(ctx_.configLock);
}

TEST_F(FrameLoopTest, a_failure_under_the_write_lock_keeps_the_frame_and_goes_on)
{
   policy.busyTag = 2;
   policy.failTag = 3;
   EXPECT_THAT(run({2, 3, 4}), ElementsAre(0u, 1u, 2u));
   EXPECT_THAT(policy.calls, ElementsAre(Pair(2, true), Pair(2, false), Pair(3, false), Pair(4, false)));
}

TEST_F(FrameLoopTest, lists_without_an_upgrade_stay_under_the_shared_lock)
{
   EXPECT_THAT(run({1, 3, 2}), ElementsAre(2u));
   EXPECT_THAT(policy.calls, ElementsAre(Pair(1, true), Pair(3, true), Pair(2, true)));
}

}  // namespace
}  // namespace swsec::testing
