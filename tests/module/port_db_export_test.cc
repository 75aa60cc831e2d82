// The exported port database queries, called as another module would.
#include "port_fixture.h"

namespace swsec::testing {
namespace {

using GetNumEntriesFn = orr_Status(uint32_t, uint32_t, uint32_t *);
using GetEntriesFn = orr_Status(uint32_t, uint32_t, void **, uint32_t *, void **);
using ReleaseBufFn = orr_Status(void *);

class PortDbExportTest : public PortTest {
protected:
   void SetUp() override
   {
      PortTest::SetUp();
      const char *ns = "switchSecurity#1.0";
      getNumEntries = reinterpret_cast<GetNumEntriesFn *>(host().resolveExport(ns, "SwSec_PortDBGetNumEntries"));
      getEntries = reinterpret_cast<GetEntriesFn *>(host().resolveExport(ns, "SwSec_PortDBGetEntries"));
      releaseBuf = reinterpret_cast<ReleaseBufFn *>(host().resolveExport(ns, "SwSec_PortDBReleaseBuf"));
      ASSERT_TRUE(getNumEntries && getEntries && releaseBuf);
   }

   GetNumEntriesFn *getNumEntries = nullptr;
   GetEntriesFn *getEntries = nullptr;
   ReleaseBufFn *releaseBuf = nullptr;
};

TEST_F(PortDbExportTest, ports_without_a_database_are_not_found_and_null_outputs_refused)
{
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

// Two static entries, set through the set-features ioctl as the slow path would.
TEST_F(PortDbExportTest, a_held_buffer_keeps_the_module_loaded_until_released)
{
   const host::FilterId filter = create();
   uint32_t count = 7;
   void *entries = &count;
   void *buffer = &count;
   ASSERT_EQ(getEntries(kPort, 2, &entries, &count, &buffer), ORR_OK);
   EXPECT_EQ(count, 0u);
   EXPECT_EQ(entries, nullptr);
   EXPECT_EQ(buffer, nullptr);
   EXPECT_EQ(host().useCount(), 0u);

   ASSERT_EQ(setFeatures(filter, {.statics = {{5, {2, 0, 0, 0, 0, 1}, {10, 0, 0, 1}},
                                              {6, {2, 0, 0, 0, 0, 2}, {10, 0, 0, 2}}}}),
             1u);
   ASSERT_EQ(getNumEntries(kPort, 0, &count), ORR_OK);
   EXPECT_EQ(count, 2u);
   ASSERT_EQ(getEntries(kPort, 0, &entries, &count, &buffer), ORR_OK);
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
   EXPECT_EQ(getNumEntries(kPort, 0, &count), ORR_NOT_FOUND);
}

}  // namespace
}  // namespace swsec::testing
