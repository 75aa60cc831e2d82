// The module linked into the test program and loaded through the host, so
// that a test can hold a port filter map reference the way an exported
// query or a management handler does, for as long as it likes.
#include "support/host_fixture.h"

#include "framework/sifra_generic_filter.h"
#include "platform/orr_module.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_port_filter_map.h"

extern "C" const orr_ModuleInfo orr_moduleInfo;

namespace swsec::testing {
namespace {

constexpr uint32_t kPortId = 11;
constexpr const char *kAgent = "sifra-generic-tarlin-swsec";

class PortReferenceTest : public HostTest {
protected:
   void SetUp() override
   {
      HostTest::SetUp();
      host::LoadOptions options;
      options.linkedModule = &orr_moduleInfo;
      ASSERT_EQ(host().load(options), 0);
      host().portsets().addPortset("vs0");
      host().portsets().addPort("vs0", kPortId);
      host::FilterConfig config;
      config.name = "vm1.eth0";
      ASSERT_EQ(host().sifra().createFilter(kAgent, kPortId, config, &filter_), ORR_OK);
   }

   void TearDown() override
   {
      if (filter_ != 0) {
         EXPECT_EQ(host().sifra().destroyFilter(filter_), ORR_OK);
      }
      HostTest::TearDown();
   }

   host::FilterId filter_ = 0;
};

TEST_F(PortReferenceTest, destroy_retries_twenty_times_ten_ms_apart_while_a_reader_holds_the_port)
{
   SwSecContext *ctx = nullptr;
   ASSERT_EQ(SwSecRefPortFilterMap(kPortId, &ctx), ORR_OK);
   const auto sleepsBefore = host().clock().sleeps();
   const auto before = host().clock().now();

   EXPECT_EQ(host().sifra().destroyFilter(filter_), ORR_BUSY);

   EXPECT_EQ(host().clock().sleeps() - sleepsBefore, 19u);
   EXPECT_EQ(host().clock().now() - before, std::chrono::milliseconds(190));
   EXPECT_EQ(host().log().count("vm1.eth0: Got ORR_BUSY: to retry ("), 19u);
   EXPECT_TRUE(logged("vm1.eth0: Got ORR_BUSY: to retry (18) ..."));
   EXPECT_TRUE(logged("vm1.eth0: Destroy didn't succeed after 19 retries(Busy)"));
   // Closing, the port grants no new reference.
   SwSecContext *other = nullptr;
   EXPECT_EQ(SwSecRefPortFilterMap(kPortId, &other), ORR_NOT_FOUND);

   SwSecReleasePortFilterMap(kPortId, ctx);
   EXPECT_EQ(host().sifra().destroyFilter(filter_), ORR_OK);
   filter_ = 0;
}

}  // namespace
}  // namespace swsec::testing
