// swsec inline: the command line and the daemon's main loop. SIGTERM and
// SIGINT stop, SIGHUP re-reads the port configurations; they are taken by
// the main thread alone (blocked everywhere, waited for here).
#include "cli/commands.h"

#include "live/inline.h"
#include "session/error.h"

#include <CLI/CLI.hpp>

#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <cstring>

#include <cerrno>
#include <cstdio>
#include <ctime>
#include <memory>
#include <set>

namespace swsec::tools {

void addInlineOptions(CLI::App &command, InlineCommandOptions &options)
{
   command.add_option("--bridge", options.bridge, "the Linux bridge whose ports are guarded")->required();
   command.add_option("--port", options.ports, "NAME=IFACE: guard the VM interface IFACE as port NAME");
   command.add_option("--watch", options.watch,
                      "PATTERN: guard every interface matching it (e.g. 'vnet*') that joins the bridge, "
                      "let go of those that leave");
   command.add_option("--config", options.config, "JSON security configuration of every port");
   command.add_option("--port-config", options.portConfigs, "NAME=FILE: this port's configuration instead");
   command.add_option("--fail", options.failMode, "what the VM is left with when swsec stops: closed (cut off) or "
                                                  "open (back on the bridge, unguarded)")
      ->check(CLI::IsMember({"closed", "open"}));
   command.add_option("--ctl", options.ctl, "control socket path");
   command.add_option("--state-dir", options.stateDir, "keep each port's saved state (bindings) in DIR/NAME.state across restarts");
   command.add_option("--batch", options.batch, "most frames in one system call and one list")
      ->check(CLI::Range(1u, 1024u));
   command.add_option("--module", options.modulePath, "module image (default: the built one)");
   command.add_option("--datapath", options.datapath,
                      "who carries the VM's frames: kernel (a tc program on the VM interface, which stays in the "
                      "bridge) or user (this process, through a veth pair); default kernel where it loads, else user")
      ->check(CLI::IsMember({"kernel", "user"}));
}

namespace {

class UsageError : public std::runtime_error {
public:
   using std::runtime_error::runtime_error;
};

live::InlineOptions parseOptions(const InlineCommandOptions &command)
{
   live::InlineOptions options;
   if (!command.stateDir.empty()) {
      // Checked now: a directory found missing at stop would lose the state.
      struct stat info {};
      if (::stat(command.stateDir.c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) {
         throw UsageError("--state-dir " + command.stateDir + ": not a directory");
      }
      if (::access(command.stateDir.c_str(), W_OK | X_OK) != 0) {
         throw UsageError("--state-dir " + command.stateDir + ": not writable: " + std::strerror(errno));
      }
      options.stateDir = command.stateDir;
   }
   if (command.ports.empty() && command.watch.empty()) {
      throw UsageError("nothing to guard: give --port NAME=IFACE or --watch PATTERN");
   }
   options.bridge = command.bridge;
   options.watch = command.watch;
   options.configPath = command.config;
   options.failMode = command.failMode == "open" ? live::FailMode::open : live::FailMode::closed;
   options.ctlPath = command.ctl;
   options.modulePath = command.modulePath;
   options.linkedModule = linkedModule();
   options.batch = command.batch;
   if (!command.datapath.empty()) {
      options.datapath = command.datapath == "kernel" ? live::Datapath::kernel : live::Datapath::user;
   }
   std::set<std::string> names;
   std::set<std::string> interfaces;
   for (const auto &text : command.ports) {
      auto [name, iface] = nameValue(text, "--port");
      // The name becomes a file name in the state directory.
      if (!command.stateDir.empty() && (name == "." || name == "..")) {
         throw UsageError("--port " + text + ": with --state-dir a port name cannot be a path");
      }
      // NAME.state and its temporary NAME.state.partial-XXXXXX must be file names.
      if (!command.stateDir.empty() && name.size() + sizeof ".state.partial-XXXXXX" - 1 > NAME_MAX) {
         throw UsageError("--port " + name.substr(0, 32) + "...: with --state-dir a port name has at most " +
                          std::to_string(NAME_MAX - (sizeof ".state.partial-XXXXXX" - 1)) + " bytes");
      }
      if (!names.insert(name).second) {
         throw UsageError("--port " + text + ": port " + name + " named twice");
      }
      if (!interfaces.insert(iface).second) {
         throw UsageError("--port " + text + ": interface " + iface + " guarded twice");
      }
      if (iface == command.bridge) {
         throw UsageError("--port " + text + ": that is the bridge");
      }
      options.ports.push_back({name, iface, command.config, "", "", ""});
   }
   for (const auto &text : command.portConfigs) {
      auto [name, file] = nameValue(text, "--port-config");
      bool found = false;
      for (auto &port : options.ports) {
         if (port.name == name) {
            port.configPath = file;
            found = true;
         }
      }
      if (!found) {
         throw UsageError("--port-config " + text + ": no port named " + name);
      }
   }
   // Every configuration is read now: a bad one stops the start before
   // anything changes.
   if (!command.config.empty()) {
      (void)session::loadConfigFile(command.config);
   }
   for (const auto &port : options.ports) {
      if (!port.configPath.empty()) {
         (void)session::loadConfigFile(port.configPath);
      }
   }
   return options;
}

}  // namespace

int runInline(const InlineCommandOptions &command)
{
   live::InlineOptions options;
   try {
      options = parseOptions(command);
   } catch (const UsageError &e) {
      std::fprintf(stderr, "swsec inline: %s\n", e.what());
      return kExitUsage;
   } catch (const session::InputError &e) {
      std::fprintf(stderr, "swsec inline: %s\n", e.what());
      return kExitUsage;
   }

   // Blocked before any thread starts, so that every thread inherits the
   // mask and only the wait below takes them.
   sigset_t signals;
   sigemptyset(&signals);
   sigaddset(&signals, SIGTERM);
   sigaddset(&signals, SIGINT);
   sigaddset(&signals, SIGHUP);
   pthread_sigmask(SIG_BLOCK, &signals, nullptr);
   signal(SIGPIPE, SIG_IGN);

   live::EventHub events;
   std::unique_ptr<live::InlineDaemon> daemon;
   std::unique_ptr<live::CtlServer> ctl;
   int status = kExitOk;
   try {
      daemon = std::make_unique<live::InlineDaemon>(options, events);
      // The control socket first: a second instance stops here, before it
      // touches the network.
      ctl = std::make_unique<live::CtlServer>(options.ctlPath, events, *daemon);
      daemon->start();
   } catch (const std::exception &e) {
      events.log("error", "inline", std::string("start-up failed: ") + e.what());
      ctl.reset();
      if (daemon) {
         daemon->pump();
         daemon.reset();
      }
      return dynamic_cast<const session::InputError *>(&e) != nullptr ? kExitUsage : kExitFailure;
   }
   events.log("info", "inline", "running; control socket " + options.ctlPath);

   const timespec tick{0, 100'000'000};
   for (;;) {
      daemon->pump();
      siginfo_t info{};
      const int signal = sigtimedwait(&signals, &info, &tick);
      if (signal == SIGTERM || signal == SIGINT) {
         events.log("info", "inline", std::string("stopping on ") + (signal == SIGTERM ? "SIGTERM" : "SIGINT"));
         break;
      }
      if (signal == SIGHUP) {
         daemon->reload();
      }
   }
   ctl.reset();
   const std::vector<std::string> violations = daemon->stop();
   for (const auto &violation : violations) {
      std::fprintf(stderr, "swsec inline: host: %s\n", violation.c_str());
   }
   if (!violations.empty() || daemon->stateLost()) {
      status = kExitFailure;
   }
   std::fprintf(stderr, "swsec inline: stopped, %zu host violation(s)\n", violations.size());
   return status;
}

}  // namespace swsec::tools
