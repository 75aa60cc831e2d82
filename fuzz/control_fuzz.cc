// The module's other readers of outside bytes, chosen by the first byte:
//   0: the security property of a port (arbitrary bytes as the configuration)
//   1: a filter ioctl (request ID, then an arbitrary payload)
//   2: the agent-creation property (arbitrary bytes as names)
// The second byte picks the port (even: enforcing, odd: learning).
#include "fuzz_input.h"
#include "loaded_module.h"

#include <cstdint>
#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
   swsec::fuzz::LoadedModule &module = swsec::fuzz::loadedModule();
   swsec::fuzz::FuzzInput in(data, size);
   const uint8_t target = in.byte() % 3;
   const swsec::host::FilterId port = (in.byte() & 1u) != 0 ? module.learning : module.enforcing;
   switch (target) {
   case 0:
      (void)module.host.sifra().writeProperty(swsec::fuzz::kSecurityProperty, port, in.rest());
      break;
   case 1: {
      const uint32_t requestId = in.u32();
      (void)module.host.sifra().sendIoctl(port, requestId, in.rest());
      break;
   }
   default: {
      const std::vector<uint8_t> names = in.rest();
      (void)module.host.plex().write(swsec::fuzz::kAgentProperty,
                                     std::string(names.begin(), names.end()));
      break;
   }
   }
   module.forgetRecords();
   return 0;
}
