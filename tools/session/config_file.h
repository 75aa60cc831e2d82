// A port's security configuration written as JSON, turned into the record
// the security property takes.
#pragma once

#include "contract/config_record_encode.h"
#include "contract/fhs_config_encode.h"

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace swsec::session {

using contract::StaticBinding;

// Defaults are those of a new port: IP discovery alone, trusted, 32 entries.
struct PortSecurityConfig : contract::PortSecurityConfig {
   std::string origin;   // where it was read from, for messages
   // The IPv6 agent's configuration, when the document has any IPv6 key:
   // the port then gets the IPv6 agent too.
   std::optional<contract::Ipv6SecurityConfig> ipv6;
};

// Parses a document; `origin` names it in errors. Throws InputError on bad
// JSON, unknown keys or feature names, wrong types and malformed addresses.
PortSecurityConfig parseConfig(std::string_view text, const std::string &origin);
PortSecurityConfig loadConfigFile(const std::string &path);

// The largest file taken as a configuration (32 static bindings are 3 KiB).
inline constexpr uint64_t kMaxConfigFileBytes = uint64_t{1} << 20;

// A configuration file's text, bounded by kMaxConfigFileBytes before it is
// read; anything but a regular file (a FIFO, a device, a directory) is
// refused without waiting on it. Throws InputError naming `path`.
std::string readConfigText(const std::string &path);

// The packed record: header then one 12-byte entry per static binding.
using contract::configRecord;

// "02:00:5e:c0:00:01" (six two-digit hex groups); throws InputError naming `what`.
std::array<uint8_t, 6> parseMac(std::string_view text, const std::string &what);

}  // namespace swsec::session
