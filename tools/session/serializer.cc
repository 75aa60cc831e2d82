// The shared output shapes.
#include "session/serializer.h"

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
