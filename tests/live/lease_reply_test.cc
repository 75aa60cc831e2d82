#include "live/lease_reply.h"

#include <gtest/gtest.h>

#include <vector>

namespace swsec::live {
namespace {

// An Ethernet frame (with `tags` 802.1Q tags) carrying UDP from `port`
// over IPv4 (fragment offset `offset`) or IPv6.
std::vector<uint8_t> udpFrame(bool ipv6, uint16_t port, int tags = 0, uint16_t offset = 0)
{
   std::vector<uint8_t> frame(12, 0x02);
   for (int i = 0; i < tags; ++i) {
      frame.insert(frame.end(), {0x81, 0x00, 0x00, 0x05});
   }
   const uint8_t hi = static_cast<uint8_t>(port >> 8), lo = static_cast<uint8_t>(port);
   if (ipv6) {
      frame.insert(frame.end(), {0x86, 0xdd, 0x60, 0, 0, 0, 0, 8, 17, 64});
      frame.resize(frame.size() + 32);
   } else {
      frame.insert(frame.end(), {0x08, 0x00, 0x45, 0, 0, 28, 0, 0, static_cast<uint8_t>(offset >> 8),
                                 static_cast<uint8_t>(offset), 64, 17, 0, 0});
      frame.resize(frame.size() + 8);
   }
   frame.insert(frame.end(), {hi, lo, 0, 68, 0, 8, 0, 0});
   return frame;
}

TEST(LeaseReply, dhcp_server_frames_are_told_apart_from_all_others)
{
   struct Case {
      std::vector<uint8_t> frame;
      bool fromServer;
   } cases[] = {
      {udpFrame(false, 67), true},
      {udpFrame(false, 67, 2), true},             // tags walked
      {udpFrame(false, 68), false},               // a client's frame
      {udpFrame(false, 67, 0, 0x2001), false},    // a later fragment: no UDP header there
      {udpFrame(true, 547), true},
      {udpFrame(true, 546), false},
   };
   for (const Case &c : cases) {
      EXPECT_EQ(fromDhcpServer(c.frame), c.fromServer) << c.frame.size();
      // Cut anywhere, the frame is read within its length and not taken.
      for (size_t len = 0; c.fromServer && len < c.frame.size(); ++len) {
         EXPECT_FALSE(fromDhcpServer(std::span(c.frame).first(len))) << len;
      }
   }
}

}  // namespace
}  // namespace swsec::live
