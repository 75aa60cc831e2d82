// A binding the module learns from a DHCP ACK is in the program's map before
// the ACK goes on: at the moment the ACK is handed on, IPv4 from the leased
// address passes the program instead of being dropped by source guard.
#include "live/kernel_path.h"
#include "replay/capture.h"
#include "session/config_file.h"

#include <gtest/gtest.h>
#include <linux/pkt_cls.h>

#include <cstdlib>

namespace swsec::testing {
namespace {

TEST(FastPathOrder, a_binding_from_a_dhcp_ack_is_in_the_map_when_the_ack_goes_on)
{
   if (const auto why = fastpath::unavailable()) {
      GTEST_SKIP() << "BPF programs cannot be loaded here: " << *why;
   }
   session::ModuleSession session(std::getenv("SWSEC_MODULE_PATH"), nullptr, [](const std::string &v) { ADD_FAILURE() << v; });
   const host::FilterId filter = session.addPort(1, "vm1", "");
   session.configure(filter, session::loadConfigFile(SWSEC_TEST_SOURCE_DIR "/examples/enforcing.json"));
   fastpath::Program program(fastpath::Program::Options{});
   fastpath::Mirror mirror(program, session.host(), filter, 1);
   live::PostedFeed feed(session.host());
   feed.follow(1, &mirror);
   feed.restart(1);

   // DISCOVER, OFFER, REQUEST, ACK; the 7th frame is ICMP from the leased address.
   replay::CaptureReader capture(SWSEC_TEST_SOURCE_DIR "/tests/data/dhclient-lease-renew-release.pcap");
   std::vector<std::vector<uint8_t>> frames;
   for (replay::CaptureFrame frame; frames.size() < 7 && capture.next(frame);) {
      frames.emplace_back(frame.bytes.begin(), frame.bytes.end());
   }
   ASSERT_EQ(frames.size(), 7u);
   ASSERT_EQ(program.testRun(frames[6], SWSEC_FP_DIR_FROM_VM).action, TC_ACT_SHOT) << "before the lease";
   live::PortCounters counters;
   int handedOn = 0;
   for (size_t i = 0; i < 4; ++i) {
      const uint32_t direction = frames[i][11] == 0x01 ? SWSEC_FP_DIR_FROM_VM : SWSEC_FP_DIR_TO_VM;   // the VM's MAC ends in 01
      ASSERT_EQ(program.testRun(frames[i], direction).action, TC_ACT_STOLEN) << "frame " << i + 1;
      std::vector<fastpath::Punt> punts;
      program.drainPunts([&punts](fastpath::Punt &&punt) { punts.push_back(std::move(punt)); });
      live::judgePunts(session, filter, feed, punts, counters, [&](fastpath::Punt &) {
         ++handedOn;
         if (i == 3) {
            EXPECT_EQ(program.testRun(frames[6], SWSEC_FP_DIR_FROM_VM).action, TC_ACT_OK) << "as the ACK goes on";
         }
      });
   }
   EXPECT_EQ(handedOn, 4);
}

}  // namespace
}  // namespace swsec::testing
