// A port's saved state taken from and given to a port of the loaded
// module, as the hypervisor does in a migration: any port, any front end.
#pragma once

#include "host/host.h"

#include <cstdint>
#include <span>
#include <stdexcept>
#include <vector>

namespace swsec::session {

// The module refused a saved state or could not save one: `what()` is the
// module's own message, on one line.
class StateRefused : public std::runtime_error {
public:
   using std::runtime_error::runtime_error;
};

// Prefetch, length and save into a buffer of the announced length: the
// blob exactly as the module produced it. Throws StateRefused.
std::vector<uint8_t> savePortState(host::Host &host, host::FilterId port);

// Restores a blob into a port (a fresh one, as after a migration); the
// bindings it brings are announced like learned ones. Throws StateRefused.
void restorePortState(host::Host &host, host::FilterId port, std::span<const uint8_t> blob);

}  // namespace swsec::session
