// How a received frame is handed to the port: which tags become VLAN
// metadata and which stay in the bytes the port judges.
#include "live/port.h"

#include <gtest/gtest.h>

#include <vector>

namespace swsec::live {
namespace {

TEST(PortView, only_an_8021q_tag_becomes_the_vlan)
{
   // Addresses, then an IPv4 ethertype (or an in-band 802.1Q tag).
   std::vector<uint8_t> plain(12, 0x02);
   plain.insert(plain.end(), {0x08, 0x00, 0x45});
   std::vector<uint8_t> inBand(12, 0x02);
   inBand.insert(inBand.end(), {0x81, 0x00, 0x00, 0x07, 0x08, 0x00, 0x45});
   struct Case {
      const char *what;
      std::vector<uint8_t> &bytes;
      bool tagged;
      uint16_t tpid;
      uint16_t tci;
      uint16_t vlanId;
      bool untag;
      std::vector<uint8_t> judged;   // empty: the bytes as received
   };
   const Case cases[] = {
      {"untagged", plain, false, 0, 0, 0, false, {}},
      {"802.1Q in the bytes", inBand, false, 0, 0, 0, true, {}},
      {"802.1Q taken off", plain, true, 0x8100, 0x2064, 100, false, {}},
      {"802.1ad taken off", plain, true, 0x88a8, 0x0064, 0, false,
       {2, 2, 2, 2, 2, 2, 2, 2, 2, 2, 2, 2, 0x88, 0xa8, 0x00, 0x64, 0x08, 0x00, 0x45}},
   };
   for (const Case &c : cases) {
      ReceivedFrame frame;
      frame.bytes = c.bytes;
      frame.tagged = c.tagged;
      frame.tpid = c.tpid;
      frame.tci = c.tci;
      std::vector<uint8_t> scratch;
      const host::FrameView view = portView(frame, scratch);
      EXPECT_EQ(view.vlanId, c.vlanId) << c.what;
      EXPECT_EQ(view.untag, c.untag) << c.what;
      const std::vector<uint8_t> &judged = c.judged.empty() ? c.bytes : c.judged;
      EXPECT_EQ(std::vector<uint8_t>(view.bytes.begin(), view.bytes.end()), judged) << c.what;
   }
}

}  // namespace
}  // namespace swsec::live
