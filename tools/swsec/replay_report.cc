// Report formatting: counts first, then what the port holds, then what it
// said, so that the end of the output is what a reader looks at first.
#include "replay_report.h"

#include "replay_capture.h"

#include <cstdio>
#include <iomanip>

namespace swsec::replay {

const char *directionName(uint8_t direction)
{
   return direction == kDirFromVm ? "from-vm" : "to-vm";
}

namespace {

const char *severityName(uint32_t severity)
{
   return severity >= 2 ? "error" : "info";
}

std::string seconds(double time)
{
   std::array<char, 32> text{};
   std::snprintf(text.data(), text.size(), "%.6f", time);
   return text.data();
}

}  // namespace

nlohmann::json replayJson(const ReplayResult &result)
{
   using nlohmann::json;
   json doc;
   json frames = json::array();
   for (const auto &frame : result.frames) {
      json entry = {{"index", frame.index},
                    {"time", frame.seconds()},
                    {"direction", directionName(frame.direction)},
                    {"vlan", frame.vlan},
                    {"verdict", frame.passed ? "passed" : "dropped"}};
      if (frame.reason != DropReason::none) {
         entry["reason"] = dropReasonName(frame.reason);
      }
      if (const std::string_view description = result.description(frame); !description.empty()) {
         entry["description"] = description;
      }
      frames.push_back(std::move(entry));
   }
   doc["frames"] = std::move(frames);
   doc["totals"] = {{"to-vm", {{"passed", result.totals[kDirToVm][0]}, {"dropped", result.totals[kDirToVm][1]}}},
                    {"from-vm", {{"passed", result.totals[kDirFromVm][0]}, {"dropped", result.totals[kDirFromVm][1]}}}};
   json portDb = json::array();
   for (const auto &e : result.portDb) {
      portDb.push_back({{"vlan", e.vlan},
                        {"mac", e.mac},
                        {"ip", e.ip},
                        {"method", e.method},
                        {"timeRemaining", e.timeRemaining},
                        {"chaddr", e.chaddr},
                        {"clientIdLen", e.clientIdLen},
                        {"serverIp", e.serverIp},
                        {"leaseTime", e.leaseTime}});
   }
   doc["portDb"] = std::move(portDb);
   doc["counters"] = json::object();
   for (const auto &[name, value] : result.counters) {
      doc["counters"][name] = value;
   }
   doc["featureSummary"] = result.featureSummary ? json(*result.featureSummary) : json(nullptr);
   json notes = json::array();
   for (const auto &n : result.notifications) {
      notes.push_back({{"afterFrame", n.afterFrame},
                       {"name", n.name},
                       {"vlan", n.vlan},
                       {"mac", n.mac},
                       {"ip", n.ip},
                       {"authoritative", n.authoritative}});
   }
   doc["notifications"] = std::move(notes);
   json log = json::array();
   for (const auto &line : result.log) {
      log.push_back({{"severity", severityName(line.severity)}, {"text", line.text}});
   }
   doc["log"] = std::move(log);
   doc["violations"] = result.violations;
   doc["warnings"] = result.warnings;
   doc["warningsNotShown"] = result.warningsNotShown;
   return doc;
}

void printReplayReport(std::ostream &out, const ReplayResult &result, bool verbose)
{
   out << "frames        passed  dropped\n";
   for (uint8_t direction : {kDirToVm, kDirFromVm}) {
      out << "  " << std::left << std::setw(10) << directionName(direction) << std::right << std::setw(8)
          << result.totals[direction][0] << std::setw(9) << result.totals[direction][1] << "\n";
   }
   if (verbose) {
      for (const auto &frame : result.frames) {
         if (!frame.passed) {
            out << "  dropped #" << frame.index << "  " << seconds(frame.seconds()) << "  "
                << directionName(frame.direction) << "  " << dropReasonName(frame.reason) << ": "
                << result.description(frame) << "\n";
         }
      }
   }

   out << "\ndrop counters\n";
   if (result.counters.empty()) {
      out << "  (none: the port has no IP discovery)\n";
   }
   for (const auto &[name, value] : result.counters) {
      out << "  " << std::left << std::setw(24) << name << std::right << value << "\n";
   }

   out << "\n";
   if (result.featureSummary) {
      out << result.featureSummaryText;
      if (!result.featureSummaryText.empty() && result.featureSummaryText.back() != '\n') {
         out << "\n";
      }
   } else {
      out << "Feature summary\n  (not available: the port has no IP discovery)\n";
   }

   out << "\nport database (" << result.portDb.size() << " entries)\n";
   if (!result.portDb.empty()) {
      out << "  VLAN  MAC                IP               method          remaining  chaddr             "
             "clientIdLen  server           lease\n";
      for (const auto &e : result.portDb) {
         out << "  " << std::left << std::setw(6) << e.vlan << std::setw(19) << e.mac << std::setw(17) << e.ip
             << std::setw(16) << e.method << std::setw(11) << e.timeRemaining << std::setw(19) << e.chaddr
             << std::setw(13) << e.clientIdLen << std::setw(17) << e.serverIp << e.leaseTime << std::right
             << "\n";
      }
   }

   out << "\nnotifications (" << result.notifications.size() << ")\n";
   for (const auto &n : result.notifications) {
      out << "  after #" << std::left << std::setw(6) << n.afterFrame << std::setw(22) << n.name << "VLAN "
          << std::setw(5) << n.vlan << std::setw(19) << n.mac << std::setw(17) << n.ip
          << (n.authoritative ? "authoritative" : "non-authoritative") << std::right << "\n";
   }

   out << "\nmodule log (" << result.log.size() << " lines)\n";
   for (const auto &line : result.log) {
      out << "  " << std::left << std::setw(6) << severityName(line.severity) << std::right << line.text << "\n";
   }

   if (!result.violations.empty()) {
      out << "\nhost checks failed\n";
      for (const auto &v : result.violations) {
         out << "  " << v << "\n";
      }
   }
}

}  // namespace swsec::replay
