// The readers of a saved-state blob: the module's restore (header checks,
// then the agent's part) into a fresh port, and the tool's decoder of the
// same bytes. The input is the blob whole. A blob the module takes must
// decode too, or be refused for content the module takes and drops: the
// decoder is never stricter than the module about shape.
#include "loaded_module.h"
#include "session/ipv6_saved_state.h"
#include "session/saved_state_format.h"

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <span>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
   swsec::fuzz::LoadedModule &module = swsec::fuzz::loadedModule();
   const std::span<const uint8_t> blob(data, size);

   // A part with the IPv6 agent's magic goes to a port of that agent, as
   // its state file's does.
   const bool ipv6 = swsec::session::isIpv6SavedState(blob);
   bool shapeTaken = true;
   try {
      if (ipv6) {
         (void)swsec::session::decodeIpv6SavedState(blob);
      } else {
         (void)swsec::session::decodeSavedState(blob);
      }
   } catch (const swsec::session::BadSavedState &refusal) {
      shapeTaken = !refusal.shape;
   }

   // A destination as a migration makes it; policy 1 restores the agent's
   // part even when the blob carries a slow path part.
   swsec::host::FilterConfig config;
   config.name = "restored.eth0";
   config.failurePolicy = 1;
   swsec::host::FilterId port = 0;
   if (module.host.sifra().createFilter(ipv6 ? swsec::fuzz::kFhsAgent : swsec::fuzz::kAgent, swsec::fuzz::kRestoredPort, config,
                                        &port) != ORR_OK) {
      std::fprintf(stderr, "restore_state_fuzz: createFilter failed\n");
      std::abort();
   }
   const orr_Status restored = module.host.migration().restore(port, blob);
   if (restored == ORR_OK && size != 0 && !shapeTaken) {
      std::fprintf(stderr, "restore_state_fuzz: the module restored a blob the decoder refused\n");
      std::abort();
   }
   if (module.host.sifra().destroyFilterAsHypervisor(port).status != ORR_OK) {
      std::fprintf(stderr, "restore_state_fuzz: the restored port would not go\n");
      std::abort();
   }
   module.forgetRecords();
   return 0;
}
