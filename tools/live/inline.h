// swsec inline: the daemon that guards live bridge ports with the module.
#pragma once

#include "live/ctl_server.h"
#include "live/events.h"
#include "live/port.h"
#include "session/config_file.h"
#include "session/ports_session.h"

#include <chrono>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

namespace swsec::live {

struct PortSpec {
   std::string name;
   std::string vmIface;
   std::string configPath;   // "" the new port's defaults
};

struct InlineOptions {
   std::string bridge;
   std::vector<PortSpec> ports;
   FailMode failMode = FailMode::closed;
   std::string ctlPath;
   std::string modulePath;
   const orr_ModuleInfo *linkedModule = nullptr;   // the program's own, unless modulePath names an image
   size_t batch = 64;
   std::string stateDir;   // "" keeps no state; else DIR/<port name>.state across restarts
};

// A port's "bindings" reply: its port database entries, each with "port".
nlohmann::json bindingsReply(const std::string &port, const session::PortState &state);

// The ports and the control handler over them; the daemon's main loop
// owns one.
class InlineDaemon final : public CtlHandler {
public:
   InlineDaemon(InlineOptions options, EventHub &events);
   ~InlineDaemon() override;

   // Starts every port; a failure stops those started, putting the network
   // back as found, and rethrows.
   void start();
   // Moves the module's log and notifications to the event rings and takes
   // down ports that stopped by themselves.
   void pump();
   // SIGHUP: every port re-reads its configuration file.
   void reload();
   // Stops every port as the fail mode says and unloads; returns the
   // host's findings.
   std::vector<std::string> stop();
   // A port's state could not be saved at stop: its bindings are lost.
   bool stateLost() const { return stateLost_; }

   nlohmann::json handle(const nlohmann::json &request) override;

private:
   struct Port {
      PortSpec portSpec;
      std::unique_ptr<GuardedPort> guarded;
      std::string configSource;   // where its configuration came from last
      bool stateDirty = false;    // bindings changed since the last save
      bool saveFailing = false;   // the last save failed (said once)
      std::chrono::steady_clock::time_point lastSave{};
   };

   Port &port(const nlohmann::json &request);
   Port &runningPort(const nlohmann::json &request);
   nlohmann::json portsJson();
   nlohmann::json bindingsJson(const Port &port);
   nlohmann::json countersJson(Port &port);
   std::vector<uint8_t> recordFor(const PortSpec &portSpec);
   std::string statePath(const PortSpec &portSpec) const;
   void restoreState(const PortSpec &portSpec, host::FilterId filter);
   bool saveState(Port &port, host::FilterId filter);

   InlineOptions options_;
   EventHub &events_;
   session::ModuleSession session_;
   std::recursive_mutex mutex_;   // the ports against the control thread
   std::vector<Port> ports_;
   bool stateLost_ = false;
};

}  // namespace swsec::live
