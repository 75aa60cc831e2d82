// What the kernel fast path mirrors of a port, read from the module through
// the host facade as the daemon reads it: the configuration (security
// property), the error-rate-limit state ("featureSummary") and the port
// database ("vmi" nodes), then kept by the port database notifications.
#pragma once

#include "fastpath.h"
#include "host/host.h"

#include <optional>

namespace swsec::fastpath {

// The port of `filter` (switch port `portId`) as the module has it now.
// Throws std::runtime_error when a node or the property cannot be read.
PortDescription readPort(host::Host &host, host::FilterId filter, uint32_t portId);

// Whether the port is in the error-rate-limit state now.
bool readErrorState(host::Host &host, uint32_t portId);

// A port database notification as a binding change; none for any other
// message or one whose payload is not a whole entry.
std::optional<BindingChange> bindingChange(const host::PostedMessage &message);

}  // namespace swsec::fastpath
