// The inline daemon's ports and the answers to control requests, read from
// the module's own management nodes and notifications.
#include "live/inline.h"

#include "session/error.h"
#include "session/port_state.h"
#include "session/saved_state_format.h"
#include "session/serializer.h"
#include "session/state_file.h"

#include <sys/stat.h>

#include <cerrno>
#include <fstream>
#include <sstream>

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
     session_(options_.modulePath, options_.linkedModule, [&events](const std::string &v) { events.log("error", "host", v); })
{
   // Ports' timers fire on real time from here on, on the host's timer thread.
   session_.host().clock().useRealTime();
   for (const PortSpec &portSpec : options_.ports) {
      ports_.push_back(Port{portSpec, nullptr, portSpec.configPath});
   }
}

InlineDaemon::~InlineDaemon()
{
   (void)stop();
}

std::vector<uint8_t> InlineDaemon::recordFor(const PortSpec &portSpec)
{
   return session::configRecord(portSpec.configPath.empty() ? session::PortSecurityConfig{}
                                                       : session::loadConfigFile(portSpec.configPath));
}

std::string InlineDaemon::statePath(const PortSpec &portSpec) const
{
   return options_.stateDir + "/" + portSpec.name + ".state";
}

// A state file that is missing, damaged or refused costs the port its
// bindings, not its start: the VMs renew their leases and are learned
// again, while a port that did not start would leave its VM cut off.
// The time since the save is taken from every lifetime, so that a lease
// that ran out meanwhile (or that the VM gave back and the server gave
// to another) does not come back.
void InlineDaemon::restoreState(const PortSpec &portSpec, host::FilterId filter)
{
   const std::string path = statePath(portSpec);
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
         const size_t saved = session::decodeSavedState(stored.blob).bindings.size();
         stored.blob = session::ageSavedState(stored.blob, elapsed);
         const size_t kept = session::decodeSavedState(stored.blob).bindings.size();
         age = " (saved " + std::to_string(elapsed) + " s ago; " + std::to_string(saved - kept) +
               " of its " + std::to_string(saved) + " bindings ran out meanwhile)";
      }
      session::restorePortState(session_.host(), filter, stored.blob);
      events_.log("info", "inline", portSpec.name + ": state restored from " + path + age);
   } catch (const session::StateFileError &e) {
      events_.log("error", "inline", portSpec.name + ": " + e.what() + "; the port starts empty");
   } catch (const session::BadSavedState &e) {
      events_.log("error", "inline", portSpec.name + ": " + path + ": saved state refused: " + e.what() +
                                         "; the port starts empty");
   } catch (const session::StateRefused &e) {
      events_.log("error", "inline", portSpec.name + ": " + path + ": saved state refused: " + e.what() +
                                         "; the port starts empty");
   }
}

// Only owner-readable: the bindings name the VMs' addresses and leases.
bool InlineDaemon::saveState(Port &port, host::FilterId filter)
{
   const std::string path = statePath(port.portSpec);
   port.stateDirty = false;
   port.lastSave = std::chrono::steady_clock::now();
   try {
      const std::vector<uint8_t> blob = session::savePortState(session_.host(), filter);
      session::writeStateFile(path, session::wrapState(blob, static_cast<int64_t>(wallClock() * 1e6)), 0600);
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

void InlineDaemon::start()
{
   std::lock_guard guard(mutex_);
   uint32_t portID = 1;
   for (Port &port : ports_) {
      PortOptions options;
      options.name = port.portSpec.name;
      options.vmIface = port.portSpec.vmIface;
      options.bridge = options_.bridge;
      options.portID = portID++;
      options.failMode = options_.failMode;
      options.batch = options_.batch;
      port.guarded = std::make_unique<GuardedPort>(
         session_, options, [this](const std::string &line) { events_.log("info", "inline", line); }, nullptr);
      try {
         std::function<void(host::FilterId)> restore;
         if (!options_.stateDir.empty()) {
            restore = [this, &port](host::FilterId filter) { restoreState(port.portSpec, filter); };
         }
         port.guarded->start(recordFor(port.portSpec), restore);
      } catch (...) {
         port.guarded.reset();
         for (auto it = ports_.rbegin(); it != ports_.rend(); ++it) {
            if (it->guarded) {
               it->guarded->stop(true);
               it->guarded.reset();
            }
         }
         throw;
      }
   }
}

void InlineDaemon::pump()
{
   std::lock_guard guard(mutex_);
   for (auto &record : session_.takeLog()) {
      events_.log(record.severity >= 2 ? "error" : "info", "module", session::withoutNewline(record.text));
   }
   for (const auto &note : session_.takeNotifications()) {
      const size_t index = note.portID - 1;
      if (index < ports_.size()) {
         ports_[index].stateDirty = true;
      }
      const std::string name = index < ports_.size() ? ports_[index].portSpec.name : std::to_string(note.portID);
      nlohmann::json event = session::notificationJson(note);
      event["time"] = wallClock();
      event["port"] = name;
      events_.notification(std::move(event));
   }
   for (Port &port : ports_) {
      if (port.guarded && port.guarded->vanished() && port.guarded->running()) {
         port.guarded->stop();
      }
   }
   // A binding change is on disk within a second, a burst of them in one save.
   const auto now = std::chrono::steady_clock::now();
   for (Port &port : ports_) {
      if (!options_.stateDir.empty() && port.stateDirty && port.guarded && port.guarded->running() &&
          now - port.lastSave >= std::chrono::seconds(1)) {
         (void)saveState(port, port.guarded->filter());
      }
   }
}

void InlineDaemon::reload()
{
   std::lock_guard guard(mutex_);
   for (Port &port : ports_) {
      if (!port.guarded || !port.guarded->running() || port.portSpec.configPath.empty()) {
         continue;
      }
      const std::string &name = port.portSpec.name;
      try {
         session_.configure(port.guarded->filter(), recordFor(port.portSpec));
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
   for (auto it = ports_.rbegin(); it != ports_.rend(); ++it) {
      if (it->guarded) {
         std::function<void(host::FilterId)> save;
         if (!options_.stateDir.empty()) {
            save = [this, &port = *it](host::FilterId filter) {
               if (!saveState(port, filter)) {
                  stateLost_ = true;
               }
            };
         }
         it->guarded->stop(false, save);
      }
   }
   std::vector<std::string> violations = session_.finish();
   pump();
   return violations;
}

InlineDaemon::Port &InlineDaemon::port(const nlohmann::json &request)
{
   const std::string name = requiredString(request, "port");
   for (Port &port : ports_) {
      if (port.portSpec.name == name) {
         return port;
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
   for (Port &port : ports_) {
      nlohmann::json entry = {{"name", port.portSpec.name},
                              {"interface", port.portSpec.vmIface},
                              {"bridge", options_.bridge},
                              {"failMode", options_.failMode == FailMode::open ? "open" : "closed"},
                              {"config", port.configSource}};
      if (port.guarded) {
         entry["portId"] = port.guarded->options().portID;
         entry["running"] = port.guarded->running();
         entry["stopReason"] = port.guarded->stopReason();
         entry["bridgeEnd"] = port.guarded->bridgeEnd();
         entry["guardEnd"] = port.guarded->guardEnd();
      } else {
         entry["running"] = false;
      }
      list.push_back(entry);
   }
   return list;
}

nlohmann::json bindingsReply(const std::string &port, const session::PortState &state)
{
   nlohmann::json list = nlohmann::json::array();
   for (const auto &entry : state.portDb) {
      nlohmann::json binding = session::bindingJson(entry);
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
   entry["frames"] = frames;
   entry["truncated"] = counters.truncated.load();
   entry["sendErrors"] = counters.sendErrors.load();
   entry["overruns"] = port.guarded->overruns();
   if (!port.guarded->running()) {
      return entry;
   }
   const session::PortState state = session_.readState(port.guarded->options().portID);
   entry["drops"] = state.counters;
   nlohmann::json methods = {{"DHCP Snooping", 0}, {"Static", 0}, {"TOFU", 0}, {"ARP Snooping", 0}};
   for (const auto &binding : state.portDb) {
      methods[binding.method] = methods.value(binding.method, 0) + 1;
   }
   entry["bindings"] = methods;
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
      for (Port &port : ports_) {
         if (port.guarded && port.guarded->running()) {
            for (auto &entry : bindingsJson(port)) {
               list.push_back(entry);
            }
         }
      }
      return list;
   }
   if (command == "summary") {
      Port &port = runningPort(request);
      const session::PortState state = session_.readState(port.guarded->options().portID);
      if (!state.featureSummary) {
         return {{"port", port.portSpec.name}, {"fields", nullptr}, {"text", "(the port has no IP discovery)\n"}};
      }
      return {{"port", port.portSpec.name},
              {"fields", session::featureSummaryJson(state)},
              {"text", state.featureSummaryText}};
   }
   if (command == "counters") {
      nlohmann::json list = nlohmann::json::array();
      for (Port &port : ports_) {
         list.push_back(countersJson(port));
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
         session_.configure(port.guarded->filter(), session::configRecord(session::parseConfig(text, origin)));
      } catch (const session::InputError &e) {
         throw CtlError(e.what());
      } catch (const session::Refused &e) {
         throw CtlError(origin + ": " + e.what());
      }
      port.configSource = origin;
      events_.log("info", "inline", port.portSpec.name + ": configuration written from " + origin);
      return {{"port", port.portSpec.name}, {"configured", true}};
   }
   throw CtlError("unknown command '" + command +
                  "' (ports, bindings, summary, counters, clear, config, watch, log, metrics)");
}

}  // namespace swsec::live
