// When a port's bindings go to disk: a removal at once, other changes
// coalesced to one save a second.
#include "live/inline.h"

#include <gtest/gtest.h>

namespace swsec::live {
namespace {

TEST(SaveSchedule, a_removal_is_due_at_once_other_changes_a_second_after_the_last_save)
{
   using namespace std::chrono_literals;
   const SaveSchedule::Clock::time_point t0{100s};
   struct Case {
      bool change, removal;
      std::chrono::milliseconds since;
      bool due;
   } cases[] = {
      {false, false, 5s, false},    // nothing changed
      {true, false, 200ms, false},  // an addition waits out the second
      {true, false, 1s, true},
      {true, true, 200ms, true},    // a removal does not wait
      {false, false, 59s, false},   // lifetimes extended by traffic: a checkpoint a minute
      {false, false, 60s, true},
   };
   for (const Case &c : cases) {
      SaveSchedule schedule;
      schedule.saved(t0);
      if (c.change) {
         schedule.changed(c.removal);
      }
      EXPECT_EQ(schedule.due(t0 + c.since), c.due) << c.change << c.removal << c.since.count();
   }
   SaveSchedule schedule;
   schedule.saved(t0);
   schedule.changed(true);
   schedule.changed(false);   // a later addition does not hide the removal
   EXPECT_TRUE(schedule.due(t0 + 100ms));
   schedule.saved(t0 + 100ms);
   EXPECT_FALSE(schedule.due(t0 + 5s));
}

}  // namespace
}  // namespace swsec::live
