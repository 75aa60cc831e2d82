// What a run keeps of each frame: the list arena hands the port the bytes
// it was given, however it grew, and keeping fewer records changes nothing
// the port decides or the clock does.
#include "replay_support.h"

#include "replay/engine.h"
#include "replay/frame_batch.h"
#include "session/config_file.h"

#include <gtest/gtest.h>

namespace swsec::testing {
namespace {

std::vector<uint8_t> patterned(size_t length, uint8_t seed)
{
   std::vector<uint8_t> bytes(length);
   for (size_t i = 0; i < length; ++i) {
      bytes[i] = static_cast<uint8_t>(seed + i * 7);
   }
   return bytes;
}

TEST(FrameBatch, views_hold_every_frame_after_the_arena_grew_and_after_reuse)
{
   // Room for 2 frames and 16 bytes: the frames below outgrow both at once.
   replay::FrameBatch batch(2, 16);
   for (int round = 0; round < 2; ++round) {
      std::vector<std::vector<uint8_t>> frames;
      for (size_t length : {0u, 60u, 1514u, 14u, 9000u}) {
         frames.push_back(patterned(length, static_cast<uint8_t>(length + round)));
         batch.add(frames.size() + 100, static_cast<int64_t>(frames.size()) * 1000, replay::kDirFromVm, frames.back());
      }
      ASSERT_EQ(batch.size(), frames.size());
      EXPECT_EQ(batch.direction(), replay::kDirFromVm);
      EXPECT_EQ(batch.firstTimeNs(), 1000);
      const auto views = batch.views();
      ASSERT_EQ(views.size(), frames.size());
      for (size_t i = 0; i < frames.size(); ++i) {
         EXPECT_EQ(std::vector<uint8_t>(views[i].bytes.begin(), views[i].bytes.end()), frames[i]) << i;
         EXPECT_TRUE(views[i].untag);
         EXPECT_EQ(batch.index(i), i + 101);
      }
      batch.clear();
      EXPECT_TRUE(batch.empty());
   }
}

// The enforcing port over the example: 4 spoofs dropped, bindings learned
// and, with the clock run on, aged out.
replay::ReplayResult replayExample(replay::FrameRecords records)
{
   replay::ReplayOptions options;
   options.capturePath = (sourceDir() / "examples/example-dhcp-then-spoof.pcap").string();
   options.vmMac = session::parseMac("02:00:5e:c0:00:01", "test");
   options.config = session::loadConfigFile((sourceDir() / "examples/enforcing.json").string());
   options.untilSeconds = 200;
   options.frameRecords = records;
   options.describeDrops = true;
   return replay::runReplay(options);
}

// Fewer records keep the totals, notifications and clock; the dropped
// records are the dropped frames with their descriptions.
TEST(FrameRecords, fewer_records_keep_everything_else_and_the_dropped_ones_their_descriptions)
{
   const auto all = replayExample(replay::FrameRecords::all);
   ASSERT_EQ(all.frames.size(), 18u);
   for (auto records : {replay::FrameRecords::none, replay::FrameRecords::dropped}) {
      const auto fewer = replayExample(records);
      EXPECT_EQ(fewer.ports[0].totals, all.ports[0].totals);
      EXPECT_EQ(fewer.ports[0].counters, all.ports[0].counters);
      ASSERT_EQ(fewer.ports[0].notifications.size(), all.ports[0].notifications.size());
      for (size_t i = 0; i < all.ports[0].notifications.size(); ++i) {
         EXPECT_EQ(fewer.ports[0].notifications[i].afterFrame, all.ports[0].notifications[i].afterFrame) << i;
         EXPECT_EQ(fewer.ports[0].notifications[i].name, all.ports[0].notifications[i].name) << i;
      }
      EXPECT_EQ(fewer.ports[0].portDb.size(), all.ports[0].portDb.size());
      if (records == replay::FrameRecords::none) {
         EXPECT_TRUE(fewer.frames.empty());
         continue;
      }
      std::vector<uint64_t> expected;
      for (const auto &frame : all.frames) {
         EXPECT_EQ(all.description(frame).empty(), frame.passed) << frame.index;
         if (!frame.passed) {
            expected.push_back(frame.index);
         }
      }
      std::vector<uint64_t> got;
      for (const auto &frame : fewer.frames) {
         EXPECT_FALSE(frame.passed);
         const auto &same = all.frames.at(frame.index - 1);
         EXPECT_EQ(frame.timeNs, same.timeNs);
         EXPECT_EQ(frame.direction, same.direction);
         EXPECT_EQ(fewer.description(frame), all.description(same));
         got.push_back(frame.index);
      }
      EXPECT_EQ(got.size(), 4u);
      EXPECT_EQ(got, expected);
   }
}

}  // namespace
}  // namespace swsec::testing
