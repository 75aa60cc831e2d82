// Management node reads. Values are kept as the nodes render them; the
// counters are also parsed, for the drop reasons and the report.
#include "replay/port_nodes.h"

#include <charconv>
#include <string>

namespace swsec::replay {

namespace {

constexpr const char *kCounterFields[] = {"dhcpSnoopingDropCnt", "daiDropCnt",          "ipSrcGuardDropCnt",
                                          "txRateLimitDropCnt",  "rxRateLimitDropCnt", "txRateLimitErrEntryCnt"};

std::string portPath(uint32_t portId)
{
   return "/security/" + std::to_string(portId);
}

bool parseCount(const std::string &text, uint64_t &value)
{
   return std::from_chars(text.data(), text.data() + text.size(), value).ec == std::errc{};
}

template <typename Values>
DropCounters countersOf(const Values &values)
{
   DropCounters counters;
   for (const char *field : kCounterFields) {
      const auto found = values.find(field);
      uint64_t value = 0;
      if (found != values.end() && parseCount(found->second, value)) {
         counters[field] = value;
      }
   }
   return counters;
}

}  // namespace

DropCounters readDropCounters(host::Host &host, uint32_t portId)
{
   host::NexoRecord summary;
   if (host.nexo().get(portPath(portId) + "/featureSummary", &summary) != ORR_OK) {
      return {};
   }
   return countersOf(summary.values());
}

void readPortState(host::Host &host, uint32_t portId, PortResult &port)
{
   const std::string path = portPath(portId);
   host::NexoRecord summary;
   if (host.nexo().get(path + "/featureSummary", &summary) == ORR_OK) {
      port.featureSummary = summary.values();
      port.featureSummaryText = summary.text();
      port.counters = countersOf(*port.featureSummary);
   }
   std::vector<int64_t> instances;
   if (host.nexo().list(path + "/vmi", &instances) != ORR_OK) {
      return;
   }
   for (int64_t instance : instances) {
      host::NexoRecord vmi;
      if (host.nexo().get(path + "/vmi/" + std::to_string(instance), &vmi) != ORR_OK) {
         continue;
      }
      const auto values = vmi.values();
      auto field = [&values](const char *name) {
         const auto found = values.find(name);
         return found != values.end() ? found->second : std::string();
      };
      PortDbEntry &entry = port.portDb.emplace_back();
      uint64_t vlan = 0;
      (void)parseCount(field("vlanId"), vlan);
      entry.vlan = static_cast<uint16_t>(vlan);
      entry.mac = field("macAddr");
      entry.ip = field("ipAddr");
      entry.method = field("discoveryMethod");
      entry.timeRemaining = field("timeRemaining");
      entry.chaddr = field("chaddr");
      entry.clientIdLen = field("clientIdLen");
      entry.serverIp = field("serverIp");
      entry.leaseTime = field("leaseTime");
   }
}

std::optional<std::chrono::seconds> soonestExpiry(host::Host &host, uint32_t portId)
{
   const std::string path = portPath(portId) + "/vmi";
   std::vector<int64_t> instances;
   if (host.nexo().list(path, &instances) != ORR_OK) {
      return std::nullopt;
   }
   std::optional<std::chrono::seconds> soonest;
   for (int64_t instance : instances) {
      host::NexoRecord vmi;
      if (host.nexo().get(path + "/" + std::to_string(instance), &vmi) != ORR_OK) {
         return std::chrono::seconds(0);   // unknown: tick on
      }
      const auto values = vmi.values();
      const auto found = values.find("timeRemaining");
      if (found == values.end() || found->second == "N/A") {
         continue;   // a static binding does not expire
      }
      uint64_t seconds = 0;
      if (!parseCount(found->second, seconds)) {
         return std::chrono::seconds(0);
      }
      const std::chrono::seconds left(seconds);
      soonest = soonest ? std::min(*soonest, left) : left;
   }
   return soonest;
}

}  // namespace swsec::replay
