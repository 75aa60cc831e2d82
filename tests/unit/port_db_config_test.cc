// Configuring a port database: the size checks, the port mode change, the
// static entries, the port filter map entry and the timer, each failure
// leaving the old configuration in force.
#include "unit/hand_made_port.h"

namespace swsec::testing {
namespace {

class PortDbConfigTest : public HandMadePortTest {
protected:
   bool mapped()
   {
      orr_SpinlockLock(portFilterMapDb.lock);
      SwSecPortFilterMap *entry = SwSecFindPortFilterMap(kPortId);
      const bool found = entry != nullptr && entry->context == &ctx_;
      orr_SpinlockUnlock(portFilterMapDb.lock);
      return found;
   }
};

TEST_F(PortDbConfigTest, sizes_outside_one_to_thirty_two_are_refused_with_the_range)
{
   ASSERT_EQ(configure(config(kOn, 1, 32, {{1, 1, 1}})), ORR_OK);
   for (uint32_t size : {0u, 33u}) {
      SCOPED_TRACE(size);
      notices();
      EXPECT_EQ(configure(config(kOn, 0, size)), ORR_FAILURE);
      EXPECT_TRUE(logged("port-7: Invalid portDbSize: " + std::to_string(size) +
                         ". Expected in the range [1 32]"));
      EXPECT_EQ(entries(), (Entries{{{1, 1, 1}, kStatic}}));
      EXPECT_EQ(+ctx_.config.portDbSize, 32u);
      EXPECT_EQ(+ctx_.config.trusted, 1u);
      EXPECT_TRUE(notices().empty());
   }
}

TEST_F(PortDbConfigTest, shrinking_below_the_surviving_entries_changes_nothing)
{
   ASSERT_EQ(configure(config(kOn, 1, 32, {{1, 1, 1}})), ORR_OK);
   ASSERT_EQ(add({1, 2, 2}, kDhcp, 1000), 0);
   ASSERT_EQ(add({1, 3, 3}, kArp, 1000), 0);
   const Entries before = entries();
   notices();

   // Trusted stays trusted: DHCP + ARP + two new statics = 4.
   EXPECT_EQ(configure(config(kOn, 1, 3, {{1, 4, 4}, {1, 5, 5}})), ORR_FAILURE);
   EXPECT_TRUE(logged("port-7: Invalid portDbSize: 3 4"));
   EXPECT_EQ(entries(), before);
   EXPECT_EQ(+ctx_.config.portDbSize, 32u);
   EXPECT_TRUE(notices().empty());

   // Leaving trusted mode drops the ARP entry, so 3 fit.
   EXPECT_EQ(configure(config(kOn, 0, 3, {{1, 4, 4}, {1, 5, 5}})), ORR_OK);
   EXPECT_EQ(entries(), (Entries{{{1, 2, 2}, kDhcp}, {{1, 4, 4}, kStatic}, {{1, 5, 5}, kStatic}}));
   EXPECT_EQ(+ctx_.config.portDbSize, 3u);
   expectCountersAgree();
}

TEST_F(PortDbConfigTest, leaving_trusted_mode_drops_learned_non_authoritative_entries)
{
   ASSERT_EQ(configure(config(kOn, 1, 32, {{1, 1, 1}})), ORR_OK);
   ASSERT_EQ(add({1, 2, 2}, kDhcp, 1000), 0);
   ASSERT_EQ(add({1, 3, 3}, kArp, 1000), 0);
   ASSERT_EQ(add({1, 4, 4}, kTofu, 1000), 0);
   notices();

   ASSERT_EQ(configure(config(kOn, 0, 32, {{1, 1, 1}})), ORR_OK);

   EXPECT_EQ(entries(), (Entries{{{1, 2, 2}, kDhcp}, {{1, 1, 1}, kStatic}}));
   EXPECT_EQ(notices(), (std::vector<Notice>{removed({1, 1, 1}, 1), removed({1, 3, 3}, 0),
                                             removed({1, 4, 4}, 0), added({1, 1, 1}, 1)}));
   EXPECT_EQ(+ctx_.config.trusted, 0u);
   EXPECT_TRUE(logged("port-7: Config success: trusted = 0 portDbSize = 32 numStatic = 1"));

   // Back to trusted: only the statics are replaced.
   ASSERT_EQ(add({1, 5, 5}, kTofu, 1000), 0);
   notices();
   ASSERT_EQ(configure(config(kOn, 1, 32, {{1, 6, 6}})), ORR_OK);
   EXPECT_EQ(entries(), (Entries{{{1, 2, 2}, kDhcp}, {{1, 5, 5}, kTofu}, {{1, 6, 6}, kStatic}}));
   EXPECT_EQ(notices(), (std::vector<Notice>{removed({1, 1, 1}, 1), added({1, 6, 6}, 1)}));
   expectCountersAgree();
}

TEST_F(PortDbConfigTest, a_static_key_listed_twice_yields_one_entry)
{
   ASSERT_EQ(configure(config(kOn, 1, 32, {{1, 1, 1}, {2, 2, 2}, {1, 1, 1}})), ORR_OK);

   EXPECT_EQ(entries(), (Entries{{{1, 1, 1}, kStatic}, {{2, 2, 2}, kStatic}}));
   expectCountersAgree();
}

TEST_F(PortDbConfigTest, a_reconfiguration_that_keeps_two_entries_reuses_the_hash_table)
{
   ASSERT_EQ(configure(config(kOn, 1, 32, {{1, 1, 1}, {1, 2, 2}})), ORR_OK);
   Hash_Table *table = ctx_.portDbHash;
   ASSERT_NE(table, nullptr);
   host().faults().failFrom("Hash_Alloc", ORR_NO_MEMORY);

   ASSERT_EQ(configure(config(kOn, 1, 32, {{1, 3, 3}, {1, 4, 4}})), ORR_OK);

   EXPECT_EQ(ctx_.portDbHash, table);
   EXPECT_EQ(entries(), (Entries{{{1, 3, 3}, kStatic}, {{1, 4, 4}, kStatic}}));
   EXPECT_NE(find({1, 4, 4}), nullptr);
   EXPECT_EQ(find({1, 1, 1}), nullptr);
}

TEST_F(PortDbConfigTest, the_built_in_agent_port_is_mapped_and_gets_one_timer)
{
   ASSERT_EQ(configure(config(kOn, 1, 32)), ORR_OK);
   EXPECT_TRUE(mapped());
   EXPECT_EQ(portFilterMapDb.numPfm, 1u);
   const orr_Timer timer = ctx_.portDbTimer;
   EXPECT_NE(timer, 0u);

   ASSERT_EQ(configure(config(kOn, 0, 16)), ORR_OK);
   EXPECT_EQ(portFilterMapDb.numPfm, 1u);
   EXPECT_EQ(ctx_.portDbTimer, timer);
}

TEST_F(PortDbConfigTest, ports_of_other_agents_stay_out_of_the_map)
{
   std::strcpy(agent_.name, "some-other-agent");
   ASSERT_EQ(configure(config(kOn, 1, 32)), ORR_OK);
   EXPECT_FALSE(mapped());
   EXPECT_EQ(portFilterMapDb.numPfm, 0u);
}

TEST_F(PortDbConfigTest, disabling_under_a_reference_is_busy_until_it_is_released)
{
   ASSERT_EQ(configure(config(kOn, 1, 32, {{1, 1, 1}})), ORR_OK);
   ASSERT_EQ(add({1, 2, 2}, kArp, 1000), 0);
   notices();
   SwSecContext *found = nullptr;
   ASSERT_EQ(SwSecRefPortFilterMap(kPortId, &found), ORR_OK);
   EXPECT_EQ(found, &ctx_);

   EXPECT_EQ(configure(config(0, 0, 0)), ORR_BUSY);
   EXPECT_EQ(ctx_.numVmiEntries, 2u);
   EXPECT_TRUE(notices().empty());
   EXPECT_TRUE(logged("port-7: PFM busy: pfm: 7 -> "));
   SwSecContext *again = nullptr;
   EXPECT_EQ(SwSecRefPortFilterMap(kPortId, &again), ORR_NOT_FOUND);

   SwSecReleasePortFilterMap(kPortId, found);
   EXPECT_EQ(configure(config(0, 0, 0)), ORR_OK);
   EXPECT_EQ(ctx_.numVmiEntries, 0u);
   EXPECT_FALSE(mapped());
   EXPECT_EQ(notices(), (std::vector<Notice>{removed({1, 1, 1}, 1), removed({1, 2, 2}, 0)}));
   // The timer stays; size and mode keep their last values.
   EXPECT_NE(ctx_.portDbTimer, 0u);
   EXPECT_EQ(+ctx_.config.portDbSize, 32u);
}

TEST_F(PortDbConfigTest, disabling_empties_pending_requests)
{
   ASSERT_EQ(configure(config(kOn, 1, 32)), ORR_OK);
   addRequest(uptime() + 60, 6);
   addRequest(uptime() + 60);

   ASSERT_EQ(configure(config(0, 1, 32)), ORR_OK);

   EXPECT_EQ(ctx_.numDhcpReqs, 0u);
   EXPECT_TRUE(SifraGenericListIsEmpty(&ctx_.dhcpReqList));
}

TEST_F(PortDbConfigTest, every_failing_step_leaves_the_old_configuration_in_force)
{
   // An existing port: mapped, timer running, statics and learned entries.
   ASSERT_EQ(configure(config(kOn, 1, 32, {{1, 1, 1}})), ORR_OK);
   ASSERT_EQ(add({1, 2, 2}, kArp, 1000), 0);
   const Entries before = entries();
   const auto next = config(kOn, 0, 8, {{1, 3, 3}, {1, 4, 4}, {1, 5, 5}});

   // Each allocation of the new configuration in turn.
   for (uint64_t nth = 1;; nth++) {
      SCOPED_TRACE(::testing::Message() << "allocation #" << nth);
      notices();
      const uint64_t blocks = host().heap().liveBlocks();
      const uint64_t callsBefore = host().faults().calls("orr_HeapAllocWithRA");
      host().faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY, nth);
      const orr_Status status = configure(next);
      const bool hit = host().faults().calls("orr_HeapAllocWithRA") - callsBefore >= nth;
      host().faults().clear();
      if (!hit) {
         ASSERT_EQ(status, ORR_OK);
         break;
      }
      EXPECT_EQ(status, ORR_NO_MEMORY);
      EXPECT_TRUE(logged("port-7: Vmi pre alloc failed"));
      EXPECT_EQ(entries(), before);
      EXPECT_EQ(+ctx_.config.trusted, 1u);
      EXPECT_TRUE(notices().empty());
      EXPECT_EQ(host().heap().liveBlocks(), blocks);
   }
   EXPECT_EQ(entries(), (Entries{{{1, 3, 3}, kStatic}, {{1, 4, 4}, kStatic}, {{1, 5, 5}, kStatic}}));
}

TEST_F(PortDbConfigTest, a_first_configuration_failing_anywhere_leaves_nothing_behind)
{
   const auto first = config(kOn, 1, 32, {{1, 1, 1}, {1, 2, 2}});
   struct Case {
      const char *op;
      orr_Status expected;
      const char *message;
   };
   const Case cases[] = {
      {"orr_HeapAllocWithRA", ORR_NO_MEMORY, nullptr},
      {"Hash_Alloc", ORR_NO_MEMORY, "port-7: Vmi pre alloc failed"},
      {"orr_TimerAdd", ORR_LIMIT_EXCEEDED, "port-7: Timer creation failed: Limit exceeded"},
   };
   for (const Case &c : cases) {
      for (uint64_t nth = 1;; nth++) {
         SCOPED_TRACE(::testing::Message() << c.op << " #" << nth);
         const uint64_t blocks = host().heap().liveBlocks();
         const uint64_t callsBefore = host().faults().calls(c.op);
         host().faults().failOnce(c.op, c.expected, nth);
         const orr_Status status = configure(first);
         const bool hit = host().faults().calls(c.op) - callsBefore >= nth;
         host().faults().clear();
         if (!hit) {
            ASSERT_EQ(status, ORR_OK);
            break;
         }
         EXPECT_EQ(status, c.expected);
         if (c.message != nullptr) {
            EXPECT_TRUE(logged(c.message));
         }
         EXPECT_TRUE(entries().empty());
         EXPECT_FALSE(mapped());
         EXPECT_EQ(ctx_.portDbTimer, 0u);
         EXPECT_EQ(host().heap().liveBlocks(), blocks);
         EXPECT_TRUE(notices().empty());
      }
      // Undo the success for the next case.
      ASSERT_EQ(configure(config(0, 0, 0)), ORR_OK);
      orr_TimerRemoveSync(ctx_.portDbTimer);
      ctx_.portDbTimer = 0;
      SwSecPortDbDestroy(&ctx_);
      notices();
   }
   EXPECT_TRUE(logged("port-7: Pfm add failed: Out of memory"));
}

}  // namespace
}  // namespace swsec::testing
