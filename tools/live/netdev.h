// The network set-up of guarded ports, changed through iproute2's `ip`, the
// administrator's own tool: every change is one command that the log shows
// and a person can repeat or undo by hand, in whatever network namespace
// swsec runs.
#pragma once

#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

namespace swsec::live {

class NetdevError : public std::runtime_error {
public:
   using std::runtime_error::runtime_error;
};

struct LinkInfo {
   int ifindex = 0;
   std::string name;
   std::string master;   // the bridge it is a port of, "" none
   std::string kind;     // "bridge", "veth", ... ("" a plain device)
   unsigned mtu = 0;
   bool up = false;
   std::string mac;      // "aa:bb:cc:dd:ee:ff", "" none
};

// Runs `ip ARGS...` (no shell); throws NetdevError with ip's message when it fails.
void runIp(const std::vector<std::string> &args);
// The interface, or none when it does not exist.
std::optional<LinkInfo> findLink(const std::string &name);
// The ports of `bridge` (none when it has none or does not exist).
std::vector<LinkInfo> bridgePorts(const std::string &bridge);

// The interface's IPv6 switch (/proc/sys/net/ipv6/conf/NAME/disable_ipv6),
// none when the kernel has no IPv6 for it.
std::optional<bool> ipv6Disabled(const std::string &name);
void setIpv6Disabled(const std::string &name, bool disabled);

}  // namespace swsec::live
