/* The module's entry and exit, called by the host loader. */
#include "module/module_entry.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_agent.h"
#include "mgmt/swsec_test_hooks.h"
#include "swsec/swsec_port_filter_map.h"

ORR_MODULE_EXPORT int init_module(void)
{
   orr_Status status = SifraGenericInit(SIFRAGENERIC_FRAMEWORK_NAME, SIFRAGENERIC_CLIENT_PORT_NAME);
   if (status != ORR_OK) {
      return 1;
   }

   /* Agent creation writes into the text it is given: a buffer of our own. */
   char builtinAgent[] = SIFRAGENERIC_BUILTIN_AGENT_NAME;
   status = SifraGenericInitFastPathAgent(builtinAgent);
   if (status != ORR_OK) {
      goto out_cleanup_framework;
   }

   /*
    * The map's clean-up frees whichever of its parts exist, so it also
    * undoes a map start that stopped half way (a lock without a hash).
    */
   status = SwSecInitPortFilterMap();
   if (status != ORR_OK) {
      goto out_cleanup_port_filter_map;
   }

   status = SwSecTestsInit();
   if (status != ORR_OK) {
      goto out_cleanup_port_filter_map;
   }
   return 0;

out_cleanup_port_filter_map:
   SwSecCleanupPortFilterMap();
out_cleanup_framework:
   (void)SifraGenericCleanup();
   return 1;
}

ORR_MODULE_EXPORT orr_Status cleanup_module(void)
{
   /*
    * Filters the hypervisor has not destroyed yet go first, with their
    * agents: their teardown uses the port filter map and posts to the test
    * hooks' listener.
    */
   SifraGenericCleanupAgents();
   (void)SwSecTestsCleanup();
   SwSecCleanupPortFilterMap();
   return SifraGenericCleanup();
}

extern "C" __attribute__((visibility("hidden"), alias("init_module"))) int
sifraGenericInitModule(void);
extern "C" __attribute__((visibility("hidden"), alias("cleanup_module"))) orr_Status
sifraGenericCleanupModule(void);
