// A binding the module learns is in the program's map before the frame that
// taught it goes on: at the moment a DHCP ACK, a DHCPv6 Reply or a
// duplicate-address claim is handed on, a frame from the address it binds
// is no longer dropped by source guard, as it was before.
#include "live/kernel_path.h"
#include "replay/capture.h"
#include "session/config_file.h"

#include <gtest/gtest.h>
#include <linux/pkt_cls.h>

#include <cstdlib>

namespace swsec::testing {
namespace {

struct OrderCase {
   const char *config;
   const char *capture;
   uint8_t vmMacEnd;              // the last byte of the VM's MAC, which tells its frames
   std::vector<size_t> taught;    // frames judged in turn (1-based); the last teaches the binding
   size_t probe;                  // a frame from the address it binds
};

TEST(FastPathOrder, a_learned_binding_is_in_the_map_when_the_frame_that_taught_it_goes_on)
{
   if (const auto why = fastpath::unavailable()) {
      GTEST_SKIP() << "BPF programs cannot be loaded here: " << *why;
   }
   const OrderCase cases[] = {
      // DISCOVER, OFFER, REQUEST, ACK; ICMP from the leased address.
      {"enforcing.json", "dhclient-lease-renew-release.pcap", 0x01, {1, 2, 3, 4}, 7},
      // The link-local's claim, the Request from it, the Reply; an echo request from the leased address.
      {"dual-stack.json", "dhclient6-lease-renew-release.pcap", 0x31, {5, 12, 13}, 19},
      // The temporary address's claim; an echo request from it.
      {"dual-stack.json", "slaac-privacy-dad.pcap", 0x32, {10}, 15},
   };
   for (const OrderCase &c : cases) {
      SCOPED_TRACE(c.capture);
      session::ModuleSession session(std::getenv("SWSEC_MODULE_PATH"), nullptr, [](const std::string &v) { ADD_FAILURE() << v; });
      const host::FilterId filter = session.addPort(1, "vm1", "");
      session.configure(filter, session::loadConfigFile(std::string(SWSEC_TEST_SOURCE_DIR "/examples/") + c.config));
      fastpath::Program program(fastpath::Program::Options{});
      fastpath::Mirror mirror(program, session.host(), filter, 1);
      live::PostedFeed feed(session.host());
      feed.follow(1, &mirror);
      feed.restart(1);

      replay::CaptureReader capture(std::string(SWSEC_TEST_SOURCE_DIR "/tests/data/") + c.capture);
      std::vector<std::vector<uint8_t>> frames;
      for (replay::CaptureFrame frame; frames.size() < c.probe && capture.next(frame);) {
         frames.emplace_back(frame.bytes.begin(), frame.bytes.end());
      }
      ASSERT_EQ(frames.size(), c.probe);
      const std::vector<uint8_t> &probe = frames[c.probe - 1];
      ASSERT_EQ(program.testRun(probe, SWSEC_FP_DIR_FROM_VM).action, TC_ACT_SHOT) << "before it is learned";
      live::PortCounters counters;
      size_t handedOn = 0;
      for (const size_t index : c.taught) {
         const std::vector<uint8_t> &frame = frames[index - 1];
         const uint32_t direction = frame[11] == c.vmMacEnd ? SWSEC_FP_DIR_FROM_VM : SWSEC_FP_DIR_TO_VM;
         ASSERT_EQ(program.testRun(frame, direction).action, TC_ACT_STOLEN) << "frame " << index;
         std::vector<fastpath::Punt> punts;
         program.drainPunts([&punts](fastpath::Punt &&punt) { punts.push_back(std::move(punt)); });
         live::judgePunts(session, filter, feed, punts, counters, [&](fastpath::Punt &) {
            ++handedOn;
            if (index == c.taught.back()) {
               EXPECT_NE(program.testRun(probe, SWSEC_FP_DIR_FROM_VM).action, TC_ACT_SHOT) << "as it goes on";
            }
         });
      }
      EXPECT_EQ(handedOn, c.taught.size());
   }
}

}  // namespace
}  // namespace swsec::testing
