// The saved-state blob of a port's IPv6 agent, decoded for people and
// programs, checked as the module's restore checks it, and aged by the
// time since its save. Every read is bounded by the blob's length.
#pragma once

#include "session/saved_state_format.h"

#include "contract/fhs_saved_state_layout.h"
#include "contract/state_blob.h"

#include <nlohmann/json.hpp>

#include <cstdint>
#include <ostream>
#include <span>
#include <vector>

namespace swsec::session {

struct SavedIpv6State {
   SavedPortState header;             // the blob header's fields alone
   FhsConfig config{};
   std::vector<FhsBindingKey> statics;
   bool ndRateLimitErr = false;
   int64_t ndRateLimitErrRemaining = 0;
   FhsDropCounters counters{};
   std::vector<FhsSavedBinding> bindings;
};

// Whether the blob's agent part is the IPv6 agent's (its magic), whatever
// else it holds; false for anything too short to say, and for a blob
// without an agent part.
bool isIpv6SavedState(std::span<const uint8_t> blob);

// Throws BadSavedState for anything the module's restore refuses: the
// header's checks, a part too short or of another magic, a record or
// bindings running past the part, a configuration a new port refuses, a
// binding neither DHCPv6 nor first come first served or with no time left.
SavedIpv6State decodeIpv6SavedState(std::span<const uint8_t> blob);

// The blob as it stands `elapsedSeconds` after its save: lifetimes and
// the ND error state shortened, the bindings whose time ran out left out.
std::vector<uint8_t> ageIpv6SavedState(std::span<const uint8_t> blob, int64_t elapsedSeconds);

// {"header", "ipv6": {"config", "ndErrorState", "counters", "bindings"}}:
// each binding in the shape of ipv6BindingJson.
nlohmann::json ipv6SavedStateJson(const SavedIpv6State &state);
void printIpv6SavedState(std::ostream &out, const SavedIpv6State &state);

}  // namespace swsec::session
