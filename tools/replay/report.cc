// Report formatting: per port, counts first, then what the port holds, then
// what it said; the module's log last, so that the end of the output is
// what a reader looks at first.
#include "replay/report.h"

#include "replay/capture.h"
#include "session/serializer.h"

#include <cstdio>
#include <iomanip>

namespace swsec::replay {

const char *directionName(uint8_t direction)
{
   return direction == kDirFromVm ? "from-vm" : "to-vm";
}

std::string groupedCount(uint64_t count)
{
   const std::string digits = std::to_string(count);
   std::string grouped;
   for (size_t i = 0; i < digits.size(); ++i) {
      if (i != 0 && (digits.size() - i) % 3 == 0) {
         grouped += ',';
      }
      grouped += digits[i];
   }
   return grouped;
}

namespace {

std::string seconds(double time)
{
   std::array<char, 32> text{};
   std::snprintf(text.data(), text.size(), "%.6f", time);
   return text.data();
}

void printPort(std::ostream &out, const PortResult &port, bool named)
{
   if (named) {
      out << "port " << port.name << " (";
      for (size_t i = 0; i < port.macs.size(); ++i) {
         out << (i != 0 ? ", " : "") << port.macs[i];
      }
      out << ")\n";
   }
   out << "frames        passed  dropped\n";
   for (uint8_t direction : {kDirToVm, kDirFromVm}) {
      out << "  " << std::left << std::setw(10) << directionName(direction) << std::right << std::setw(8)
          << port.totals[direction][0] << std::setw(9) << port.totals[direction][1] << "\n";
   }

   out << "\ndrop counters\n";
   if (port.counters.empty()) {
      out << "  (none: the port has no IP discovery)\n";
   }
   for (const auto &[name, value] : port.counters) {
      out << "  " << std::left << std::setw(24) << name << std::right << value << "\n";
   }

   out << "\n";
   if (port.featureSummary) {
      out << port.featureSummaryText;
      if (!port.featureSummaryText.empty() && port.featureSummaryText.back() != '\n') {
         out << "\n";
      }
   } else {
      out << "Feature summary\n  (not available: the port has no IP discovery)\n";
   }

   out << "\nport database (" << port.portDb.size() << " entries)\n";
   if (!port.portDb.empty()) {
      std::vector<std::vector<std::string>> rows{
         {"VLAN", "MAC", "IP", "method", "remaining", "chaddr", "clientIdLen", "server", "lease"}};
      for (const auto &e : port.portDb) {
         rows.push_back({std::to_string(e.vlan), e.mac, e.ip, e.method, e.timeRemaining, e.chaddr, e.clientIdLen,
                         e.serverIp, e.leaseTime});
      }
      out << session::textTable(rows, "  ");
   }

   if (port.ipv6) {
      out << "\n" << session::ipv6Text(*port.ipv6);
   }

   out << "\nnotifications (" << port.notifications.size() << ")\n";
   for (const auto &n : port.notifications) {
      out << "  after #" << std::left << std::setw(6) << n.afterFrame << std::setw(22) << n.name << "VLAN "
          << std::setw(5) << n.vlan << std::setw(19) << n.mac << std::setw(17) << n.ip
          << (n.authoritative ? "authoritative" : "non-authoritative") << std::right << "\n";
   }
}

}  // namespace

void printDroppedFrame(std::ostream &out, const FrameEvent &event, const std::string *port)
{
   const FrameVerdict &frame = event.verdict;
   out << "dropped #" << frame.index << "  " << seconds(frame.seconds()) << "  ";
   if (port != nullptr) {
      out << *port << "  ";
   }
   out << directionName(frame.direction) << "  " << dropReasonName(frame.reason) << ": " << event.description
       << "\n";
}

void printReplayReport(std::ostream &out, const ReplayResult &result)
{
   const bool named = result.ports.size() > 1;
   for (size_t i = 0; i < result.ports.size(); ++i) {
      out << (i != 0 ? "\n" : "");
      printPort(out, result.ports[i], named);
   }
   if (result.otherVlan != 0) {
      out << "\n" << result.otherVlan << " frames of other VLANs left out\n";
   }
   if (result.unassigned != 0) {
      out << "\n" << result.unassigned << " frames from and to no port's VM\n";
   }

   // The module's own severities: 2 marks failures and refusals (and some
   // of its notices), 1 information.
   out << "\nmodule log (" << result.log.size() << " lines, severity as the module gave it)\n";
   for (const auto &line : result.log) {
      out << "  " << line.severity << "  " << line.text << "\n";
      if (line.repeated != 0) {
         out << "     ... repeated " << groupedCount(line.repeated) << (line.repeated == 1 ? " time\n" : " times\n");
      }
   }

   if (!result.violations.empty()) {
      out << "\nhost checks failed\n";
      for (const auto &v : result.violations) {
         out << "  " << v << "\n";
      }
   }
}

}  // namespace swsec::replay
