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
   uint32_t count = 7;
   void *entries = &count;
   void *buffer = &count;
};

TEST_F(PortDbExportTest, ports_without_a_database_are_not_found_and_null_outputs_refused)
{
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

// Two static entries and a learned one: selectors 0 (authoritative), 1
// (learned), 2 (all) and an unknown one, which selects nothing.
TEST_F(PortDbExportTest, each_selector_counts_its_entries_and_a_held_buffer_keeps_the_module_loaded)
{
   const host::FilterId filter = create();
   ASSERT_EQ(setFeatures(filter, {.statics = {binding(5, kVmMac, Ip4{{10, 0, 0, 1}}),
                                              binding(6, kPeerMac, Ip4{{10, 0, 0, 2}})}}),
             1u);
   ASSERT_TRUE(passes(filter, kTx, arpRequest(kServerMac, kServerIp)));
   const uint32_t counts[] = {2, 1, 3, 0};
   for (uint32_t selector = 0; selector <= 3; selector++) {
      ASSERT_EQ(getNumEntries(kPort, selector, &count), ORR_OK);
      EXPECT_EQ(count, counts[selector]) << selector;
   }
   ASSERT_EQ(getEntries(kPort, 3, &entries, &count, &buffer), ORR_OK);
   EXPECT_EQ(count, 0u);
   EXPECT_EQ(entries, nullptr);
   EXPECT_EQ(buffer, nullptr);
   EXPECT_EQ(host().useCount(), 0u);

   ASSERT_EQ(getEntries(kPort, 0, &entries, &count, &buffer), ORR_OK);
   ASSERT_EQ(count, 2u);
   EXPECT_EQ(entries, buffer);
   // 32-byte records in list order: VLAN, MAC, type 1, address, authoritative 1, every other byte zero.
   auto record = [](uint8_t vlan, const Mac &mac, uint8_t ip) {
      return cat(cat(Bytes{vlan, 0}, Bytes(mac.bytes.begin(), mac.bytes.end())),
                 {1, 0, 0, 0, 10, 0, 0, ip, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0});
   };
   const auto *bytes = static_cast<const uint8_t *>(entries);
   EXPECT_EQ(Bytes(bytes, bytes + 64), cat(record(5, kVmMac, 1), record(6, kPeerMac, 2)));
   EXPECT_EQ(host().useCount(), 1u);
   EXPECT_EQ(host().unload(), ORR_BUSY);
   EXPECT_EQ(releaseBuf(buffer), ORR_OK);
   EXPECT_EQ(host().useCount(), 0u);
}

TEST_F(PortDbExportTest, failed_reads_free_the_buffer_and_drop_the_reference)
{
   const host::FilterId filter = create();
   ASSERT_EQ(setFeatures(filter, {.statics = {binding(5, kVmMac, kVmIp)}}), 1u);
   const uint64_t blocks = host().heap().liveBlocks();
   host().faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY);
   EXPECT_EQ(getEntries(kPort, 0, &entries, &count, &buffer), ORR_NO_MEMORY);
   EXPECT_TRUE(logged("filter: Dbentry alloc failed"));
   host().faults().failOnce("orr_ModuleIncUseCount", ORR_FAILURE);
   buffer = nullptr;
   EXPECT_EQ(getEntries(kPort, 0, &entries, &count, &buffer), ORR_FAILURE);
   EXPECT_TRUE(logged("filter: portId= 7: ModIncUseCnt() failed: Failure"));
   EXPECT_EQ(buffer, nullptr);
   EXPECT_EQ(host().heap().liveBlocks(), blocks);
   // No reference is left behind: the disable goes through.
   EXPECT_EQ(writeConfig(filter, {.features = 0}), ORR_OK);
}

}  // namespace
}  // namespace swsec::testing
