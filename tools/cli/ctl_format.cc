// Text forms of the control replies.
#include "cli/ctl_format.h"

#include "session/serializer.h"

#include <cstdio>
#include <ctime>
#include <sstream>

namespace swsec::ctl {

namespace {

// A member object, or an empty one: iterated in place, never copied.
const nlohmann::json &member(const nlohmann::json &object, const char *key)
{
   static const nlohmann::json empty = nlohmann::json::object();
   return object.is_object() && object.contains(key) && object[key].is_object() ? object[key] : empty;
}

std::string field(const nlohmann::json &object, const char *key)
{
   if (!object.is_object() || !object.contains(key)) {
      return "-";
   }
   const auto &value = object[key];
   return value.is_string() ? value.get<std::string>() : value.is_null() ? "-" : value.dump();
}

std::string timeText(const nlohmann::json &object)
{
   const double seconds = object.value("time", 0.0);
   const std::time_t whole = static_cast<std::time_t>(seconds);
   std::tm local{};
   localtime_r(&whole, &local);
   char text[32];
   std::strftime(text, sizeof text, "%H:%M:%S", &local);
   char fraction[8];
   std::snprintf(fraction, sizeof fraction, ".%03d", static_cast<int>((seconds - static_cast<double>(whole)) * 1000));
   return std::string(text) + fraction;
}

using session::textTable;

// A label value with backslash, quote and newline escaped as the format says.
std::string labelValue(const std::string &value)
{
   std::string escaped;
   for (char c : value) {
      if (c == '\\' || c == '"') {
         escaped += '\\';
         escaped += c;
      } else if (c == '\n') {
         escaped += "\\n";
      } else {
         escaped += c;
      }
   }
   return escaped;
}

}  // namespace

std::string humanText(const std::string &command, const nlohmann::json &result)
{
   if (command == "ports") {
      std::vector<std::vector<std::string>> rows{
         {"PORT", "INTERFACE", "BRIDGE", "ID", "STATE", "FAIL", "DATA PATH", "CONFIG"}};
      for (const auto &port : result) {
         std::string state = port.value("running", false) ? "guarding" : "stopped";
         const std::string reason = port.value("stopReason", "");
         if (!reason.empty()) {
            state += " (" + reason + ")";
         }
         const std::string config = port.value("config", "");
         rows.push_back({field(port, "name"), field(port, "interface"), field(port, "bridge"), field(port, "portId"),
                         state, field(port, "failMode"),
                         field(port, "datapath") + (port.contains("datapathReason") ? " (" + field(port, "datapathReason") + ")" : ""),
                         config.empty() ? "(defaults)" : config});
      }
      return textTable(rows);
   }
   if (command == "bindings") {
      std::vector<std::vector<std::string>> rows{
         {"PORT", "VLAN", "MAC", "IP", "METHOD", "REMAINING (S)", "SERVER", "LEASE (S)"}};
      for (const auto &entry : result) {
         rows.push_back({field(entry, "port"), field(entry, "vlan"), field(entry, "mac"), field(entry, "ip"),
                         field(entry, "method"), field(entry, "timeRemaining"), field(entry, "serverIp"),
                         field(entry, "leaseTime")});
      }
      return textTable(rows) + std::to_string(result.size()) + " binding(s)\n";
   }
   if (command == "summary") {
      return result.value("text", "");
   }
   if (command == "counters") {
      std::vector<std::vector<std::string>> rows{
         {"PORT", "DATA PATH", "TO-VM PASSED", "TO-VM DROPPED", "FROM-VM PASSED", "FROM-VM DROPPED", "LOST", "DROP COUNTERS"}};
      std::string kernel;
      for (const auto &port : result) {
         // What the kernel's program did itself, by reason, under the table.
         for (const auto &[reason, count] : member(port, "kernel").items()) {
            kernel += field(port, "port") + " kernel: " + reason + " " + count.dump() + "\n";
         }
         const nlohmann::json &frames = member(port, "frames");
         std::string drops;
         for (const auto &[name, count] : member(port, "drops").items()) {
            drops += (drops.empty() ? "" : " ") + name + "=" + count.dump();
         }
         rows.push_back({field(port, "port"), field(port, "datapath"), field(member(frames, "to-vm"), "passed"),
                         field(member(frames, "to-vm"), "dropped"),
                         field(member(frames, "from-vm"), "passed"),
                         field(member(frames, "from-vm"), "dropped"),
                         std::to_string(port.value("overruns", 0ULL) + port.value("truncated", 0ULL) +
                                        port.value("sendErrors", 0ULL)),
                         drops.empty() ? "-" : drops});
      }
      return textTable(rows) + kernel;
   }
   if (command == "clear") {
      return "cleared " + std::string(result.value("cleared", "") == "one" ? "the binding" : "every binding") +
             " of " + field(result, "port") + "\n";
   }
   if (command == "config") {
      return field(result, "port") + " configured\n";
   }
   if (command == "add-port") {
      return field(result, "name") + " guards " + field(result, "interface") + " through " +
             field(result, "bridgeEnd") + "\n";
   }
   if (command == "remove-port") {
      return field(result, "port") + " removed; its VM is " + field(result, "vm") + "\n";
   }
   if (command == "log" || command == "watch") {
      std::string text;
      for (const auto &entry : result) {
         text += eventText(command, entry);
      }
      return text;
   }
   return result.dump(1) + "\n";
}

std::string eventText(const std::string &command, const nlohmann::json &event)
{
   if (command == "watch") {
      const std::string name = field(event, "name");
      return timeText(event) + " " + field(event, "port") + " " + name.substr(name.rfind('.') + 1) + " vlan " +
             field(event, "vlan") + " " + field(event, "mac") + " " + field(event, "ip") +
             (event.value("authoritative", false) ? " (authoritative)" : "") + "\n";
   }
   return timeText(event) + " " + field(event, "severity") + " " + field(event, "source") + ": " +
          field(event, "text") + "\n";
}

std::string metricsText(const nlohmann::json &counters)
{
   std::ostringstream out;
   out << "# HELP swsec_port_up 1 while the port is guarded.\n# TYPE swsec_port_up gauge\n";
   for (const auto &port : counters) {
      out << "swsec_port_up{port=\"" << labelValue(field(port, "port")) << "\"} "
          << (port.value("running", false) ? 1 : 0) << "\n";
   }
   out << "# HELP swsec_port_datapath 1 for the data path that carries the port's frames.\n"
          "# TYPE swsec_port_datapath gauge\n";
   for (const auto &port : counters) {
      if (port.contains("datapath")) {
         out << "swsec_port_datapath{port=\"" << labelValue(field(port, "port")) << "\",datapath=\""
             << labelValue(field(port, "datapath")) << "\"} 1\n";
      }
   }
   out << "# HELP swsec_kernel_frames_total Frames the kernel fast path decided or punted, by reason.\n"
          "# TYPE swsec_kernel_frames_total counter\n";
   for (const auto &port : counters) {
      for (const auto &[reason, count] : member(port, "kernel").items()) {
         out << "swsec_kernel_frames_total{port=\"" << labelValue(field(port, "port")) << "\",reason=\""
             << labelValue(reason) << "\"} " << count.get<uint64_t>() << "\n";
      }
   }
   out << "# HELP swsec_frames_total Frames the port judged, by direction and verdict.\n"
          "# TYPE swsec_frames_total counter\n";
   for (const auto &port : counters) {
      const std::string name = labelValue(field(port, "port"));
      for (const auto &[direction, verdicts] : member(port, "frames").items()) {
         for (const char *verdict : {"passed", "dropped"}) {
            out << "swsec_frames_total{port=\"" << name << "\",direction=\"" << direction << "\",verdict=\""
                << verdict << "\"} " << verdicts.value(verdict, 0ULL) << "\n";
         }
      }
   }
   out << "# HELP swsec_module_drops_total The module's drop counters.\n# TYPE swsec_module_drops_total counter\n";
   for (const auto &port : counters) {
      const std::string name = labelValue(field(port, "port"));
      for (const auto &[counter, count] : member(port, "drops").items()) {
         out << "swsec_module_drops_total{port=\"" << name << "\",counter=\"" << labelValue(counter) << "\"} "
             << count.get<uint64_t>() << "\n";
      }
   }
   out << "# HELP swsec_bindings Port database entries by discovery method.\n# TYPE swsec_bindings gauge\n";
   for (const auto &port : counters) {
      const std::string name = labelValue(field(port, "port"));
      for (const auto &[method, count] : member(port, "bindings").items()) {
         out << "swsec_bindings{port=\"" << name << "\",method=\"" << labelValue(method) << "\"} "
             << count.get<uint64_t>() << "\n";
      }
   }
   out << "# HELP swsec_ipv6_bindings IPv6 bindings by how they were learned (ports with the IPv6 agent).\n"
          "# TYPE swsec_ipv6_bindings gauge\n";
   for (const auto &port : counters) {
      const std::string name = labelValue(field(port, "port"));
      for (const auto &[method, count] : member(port, "ipv6Bindings").items()) {
         out << "swsec_ipv6_bindings{port=\"" << name << "\",method=\"" << labelValue(method) << "\"} "
             << count.get<uint64_t>() << "\n";
      }
   }
   out << "# HELP swsec_frames_lost_total Frames lost outside the module: the reader fell behind (overrun), too long "
          "for a slot (truncated), refused on send.\n"
          "# TYPE swsec_frames_lost_total counter\n";
   for (const auto &port : counters) {
      const std::string name = labelValue(field(port, "port"));
      out << "swsec_frames_lost_total{port=\"" << name << "\",reason=\"truncated\"} " << port.value("truncated", 0ULL)
          << "\n";
      out << "swsec_frames_lost_total{port=\"" << name << "\",reason=\"overrun\"} " << port.value("overruns", 0ULL)
          << "\n";
      out << "swsec_frames_lost_total{port=\"" << name << "\",reason=\"send-error\"} "
          << port.value("sendErrors", 0ULL) << "\n";
   }
   return out.str();
}

}  // namespace swsec::ctl
