// swsec replay: the command line over the replay engine. Bad input is one
// line on stderr and exit status 2; a progress line on a terminal for runs
// that take more than a second, also while the clock runs on and while the
// JSON is written.
#include "cli/commands.h"

#include "replay/engine.h"
#include "replay/json.h"
#include "replay/report.h"
#include "session/config_file.h"
#include "session/error.h"

#include <CLI/CLI.hpp>

#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <iostream>
#include <set>

namespace swsec::tools {

void addReplayOptions(CLI::App &command, ReplayCommandOptions &options)
{
   command.add_option("CAPTURE", options.capture, "pcap or pcapng capture ('-': standard input)")->required();
   command.add_option("--vm-mac", options.vmMac, "one VM: frames from this MAC go from it, others to it");
   command.add_option("--port", options.ports, "a VM's port: NAME=MAC[,MAC...] (repeatable)");
   command.add_option("--port-config", options.portConfigs, "NAME=FILE: that port's configuration (repeatable)");
   command.add_option("--network-mac", options.networkMacs,
                      "frames from this MAC come from the network; any other source is a VM (repeatable)");
   command.add_option("--config", options.config, "JSON security configuration of every port without its own");
   command.add_option("--vlan", options.vlan, "replay only the frames of this VLAN (0: untagged)")
      ->check(CLI::Range(0, 4095));
   command.add_option("--until", options.until, "run the clock on this many seconds after the last frame");
   command.add_option("--batch", options.batch, "most frames handed over in one list")
      ->check(CLI::Range(1u, 1u << 16));
   command.add_flag("--json", options.json, "print one JSON document");
   command.add_flag("--json-lines", options.jsonLines, "print one JSON object a frame, then a summary object");
   command.add_flag("-v,--verbose", options.verbose, "one line per dropped frame, with its reason");
   command.add_option("--write-passed", options.writePassed, "write the frames that passed to this pcap file");
   command.add_option("--write-dropped", options.writeDropped, "write the dropped frames to this pcap file");
   command.add_option("--module", options.modulePath, "open this module image instead of the module linked into swsec");
   command.add_option("--save-state", options.saveState, "write the port's saved state at the end to this file");
   command.add_option("--restore-state", options.restoreState,
                      "restore the port from this saved state before the first frame");
}

namespace {

// A number of seconds from 0 to kMaxUntilSeconds, written as a decimal
// number; not a NaN or an infinity, which strtod would take.
double parseUntil(const std::string &text)
{
   double seconds = 0;
   const char *end = text.data() + text.size();
   const auto [stop, error] = std::from_chars(text.data(), end, seconds, std::chars_format::general);
   if (text.empty() || error != std::errc{} || stop != end || !std::isfinite(seconds) || seconds < 0 ||
       seconds > replay::kMaxUntilSeconds) {
      throw session::InputError("--until: expected seconds from 0 to 10000000000, got \"" + text.substr(0, 40) +
                                (text.size() > 40 ? "...\"" : "\""));
   }
   return seconds;
}

std::vector<replay::PortSpec> parsePorts(const ReplayCommandOptions &options)
{
   std::vector<replay::PortSpec> ports;
   std::set<replay::Mac> macs;
   for (const std::string &text : options.ports) {
      auto [name, list] = nameValue(text, "--port");
      for (const auto &port : ports) {
         if (port.name == name) {
            throw session::InputError("--port " + name + ": given twice");
         }
      }
      replay::PortSpec &port = ports.emplace_back();
      port.name = name;
      for (size_t at = 0; at <= list.size();) {
         const size_t comma = std::min(list.find(',', at), list.size());
         port.macs.push_back(session::parseMac(list.substr(at, comma - at), "--port " + name));
         if (!macs.insert(port.macs.back()).second) {
            throw session::InputError("--port " + name + ": " + list.substr(at, comma - at) +
                                      " is already another port's MAC");
         }
         at = comma + 1;
      }
   }
   for (const std::string &text : options.portConfigs) {
      const auto named = nameValue(text, "--port-config");
      const std::string &name = named.first;
      const std::string &file = named.second;
      auto found = std::find_if(ports.begin(), ports.end(), [&name](const auto &port) { return port.name == name; });
      if (found == ports.end()) {
         throw session::InputError("--port-config " + name + ": no --port of that name");
      }
      if (found->config) {
         throw session::InputError("--port-config " + name + ": given twice");
      }
      found->config = session::loadConfigFile(file);
   }
   for (const std::string &text : options.networkMacs) {
      const replay::Mac mac = session::parseMac(text, "--network-mac");
      if (macs.count(mac) != 0) {
         throw session::InputError("--network-mac " + text + ": is a port's MAC");
      }
   }
   return ports;
}

// Prints "\r<progress>" on stderr once a run has taken a second.
class ProgressLine {
public:
   ProgressLine() : enabled_(isatty(STDERR_FILENO) != 0), start_(std::chrono::steady_clock::now()) {}
   ~ProgressLine() { clear(); }
   ProgressLine(const ProgressLine &) = delete;
   ProgressLine &operator=(const ProgressLine &) = delete;

   void update(uint64_t frames, uint64_t bytesRead, uint64_t fileSize)
   {
      if (!enabled_ || std::chrono::steady_clock::now() - start_ < std::chrono::seconds(1)) {
         return;
      }
      shown_ = true;
      if (fileSize != 0) {
         const double percent = 100.0 * static_cast<double>(bytesRead) / static_cast<double>(fileSize);
         std::fprintf(stderr, "\rreplay: %llu frames (%.0f%%)   ", static_cast<unsigned long long>(frames), percent);
      } else if (bytesRead != 0) {
         std::fprintf(stderr, "\rreplay: %llu frames   ", static_cast<unsigned long long>(frames));
      } else {
         std::fprintf(stderr, "\rreplay: %llu frames, running the clock on   ",
                      static_cast<unsigned long long>(frames));
      }
   }
   void clear()
   {
      if (shown_) {
         std::fprintf(stderr, "\r%60s\r", "");
         shown_ = false;
      }
   }

private:
   bool enabled_;
   bool shown_ = false;
   std::chrono::steady_clock::time_point start_;
};

}  // namespace

int runReplay(const ReplayCommandOptions &options)
{
   try {
      replay::ReplayOptions run;
      run.capturePath = options.capture;
      if (!options.vmMac.empty()) {
         if (!options.ports.empty()) {
            throw session::InputError("--vm-mac: give the VM's MAC in its --port instead");
         }
         run.vmMac = session::parseMac(options.vmMac, "--vm-mac");
      }
      run.ports = parsePorts(options);
      for (const std::string &text : options.networkMacs) {
         run.networkMacs.push_back(session::parseMac(text, "--network-mac"));
      }
      if (!options.config.empty()) {
         run.config = session::loadConfigFile(options.config);
      }
      if (options.vlan >= 0) {
         run.vlan = static_cast<uint16_t>(options.vlan);
      }
      if (!options.until.empty()) {
         run.untilSeconds = parseUntil(options.until);
      }
      if (options.json && options.jsonLines) {
         throw session::InputError("--json and --json-lines: give one");
      }
      run.batch = options.batch;
      // Every frame streams to the JSON and the dropped ones to the verbose
      // report as they are judged; the result keeps none of them.
      run.frameRecords = replay::FrameRecords::none;
      const bool json = options.json || options.jsonLines;
      run.describeDrops = options.verbose || json;
      run.reasons = options.verbose || json;
      run.writePassed = options.writePassed;
      run.writeDropped = options.writeDropped;
      run.modulePath = options.modulePath;
      run.linkedModule = linkedModule();

      std::vector<std::string> portNames;
      if (run.ports.empty()) {
         portNames.push_back("vm");
      }
      for (const auto &port : run.ports) {
         portNames.push_back(port.name);
      }
      std::optional<replay::JsonFrameStream> stream;
      if (json) {
         stream.emplace(std::cout,
                        options.jsonLines ? replay::JsonFrameStream::Form::lines : replay::JsonFrameStream::Form::document,
                        portNames);
         run.sink = [&stream](const replay::FrameEvent &event) { stream->frame(event); };
      }
      bool printedDrops = false;
      if (!json && options.verbose) {
         const bool named = portNames.size() > 1;
         run.sink = [&portNames, named, &printedDrops](const replay::FrameEvent &event) {
            if (!event.verdict.passed) {
               replay::printDroppedFrame(std::cout, event, named ? &portNames.at(event.verdict.port) : nullptr);
               printedDrops = true;
            }
         };
      }
      run.saveStatePath = options.saveState;
      run.restoreStatePath = options.restoreState;
      ProgressLine progress;
      run.progress = [&progress](uint64_t frames, uint64_t bytesRead, uint64_t fileSize) {
         progress.update(frames, bytesRead, fileSize);
      };
      const replay::ReplayResult result = replay::runReplay(run);
      progress.clear();
      if (stream) {
         stream->finish(result);
      } else {
         if (printedDrops) {
            std::cout << "\n";
         }
         replay::printReplayReport(std::cout, result);
      }
      std::cout.flush();
      for (const auto &warning : result.warnings) {
         std::fprintf(stderr, "swsec replay: warning: %s\n", warning.c_str());
      }
      if (result.warningsNotShown != 0) {
         std::fprintf(stderr, "swsec replay: warning: %llu more warnings\n",
                      static_cast<unsigned long long>(result.warningsNotShown));
      }
      return result.violations.empty() ? kExitOk : kExitFailure;
   } catch (const session::InputError &e) {
      std::cout.flush();
      std::fprintf(stderr, "swsec replay: %s\n", e.what());
      return kExitUsage;
   } catch (const replay::ConfigRefused &e) {
      std::cout.flush();
      std::fprintf(stderr, "swsec replay: %s\n", e.what());
      return kExitFailure;
   }
}

}  // namespace swsec::tools
