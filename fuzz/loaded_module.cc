#include "loaded_module.h"

#include "tests/support/security_config.h"

#include <cstdio>
#include <cstdlib>

namespace swsec::fuzz {
namespace {

constexpr uint32_t kEnforcingPort = 7;
constexpr uint32_t kLearningPort = 8;

[[noreturn]] void fail(const char *what)
{
   std::fprintf(stderr, "fuzz set-up: %s\n", what);
   std::abort();
}

host::FilterId createPort(host::Host &host, uint32_t portId, const testing::PortConfig &config)
{
   host::FilterConfig filterConfig;
   filterConfig.name = "vm-" + std::to_string(portId) + ".eth0";
   host::FilterId id = 0;
   if (host.sifra().createFilter(kAgent, portId, filterConfig, &id) != ORR_OK) {
      fail("createFilter");
   }
   if (host.sifra().writeProperty(kSecurityProperty, id, testing::configRecord(config)) != ORR_OK) {
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
   // The VM of the test captures, bound statically so that source checks pass for it.
   const testing::StaticBinding vm{.vlan = 0, .mac = {0x02, 0x00, 0x5e, 0xc0, 0x00, 0x01}, .ip = {192, 0, 2, 101}};
   module->enforcing = createPort(module->host, kEnforcingPort, testing::enforcingConfig({vm}));
   module->learning = createPort(module->host, kLearningPort, testing::learningConfig());
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
