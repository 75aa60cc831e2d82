// Slow paths registered and withdrawn, replies delivered, attach callbacks
// run and filters created and destroyed on several threads at once while
// frames are judged. Run under ThreadSanitizer in CI; the host checks lock
// ranks on every acquisition and the request contract on every request.
#include "slow_path_fixture.h"

#include <atomic>
#include <thread>

namespace swsec::testing {
namespace {

using host::SlowPathRequestKind;

constexpr int kRounds = 40;
constexpr uint32_t kFirstChurnPort = 100;
constexpr uint32_t kChurnPorts = 4;

TEST_F(SlowPathTest, registrations_replies_and_filters_on_several_threads_while_frames_are_judged)
{
   for (uint32_t port = kFirstChurnPort; port < kFirstChurnPort + kChurnPorts; ++port) {
      host().portsets().addPort("vs0", port);
   }
   // Some replies fail (and are retried), some requests are refused, some
   // clears fail for a while.
   std::vector<orr_Status> replies;
   for (int i = 0; i < 3 * kRounds; ++i) {
      replies.push_back(i % 3 == 1 ? ORR_TIMEOUT : ORR_OK);
   }
   slowPaths().scriptReplies(SlowPathRequestKind::Set, replies);
   for (uint64_t nth : {5, 13, 29}) {
      host().faults().failOnce("orr_SifraSetSlowPath", ORR_NO_MEMORY, nth);
      host().faults().failOnce("orr_SifraClearSlowPath", nth % 2 == 0 ? ORR_BUSY : ORR_TRY_AGAIN, nth);
   }
   const host::FilterId judged = create({.name = "judged"});
   std::atomic<bool> done{false};

   std::thread registrar([&] {
      for (uint32_t id = 1; id <= kRounds; ++id) {
         EXPECT_EQ(slowPaths().registerSlowPath(kAgent, id), ORR_OK);
         if (id > 2) {
            orr_Status status = slowPaths().unregisterSlowPath(id - 2);
            for (int spins = 0; status == ORR_BUSY && spins < 100000; ++spins) {
               std::this_thread::yield();
               status = slowPaths().retryWithdrawals() == 0 ? ORR_OK : ORR_BUSY;
            }
            EXPECT_EQ(status, ORR_OK);
         }
      }
   });
   std::thread replier([&] {
      while (!done.load()) {
         if (slowPaths().deliverReplies() == 0) {
            std::this_thread::yield();
         }
      }
   });
   std::thread scheduler([&] {
      while (!done.load()) {
         host().clock().runDue();
         std::this_thread::yield();
      }
   });
   std::thread churn([&] {
      for (int round = 0; round < kRounds; ++round) {
         const uint32_t port = kFirstChurnPort + static_cast<uint32_t>(round) % kChurnPorts;
         host::FilterId id = 0;
         ASSERT_EQ(host().sifra().createFilter(kAgent, port, {.name = "churn" + std::to_string(round)}, &id), ORR_OK);
         orr_Status status = ORR_BUSY;
         for (int spins = 0; status == ORR_BUSY && spins < 100000; ++spins) {
            status = host().sifra().destroyFilter(id);
            std::this_thread::yield();
         }
         EXPECT_EQ(status, ORR_OK);
      }
   });
   std::thread frames([&] {
      const Bytes frame = udpFrame({.src = Mac::parse("02:00:00:00:00:01"), .dst = Mac::parse("02:00:00:00:00:02"),
                                    .ipSrc = Ip4::parse("10.0.0.5"), .ipDst = Ip4::parse("10.0.0.9")});
      while (!done.load()) {
         EXPECT_EQ(send(judged, kTx, {frame, frame, frame}).status, ORR_OK);
      }
   });

   registrar.join();
   churn.join();
   done.store(true);
   replier.join();
   scheduler.join();
   frames.join();

   // Quiet again: what is still owed completes, and the records agree.
   runAttach();
   while (deliver() != 0) {
   }
   EXPECT_EQ(slowPaths().retryWithdrawals(), 0u);
   expectConsistent();
   EXPECT_EQ(slowPaths().registered().size(), 2u);
   EXPECT_EQ(state(judged), SifraGenericAttachAttached);
   EXPECT_GE(slowPaths().requests().size(), size_t{kRounds});
}

}  // namespace
}  // namespace swsec::testing
