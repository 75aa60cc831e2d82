// What the kernel fast path mirrors of a port, read from the module through
// the host facade as the daemon reads it: the configuration (security
// property), the error-rate-limit state ("featureSummary") and the port
// database ("vmi" nodes); of the IPv6 agent, where the port has it, its
// configuration (its security property), ND error state ("summary") and
// bindings (its exported query). Then kept by both agents' notifications.
#pragma once

#include "fastpath.h"
#include "host/host.h"

#include <optional>
#include <span>

namespace swsec::fastpath {

// The port of `filter` (switch port `portId`) as the module has it now.
// Throws std::runtime_error when a node or the property cannot be read.
PortDescription readPort(host::Host &host, host::FilterId filter, uint32_t portId);

// Whether the port, whose features are `features`, is in the
// error-rate-limit state now (only DAI enters it; a port without IP
// discovery has no summary to read).
bool readErrorState(host::Host &host, uint32_t portId, uint32_t features);

// Whether the port's IPv6 agent, whose features are `ipv6Features` and ND
// rate limit `ndRateLimit`, is in its ND error state now.
bool readNdErrorState(host::Host &host, uint32_t portId, uint32_t ipv6Features, uint32_t ndRateLimit);

// The port's IPv6 agent's filter, where it has one.
std::optional<host::FilterId> ipv6FilterOf(host::Host &host, uint32_t portId);

// A port database notification, or the IPv6 agent's binding one, as a binding change; none for any other
// message or one whose payload is not a whole entry.
std::optional<BindingChange> bindingChange(const host::PostedMessage &message);

// Keeps a program's maps the mirror of one port: started from the port as
// it is (at start and after a new configuration), then kept by the port's
// notifications and its error state after each list of frames the module
// judged and each timer tick.
class Mirror {
public:
   Mirror(Program &program, host::Host &host, host::FilterId filter, uint32_t portId);
   void start();
   // Applies the binding changes of this port among `messages`, in order,
   // then the port's error state.
   void follow(std::span<const host::PostedMessage> messages);

private:
   Program &program_;
   host::Host &host_;
   host::FilterId filter_;
   uint32_t portId_;
   uint32_t features_ = 0;
   uint32_t ipv6Features_ = 0;
   uint32_t ndRateLimit_ = 0;
};

}  // namespace swsec::fastpath
