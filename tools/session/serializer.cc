// The shared output shapes.
#include "session/serializer.h"

#include <arpa/inet.h>

#include <algorithm>
#include <charconv>
#include <cstdio>

namespace swsec::session {

std::string macText(const uint8_t *mac)
{
   char text[18];
   std::snprintf(text, sizeof text, "%02x:%02x:%02x:%02x:%02x:%02x", mac[0], mac[1], mac[2], mac[3], mac[4], mac[5]);
   return text;
}

std::string ipText(const uint8_t *ip)
{
   return std::to_string(ip[0]) + "." + std::to_string(ip[1]) + "." + std::to_string(ip[2]) + "." +
          std::to_string(ip[3]);
}

std::string ipv6Text(const uint8_t *addr)
{
   char text[INET6_ADDRSTRLEN] = {};
   return inet_ntop(AF_INET6, addr, text, sizeof text) != nullptr ? text : "";
}

std::string ipv6Text(const std::string &text)
{
   uint8_t addr[16];
   return inet_pton(AF_INET6, text.c_str(), addr) == 1 ? ipv6Text(addr) : text;
}

nlohmann::json nodeValue(const std::string &text)
{
   if (text == "N/A") {
      return nullptr;
   }
   uint64_t number = 0;
   const char *end = text.data() + text.size();
   const auto [stop, error] = std::from_chars(text.data(), end, number);
   if (error == std::errc{} && (stop == end || std::string_view(stop, end) == " sec")) {
      return number;
   }
   return text;
}

nlohmann::json bindingJson(const PortDbEntry &entry)
{
   return {{"vlan", entry.vlan},
           {"mac", entry.mac},
           {"ip", entry.ip},
           {"method", entry.method},
           {"timeRemaining", nodeValue(entry.timeRemaining)},
           {"chaddr", nodeValue(entry.chaddr)},
           {"clientIdLen", nodeValue(entry.clientIdLen)},
           {"serverIp", nodeValue(entry.serverIp)},
           {"leaseTime", nodeValue(entry.leaseTime)}};
}

nlohmann::json notificationJson(const PortDbNotification &note)
{
   return {{"name", note.name},
           {"vlan", note.vlan},
           {"mac", note.mac},
           {"ip", note.ip},
           {"authoritative", note.authoritative}};
}

nlohmann::json ipv6BindingJson(const Ipv6Binding &binding)
{
   // The port database entry's shape; the DHCP details are the IPv4 agent's alone.
   return {{"vlan", binding.vlan},
           {"mac", binding.mac},
           {"ip", binding.ip},
           {"method", binding.method},
           {"timeRemaining", binding.timeRemaining == "never" ? nlohmann::json(nullptr) : nodeValue(binding.timeRemaining)},
           {"chaddr", nullptr},
           {"clientIdLen", nullptr},
           {"serverIp", nullptr},
           {"leaseTime", nullptr}};
}

nlohmann::json ipv6Json(const PortState &state)
{
   if (!state.ipv6) {
      return nullptr;
   }
   nlohmann::json summary = nlohmann::json::object();
   for (const auto &[name, value] : state.ipv6->summary) {
      summary[name] = nodeValue(value);
   }
   nlohmann::json bindings = nlohmann::json::array();
   for (const auto &binding : state.ipv6->bindings) {
      bindings.push_back(ipv6BindingJson(binding));
   }
   return {{"summary", std::move(summary)}, {"counters", countersJson(state.ipv6->counters)}, {"bindings", std::move(bindings)}};
}

nlohmann::json featureSummaryJson(const PortState &state)
{
   if (!state.featureSummary) {
      return nullptr;
   }
   nlohmann::json summary = nlohmann::json::object();
   for (const auto &[name, value] : *state.featureSummary) {
      summary[name] = nodeValue(value);
   }
   return summary;
}

nlohmann::json countersJson(const DropCounters &counters)
{
   nlohmann::json doc = nlohmann::json::object();
   for (const auto &[name, value] : counters) {
      doc[name] = value;
   }
   return doc;
}

std::string ipv6Text(const Ipv6PortState &state)
{
   std::string text = state.summaryText;
   if (!text.empty() && text.back() != '\n') {
      text += '\n';
   }
   text += "\nIPv6 bindings (" + std::to_string(state.bindings.size()) + ")\n";
   if (!state.bindings.empty()) {
      std::vector<std::vector<std::string>> rows{{"VLAN", "MAC", "IPv6", "method", "remaining"}};
      for (const auto &b : state.bindings) {
         rows.push_back({std::to_string(b.vlan), b.mac, b.ip, b.method, b.timeRemaining});
      }
      text += textTable(rows, "  ");
   }
   return text;
}

std::string textTable(const std::vector<std::vector<std::string>> &rows, const std::string &indent)
{
   std::vector<size_t> widths;
   for (const auto &row : rows) {
      widths.resize(std::max(widths.size(), row.size()));
      for (size_t i = 0; i < row.size(); ++i) {
         widths[i] = std::max(widths[i], row[i].size());
      }
   }
   std::string text;
   for (const auto &row : rows) {
      std::string line = indent;
      for (size_t i = 0; i < row.size(); ++i) {
         line += row[i];
         if (i + 1 < row.size()) {
            line += std::string(widths[i] - row[i].size() + 2, ' ');
         }
      }
      text += line + "\n";
   }
   return text;
}

}  // namespace swsec::session
