// What a loaded module publishes and registers, and how it goes away.
#include "module_checks.h"
#include "support/host_fixture.h"

#include <cstring>
#include <string>
#include <vector>

namespace swsec::testing {
namespace {

using Strings = std::vector<std::string>;
const std::string kAgent = "sifra-generic-tarlin-swsec";

using ModuleInfoTest = HostTest;

TEST_F(ModuleInfoTest, publishes_namespaces_version_parameters_and_exports)
{
   ASSERT_EQ(host().load(), 0);
   const auto &module = host().module();

   EXPECT_EQ(module.requiredNamespaces, (Strings{"com.tarlin.orrapi#v2_2_0_0",
                                                 "com.tarlin.orrapi.incompat#v2_2_0_0", "orrin#nover"}));
   EXPECT_EQ(module.providedNamespace, "switchSecurity#1.0");
   EXPECT_EQ(module.version.rfind("Verison 0.1.0-0 (Built on: ", 0), 0u) << module.version;
   EXPECT_EQ(module.version.back(), ')');

   Strings parameters, exports;
   for (const auto &p : module.parameters) {
      parameters.push_back(p.name + " " + std::to_string(p.value) + " " + p.description);
   }
   EXPECT_EQ(parameters, (Strings{"SIFRAGENERIC_HEAP_MIN_SIZE 4096 Minimum heap size (default: 4096 bytes)",
                                  "SIFRAGENERIC_HEAP_MAX_SIZE 1073741824 Maximum heap size (default: 1GB)",
                                  "SIFRAGENERIC_SLOWPATH_TIMEOUT 2000 Slow path communication timeout (default: 2000ms)"}));
   for (const auto &exported : module.exports) {
      exports.push_back(exported.nameSpace + " " + exported.name);
   }
   EXPECT_EQ(exports, (Strings{"switchSecurity#1.0 SwSec_PortDBReleaseBuf",
                               "switchSecurity#1.0 SwSec_PortDBGetEntries",
                               "switchSecurity#1.0 SwSec_PortDBGetNumEntries",
                               "switchSecurity#1.0 Fhs_BindingsReleaseBuf",
                               "switchSecurity#1.0 Fhs_BindingsGetEntries",
                               "switchSecurity#1.0 Fhs_BindingsGetNumEntries"}));
}

TEST_F(ModuleInfoTest, heap_takes_its_name_and_sizes_from_the_module)
{
   host::LoadOptions options;
   options.moduleName = "swsec-b";
   options.parameters = {{"SIFRAGENERIC_HEAP_MIN_SIZE", 8192}, {"SIFRAGENERIC_HEAP_MAX_SIZE", 1 << 20}};
   ASSERT_EQ(host().load(options), 0);
   const auto props = host().heap().moduleHeapProps();
   ASSERT_TRUE(props.has_value());
   EXPECT_STREQ(props->name.name, "swsec-b");
   EXPECT_EQ(props->initialSize, 8192u);
   EXPECT_EQ(props->maximumSize, 1u << 20);
}

using ModuleLoadTest = ModuleTest;

TEST_F(ModuleLoadTest, registers_the_builtin_agent_its_property_and_the_client_port)
{
   const auto fastPaths = host().sifra().fastPaths();
   ASSERT_EQ(fastPaths.size(), 1u);
   EXPECT_EQ(fastPaths[0].name, kAgent);
   ASSERT_NE(fastPaths[0].agent, nullptr);
   EXPECT_EQ(std::memcmp(fastPaths[0].agent, "sifgfast", 8), 0) << "the handle is the magic's address";

   EXPECT_EQ(host().sifra().properties(), (Strings{kAgent + ".security"}));
   EXPECT_EQ(host().plex().clientPorts(), (Strings{"com.tarlin.common.switch-security"}));
   EXPECT_EQ(host().locks().domains(), (Strings{"switch-security"}));
   EXPECT_TRUE(loggedWithPrefix(host(), "Registered sifra generic create agent property handler",
                                ORR_LOG_INFO));
   EXPECT_TRUE(loggedWithPrefix(host(), kAgent + ": Registered security rules property handler",
                                ORR_LOG_INFO, "SifraGenericFWInitProperty"));
}

TEST_F(ModuleLoadTest, creates_its_locks_in_rank_order)
{
   Strings locks;
   for (const auto &lock : host().locks().live()) {
      locks.push_back(lock.name + " " + std::to_string(lock.type) + " " + std::to_string(lock.rank));
   }
   EXPECT_EQ(locks, (Strings{"sifg.fastpath 1 2", "sifg.sec.portFilterMapDb 1 5",
                             "sifg.sec.testConfig 3 7"}));
}

TEST_F(ModuleLoadTest, unload_withdraws_everything)
{
   EXPECT_EQ(host().unload(), ORR_OK);
   EXPECT_TRUE(loggedWithPrefix(host(), kAgent + ": Unregistering security property handler",
                                ORR_LOG_INFO, "SifraGenericFWCleanupProperty"));
   EXPECT_EQ(host().faults().calls("orr_ModuleUnregister"), 1u);
   EXPECT_EQ(host().faults().calls("orr_PlexClientPortUnregister"), 1u);
   expectNothingLeft(host());
}

}  // namespace
}  // namespace swsec::testing
