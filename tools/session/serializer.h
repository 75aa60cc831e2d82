// One shape for each thing every output shows, whichever front end shows
// it: bindings, notifications, drop counters and the feature summary as
// JSON (numbers as numbers, null where a field does not apply, one set of
// names), MAC and IPv4 addresses as text, and tables for people.
#pragma once

#include "session/ports_session.h"

#include <nlohmann/json.hpp>

#include <cstdint>
#include <string>
#include <vector>

namespace swsec::session {

// "02:00:5e:c0:00:01"; "192.0.2.1" (network order).
std::string macText(const uint8_t *mac);
std::string ipText(const uint8_t *ip);
// "2001:db8::a" (RFC 5952) from 16 bytes, or from any text form of an
// IPv6 address; text that is none is returned as it is.
std::string ipv6Text(const uint8_t *addr);
std::string ipv6Text(const std::string &text);

// A value as a node renders it: a leading count (with its unit dropped, as
// in "118 sec") is a number, "N/A" is null, anything else stays text.
nlohmann::json nodeValue(const std::string &text);

// {"vlan", "mac", "ip", "method", "timeRemaining" (seconds), "chaddr",
//  "clientIdLen", "serverIp", "leaseTime" (seconds)}.
nlohmann::json bindingJson(const PortDbEntry &entry);
// {"name": "portdb.entry.added" or "portdb.entry.removed", "vlan", "mac",
//  "ip", "authoritative"}.
nlohmann::json notificationJson(const PortDbNotification &note);
// A port database entry's shape with an IPv6 "ip": "timeRemaining" in
// seconds (null for a static binding, which never expires), the DHCP
// fields null.
nlohmann::json ipv6BindingJson(const Ipv6Binding &binding);
// The IPv6 agent's part of a port: {"summary": every field of its
// "summary" node, "counters": drop counters by reason and bindings
// evicted, "bindings": [...]}, or null for a port without the agent.
nlohmann::json ipv6Json(const PortState &state);
// Every field of the "featureSummary" node, or null without one.
nlohmann::json featureSummaryJson(const PortState &state);
nlohmann::json countersJson(const DropCounters &counters);

// The IPv6 agent's part of a port for people: its summary node as the
// module renders it, then its bindings as a table.
std::string ipv6Text(const Ipv6PortState &state);

// Columns as wide as their widest cell, two spaces apart, each line
// starting with `indent`.
std::string textTable(const std::vector<std::vector<std::string>> &rows, const std::string &indent = "");

}  // namespace swsec::session
