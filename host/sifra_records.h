// The records behind the Sifra registry's handles, shared by the files
// that implement the registry.
#pragma once

#include "host/sifra_registry.h"

#include <array>

struct orr_SifraFastPathOpaque {};
struct orr_SifraPropertyOpaque {};
struct orr_SifraFilterHandleOpaque {};

namespace swsec::host {

struct SifraRegistry::FastPath final : orr_SifraFastPathOpaque {
   uint64_t seq = 0;
   FastPathInfo info;
};

// A filter from the start of the module's createFilter (which may already
// ask for its configuration) until a destroy succeeds. Guarded by the
// registry's mutex.
struct SifraRegistry::Filter final : orr_SifraFilterHandleOpaque {
   FilterId id = 0;
   const FastPath *fastPath = nullptr;
   uint32_t portID = 0;
   FilterConfig config;
   orr_SifraFilter record = nullptr;
   bool created = false;                   // createFilter succeeded
   std::array<uint32_t, 2> minMappedLen{};   // by direction: RX, TX
   uint32_t minMappedDirections = 0;
   std::optional<uint32_t> slowPathID;     // the host's pairing (FilterInfo::slowPathID)
};

}  // namespace swsec::host
