// The inline daemon's ports and the answers to control requests, read from
// the module's own management nodes and notifications.
#include "live/inline.h"

#include "contract/fhs_binding.h"
#include "contract/notification.h"
#include "live/ctl_commands.h"
#include "live/netdev.h"

#include "session/error.h"
#include "session/ipv6_saved_state.h"
#include "session/port_state.h"
#include "session/saved_state_format.h"
#include "session/serializer.h"
#include "session/state_file.h"

#include <net/if.h>

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <fstream>
#include <sstream>
#include <system_error>

namespace swsec::live {

namespace {

constexpr const char *kDirectionNames[] = {"", "to-vm", "from-vm"};

std::string requiredString(const nlohmann::json &request, const char *key)
{
   if (!request.contains(key) || !request[key].is_string() || request[key].get<std::string>().empty()) {
      throw CtlError(std::string("\"") + key + "\" is required");
   }
   return request[key];
}

}  // namespace

InlineDaemon::InlineDaemon(InlineOptions options, EventHub &events)
   : options_(std::move(options)), events_(events),
     session_(options_.modulePath, options_.linkedModule, [&events](const std::string &v) { events.log("error", "host", v); }),
     feed_(session_.host())
{
   // Ports' timers fire on real time from here on, on the host's timer thread.
   session_.host().clock().useRealTime();
   for (const PortSpec &portSpec : options_.ports) {
      ports_.push_back(std::make_unique<Port>());
      ports_.back()->portSpec = portSpec;
      ports_.back()->configSource = portSpec.configPath;
   }
}

InlineDaemon::~InlineDaemon()
{
   (void)stop();
}

session::PortSecurityConfig InlineDaemon::configFor(const PortSpec &portSpec)
{
   if (!portSpec.configText.empty()) {
      return session::parseConfig(portSpec.configText, portSpec.configOrigin);
   }
   return portSpec.configPath.empty() ? session::PortSecurityConfig{} : session::loadConfigFile(portSpec.configPath);
}

std::string InlineDaemon::statePath(const PortSpec &portSpec) const
{
   return options_.stateDir + "/" + (portSpec.stateKey.empty() ? portSpec.name : portSpec.stateKey) + ".state";
}

// A state file that is missing, damaged or refused costs the port its
// bindings, not its start: the VMs renew their leases and are learned
// again, while a port that did not start would leave its VM cut off.
// The time since the save is taken from every lifetime, so that a lease
// that ran out meanwhile (or that the VM gave back and the server gave
// to another) does not come back.
//
// The IPv6 agent's state sits beside it in NAME.state6 (no port's own file
// ends so); found, it gives the port the IPv6 agent before its restore.
void InlineDaemon::restoreState(const PortSpec &portSpec, host::FilterId filter)
{
   restoreFile(portSpec, statePath(portSpec), [filter] { return filter; });
   const std::string ipv6Path = statePath(portSpec) + "6";
   struct stat info {};
   if (::lstat(ipv6Path.c_str(), &info) == 0 || errno != ENOENT) {
      restoreFile(portSpec, ipv6Path, [this, filter] { return session_.ipv6Filter(filter); });
   }
}

namespace {

size_t savedBindings(std::span<const uint8_t> blob)
{
   return session::isIpv6SavedState(blob) ? session::decodeIpv6SavedState(blob).bindings.size()
                                          : session::decodeSavedState(blob).bindings.size();
}

}  // namespace

void InlineDaemon::restoreFile(const PortSpec &portSpec, const std::string &path,
                               const std::function<host::FilterId()> &filterOf)
{
   struct stat info {};
   if (::lstat(path.c_str(), &info) != 0 && errno == ENOENT) {
      events_.log("info", "inline", portSpec.name + ": no saved state in " + path + "; the port starts empty");
      return;
   }
   try {
      session::StoredState stored = session::readStoredState(path);
      std::string age;
      if (stored.savedAtUs) {
         const int64_t elapsedUs = static_cast<int64_t>(wallClock() * 1e6) - *stored.savedAtUs;
         if (elapsedUs < 0) {
            events_.log("error", "inline", portSpec.name + ": " + path + " was saved " +
                                               std::to_string(-elapsedUs / 1'000'000) +
                                               " s in the future; the clock went back: no time deducted");
         }
         // Whole seconds, rounded up: a binding is never given time it did not have.
         const int64_t elapsed = elapsedUs <= 0 ? 0 : (elapsedUs + 999'999) / 1'000'000;
         const size_t saved = savedBindings(stored.blob);
         stored.blob = session::isIpv6SavedState(stored.blob) ? session::ageIpv6SavedState(stored.blob, elapsed)
                                                              : session::ageSavedState(stored.blob, elapsed);
         const size_t kept = savedBindings(stored.blob);
         age = " (saved " + std::to_string(elapsed) + " s ago; " + std::to_string(saved - kept) +
               " of its " + std::to_string(saved) + " bindings ran out meanwhile)";
      }
      session::restorePortState(session_.host(), filterOf(), stored.blob);
      events_.log("info", "inline", portSpec.name + ": state restored from " + path + age);
   } catch (const session::StateFileError &e) {
      events_.log("error", "inline", portSpec.name + ": " + e.what() + "; the port starts empty");
   } catch (const session::BadSavedState &e) {
      events_.log("error", "inline", portSpec.name + ": " + path + ": saved state refused: " + e.what() +
                                         "; the port starts empty");
   } catch (const session::StateRefused &e) {
      events_.log("error", "inline", portSpec.name + ": " + path + ": saved state refused: " + e.what() +
                                         "; the port starts empty");
   } catch (const std::runtime_error &e) {
      events_.log("error", "inline", portSpec.name + ": " + path + ": " + e.what() + "; the port starts empty");
   }
}

// Only owner-readable: the bindings name the VMs' addresses and leases.
bool InlineDaemon::saveState(Port &port, host::FilterId filter)
{
   const std::string path = statePath(port.portSpec);
   port.saving.saved(std::chrono::steady_clock::now());
   try {
      const std::vector<uint8_t> blob = session::savePortState(session_.host(), filter);
      const int64_t savedAtUs = static_cast<int64_t>(wallClock() * 1e6);
      session::writeStateFile(path, session::wrapState(blob, savedAtUs), 0600);
      // The IPv6 agent's state beside it; none left behind for a port that no longer has the agent.
      if (const std::optional<host::FilterId> ipv6 = session_.findIpv6Filter(filter)) {
         session::writeStateFile(path + "6", session::wrapState(session::savePortState(session_.host(), *ipv6), savedAtUs),
                                 0600);
      } else if (::unlink((path + "6").c_str()) != 0 && errno != ENOENT) {
         throw std::system_error(errno, std::generic_category(), "cannot remove " + path + "6");
      }
      if (port.saveFailing) {
         events_.log("info", "inline", port.portSpec.name + ": state saved to " + path + " again");
      }
      port.saveFailing = false;
      return true;
   } catch (const std::exception &e) {
      // Said once until a save succeeds again, not at every binding change.
      if (!port.saveFailing) {
         events_.log("error", "inline", port.portSpec.name + ": state not saved: " + e.what());
      }
      port.saveFailing = true;
      return false;
   }
}

void InlineDaemon::startPort(Port &port)
{
   port.datapathReason.clear();
   PortOptions options;
   options.name = port.portSpec.name;
   options.vmIface = port.portSpec.vmIface;
   options.bridge = options_.bridge;
   options.portID = nextPortID_++;
   options.failMode = options_.failMode;
   options.batch = options_.batch;
   options.datapath = datapath_;
   options.feed = &feed_;
   std::function<void(host::FilterId)> restore;
   if (!options_.stateDir.empty()) {
      restore = [this, &port](host::FilterId filter) { restoreState(port.portSpec, filter); };
   }
   const session::PortSecurityConfig config = configFor(port.portSpec);
   const auto log = [this](const std::string &line) { events_.log("info", "inline", line); };
   port.guarded = std::make_unique<GuardedPort>(session_, options, log, nullptr);
   try {
      port.guarded->start(config, restore);
   } catch (const fastpath::Error &e) {
      port.guarded.reset();
      if (options_.datapath) {
         throw;
      }
      // Chosen, not asked for: this port goes on the user path.
      events_.log("error", "inline", port.portSpec.name + ": the kernel data path failed (" + e.what() +
                                         "); the port uses the user data path");
      options.datapath = Datapath::user;
      port.datapathReason = std::string("the kernel data path failed: ") + e.what();
      port.guarded = std::make_unique<GuardedPort>(session_, options, log, nullptr);
      try {
         port.guarded->start(config, restore);
      } catch (...) {
         port.guarded.reset();
         throw;
      }
   } catch (...) {
      port.guarded.reset();
      throw;
   }
}

void InlineDaemon::chooseDatapath()
{
   std::optional<std::string> why;
   try {
      why = fastpath::unavailable();
   } catch (const fastpath::Error &e) {
      why = e.what();
   }
   if (!why) {
      datapath_ = Datapath::kernel;
      events_.log("info", "inline", "data path: kernel (the fast path program on each VM interface)");
      return;
   }
   if (options_.datapath == Datapath::kernel) {
      throw fastpath::Error("--datapath kernel: the fast path program cannot be loaded here (" + *why + ")", ENOTSUP);
   }
   datapath_ = Datapath::user;
   userReason_ = options_.datapath ? "asked for" : *why;
   events_.log("info", "inline", "data path: user (" + userReason_ + ")");
}

void InlineDaemon::configured(Port &port)
{
   if (KernelPath *kernel = port.guarded->kernel()) {
      kernel->configured();
   }
}

void InlineDaemon::start()
{
   std::lock_guard guard(mutex_);
   if (options_.datapath == Datapath::user) {
      datapath_ = Datapath::user;
      userReason_ = "asked for";
      events_.log("info", "inline", "data path: user (asked for)");
   } else {
      chooseDatapath();
   }
   // Listening before the bridge is looked at: nothing that changes after
   // the look goes unheard.
   links_ = std::make_unique<LinkMonitor>();
   const auto bridge = findLink(options_.bridge);
   if (!options_.watch.empty() && (!bridge || bridge->kind != "bridge")) {
      throw NetdevError(options_.bridge + " is not a bridge");
   }
   bridgeIndex_ = bridge ? bridge->ifindex : 0;
   for (auto &port : ports_) {
      try {
         startPort(*port);
      } catch (...) {
         for (auto it = ports_.rbegin(); it != ports_.rend(); ++it) {
            if ((*it)->guarded) {
               (*it)->guarded->stop(true);
               (*it)->guarded.reset();
            }
         }
         throw;
      }
   }
   if (!options_.watch.empty()) {
      watchScan();
   }
}

InlineDaemon::Port &InlineDaemon::addPort(PortSpec portSpec, bool watched)
{
   if (bridgeIndex_ == 0) {
      throw CtlError("bridge " + options_.bridge + " is gone; no port can be added");
   }
   for (const auto &port : ports_) {
      if (port->portSpec.name == portSpec.name) {
         throw CtlError("a port named '" + portSpec.name + "' exists");
      }
      if (port->portSpec.vmIface == portSpec.vmIface && port->guarded && port->guarded->running()) {
         throw CtlError(portSpec.vmIface + " is guarded by port '" + port->portSpec.name + "'");
      }
   }
   if (portSpec.vmIface == options_.bridge || isOwnPairEnd(portSpec.vmIface)) {
      throw CtlError(portSpec.vmIface + " is the bridge or swsec's own");
   }
   const std::string source = portSpec.configText.empty() ? portSpec.configPath : portSpec.configOrigin;
   ports_.push_back(std::make_unique<Port>());
   Port &port = *ports_.back();
   port.portSpec = std::move(portSpec);
   port.configSource = source;
   port.watched = watched;
   try {
      startPort(port);
   } catch (const std::exception &e) {
      const std::string what = e.what();
      ports_.pop_back();
      throw CtlError(what);
   }
   return port;
}

void InlineDaemon::stopPort(Port &port)
{
   std::function<void(host::FilterId)> save;
   if (!options_.stateDir.empty()) {
      save = [this, &port](host::FilterId filter) {
         if (!saveState(port, filter)) {
            stateLost_ = true;
         }
      };
   }
   port.guarded->stop(false, save);
}

void InlineDaemon::removePort(const std::string &name, const std::string &why)
{
   for (auto it = ports_.begin(); it != ports_.end(); ++it) {
      if ((*it)->portSpec.name == name) {
         events_.log("info", "inline", name + ": " + why + "; the port is removed");
         if ((*it)->guarded) {
            stopPort(**it);
         }
         ports_.erase(it);
         return;
      }
   }
}

InlineDaemon::Port *InlineDaemon::portOn(int ifindex)
{
   for (auto &port : ports_) {
      if (port->guarded && port->guarded->running() && port->guarded->vmIfindex() == ifindex) {
         return port.get();
      }
   }
   return nullptr;
}

// The bridge's ports that the pattern matches, and interfaces a killed run
// left out of the bridge with their pair's end in it.
void InlineDaemon::watchScan()
{
   for (const LinkInfo &link : bridgePorts(options_.bridge)) {
      LinkEvent event;
      event.ifindex = link.ifindex;
      event.name = link.name;
      event.hasMaster = true;
      event.master = bridgeIndex_;
      event.mac = link.mac;
      event.kind = link.kind;
      if (isOwnPairEnd(link.name) && link.name.back() == 'b') {
         char vm[IF_NAMESIZE];
         const int index = std::atoi(link.name.c_str() + 5);
         const auto found = if_indextoname(static_cast<unsigned>(index), vm) ? findLink(vm) : std::nullopt;
         if (!found || !found->master.empty()) {
            continue;
         }
         event.ifindex = found->ifindex;
         event.name = found->name;
         event.mac = found->mac;
         event.kind = found->kind;
      }
      followLink(event);
   }
}

void InlineDaemon::bridgeGone()
{
   const std::string reason = "bridge " + options_.bridge + " deleted";
   events_.log("error", "inline", reason + "; every port stops");
   bridgeIndex_ = 0;
   for (auto &port : ports_) {
      if (port->guarded && port->guarded->running()) {
         port->guarded->setStopReason(reason);
         stopPort(*port);
      }
   }
}

// A guarded interface put back into the bridge (by hand, or by a VM
// manager re-plugging it) would carry the VM's frames round the guard: it
// is taken out again. Looked at afresh, as the event may be one queued
// before the port took it out itself.
void InlineDaemon::rejoined(Port &port)
{
   const auto now = findLink(port.portSpec.vmIface);
   if (!now || now->master != options_.bridge || port.guarded->kernel() != nullptr) {
      return;
   }
   events_.log("error", "inline", port.portSpec.name + ": " + port.portSpec.vmIface + " was put back into " +
                                      options_.bridge + " round the guard; taking it out again");
   try {
      runIp({"link", "set", port.portSpec.vmIface, "nomaster"});
   } catch (const NetdevError &e) {
      events_.log("error", "inline", port.portSpec.name + ": " + e.what());
   }
}

void InlineDaemon::followLink(const LinkEvent &event)
{
   if (bridgeIndex_ != 0 && event.ifindex == bridgeIndex_ && event.removed) {
      bridgeGone();
      return;
   }
   Port *port = portOn(event.ifindex);
   if (port != nullptr && !event.removed && event.mtu != 0 && event.mtu != port->guarded->mtu()) {
      try {
         port->guarded->followMtu(event.mtu);
      } catch (const NetdevError &e) {
         events_.log("error", "inline", port->portSpec.name + ": MTU not followed: " + e.what());
      }
   }
   if (port != nullptr && !event.removed && event.hasMaster && event.master == bridgeIndex_) {
      rejoined(*port);
   }
   if (options_.watch.empty() || bridgeIndex_ == 0) {
      return;
   }
   if (port != nullptr && !port->watched) {
      return;   // named on the command line or added by hand: it stays until removed
   }
   if (event.removed) {
      handsOff_.erase(event.ifindex);
   }
   switch (watchAction(event, bridgeIndex_, options_.watch, port != nullptr)) {
   case WatchAction::guard: {
      if (handsOff_.count(event.ifindex) != 0) {
         break;   // let go of by remove-port: not guarded again until it is made anew
      }
      PortSpec portSpec{event.name, event.name, options_.configPath, "", "", ""};
      if (!event.mac.empty()) {
         // A VM restarted on a new interface finds its bindings again by its MAC.
         portSpec.stateKey = event.mac;
         std::replace(portSpec.stateKey.begin(), portSpec.stateKey.end(), ':', '-');
      }
      try {
         addPort(portSpec, true);
      } catch (const CtlError &e) {
         events_.log("error", "inline", event.name + " joined " + options_.bridge + " but is not guarded: " + e.what());
      }
      break;
   }
   case WatchAction::release:
      removePort(port->portSpec.name, event.name + (event.removed ? " is gone" : " left " + options_.bridge));
      break;
   case WatchAction::none:
      break;
   }
}

void InlineDaemon::followLinks()
{
   if (!links_) {
      return;
   }
   bool lost = false;
   for (const LinkEvent &event : links_->drain(&lost)) {
      followLink(event);
   }
   if (lost) {
      events_.log("error", "inline", "link events lost; looking at the bridge again");
      if (bridgeIndex_ != 0 && !findLink(options_.bridge)) {
         bridgeGone();
      } else if (bridgeIndex_ != 0 && !options_.watch.empty()) {
         watchScan();
      }
   }
}

void InlineDaemon::pump()
{
   std::lock_guard guard(mutex_);
   for (auto &record : session_.takeLog()) {
      events_.log(record.severity >= 2 ? "error" : "info", "module", session::withoutNewline(record.text));
   }
   feed_.take();
   std::vector<session::PortDbNotification> notes;
   for (const auto &message : feed_.drain()) {
      if (auto note = session::decodePortDbMessage(message)) {
         notes.push_back(std::move(*note));
      }
   }
   for (const auto &note : notes) {
      std::string name = std::to_string(note.portID);
      for (const auto &port : ports_) {
         if (port->guarded && port->guarded->options().portID == note.portID) {
            name = port->portSpec.name;
            port->saving.changed(note.name == SWSEC_PORTDB_MSG_REMOVED || note.name == FHS_MSG_REMOVED);
         }
      }
      nlohmann::json event = session::notificationJson(note);
      event["time"] = wallClock();
      event["port"] = name;
      events_.notification(std::move(event));
   }
   std::vector<std::string> gone;
   for (auto &port : ports_) {
      if (port->guarded && port->guarded->vanished() && port->guarded->running()) {
         if (port->watched) {
            // Its state is kept by its VM's MAC: the VM may come back on a new interface.
            gone.push_back(port->portSpec.name);
         } else {
            // Saved as it stops: what it learned since the last save is not lost with it.
            stopPort(*port);
         }
      }
   }
   for (const auto &name : gone) {
      removePort(name, "its interface disappeared");
   }
   const auto now = std::chrono::steady_clock::now();
   for (auto &port : ports_) {
      // A lease may have been renewed in place: no notification says so.
      if (port->guarded) {
         const uint64_t replies = port->guarded->counters().leaseReplies.load(std::memory_order_relaxed);
         if (replies != port->leaseRepliesSeen) {
            port->leaseRepliesSeen = replies;
            port->saving.changed(false);
         }
      }
      if (!options_.stateDir.empty() && port->saving.due(now) && port->guarded && port->guarded->running()) {
         (void)saveState(*port, port->guarded->filter());
      }
   }
   followLinks();
}

void InlineDaemon::reload()
{
   std::lock_guard guard(mutex_);
   for (auto &entry : ports_) {
      Port &port = *entry;
      if (!port.guarded || !port.guarded->running() || port.portSpec.configPath.empty()) {
         continue;
      }
      const std::string &name = port.portSpec.name;
      try {
         session_.configure(port.guarded->filter(), configFor(port.portSpec));
         configured(port);
         port.configSource = port.portSpec.configPath;
         events_.log("info", "inline", name + ": configuration re-read from " + port.portSpec.configPath);
      } catch (const session::InputError &e) {
         events_.log("error", "inline", name + ": " + e.what() + "; the port keeps its configuration");
      } catch (const std::exception &e) {
         events_.log("error", "inline", name + ": " + port.portSpec.configPath + ": " + e.what() +
                                            "; the port keeps its configuration");
      }
   }
}

std::vector<std::string> InlineDaemon::stop()
{
   std::lock_guard guard(mutex_);
   links_.reset();
   for (auto it = ports_.rbegin(); it != ports_.rend(); ++it) {
      if ((*it)->guarded) {
         stopPort(**it);
      }
   }
   std::vector<std::string> violations = session_.finish();
   pump();
   return violations;
}

InlineDaemon::Port &InlineDaemon::port(const nlohmann::json &request)
{
   const std::string name = requiredString(request, "port");
   for (auto &port : ports_) {
      if (port->portSpec.name == name) {
         return *port;
      }
   }
   throw CtlError("no port named '" + name + "'");
}

InlineDaemon::Port &InlineDaemon::runningPort(const nlohmann::json &request)
{
   Port &found = port(request);
   if (!found.guarded || !found.guarded->running()) {
      const std::string reason = found.guarded ? found.guarded->stopReason() : std::string();
      throw CtlError("port '" + found.portSpec.name + "' is stopped" + (reason.empty() ? "" : ": " + reason));
   }
   return found;
}

nlohmann::json InlineDaemon::portsJson()
{
   nlohmann::json list = nlohmann::json::array();
   for (auto &port : ports_) {
      list.push_back(portJson(*port));
   }
   return list;
}

nlohmann::json InlineDaemon::portJson(const Port &port)
{
   nlohmann::json entry = {{"name", port.portSpec.name},
                           {"interface", port.portSpec.vmIface},
                           {"bridge", options_.bridge},
                           {"failMode", options_.failMode == FailMode::open ? "open" : "closed"},
                           {"config", port.configSource},
                           {"watched", port.watched}};
   if (!options_.stateDir.empty()) {
      entry["stateFile"] = statePath(port.portSpec);
   }
   if (port.guarded) {
      entry["datapath"] = datapathName(port.guarded->options().datapath);
      const std::string &reason = port.datapathReason.empty() ? userReason_ : port.datapathReason;
      if (port.guarded->options().datapath == Datapath::user && !reason.empty()) {
         entry["datapathReason"] = reason;
      }
      entry["portId"] = port.guarded->options().portID;
      entry["running"] = port.guarded->running();
      entry["stopReason"] = port.guarded->stopReason();
      entry["bridgeEnd"] = port.guarded->bridgeEnd();
      entry["guardEnd"] = port.guarded->guardEnd();
      entry["mtu"] = port.guarded->mtu();
   } else {
      entry["running"] = false;
   }
   return entry;
}

nlohmann::json bindingsReply(const std::string &port, const session::PortState &state)
{
   nlohmann::json list = nlohmann::json::array();
   for (const auto &entry : state.portDb) {
      nlohmann::json binding = session::bindingJson(entry);
      binding["port"] = port;
      list.push_back(std::move(binding));
   }
   for (const auto &entry : state.ipv6 ? state.ipv6->bindings : std::vector<session::Ipv6Binding>{}) {
      nlohmann::json binding = session::ipv6BindingJson(entry);
      binding["port"] = port;
      list.push_back(std::move(binding));
   }
   return list;
}

nlohmann::json InlineDaemon::bindingsJson(const Port &port)
{
   return bindingsReply(port.portSpec.name, session_.readState(port.guarded->options().portID));
}

nlohmann::json InlineDaemon::countersJson(Port &port)
{
   nlohmann::json entry = {{"port", port.portSpec.name}, {"running", port.guarded && port.guarded->running()}};
   if (!port.guarded) {
      return entry;
   }
   const PortCounters &counters = port.guarded->counters();
   nlohmann::json frames = nlohmann::json::object();
   for (uint32_t direction : {ORR_SIFRA_DIR_RX, ORR_SIFRA_DIR_TX}) {
      frames[kDirectionNames[direction]] = {{"passed", counters.passed[direction].load()},
                                            {"dropped", counters.dropped[direction].load()}};
   }
   KernelPath *kernel = port.guarded->running() ? port.guarded->kernel() : nullptr;
   entry["datapath"] = datapathName(port.guarded->options().datapath);
   if (kernel != nullptr) {
      // The frames the program decided itself, added to those the module judged.
      const fastpath::Counters counts = kernel->counters();
      nlohmann::json byReason = nlohmann::json::object();
      for (uint32_t reason = 0; reason < SWSEC_FP_REASON_COUNT; ++reason) {
         byReason[std::string(fastpath::reasonName(reason))] = counts.frames[reason];
      }
      entry["kernel"] = byReason;
      frames["from-vm"]["passed"] = frames["from-vm"]["passed"].get<uint64_t>() + counts[SWSEC_FP_PASSED];
      frames["to-vm"]["passed"] = frames["to-vm"]["passed"].get<uint64_t>() + counts[SWSEC_FP_PASSED_TO_VM];
      frames["from-vm"]["dropped"] = frames["from-vm"]["dropped"].get<uint64_t>() + counts.dropped();
   }
   entry["frames"] = frames;
   entry["truncated"] = counters.truncated.load();
   entry["sendErrors"] = counters.sendErrors.load();
   entry["overruns"] = port.guarded->overruns();
   if (!port.guarded->running()) {
      return entry;
   }
   const session::PortState state = session_.readState(port.guarded->options().portID);
   entry["drops"] = state.counters;
   if (state.ipv6) {
      entry["drops"].update(state.ipv6->counters);
   }
   if (kernel != nullptr) {
      for (const auto &[name, drops] : kernel->dropsSinceConfigured()) {
         if (entry["drops"].contains(name)) {
            entry["drops"][name] = entry["drops"][name].get<uint64_t>() + drops;
         }
      }
   }
   nlohmann::json methods = {{"DHCP Snooping", 0}, {"Static", 0}, {"TOFU", 0}, {"ARP Snooping", 0}};
   for (const auto &binding : state.portDb) {
      methods[binding.method] = methods.value(binding.method, 0) + 1;
   }
   entry["bindings"] = methods;
   if (state.ipv6) {
      nlohmann::json ipv6 = {{"DHCPv6", 0}, {"Static", 0}, {"First come first served", 0}};
      for (const auto &binding : state.ipv6->bindings) {
         ipv6[binding.method] = ipv6.value(binding.method, 0) + 1;
      }
      entry["ipv6Bindings"] = ipv6;
   }
   return entry;
}

nlohmann::json InlineDaemon::handle(const nlohmann::json &request)
{
   std::lock_guard guard(mutex_);
   const std::string command = request["command"];
   if (command == "ports") {
      return portsJson();
   }
   if (command == "bindings") {
      nlohmann::json list = nlohmann::json::array();
      if (request.contains("port")) {
         for (auto &entry : bindingsJson(runningPort(request))) {
            list.push_back(entry);
         }
         return list;
      }
      for (auto &port : ports_) {
         if (port->guarded && port->guarded->running()) {
            for (auto &entry : bindingsJson(*port)) {
               list.push_back(entry);
            }
         }
      }
      return list;
   }
   if (command == "summary") {
      Port &port = runningPort(request);
      const session::PortState state = session_.readState(port.guarded->options().portID);
      nlohmann::json ipv6 = session::ipv6Json(state);
      std::string ipv6Text = state.ipv6 ? "\n" + session::ipv6Text(*state.ipv6) : "";
      KernelPath *kernel = port.guarded->kernel();
      const std::map<std::string, uint64_t> inKernel = kernel ? kernel->dropsSinceConfigured() : std::map<std::string, uint64_t>{};
      // The module's summaries with the program's drops added.
      const auto addKernelDrops = [&inKernel](nlohmann::json &fields) {
         uint64_t added = 0;
         for (const auto &[name, drops] : inKernel) {
            if (fields.is_object() && fields.contains(name) && fields[name].is_number()) {
               fields[name] = fields[name].get<uint64_t>() + drops;
               added += drops;
            }
         }
         return added;
      };
      if (!ipv6.is_null()) {
         if (const uint64_t added = addKernelDrops(ipv6["summary"]); kernel != nullptr) {
            ipv6Text += "IPv6 drops made in the kernel, not in the counts above: " + std::to_string(added) + "\n";
         }
      }
      if (!state.featureSummary) {
         return {{"port", port.portSpec.name},
                 {"fields", nullptr},
                 {"ipv6", ipv6.is_null() ? ipv6 : ipv6["summary"]},
                 {"text", "(the port has no IP discovery)\n" + ipv6Text}};
      }
      nlohmann::json fields = session::featureSummaryJson(state);
      std::string text = state.featureSummaryText;
      if (kernel != nullptr) {
         const uint64_t added = addKernelDrops(fields);
         text += "Data path: kernel (" + std::to_string(added) + " of the drops above made in the kernel)\n";
      } else {
         text += "Data path: user\n";
      }
      return {{"port", port.portSpec.name},
              {"datapath", datapathName(port.guarded->options().datapath)},
              {"fields", fields},
              {"ipv6", ipv6.is_null() ? ipv6 : ipv6["summary"]},
              {"text", text + ipv6Text}};
   }
   if (command == "counters") {
      nlohmann::json list = nlohmann::json::array();
      for (auto &port : ports_) {
         list.push_back(countersJson(*port));
      }
      return list;
   }
   if (command == "clear") {
      Port &port = runningPort(request);
      std::optional<std::vector<std::string>> key;
      if (request.contains("key")) {
         if (!request["key"].is_array() || request["key"].size() != 3) {
            throw CtlError("\"key\" is VLAN, MAC and IP");
         }
         key.emplace();
         for (const auto &part : request["key"]) {
            if (!part.is_string()) {
               throw CtlError("\"key\" is VLAN, MAC and IP, as text");
            }
            key->push_back(part);
         }
      }
      try {
         session_.clear(port.guarded->options().portID, key);
      } catch (const session::Refused &e) {
         throw CtlError(e.what());
      }
      return {{"port", port.portSpec.name}, {"cleared", key ? "one" : "all"}};
   }
   if (command == "config") {
      Port &port = runningPort(request);
      const std::string text = requiredString(request, "text");
      const std::string origin = request.value("origin", std::string("(control request)"));
      try {
         session_.configure(port.guarded->filter(), session::parseConfig(text, origin));
         configured(port);
      } catch (const session::InputError &e) {
         throw CtlError(e.what());
      } catch (const session::Refused &e) {
         throw CtlError(origin + ": " + e.what());
      }
      port.configSource = origin;
      events_.log("info", "inline", port.portSpec.name + ": configuration written from " + origin);
      return {{"port", port.portSpec.name}, {"configured", true}};
   }
   if (command == "add-port") {
      PortSpec portSpec{requiredString(request, "port"), requiredString(request, "interface"), options_.configPath,
                    "", "", ""};
      // A name becomes a file name in the state directory.
      if (!options_.stateDir.empty() && (portSpec.name.find('/') != std::string::npos || portSpec.name == "." ||
                                         portSpec.name == "..")) {
         throw CtlError("with a state directory a port name cannot be a path");
      }
      if (!options_.stateDir.empty() && portSpec.name.size() + sizeof ".state.partial-XXXXXX" - 1 > NAME_MAX) {
         throw CtlError("with a state directory a port name has at most " +
                        std::to_string(NAME_MAX - (sizeof ".state.partial-XXXXXX" - 1)) + " bytes");
      }
      if (request.contains("text")) {
         portSpec.configText = requiredString(request, "text");
         portSpec.configOrigin = request.value("origin", std::string("(control request)"));
         portSpec.configPath.clear();
      }
      return portJson(addPort(std::move(portSpec), false));
   }
   if (command == "remove-port") {
      const Port &found = port(request);
      const std::string name = found.portSpec.name;
      const bool running = found.guarded && found.guarded->running();
      if (found.watched && running) {
         // Back in the bridge (fail open) it would be guarded again at once.
         handsOff_.insert(found.guarded->vmIfindex());
      }
      removePort(name, "removed on request");
      return {{"port", name},
              {"removed", true},
              {"vm", running && options_.failMode == FailMode::open ? "back on the bridge" : "cut off"}};
   }
   throw CtlError("unknown command '" + command + "' (" + ctlCommandNames(false) + ")");
}

}  // namespace swsec::live
