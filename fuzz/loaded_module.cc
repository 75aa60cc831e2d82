#include "loaded_module.h"

#include "contract/fhs_config_encode.h"
#include "tests/support/security_config.h"

#include <cstdio>
#include <cstdlib>

namespace swsec::fuzz {
namespace {

[[noreturn]] void fail(const char *what)
{
   std::fprintf(stderr, "fuzz set-up: %s\n", what);
   std::abort();
}

host::FilterId createFilter(host::Host &host, std::string_view agent, uint32_t portId, std::string_view property,
                            const std::vector<uint8_t> &record)
{
   host::FilterConfig filterConfig;
   filterConfig.name = "vm-" + std::to_string(portId) + ".eth0";
   host::FilterId id = 0;
   if (host.sifra().createFilter(agent, portId, filterConfig, &id) != ORR_OK) {
      fail("createFilter");
   }
   if (host.sifra().writeProperty(property, id, record) != ORR_OK) {
      fail("security property write");
   }
   return id;
}

LoadedModule *make()
{
   auto *module = new LoadedModule();
   if (module->host.load() != 0) {
      fail("module load");
   }
   module->host.portsets().addPortset("vs0");
   module->host.portsets().addPort("vs0", kEnforcingPort);
   module->host.portsets().addPort("vs0", kLearningPort);
   module->host.portsets().addPort("vs0", kRestoredPort);
   // The VM of the test captures, bound statically so that source checks pass for it.
   const testing::StaticBinding vm{.vlan = 0, .mac = {0x02, 0x00, 0x5e, 0xc0, 0x00, 0x01}, .ip = {192, 0, 2, 101}};
   module->enforcing = createFilter(module->host, kAgent, kEnforcingPort, kSecurityProperty, testing::configRecord(testing::enforcingConfig({vm})));
   module->learning = createFilter(module->host, kAgent, kLearningPort, kSecurityProperty, testing::configRecord(testing::learningConfig()));
   if (module->host.plex().write(kAgentProperty, kFhsAgent) != ORR_OK) {
      fail("IPv6 agent");
   }
   const std::string fhsProperty = std::string(kFhsAgent) + ".security";
   (void)createFilter(module->host, kFhsAgent, kEnforcingPort, fhsProperty,
                      contract::fhsConfigRecord({.features = FhsFeaturesKnown, .trusted = false, .ndRateLimit = 10, .errRateLimit = 5, .errRateLimitPeriod = 10}));
   (void)createFilter(module->host, kFhsAgent, kLearningPort, fhsProperty, contract::fhsConfigRecord({}));
   module->forgetRecords();
   return module;
}

}  // namespace

void LoadedModule::forgetRecords()
{
   host.log().clear();
   host.portsets().clearPosted();
   host.sifra().clearIoctlReplies();
}

LoadedModule &loadedModule()
{
   static LoadedModule *module = make();
   return *module;
}

}  // namespace swsec::fuzz

// Every target that drives the loaded module loads it before its first input.
extern "C" int LLVMFuzzerInitialize(int *, char ***)
{
   (void)swsec::fuzz::loadedModule();
   return 0;
}
