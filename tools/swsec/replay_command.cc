// swsec replay: the command line over the replay engine. Bad input is one
// line on stderr and exit status 2; a progress line on a terminal for runs
// that take more than a second.
#include "commands.h"

#include "replay_config.h"
#include "replay_engine.h"
#include "replay_error.h"
#include "replay_report.h"

#include <CLI/CLI.hpp>

#include <unistd.h>

#include <charconv>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <iostream>

namespace swsec::tools {

void addReplayOptions(CLI::App &command, ReplayCommandOptions &options)
{
   command.add_option("CAPTURE", options.capture, "pcap or pcapng capture of the VM's port")->required();
   command.add_option("--vm-mac", options.vmMac, "frames from this MAC go from the VM, others to it");
   command.add_option("--config", options.config, "JSON security configuration of the port");
   command.add_option("--until", options.until, "run the clock on this many seconds after the last frame");
   command.add_option("--batch", options.batch, "most frames handed over in one list")
      ->check(CLI::Range(1u, 1u << 16));
   command.add_flag("--json", options.json, "print one JSON document");
   command.add_flag("-v,--verbose", options.verbose, "one line per dropped frame");
   command.add_option("--write-passed", options.writePassed, "write the frames that passed to this pcap file");
   command.add_option("--write-dropped", options.writeDropped, "write the dropped frames to this pcap file");
   command.add_option("--module", options.modulePath, "open this module image instead of the module linked into swsec");
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
      throw replay::ReplayError("--until: expected seconds from 0 to 10000000000, got \"" +
                                text.substr(0, 40) + (text.size() > 40 ? "...\"" : "\""));
   }
   return seconds;
}

// Prints "\r<progress>" on stderr once a run has taken a second.
class ProgressLine {
public:
   ProgressLine() : enabled_(isatty(STDERR_FILENO) != 0), start_(std::chrono::steady_clock::now()) {}
   ~ProgressLine()
   {
      if (shown_) {
         std::fprintf(stderr, "\r%60s\r", "");
      }
   }
   ProgressLine(const ProgressLine &) = delete;
   ProgressLine &operator=(const ProgressLine &) = delete;

   void update(uint64_t frames, uint64_t bytesRead, uint64_t fileSize)
   {
      if (!enabled_ || std::chrono::steady_clock::now() - start_ < std::chrono::seconds(1)) {
         return;
      }
      shown_ = true;
      const double percent = fileSize != 0 ? 100.0 * static_cast<double>(bytesRead) / static_cast<double>(fileSize) : 0;
      std::fprintf(stderr, "\rreplay: %llu frames (%.0f%%)", static_cast<unsigned long long>(frames), percent);
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
         run.vmMac = replay::parseMac(options.vmMac, "--vm-mac");
      }
      if (!options.config.empty()) {
         run.config = replay::loadConfigFile(options.config);
      }
      if (!options.until.empty()) {
         run.untilSeconds = parseUntil(options.until);
      }
      run.batch = options.batch;
      // JSON lists every frame; the verbose report only the dropped ones.
      run.frameRecords = options.json      ? replay::FrameRecords::all
                         : options.verbose ? replay::FrameRecords::dropped
                                           : replay::FrameRecords::none;
      run.describeDrops = options.verbose || options.json;
      run.reasons = options.verbose || options.json;
      run.writePassed = options.writePassed;
      run.writeDropped = options.writeDropped;
      run.modulePath = options.modulePath;
      run.linkedModule = linkedModule();
      ProgressLine progress;
      run.progress = [&progress](uint64_t frames, uint64_t bytesRead, uint64_t fileSize) {
         progress.update(frames, bytesRead, fileSize);
      };
      const replay::ReplayResult result = replay::runReplay(run);
      for (const auto &warning : result.warnings) {
         std::fprintf(stderr, "swsec replay: warning: %s\n", warning.c_str());
      }
      if (result.warningsNotShown != 0) {
         std::fprintf(stderr, "swsec replay: warning: %llu more warnings\n",
                      static_cast<unsigned long long>(result.warningsNotShown));
      }
      if (options.json) {
         std::cout << replay::replayJson(result).dump(1) << "\n";
      } else {
         replay::printReplayReport(std::cout, result, options.verbose);
      }
      return result.violations.empty() ? kExitOk : kExitFailure;
   } catch (const replay::ReplayError &e) {
      std::fprintf(stderr, "swsec replay: %s\n", e.what());
      return kExitUsage;
   } catch (const replay::ConfigRefused &e) {
      std::fprintf(stderr, "swsec replay: %s: %s\n", options.config.c_str(), e.what());
      return kExitUsage;
   }
}

}  // namespace swsec::tools
