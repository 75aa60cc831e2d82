// A port's state as an administrator reads it: the "featureSummary" and
// "vmi" management nodes of /security/<port>.
#pragma once

#include "replay/drop_reason.h"
#include "replay/engine.h"

#include "host/host.h"

#include <chrono>
#include <optional>

namespace swsec::replay {

// The drop counters the summary shows (none without IP discovery).
DropCounters readDropCounters(host::Host &host, uint32_t portId);

// The summary, its counters and the port database into `port`.
void readPortState(host::Host &host, uint32_t portId, PortResult &port);

// The time left to the binding that expires first (none: no binding
// expires); 0 when a node cannot be read.
std::optional<std::chrono::seconds> soonestExpiry(host::Host &host, uint32_t portId);

}  // namespace swsec::replay
