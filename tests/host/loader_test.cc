// The loader, with a tiny module image of its own (fixture_module/): load
// and unload, parameters, fresh globals on reload, the use count, and the
// leftovers of a failed load or a leaking unload.
#include "host_unit.h"

#include <gmock/gmock.h>

#include <stdexcept>

using ::testing::ElementsAre;
using ::testing::FieldsAre;
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

TEST_F(LoaderTest, LoadSetsParametersAndDescribesTheModule)
{
   ASSERT_EQ(load({{"TINY_BLOCK_SIZE", 40}}), 0);
   EXPECT_TRUE(host.loaded());
   const auto &module = host.module();
   EXPECT_EQ(module.name, "tiny");
   EXPECT_EQ(module.version, "tiny 1");
   EXPECT_THAT(module.requiredNamespaces, ElementsAre("orrin#nover"));
   EXPECT_EQ(module.providedNamespace, "tiny#1.0");
   EXPECT_THAT(module.parameters, ElementsAre(FieldsAre("TINY_MODE", "What to get wrong", 0),
                                              FieldsAre("TINY_BLOCK_SIZE", "Size of the block made at init", 40)));
   EXPECT_THAT(module.exports, ElementsAre(FieldsAre("tiny#1.0", "TinyInitCalls"), FieldsAre("tiny#1.0", "TinyTakeUse"),
                                           FieldsAre("tiny#1.0", "TinyDropUse")));
   EXPECT_EQ(host.heap().liveBytes(), 40u) << "the module saw the parameter";
   auto heapProps = host.heap().moduleHeapProps();
   ASSERT_TRUE(heapProps.has_value());
   EXPECT_STREQ(heapProps->name.name, "tiny") << "named through orr_ModuleGetName";
   EXPECT_EQ(host.resolveExport("other#1.0", "TinyInitCalls"), nullptr);
   EXPECT_EQ(host.resolveExport("tiny#1.0", "Nothing"), nullptr);
   EXPECT_EQ(host.unload(), ORR_OK);
   EXPECT_FALSE(host.loaded());
   EXPECT_EQ(host.heap().liveBytes(), 0u);
}

TEST_F(LoaderTest, UnknownParameterAndImageThatCannotBeOpenedAreRefusedBeforeTheModuleRuns)
{
   EXPECT_THROW(load({{"TINY_MODES", 1}}), std::invalid_argument);
   EXPECT_FALSE(host.loaded());
   EXPECT_THROW(host.load({.modulePath = "/nonexistent/tiny_module.so"}), std::runtime_error);
   EXPECT_FALSE(host.loaded());
   ASSERT_EQ(load(), 0);
   EXPECT_EQ(exported<int()>("TinyInitCalls")(), 1);
}

TEST_F(LoaderTest, ReloadStartsFromFreshGlobals)
{
   ASSERT_EQ(load(), 0);
   EXPECT_EQ(exported<int()>("TinyInitCalls")(), 1);
   ASSERT_EQ(host.unload(), ORR_OK);
   ASSERT_EQ(load(), 0);
   EXPECT_EQ(exported<int()>("TinyInitCalls")(), 1) << "the second image is a fresh copy";
}

TEST_F(LoaderTest, FailedLoadReportsEachObjectLeftBehind)
{
   EXPECT_EQ(load({{"TINY_MODE", 2}}), 1);
   EXPECT_FALSE(host.loaded());
   EXPECT_THAT(takeViolations(),
               ElementsAre("after a failed load: module 'tiny' is still registered",
                           "after a failed load: heap 'tiny' was not destroyed",
                           HasSubstr("after a failed load: heap 'tiny': 1 live block (24 bytes) allocated at "
                                     "TinyInit+0x")));
   EXPECT_EQ(host.heap().liveBlocks(), 0u) << "the host took the leftovers back";
   EXPECT_EQ(load(), 0) << "and can load again";
}

TEST_F(LoaderTest, LeakAtUnloadNamesTheAllocatingFunction)
{
   ASSERT_EQ(load({{"TINY_MODE", 3}}), 0);
   EXPECT_EQ(host.unload(), ORR_OK);
   EXPECT_THAT(takeViolations(),
               ElementsAre(HasSubstr("orr_HeapDestroy: heap 'tiny': 1 live block (24 bytes) allocated at "
                                     "TinyInit+0x")));
}

TEST_F(LoaderTest, UnloadIsRefusedWhileTheModuleHasUsers)
{
   ASSERT_EQ(load(), 0);
   ASSERT_EQ(exported<orr_Status()>("TinyTakeUse")(), ORR_OK);
   EXPECT_EQ(host.useCount(), 1u);
   EXPECT_EQ(host.unload(), ORR_BUSY);
   EXPECT_TRUE(host.loaded());
   exported<void()>("TinyDropUse")();
   exported<void()>("TinyDropUse")();
   EXPECT_EQ(takeViolations().size(), 1u) << "dropping a use not taken";
   EXPECT_EQ(host.unload(), ORR_OK);
}

TEST_F(LoaderTest, AModuleBeingUnloadedTakesNoNewUsers)
{
   ASSERT_EQ(load({{"TINY_MODE", 4}}), 0);
   EXPECT_EQ(host.unload(), ORR_FAILURE) << "cleanup returns the refused status";
   EXPECT_FALSE(host.loaded());
}

// A failed init that undoes its own work leaves no violation behind.
TEST_F(LoaderTest, ModuleCallsFailAsToldAndTheModuleUnwinds)
{
   for (const char *op : {"orr_ModuleRegister", "orr_ModuleGetName", "orr_HeapCreate", "orr_ModuleSetHeapID",
                          "orr_HeapAllocWithRA"}) {
      SCOPED_TRACE(op);
      host.faults().failOnce(op, ORR_NO_MEMORY);
      EXPECT_EQ(load(), 1);
      EXPECT_FALSE(host.loaded());
      EXPECT_TRUE(takeViolations().empty());
   }
   EXPECT_EQ(load(), 0);
}

using ModuleRegistrationTest = HostUnitTest;

TEST_F(ModuleRegistrationTest, RegisteringOutsideInitModuleIsRefused)
{
   orr_ModuleID id = ORR_INVALID_MODULE_ID;
   EXPECT_EQ(orr_ModuleRegister(&id, ORR_MODULE_INTERFACE_REVISION), ORR_FAILURE);
   EXPECT_EQ(id, ORR_INVALID_MODULE_ID);
   EXPECT_EQ(takeViolations().size(), 1u);
}

}  // namespace
}  // namespace swsec::testing
