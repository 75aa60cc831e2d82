// Every allocation and every host request of a slow path life cycle failed
// in turn, the n-th for every n until the cycle runs clean: each failure is
// reported where it happens, the records stay consistent after every step
// and nothing is left behind at unload.
#include "slow_path_fixture.h"

#include <functional>

namespace swsec::testing {
namespace {

using host::SlowPathRequestKind;

struct SweepCase {
   const char *name;
   const char *point;       // fault point, or null: the n-th set reply fails
   orr_Status status;
   const char *message;     // logged once the failure is hit; null: none of its own
};

class SlowPathSweepTest : public SlowPathTest, public ::testing::WithParamInterface<SweepCase> {
protected:
   // Filters and slow paths that exist at the moment (failed steps made none).
   std::vector<host::FilterId> filters_;
   std::vector<orr_Status> failures_;

   void step(const char *what, const std::function<orr_Status()> &action)
   {
      SCOPED_TRACE(what);
      const orr_Status status = action();
      if (status != ORR_OK) {
         failures_.push_back(status);
      }
      expectConsistent();
   }

   host::FilterId createNamed(const char *name)
   {
      host::FilterId id = 0;
      step(name, [&] { return host().sifra().createFilter(kAgent, kPort, {.name = name}, &id); });
      return id;
   }

   void withdraw(uint32_t id)
   {
      step("unregister", [&] {
         if (slowPath(id) == nullptr) {
            return ORR_OK;   // its registration failed
         }
         orr_Status status = slowPaths().unregisterSlowPath(id);
         for (int round = 0; status == ORR_BUSY && round < 10; ++round) {
            deliver();
            status = slowPaths().retryWithdrawals() == 0 ? ORR_OK : ORR_BUSY;
         }
         return status;
      });
   }

   void destroy(host::FilterId id)
   {
      if (id != 0) {
         step("destroy", [&] { return host().sifra().destroyFilterAsHypervisor(id).status; });
      }
   }

   // The life cycle: a filter before any slow path, one attached at
   // creation, a second slow path taking the next filter, the first slow
   // path withdrawn with its filters moving, filters destroyed attached and
   // detached.
   void lifeCycle()
   {
      const host::FilterId a = createNamed("a");
      step("register 1", [&] { return slowPaths().registerSlowPath(kAgent, 1); });
      runAttach();
      deliver();
      const host::FilterId b = createNamed("b");
      step("register 2", [&] { return slowPaths().registerSlowPath(kAgent, 2); });
      runAttach();
      const host::FilterId c = createNamed("c");
      deliver();
      expectConsistent();
      withdraw(1);
      deliver();
      expectConsistent();
      destroy(b);
      withdraw(2);
      destroy(a);
      destroy(c);
   }
};

TEST_P(SlowPathSweepTest, each_failure_in_turn_is_reported_and_undone)
{
   const SweepCase &c = GetParam();
   uint64_t n = 1;
   for (;; ++n) {
      SCOPED_TRACE("failing call " + std::to_string(n));
      if (!host().loaded()) {
         ASSERT_EQ(host().load(), 0);
      }
      failures_.clear();
      const uint64_t callsBefore = c.point != nullptr ? host().faults().calls(c.point) : 0;
      if (c.point != nullptr) {
         host().faults().failOnce(c.point, c.status, n);
      } else {
         std::vector<orr_Status> replies(n, ORR_OK);
         replies.back() = c.status;
         slowPaths().scriptReplies(SlowPathRequestKind::Set, replies);
      }
      host().log().clear();
      slowPaths().clearRequests();

      lifeCycle();

      bool hit = false;
      if (c.point != nullptr) {
         hit = host().faults().calls(c.point) - callsBefore >= n;
      } else {
         size_t accepted = 0;
         for (const auto &request : slowPaths().requests()) {
            accepted += request.kind == SlowPathRequestKind::Set && request.result == ORR_OK;
         }
         hit = accepted >= n;
      }
      host().faults().clear();
      if (hit) {
         if (c.message != nullptr) {
            EXPECT_TRUE(logged(c.message)) << c.message;
         }
         if (std::string(c.name) == "allocation") {
            EXPECT_EQ(failures_, std::vector<orr_Status>{ORR_NO_MEMORY}) << "one creation or registration refused";
         } else {
            EXPECT_TRUE(failures_.empty()) << "the host's failures do not fail the host's calls";
         }
      }
      EXPECT_TRUE(slowPaths().registered().empty());
      EXPECT_TRUE(host().sifra().filters().empty());
      ASSERT_EQ(host().unload(), ORR_OK);
      expectNothingLeft(host());
      if (!hit) {
         break;
      }
   }
   EXPECT_GE(n, 3u) << "the cycle makes at least two such calls";
   RecordProperty("failedCalls", std::to_string(n - 1));
}

INSTANTIATE_TEST_SUITE_P(
   Failures, SlowPathSweepTest,
   ::testing::Values(
      SweepCase{"allocation", "orr_HeapAllocWithRA", ORR_NO_MEMORY, nullptr},
      SweepCase{"set_refused", "orr_SifraSetSlowPath", ORR_NO_MEMORY,
                "Request to set slow path failed (0xbad0014): Out of memory"},
      SweepCase{"set_reply_failed", nullptr, ORR_TIMEOUT, "Retry (#1) to attach slow path"},
      SweepCase{"clear_transient", "orr_SifraClearSlowPath", ORR_TRY_AGAIN,
                "Transient failure in clearing slow path (0xbad0006): Try again"},
      SweepCase{"clear_failed", "orr_SifraClearSlowPath", ORR_FAILURE,
                "Request to clear slow path failed (0xbad0001): Failure"},
      SweepCase{"schedule_failed", "orr_TimerSchedule", ORR_NO_MEMORY,
                "Could not schedule callback (0xbad0014): Out of memory"}),
   [](const auto &param) { return std::string(param.param.name); });

}  // namespace
}  // namespace swsec::testing
