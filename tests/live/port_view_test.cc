// How a received frame is handed to the port: the outer tag, of any TPID,
// becomes the VLAN; a runt is padded in its buffer before it is judged.
#include "live/port.h"

#include <gtest/gtest.h>

#include <optional>
#include <tuple>
#include <vector>

namespace swsec::live {
namespace {

TEST(PortView, the_outer_tag_becomes_the_vlan_and_a_runt_is_padded_where_it_lies)
{
   // length, tag taken off by the kernel (TCI), VLAN, left for the host to untag, length judged and sent
   const std::tuple<size_t, std::optional<uint16_t>, uint16_t, bool, size_t> cases[] = {
      {64, std::nullopt, 0, true, 64}, {64, 0x2064, 100, false, 64}, {20, std::nullopt, 0, true, 60}};
   for (const auto &[length, tci, vlanId, untag, judged] : cases) {
      std::vector<uint8_t> slot(128, 0xee);
      ReceivedFrame frame{.bytes = {slot.data(), length}, .tagged = tci.has_value(), .tci = tci.value_or(0)};
      const host::FrameView view = portView(frame);
      EXPECT_EQ(std::tuple(view.vlanId, view.untag, view.bytes.size(), frame.bytes.size()),
                std::tuple(vlanId, untag, judged, judged));
      EXPECT_EQ(slot[judged - 1], judged == length ? 0xee : 0);
   }
}

}  // namespace
}  // namespace swsec::live
