// The loader, with a tiny module image of its own (fixture_module/): load
// and unload, parameters, fresh globals on reload, the use count, and the
// leftovers of a failed load or a leaking unload.
#include "host_unit.h"

#include <gmock/gmock.h>

#include <stdexcept>

using ::testing::ElementsAre;
using ::testing::HasSubstr;

namespace swsec::testing {
namespace {

class LoaderTest : public HostUnitTest {
public:
   void SetUp() override
   {
#ifndef SWSEC_HOST_FIXTURE_MODULE
      GTEST_SKIP() << "the tiny fixture module is not part of this build";
#endif
   }

   void TearDown() override
   {
      if (host.loaded()) {
         EXPECT_EQ(host.unload(), ORR_OK);
      }
      HostUnitTest::TearDown();
   }

   int load(std::map<std::string, int, std::less<>> parameters = {})
   {
      host::LoadOptions options;
#ifdef SWSEC_HOST_FIXTURE_MODULE
      options.modulePath = SWSEC_HOST_FIXTURE_MODULE;
#endif
      options.moduleName = "tiny";
      options.parameters = std::move(parameters);
      return host.load(options);
   }

   template <typename Fn>
   Fn *exported(const char *name)
   {
      return reinterpret_cast<Fn *>(host.resolveExport("tiny#1.0", name));
   }
};

TEST_F(LoaderTest, LoadSetsParametersAndAReloadStartsFromFreshGlobals)
{
   EXPECT_THROW(load({{"TINY_MODES", 1}}), std::invalid_argument);
   EXPECT_THROW(host.load({.modulePath = "/nonexistent/tiny_module.so"}), std::runtime_error);
   EXPECT_FALSE(host.loaded());
   ASSERT_EQ(load({{"TINY_BLOCK_SIZE", 40}}), 0);
   EXPECT_EQ(host.heap().liveBytes(), 40u) << "the module saw the parameter";
   EXPECT_STREQ(host.heap().moduleHeapProps()->name.name, "tiny") << "named through orr_ModuleGetName";
   EXPECT_EQ(host.resolveExport("other#1.0", "TinyInitCalls"), nullptr);
   EXPECT_EQ(exported<int()>("TinyInitCalls")(), 1);
   ASSERT_EQ(host.unload(), ORR_OK);
   EXPECT_EQ(host.heap().liveBytes(), 0u);
   ASSERT_EQ(load(), 0);
   EXPECT_EQ(exported<int()>("TinyInitCalls")(), 1) << "the second image is a fresh copy";
}

TEST_F(LoaderTest, WhatAFailedLoadOrAnUnloadLeavesIsReportedAndTakenBack)
{
   EXPECT_EQ(load({{"TINY_MODE", 2}}), 1);
   EXPECT_FALSE(host.loaded());
   EXPECT_THAT(takeViolations(),
               ElementsAre("after a failed load: module 'tiny' is still registered",
                           "after a failed load: heap 'tiny' was not destroyed",
                           HasSubstr("after a failed load: heap 'tiny': 1 live block (24 bytes) allocated at "
                                     "TinyInit+0x")));
   EXPECT_EQ(host.heap().liveBlocks(), 0u);
   ASSERT_EQ(load({{"TINY_MODE", 3}}), 0);
   EXPECT_EQ(host.unload(), ORR_OK);
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("orr_HeapDestroy: heap 'tiny': 1 live block (24 bytes) "
                                                       "allocated at TinyInit+0x")));
   // A failed init that undoes its own work leaves no violation behind.
   for (const char *op : {"orr_ModuleRegister", "orr_ModuleGetName", "orr_HeapCreate", "orr_ModuleSetHeapID",
                          "orr_HeapAllocWithRA"}) {
      host.faults().failOnce(op, ORR_NO_MEMORY);
      EXPECT_EQ(load(), 1) << op;
      EXPECT_FALSE(host.loaded());
      EXPECT_THAT(takeViolations(), ElementsAre()) << op;
   }
}

TEST_F(LoaderTest, UnloadIsRefusedWhileTheModuleHasUsersAndTakesNoNewOnes)
{
   ASSERT_EQ(load(), 0);
   ASSERT_EQ(exported<orr_Status()>("TinyTakeUse")(), ORR_OK);
   EXPECT_EQ(host.useCount(), 1u);
   ASSERT_EQ(host.unload(), ORR_BUSY);   // the image stays for the calls below
   EXPECT_TRUE(host.loaded());
   exported<void()>("TinyDropUse")();
   exported<void()>("TinyDropUse")();
   EXPECT_EQ(takeViolations().size(), 1u) << "dropping a use not taken";
   EXPECT_EQ(host.unload(), ORR_OK);
   ASSERT_EQ(load({{"TINY_MODE", 4}}), 0);
   EXPECT_EQ(host.unload(), ORR_FAILURE) << "cleanup returns the refused status";
   EXPECT_FALSE(host.loaded());
   orr_ModuleID id = ORR_INVALID_MODULE_ID;
   EXPECT_EQ(orr_ModuleRegister(&id, ORR_MODULE_INTERFACE_REVISION), ORR_FAILURE) << "outside a module's init";
   EXPECT_EQ(id, ORR_INVALID_MODULE_ID);
   EXPECT_EQ(takeViolations().size(), 1u);
}

}  // namespace
}  // namespace swsec::testing
