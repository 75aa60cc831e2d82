// Finding a byte range that one scatter-gather element of a frame holds whole.
#include "support/host_fixture.h"

#include "framework/sifra_generic_filter.h"

#include <optional>
#include <string>
#include <vector>

namespace swsec::testing {
namespace {

struct RangeCase {
   const char *name;
   std::vector<uint32_t> split;   // element lengths; bytes left over form the last one
   uint32_t frameLen;
   uint32_t start;
   uint32_t end;
   std::optional<uint32_t> found;   // frame offset of the byte returned; none: null
};

class FindSGEntryTest : public HostTest, public ::testing::WithParamInterface<RangeCase> {};

TEST_P(FindSGEntryTest, maps_the_element_that_holds_the_whole_range)
{
   const RangeCase &c = GetParam();
   host::FrameSpec frameSpec;
   frameSpec.bytes.resize(c.frameLen);
   for (uint32_t i = 0; i < c.frameLen; i++) {
      frameSpec.bytes[i] = static_cast<uint8_t>(i * 7 + i / 256);   // each offset tells itself apart
   }
   frameSpec.split = c.split;
   auto list = host().frames().makeList({frameSpec});
   orr_Pkt *pkt = list->frame(0);

   const uint8_t *found = SifraGenericFindSGEntry(pkt, c.start, c.end);
   if (!c.found) {
      EXPECT_EQ(found, nullptr);
      return;
   }
   ASSERT_NE(found, nullptr);
   // The bytes there are the frame's bytes from the start offset to the end.
   EXPECT_EQ(std::vector<uint8_t>(found, found + (c.end - c.start)),
             std::vector<uint8_t>(frameSpec.bytes.begin() + c.start, frameSpec.bytes.begin() + c.end));
}

INSTANTIATE_TEST_SUITE_P(
   Frames, FindSGEntryTest,
   ::testing::Values(
      RangeCase{"inside_the_first", {60}, 1514, 14, 34, 14},
      RangeCase{"across_two_elements", {60}, 1514, 50, 70, std::nullopt},
      RangeCase{"at_the_second_elements_start", {60}, 1514, 60, 80, 60},
      RangeCase{"ending_at_the_element_end", {60}, 1514, 60, 1514, 60},
      RangeCase{"one_past_the_frame", {60}, 1514, 60, 1515, std::nullopt},
      RangeCase{"ending_at_the_first_element_end", {60}, 1514, 0, 60, 0},
      RangeCase{"starting_past_the_frame", {60}, 1514, 1514, 1520, std::nullopt},
      RangeCase{"zero_length_elements_are_passed_over", {0, 20, 0, 0, 40}, 100, 20, 60, 20},
      RangeCase{"zero_length_first_element", {0}, 100, 0, 10, 0},
      RangeCase{"empty_range_at_an_element_end", {20, 0}, 100, 20, 20, 20},
      RangeCase{"range_after_zero_length_run", {10, 0, 0}, 100, 12, 100, 12}),
   [](const auto &test) { return std::string(test.param.name); });

}  // namespace
}  // namespace swsec::testing
