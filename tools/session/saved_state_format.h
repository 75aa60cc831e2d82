// The saved-state blob of a switch-security port, decoded for people and
// programs without loading a port: the 48-byte header, the agent's part
// (configuration, error-rate-limit state, counters, bindings) and the size
// of the slow path's part. Every read is bounded by the blob's length.
#pragma once

#include <nlohmann/json.hpp>

#include <array>
#include <cstdint>
#include <ostream>
#include <span>
#include <stdexcept>
#include <string>
#include <vector>

namespace swsec::session {

// A blob that is not a well-formed saved state: `what()` says what is wrong.
// Most refusals are of shape (lengths, offsets, a configuration a new port
// refuses), where the module's restore refuses too. A few are of content the
// module takes and then drops or cuts short (a binding with an unknown
// discovery method, a remaining time past 32 bits): the tool refuses those
// files rather than restore them wrong, and says so with `shape` false.
class BadSavedState : public std::runtime_error {
public:
   explicit BadSavedState(const std::string &what, bool ofShape = true) : std::runtime_error(what), shape(ofShape) {}
   bool shape;
};

struct SavedBinding {
   uint16_t vlan = 0;
   std::array<uint8_t, 6> mac{};
   std::array<uint8_t, 4> ip{};
   uint8_t method = 0;              // 1 DHCP Snooping, 2 Static, 4 TOFU, 8 ARP Snooping
   int64_t timeRemaining = 0;       // seconds
   // DHCP Snooping only.
   std::array<uint8_t, 6> chaddr{};
   std::vector<uint8_t> clientId;
   std::array<uint8_t, 4> serverIp{};
   uint32_t leaseTime = 0;
};

struct SavedPortState {
   // Header.
   uint64_t version = 0;
   uint64_t agentOffset = 0;
   uint64_t agentLen = 0;
   uint64_t slowPathOffset = 0;
   uint64_t slowPathLen = 0;
   // Configuration.
   uint8_t configVersion = 0;
   uint32_t featuresEnabled = 0;
   uint8_t trusted = 0;
   uint32_t portDbSize = 0;
   uint32_t numStatic = 0;
   uint32_t arpRateLimit = 0;
   uint32_t errRateLimit = 0;
   uint32_t errRateLimitPeriod = 0;
   // Error-rate-limit state.
   bool txRateLimitErr = false;
   int64_t txRateLimitErrRemaining = 0;
   // Counters, in the blob's order.
   std::array<uint64_t, 6> counters{};
   std::vector<SavedBinding> bindings;
   // The frame guard after the bindings; a part saved without it restores
   // these defaults (tagged frames dropped, any ethertype).
   bool allowTagged = false;
   std::vector<uint16_t> etherTypes;   // empty: any
   uint64_t taggedDropCnt = 0;
   uint64_t etherTypeDropCnt = 0;
};

// The counters' names, in the blob's order.
inline constexpr std::array<const char *, 6> kSavedCounterNames = {
   "dhcpSnoopingDropCnt", "daiDropCnt", "txRateLimitDropCnt", "txRateLimitErrEntryCnt", "rxRateLimitDropCnt",
   "ipSrcGuardDropCnt"};

// Throws BadSavedState for anything the module's restore would refuse or
// mishandle on the blob's own evidence (short, foreign, another version,
// parts outside the blob or overlapping, counts running past the agent's
// part, a configuration a new port would refuse, an unknown discovery
// method, a remaining time outside 32 bits, a frame guard missing from a
// version-2 configuration or listing more ethertypes than it holds).
SavedPortState decodeSavedState(std::span<const uint8_t> blob);
// The blob's header alone, checked as decodeSavedState checks it (any agent).
SavedPortState decodeSavedStateHeader(std::span<const uint8_t> blob);

// The blob as it stands `elapsedSeconds` after its save: every lifetime
// and the error-rate-limit state shortened by that much, the bindings
// whose time ran out left out (static ones stay). Throws BadSavedState as
// decodeSavedState does.
std::vector<uint8_t> ageSavedState(std::span<const uint8_t> blob, int64_t elapsedSeconds);

// "DHCP Snooping", "Static", "TOFU", "ARP Snooping", or "unknown (N)".
std::string methodName(uint8_t method);
// Feature names as the configuration files spell them, comma-separated.
std::string featureNames(uint32_t features);

nlohmann::json savedStateJson(const SavedPortState &state);
void printSavedState(std::ostream &out, const SavedPortState &state);

}  // namespace swsec::session
