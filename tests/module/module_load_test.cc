// What a loaded module publishes and registers, and how it goes away; a
// failure in each step of its start fails the load with the step's message
// and leaves nothing of the module in the host.
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

TEST_F(ModuleLoadTest, unload_withdraws_everything)
{
   EXPECT_EQ(host().unload(), ORR_OK);
   EXPECT_TRUE(loggedWithPrefix(host(), kAgent + ": Unregistering security property handler",
                                ORR_LOG_INFO, "SifraGenericFWCleanupProperty"));
   EXPECT_EQ(host().faults().calls("orr_ModuleUnregister"), 1u);
   EXPECT_EQ(host().faults().calls("orr_PlexClientPortUnregister"), 1u);
   expectNothingLeft(host());
}

// ---------------------------------------------------------------- start-up failures

constexpr orr_Status kInjected = ORR_LIMIT_EXCEEDED;

enum Made : unsigned { Module = 1, PortClient = 2, Agent = 4 };

struct StartupFault {
   const char *name;
   const char *op;
   uint64_t nth;
   std::string message;   // "{status}" stands for "(%#x): %s"
   bool withLog;          // the log existed when the step failed
   unsigned made;         // what the teardown had to withdraw
};

std::vector<StartupFault> startupFaults()
{
   const unsigned all = Module | PortClient;
   return {
      {"module_registration", "orr_ModuleRegister", 1, "Registration failed {status}", false, 0},
      {"module_name", "orr_ModuleGetName", 1, "Failed to create heap {status}", false, Module},
      {"heap", "orr_HeapCreate", 1, "Failed to create heap {status}", false, Module},
      {"default_heap", "orr_ModuleSetHeapID", 1, "Failed to set module heap {status}", false, Module},
      {"log", "orr_LogRegister", 1, "Failed to allocate log handle {status}", false, Module},
      {"timer_queue", "orr_TimerQueueCreate", 1, "Failed to create timer queue: Limit exceeded", true,
       Module},
      {"lock_domain", "orr_LockDomainCreate", 1, "Failed to create lock domain {status}", true, Module},
      {"client_port", "orr_PlexClientPortRegister", 1,
       "Failed to register sifra generic create agent prop handler {status}", true, Module},
      {"agent_record", "orr_HeapAllocWithRA", 1, "Failed to allocate memory for fast path agent", true,
       all},
      {"agent_lock", "orr_SpinlockCreate", 1, kAgent + ": Failed to create lock {status}", true, all},
      {"agent_registration", "orr_SifraRegisterFastPath", 1,
       kAgent + ": Failed to register agent {status}", true, all},
      {"port_filter_map_lock", "orr_SpinlockCreate", 2, "Could not allocate portFilterMapDb lock", true,
       all | Agent},
      {"port_filter_map_hash", "Hash_Alloc", 1, "Could not allocate portFilterMapDb hash", true,
       all | Agent},
      {"test_hook_lock", "orr_SpinlockCreate", 3, "Could not allocate test configuration lock", true,
       all | Agent},
   };
}

class StartupFaultTest : public HostTest, public ::testing::WithParamInterface<StartupFault> {};

TEST_P(StartupFaultTest, load_fails_with_the_steps_message_and_leaves_nothing_behind)
{
   const StartupFault &fault = GetParam();
   host().faults().failOnce(fault.op, kInjected, fault.nth);

   EXPECT_EQ(host().load(), 1);

   std::string message = fault.message;
   if (auto at = message.find("{status}"); at != std::string::npos) {
      message.replace(at, 8, statusText(kInjected));
   }
   EXPECT_TRUE(fault.withLog ? loggedWithPrefix(host(), message, ORR_LOG_ERROR)
                             : loggedWithoutLog(host(), message));
   expectNothingLeft(host());

   // The teardown withdraws what the start made and skips what it did not.
   EXPECT_EQ(host().faults().calls("orr_ModuleUnregister"), (fault.made & Module) ? 1u : 0u);
   EXPECT_EQ(host().faults().calls("orr_PlexClientPortUnregister"),
             (fault.made & PortClient) ? 1u : 0u);
   // Agents are released while the log still exists.
   const bool agentReleased = loggedWithPrefix(
      host(), kAgent + ": Unregistering security property handler", ORR_LOG_INFO);
   EXPECT_EQ(agentReleased, (fault.made & Agent) != 0);
}

INSTANTIATE_TEST_SUITE_P(EachStep, StartupFaultTest, ::testing::ValuesIn(startupFaults()),
                         [](const auto &test) { return std::string(test.param.name); });

// Fails the 1st, 2nd, ... call of one host operation during the load until
// the load no longer reaches it. Every failure logs an error and leaves
// nothing behind; only a failed property keeps the load going.
class StartupSweepTest : public HostTest, public ::testing::WithParamInterface<const char *> {};

TEST_P(StartupSweepTest, every_failing_call_is_undone)
{
   const std::string op = GetParam();
   const bool tolerated = op == "orr_SifraPropertyRegister" || op == "orr_StringFormat";

   for (uint64_t nth = 1;; nth++) {
      ASSERT_LE(nth, 64u) << op << " still fails the load";
      SCOPED_TRACE("call " + std::to_string(nth) + " of " + op);
      host().log().clear();
      const uint64_t before = host().faults().calls(op);
      host().faults().failOnce(op, kInjected, nth);

      const int result = host().load();
      const bool fired = host().faults().calls(op) - before >= nth;
      host().faults().clear();
      EXPECT_EQ(result, fired && !tolerated ? 1 : 0);
      if (fired) {
         bool error = false;
         for (const auto &record : host().log().records()) {
            error = error || record.severity == ORR_LOG_ERROR;
         }
         EXPECT_TRUE(error) << "a failed step logs";
      }
      if (result == 0) {
         EXPECT_EQ(host().unload(), ORR_OK);
      }
      expectNothingLeft(host());
      if (!fired) {
         break;
      }
   }
}

INSTANTIATE_TEST_SUITE_P(EachOperation, StartupSweepTest,
                         ::testing::Values("orr_ModuleRegister", "orr_ModuleGetName", "orr_HeapCreate",
                                           "orr_ModuleSetHeapID", "orr_LogRegister",
                                           "orr_TimerQueueCreate", "orr_LockDomainCreate",
                                           "orr_PlexClientPortRegister", "orr_HeapAllocWithRA",
                                           "orr_SpinlockCreate", "orr_SifraRegisterFastPath",
                                           "orr_SifraPropertyRegister", "orr_StringFormat",
                                           "Hash_Alloc"));

}  // namespace
}  // namespace swsec::testing
