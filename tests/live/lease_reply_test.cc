#include "live/lease_reply.h"
#include "support/frames.h"

#include <gtest/gtest.h>

namespace swsec::live {
namespace {

using namespace swsec::testing;

TEST(LeaseReply, dhcp_server_frames_are_told_apart_from_all_others)
{
   // UDP from `port` and nothing after its header.
   const auto v4 = [](uint16_t port) { return udpFrame({.srcPort = port, .dstPort = 68, .payload = {}}); };
   const auto v6 = [](uint16_t port) { return udp6Frame({.srcPort = port, .dstPort = 546, .payload = {}}); };
   struct Case {
      Bytes frame;
      bool fromServer;
   } cases[] = {
      {v4(67), true},
      {pushTag(v4(67), kEtherVlan, 5, 2), true},   // tags walked
      {v4(68), false},                             // a client's frame
      // A later fragment: no UDP header there.
      {ethernet({.etherType = kEtherIpv4}, ipv4({.fragmentOffset = 1}, udp({.srcPort = 67, .dstPort = 68}, {}))), false},
      {v6(547), true},
      {v6(546), false},
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
