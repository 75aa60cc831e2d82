// What a running swsec inline reads from others. First byte even: a control
// request line, answered as the server answers it by a daemon whose two
// ports were never started; the reply must be one JSON line. Odd: a state
// file, unwrapped, decoded and aged as a restart does; what decodes must
// age and decode again, with no binding more.
#include "fuzz_input.h"

#include "live/inline.h"
#include "session/ipv6_saved_state.h"
#include "session/saved_state_format.h"
#include "session/state_file.h"

#include <cstdlib>

using namespace swsec;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
   static live::EventHub *events = new live::EventHub();
   static live::InlineDaemon *daemon = [] {
      live::InlineOptions options;
      options.bridge = "br0";
      for (const char *name : {"vm1", "vm2"}) {
         live::PortSpec port;
         port.name = name;
         port.vmIface = std::string("vnet-") + name;
         options.ports.push_back(port);
      }
      return new live::InlineDaemon(options, *events);
   }();
   fuzz::FuzzInput in(data, size);
   const bool request = (in.byte() & 1) == 0;
   const std::vector<uint8_t> rest = in.rest();
   if (request) {
      const std::string reply = live::answerRequest(std::string(rest.begin(), rest.end()), *events, *daemon).reply;
      if (reply.find('\n') != reply.size() - 1 || !nlohmann::json::accept(reply)) {
         std::abort();
      }
      return 0;
   }
   session::StoredState stored;
   size_t before = 0;
   bool ipv6 = false;
   // Either agent's state, as the daemon restores NAME.state and NAME.state6.
   const auto bindings = [&ipv6](std::span<const uint8_t> blob) {
      return ipv6 ? session::decodeIpv6SavedState(blob).bindings.size() : session::decodeSavedState(blob).bindings.size();
   };
   try {
      stored = session::unwrapState(rest, "fuzz");
      ipv6 = session::isIpv6SavedState(stored.blob);
      before = bindings(stored.blob);
   } catch (const std::runtime_error &) {
      return 0;
   }
   const int64_t elapsed = stored.savedAtUs ? (*stored.savedAtUs & 0xffffff) : 0;
   if (bindings(ipv6 ? session::ageIpv6SavedState(stored.blob, elapsed) : session::ageSavedState(stored.blob, elapsed)) >
       before) {
      std::abort();
   }
   return 0;
}
