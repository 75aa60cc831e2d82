// The port database test hooks, switched through the "startTest" and
// "stopTest" nodes: while on, each port database change reads the port
// through the exported queries once per selector.
#include "port_fixture.h"

#include "contract/notification.h"

#include <chrono>
#include <cstdint>

namespace swsec::testing {
namespace {

class TestHooksTest : public PortTest {
protected:
   void SetUp() override
   {
      PortTest::SetUp();
      filter_ = create();
   }

   size_t portDbListeners()
   {
      size_t count = 0;
      for (const auto &listener : host().portsets().listeners()) {
         count += listener.msgClass == SWSEC_PORTSET_MSG_PORTDB && listener.portset == nullptr && listener.portID == 0 ? 1 : 0;
      }
      return count;
   }

   // The traffic one learned VMI causes: portset holds taken by port ID and
   // exported-query buffers (module use count increments).
   struct Traffic {
      uint64_t acquisitions;
      uint64_t useCountIncrements;
   };
   Traffic learnOneVmi(const char *mac, const char *ip)
   {
      const uint64_t acquisitions = host().faults().calls("orr_PortsetAcquireByPortID");
      const uint64_t increments = host().faults().calls("orr_ModuleIncUseCount");
      (void)send(filter_, kTx, {arpRequest(Mac::parse(mac), Ip4::parse(ip))});
      EXPECT_EQ(host().portsets().pendingDeliveries(), 0u);
      return {host().faults().calls("orr_PortsetAcquireByPortID") - acquisitions,
              host().faults().calls("orr_ModuleIncUseCount") - increments};
   }

   host::FilterId filter_ = 0;
};

TEST_F(TestHooksTest, start_twice_registers_one_listener_and_one_stop_removes_it)
{
   EXPECT_EQ(host().nexo().set("/stopTest", {}), ORR_OK) << "stop without start";
   host().faults().failOnce("orr_PortsetRegisterMessageCB", ORR_NO_MEMORY);
   EXPECT_EQ(host().nexo().set("/startTest", {}), ORR_NO_MEMORY);
   EXPECT_EQ(portDbListeners(), 0u) << "a refused registration leaves the hooks off";
   EXPECT_EQ(host().nexo().set("/startTest", {}), ORR_OK);
   EXPECT_EQ(host().nexo().set("/startTest", {}), ORR_OK);
   EXPECT_EQ(portDbListeners(), 1u);
   EXPECT_EQ(host().nexo().set("/stopTest", {}), ORR_OK);
   EXPECT_EQ(portDbListeners(), 0u);
}

TEST_F(TestHooksTest, each_vmi_added_while_on_reads_the_port_once_per_selector)
{
   const Traffic off = learnOneVmi("02:00:00:00:00:01", "10.0.0.1");
   EXPECT_EQ(off.acquisitions, 0u);
   EXPECT_EQ(off.useCountIncrements, 0u);

   ASSERT_EQ(host().nexo().set("/startTest", {}), ORR_OK);
   // Two non-authoritative VMIs then: selector 0 finds none, 1 and 2 both
   // hand out a buffer (one use count each, given back at once).
   const Traffic on = learnOneVmi("02:00:00:00:00:02", "10.0.0.2");
   EXPECT_EQ(on.acquisitions, 1u);
   EXPECT_EQ(on.useCountIncrements, 2u);
   EXPECT_EQ(host().useCount(), 0u);
   EXPECT_EQ(host().portsets().outstandingAcquisitions(), 0u);

   // A failed query (selector 1's buffer refused) skips selector 2 and lets the portset go.
   host().faults().failOnce("orr_ModuleIncUseCount", ORR_FAILURE);
   const Traffic failed = learnOneVmi("02:00:00:00:00:03", "10.0.0.3");
   EXPECT_EQ(failed.acquisitions, 1u);
   EXPECT_EQ(failed.useCountIncrements, 1u);
   EXPECT_EQ(host().portsets().outstandingAcquisitions(), 0u);

   ASSERT_EQ(host().nexo().set("/stopTest", {}), ORR_OK);
   const Traffic stopped = learnOneVmi("02:00:00:00:00:04", "10.0.0.4");
   EXPECT_EQ(stopped.acquisitions, 0u);
}

TEST_F(TestHooksTest, removals_by_a_management_clear_and_by_the_ageing_timer_reach_the_hooks)
{
   (void)learnOneVmi("02:00:00:00:00:01", "10.0.0.1");
   (void)learnOneVmi("02:00:00:00:00:02", "10.0.0.2");
   ASSERT_EQ(host().nexo().set("/startTest", {}), ORR_OK);
   const uint64_t acquisitions = host().faults().calls("orr_PortsetAcquireByPortID");
   ASSERT_EQ(host().nexo().set("/security/7/clearVmi", {"one", "0", "02:00:00:00:00:01", "10.0.0.1"}), ORR_OK);
   EXPECT_EQ(host().faults().calls("orr_PortsetAcquireByPortID") - acquisitions, 1u);
   host().clock().advance(std::chrono::seconds(190));   // the other one ages out
   EXPECT_EQ(host().faults().calls("orr_PortsetAcquireByPortID") - acquisitions, 2u);
   EXPECT_EQ(host().portsets().pendingDeliveries(), 0u);
   EXPECT_EQ(host().portsets().outstandingAcquisitions(), 0u);
}

TEST_F(TestHooksTest, messages_of_another_class_or_without_a_message_are_ignored)
{
   ASSERT_EQ(host().nexo().set("/startTest", {}), ORR_OK);
   orr_PortsetMessageCB callback = nullptr;
   for (const auto &listener : host().portsets().listeners()) {
      if (listener.msgClass == SWSEC_PORTSET_MSG_PORTDB) {
         callback = listener.callback;
      }
   }
   ASSERT_NE(callback, nullptr);
   const uint64_t before = host().faults().calls("orr_PortsetAcquireByPortID");
   orr_PortsetMessageHeader message{};
   callback(kPort, SWSEC_PORTSET_MSG_PORTDB << 1, &message);
   callback(kPort, SWSEC_PORTSET_MSG_PORTDB, nullptr);
   EXPECT_EQ(host().faults().calls("orr_PortsetAcquireByPortID"), before);

   // A port the host does not know: the hold is refused and nothing is read.
   const uint64_t increments = host().faults().calls("orr_ModuleIncUseCount");
   callback(4242, SWSEC_PORTSET_MSG_PORTDB, &message);
   EXPECT_EQ(host().faults().calls("orr_ModuleIncUseCount"), increments);
}

// The port's filter is still there: it goes before the map and the hooks it uses.
TEST_F(TestHooksTest, unloading_with_the_hooks_on_and_a_live_port_withdraws_both)
{
   ASSERT_EQ(host().nexo().set("/startTest", {}), ORR_OK);
   (void)learnOneVmi("02:00:00:00:00:01", "10.0.0.1");
   ASSERT_EQ(host().unload(), ORR_OK);
   EXPECT_TRUE(host().sifra().filters().empty());
   EXPECT_EQ(portDbListeners(), 0u);
   EXPECT_TRUE(host().violations().empty());
}

}  // namespace
}  // namespace swsec::testing
