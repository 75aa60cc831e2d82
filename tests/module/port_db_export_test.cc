// The exported port database queries, called as another module would.
#include "support/host_fixture.h"

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

}  // namespace
}  // namespace swsec::testing
