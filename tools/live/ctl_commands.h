// The commands of the control socket, as one table: the daemon names them
// when it refuses one, the client checks its arguments against them, and
// the help lists them.
#pragma once

#include <cstddef>
#include <string>

namespace swsec::live {

struct CtlCommand {
   const char *name;
   const char *arguments;   // as `swsec ctl` takes them
   size_t leastArguments;
   size_t mostArguments;
   const char *what;
   bool clientOnly;         // answered by the client from another request
};

inline constexpr CtlCommand kCtlCommands[] = {
   {"ports", "", 0, 0, "each port: interface, bridge, port ID, guarding or stopped (and why), fail mode, configuration",
    false},
   {"bindings", "[PORT]", 0, 1, "IPv4 and IPv6 bindings: VLAN, MAC, IP, method, remaining lifetime, DHCP server and lease",
    false},
   {"summary", "PORT", 1, 1, "the port's feature summary and IPv6 summary", false},
   {"counters", "", 0, 0, "frames passed and dropped in each direction, the module's drop counters, bindings by method",
    false},
   {"metrics", "", 0, 0, "the counters in the Prometheus text format", true},
   {"clear", "PORT [VLAN MAC IP]", 1, 4, "clear every binding of the port, or one", false},
   {"config", "PORT FILE", 2, 2, "write the port's configuration from FILE", false},
   {"add-port", "NAME=IFACE [--config FILE]", 1, 1, "guard one more interface of the bridge as port NAME", false},
   {"remove-port", "NAME", 1, 1, "stop guarding port NAME, its VM left as the fail mode says", false},
   {"watch", "", 0, 0, "binding added/removed notifications as they happen", false},
   {"log", "[-f]", 0, 0, "the 200 most recent log lines; with -f, then the new ones as they come", false},
};

// The command named `name`, or null.
inline const CtlCommand *findCtlCommand(const std::string &name)
{
   for (const CtlCommand &command : kCtlCommands) {
      if (name == command.name) {
         return &command;
      }
   }
   return nullptr;
}

// "ports, bindings, ...": the commands the daemon receives (`withClient`:
// and those the client answers itself).
inline std::string ctlCommandNames(bool withClient)
{
   std::string names;
   for (const CtlCommand &command : kCtlCommands) {
      if (withClient || !command.clientOnly) {
         names += (names.empty() ? "" : ", ") + std::string(command.name);
      }
   }
   return names;
}

}  // namespace swsec::live
