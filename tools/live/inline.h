// swsec inline: the daemon that guards live bridge ports with the module.
#pragma once

#include "live/ctl_server.h"
#include "live/events.h"
#include "live/kernel_path.h"
#include "live/port.h"
#include "live/rtnetlink.h"
#include "session/config_file.h"
#include "session/ports_session.h"

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace swsec::live {

struct PortSpec {
   std::string name;
   std::string vmIface;
   std::string configPath;   // "" the new port's defaults
   std::string configText;   // sent over the control socket instead of a path
   std::string configOrigin; // where configText came from
   std::string stateKey;     // names its state file; "" the port's name
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
   std::string watch;      // "" none; else a shell pattern: the bridge's ports it matches are guarded
   std::string configPath; // the configuration of ports added later ("" the defaults)
   std::optional<Datapath> datapath;   // none: the kernel's where it loads, else the user path
};

// A port's "bindings" reply: its port database entries, each with "port".
nlohmann::json bindingsReply(const std::string &port, const session::PortState &state);

// When a port's bindings go to disk: a change is saved at the latest a
// second after the last save, a burst of them in one save; a removal at the
// next pump, so that a binding the VM released (and the server may give to
// another) never comes back after a crash. Removals are rare: at most one
// save a pump (10 a second). Lifetimes that the VM's own traffic extends
// (first-come bindings, ARP-learned ones on a trusted port) move without a
// notification: a checkpoint a minute keeps what a restart restores within
// a minute of their true end, at one small write a port a minute.
class SaveSchedule {
public:
   using Clock = std::chrono::steady_clock;
   static constexpr std::chrono::seconds kCheckpoint{60};
   void changed(bool removal)
   {
      dirty_ = true;
      removal_ = removal_ || removal;
   }
   bool due(Clock::time_point now) const
   {
      const auto since = now - lastSave_;
      return (dirty_ && (removal_ || since >= std::chrono::seconds(1))) || since >= kCheckpoint;
   }
   void saved(Clock::time_point now)
   {
      dirty_ = removal_ = false;
      lastSave_ = now;
   }

private:
   bool dirty_ = false;
   bool removal_ = false;
   Clock::time_point lastSave_ = Clock::now();
};

// The ports and the control handler over them; the daemon's main loop
// owns one.
class InlineDaemon final : public CtlHandler {
public:
   InlineDaemon(InlineOptions options, EventHub &events);
   ~InlineDaemon() override;

   // Starts every port; a failure stops those started, putting the network
   // back as found, and rethrows.
   void start();
   // Moves the module's log and notifications to the event rings, takes
   // down ports that stopped by themselves and follows link changes (the
   // bridge deleted, an MTU changed, watched interfaces joining or leaving).
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
      bool watched = false;       // guarded by --watch: let go when its interface leaves
      std::string datapathReason; // why it is on the user path, "" when that is the daemon's choice
      SaveSchedule saving;
      uint64_t leaseRepliesSeen = 0;   // the port's leaseReplies at the last pump
      bool saveFailing = false;   // the last save failed (said once)
   };

   void startPort(Port &port);
   void chooseDatapath();
   // The module's port counters restarted on a new configuration.
   void configured(Port &port);
   // Adds and starts one port; throws CtlError (nothing left behind) when it cannot.
   Port &addPort(PortSpec portSpec, bool watched);
   // Stops one port as the fail mode says, saving its state, and forgets it.
   void removePort(const std::string &name, const std::string &why);
   void stopPort(Port &port);
   void followLinks();
   void followLink(const LinkEvent &event);
   void watchScan();
   void bridgeGone();
   void rejoined(Port &port);
   Port *portOn(int ifindex);

   Port &port(const nlohmann::json &request);
   Port &runningPort(const nlohmann::json &request);
   nlohmann::json portsJson();
   nlohmann::json portJson(const Port &port);
   nlohmann::json bindingsJson(const Port &port);
   nlohmann::json countersJson(Port &port);
   session::PortSecurityConfig configFor(const PortSpec &portSpec);
   std::string statePath(const PortSpec &portSpec) const;
   void restoreState(const PortSpec &portSpec, host::FilterId filter);
   // Restores one state file into the filter `filterOf` gives, aged by the time since its save.
   void restoreFile(const PortSpec &portSpec, const std::string &path, const std::function<host::FilterId()> &filterOf);
   bool saveState(Port &port, host::FilterId filter);

   InlineOptions options_;
   EventHub &events_;
   session::ModuleSession session_;
   PostedFeed feed_;
   Datapath datapath_ = Datapath::user;   // what ports start on
   std::string userReason_;               // why the kernel path is not used, "" when chosen
   std::recursive_mutex mutex_;   // the ports against the control thread
   std::vector<std::unique_ptr<Port>> ports_;   // stable: ports hold no index into it
   bool stateLost_ = false;
   uint32_t nextPortID_ = 1;
   std::unique_ptr<LinkMonitor> links_;
   int bridgeIndex_ = 0;          // 0 once the bridge is gone
   std::set<int> handsOff_;       // watched interfaces removed by request, by index
};

}  // namespace swsec::live
