// The module loaded in a host for the process, with one port configured to
// enforce and one learning, as the frame and control-input targets use it.
// Each port has the IPv6 agent behind the switch-security agent: every
// feature on the enforcing port (ND limits as ARP's), trusted on the other.
#pragma once

#include "host/host.h"

#include <cstdint>
#include <string_view>

namespace swsec::fuzz {

inline constexpr std::string_view kAgent = "sifra-generic-tarlin-swsec";
inline constexpr std::string_view kSecurityProperty = "sifra-generic-tarlin-swsec.security";
inline constexpr std::string_view kAgentProperty = "com.tarlin.common.switch-security";
inline constexpr std::string_view kFhsAgent = "sifra-generic-tarlin-fhs";
inline constexpr uint32_t kEnforcingPort = 7;
inline constexpr uint32_t kLearningPort = 8;
inline constexpr uint32_t kRestoredPort = 9;   // no filter: a target makes its own there

struct LoadedModule {
   host::Host host;
   host::FilterId enforcing = 0;
   host::FilterId learning = 0;

   // Per input: forgets what the host recorded, so that memory stays flat
   // over millions of inputs.
   void forgetRecords();
};

// Made before the first input (LLVMFuzzerInitialize is defined with it) and
// kept until exit: unloading would only repeat what the test suite checks,
// and a fresh load per input is too slow to fuzz.
LoadedModule &loadedModule();

}  // namespace swsec::fuzz
