// The exported port database queries, called as another module would.
#include "support/host_fixture.h"

#include <cstring>
#include <vector>

namespace swsec::testing {
namespace {

using GetNumEntriesFn = orr_Status (*)(uint32_t, uint32_t, uint32_t *);
using GetEntriesFn = orr_Status (*)(uint32_t, uint32_t, void **, uint32_t *, void **);
using ReleaseBufFn = orr_Status (*)(void *);

using PortDbExportTest = ModuleTest;

TEST_F(PortDbExportTest, ports_without_a_database_are_not_found_and_null_outputs_refused)
{
   const char *ns = "switchSecurity#1.0";
   auto getNumEntries =
      reinterpret_cast<GetNumEntriesFn>(host().resolveExport(ns, "SwSec_PortDBGetNumEntries"));
   auto getEntries = reinterpret_cast<GetEntriesFn>(host().resolveExport(ns, "SwSec_PortDBGetEntries"));
   auto releaseBuf = reinterpret_cast<ReleaseBufFn>(host().resolveExport(ns, "SwSec_PortDBReleaseBuf"));
   ASSERT_TRUE(getNumEntries && getEntries && releaseBuf);

   uint32_t count = 0;
   void *entries = nullptr;
   void *buffer = nullptr;
   for (uint32_t selector : {0u, 1u, 2u, 3u}) {
      EXPECT_EQ(getNumEntries(5, selector, &count), ORR_NOT_FOUND);
      EXPECT_EQ(getEntries(5, selector, &entries, &count, &buffer), ORR_NOT_FOUND);
   }
   EXPECT_EQ(getNumEntries(5, 0, nullptr), ORR_BAD_PARAM);
   EXPECT_EQ(getEntries(5, 0, nullptr, &count, &buffer), ORR_BAD_PARAM);
   EXPECT_EQ(getEntries(5, 0, &entries, nullptr, &buffer), ORR_BAD_PARAM);
   EXPECT_EQ(getEntries(5, 0, &entries, &count, nullptr), ORR_BAD_PARAM);
   EXPECT_EQ(releaseBuf(nullptr), ORR_BAD_PARAM);
   EXPECT_EQ(host().useCount(), 0u);
}

// A port of the built-in agent with two static entries, set through the
// set-features ioctl as the slow path would.
TEST_F(PortDbExportTest, a_held_buffer_keeps_the_module_loaded_until_released)
{
   const char *ns = "switchSecurity#1.0";
   auto getNumEntries =
      reinterpret_cast<GetNumEntriesFn>(host().resolveExport(ns, "SwSec_PortDBGetNumEntries"));
   auto getEntries = reinterpret_cast<GetEntriesFn>(host().resolveExport(ns, "SwSec_PortDBGetEntries"));
   auto releaseBuf = reinterpret_cast<ReleaseBufFn>(host().resolveExport(ns, "SwSec_PortDBReleaseBuf"));
   ASSERT_TRUE(getNumEntries && getEntries && releaseBuf);

   host().portsets().addPortset("vswitch0");
   host().portsets().addPort("vswitch0", 9);
   host::FilterId filter = 0;
   ASSERT_EQ(host().sifra().createFilter("sifra-generic-tarlin-swsec", 9, {}, &filter), ORR_OK);

   uint32_t count = 7;
   void *entries = &count;
   void *buffer = &count;
   ASSERT_EQ(getEntries(9, 2, &entries, &count, &buffer), ORR_OK);
   EXPECT_EQ(count, 0u);
   EXPECT_EQ(entries, nullptr);
   EXPECT_EQ(buffer, nullptr);
   EXPECT_EQ(host().useCount(), 0u);

   // Type 7, then the record: version 1, IP discovery, trusted, 32 entries, 2 statics.
   std::vector<uint8_t> payload(4 + 26 + 24, 0);
   payload[0] = 7;
   payload[4] = 1;
   payload[5] = 0x04;
   payload[9] = 1;
   payload[10] = 32;
   payload[14] = 2;
   const uint8_t statics[24] = {5, 0, 2, 0, 0, 0, 0, 1, 10, 0, 0, 1,
                                6, 0, 2, 0, 0, 0, 0, 2, 10, 0, 0, 2};
   std::memcpy(payload.data() + 30, statics, sizeof(statics));
   ASSERT_EQ(host().sifra().sendIoctl(filter, 1, payload), ORR_OK);

   ASSERT_EQ(getNumEntries(9, 0, &count), ORR_OK);
   EXPECT_EQ(count, 2u);
   ASSERT_EQ(getEntries(9, 0, &entries, &count, &buffer), ORR_OK);
   ASSERT_EQ(count, 2u);
   ASSERT_NE(buffer, nullptr);
   EXPECT_EQ(entries, buffer);
   const auto *bytes = static_cast<const uint8_t *>(entries);
   EXPECT_EQ(bytes[0], 5u);
   EXPECT_EQ(bytes[7], 1u);
   EXPECT_EQ(bytes[15], 1u);
   EXPECT_EQ(bytes[28], 1u);
   EXPECT_EQ(bytes[32 + 0], 6u);
   EXPECT_EQ(bytes[32 + 15], 2u);
   EXPECT_EQ(host().useCount(), 1u);

   EXPECT_EQ(host().unload(), ORR_BUSY);
   EXPECT_TRUE(host().loaded());

   EXPECT_EQ(releaseBuf(buffer), ORR_OK);
   EXPECT_EQ(host().useCount(), 0u);
   EXPECT_EQ(host().sifra().destroyFilterAsHypervisor(filter).status, ORR_OK);
   EXPECT_EQ(getNumEntries(9, 0, &count), ORR_NOT_FOUND);
}

}  // namespace
}  // namespace swsec::testing
