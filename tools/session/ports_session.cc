// The module session: load, ports, configuration, management nodes and
// notifications, shared by replay and inline.
#include "session/ports_session.h"

#include "session/error.h"
#include "session/ipv6_config.h"
#include "session/serializer.h"

#include "contract/notification.h"

#include <algorithm>
#include <charconv>
#include <cstdio>
#include <cstring>

namespace swsec::session {

namespace {

std::string portPath(uint32_t portID)
{
   return "/security/" + std::to_string(portID);
}

// A whole decimal count, as the nodes render them; "N/A" and text are not.
template <typename Number>
bool parseCount(const std::string &text, Number &value)
{
   const char *end = text.data() + text.size();
   const auto [stop, error] = std::from_chars(text.data(), end, value);
   return error == std::errc{} && stop == end;
}

using NodeValues = std::map<std::string, std::string, std::less<>>;

// The counters named in `fields` that a node's values hold as counts.
DropCounters countersOf(std::span<const char *const> fields, const NodeValues &values)
{
   DropCounters counters;
   for (const char *field : fields) {
      const auto found = values.find(field);
      uint64_t value = 0;
      if (found != values.end() && parseCount(found->second, value)) {
         counters[field] = value;
      }
   }
   return counters;
}

std::string ipv6Path(uint32_t portID)
{
   return "/ipv6/" + std::to_string(portID);
}

// The values of each instance of a node table ("/security/N/vmi"), in the
// list's order; one removed since the list was taken is left out, and a
// table that cannot be listed has none.
std::vector<NodeValues> tableValues(host::Nexo &nexo, const std::string &table)
{
   std::vector<int64_t> instances;
   std::vector<NodeValues> rows;
   if (nexo.list(table, &instances) != ORR_OK) {
      return rows;
   }
   for (int64_t instance : instances) {
      host::NexoRecord record;
      if (nexo.get(table + "/" + std::to_string(instance), &record) == ORR_OK) {
         rows.push_back(record.values());
      }
   }
   return rows;
}

// A field of a node's values; empty where it has none.
std::string fieldOf(const NodeValues &values, const char *name)
{
   const auto found = values.find(name);
   return found != values.end() ? found->second : std::string();
}

}  // namespace

std::string withoutNewline(std::string text)
{
   while (!text.empty() && text.back() == '\n') {
      text.pop_back();
   }
   return text;
}

std::optional<PortDbNotification> decodePortDbMessage(const host::PostedMessage &message)
{
   if (message.name == FHS_MSG_ADDED || message.name == FHS_MSG_REMOVED) {
      if (message.payload.size() < sizeof(FhsBindingMsgPayload)) {
         return std::nullopt;
      }
      FhsBindingMsgPayload payload;
      std::memcpy(&payload, message.payload.data(), sizeof payload);
      return PortDbNotification{.portID = message.portID,
                                .name = message.name,
                                .vlan = payload.key.vlanId,
                                .mac = macText(payload.key.mac),
                                .ip = ipv6Text(payload.key.addr),
                                .authoritative = payload.method != FhsBindFcfs};
   }
   if ((message.name != SWSEC_PORTDB_MSG_ADDED && message.name != SWSEC_PORTDB_MSG_REMOVED) ||
       message.payload.size() < sizeof(SwSecPortDbMsgPayload)) {
      return std::nullopt;
   }
   SwSecPortDbMsgPayload payload;
   std::memcpy(&payload, message.payload.data(), sizeof payload);
   PortDbNotification note;
   note.portID = message.portID;
   note.name = message.name;
   note.vlan = payload.entry.vlanId;
   note.mac = macText(payload.entry.macAddr);
   note.ip = ipText(reinterpret_cast<const uint8_t *>(&payload.entry.ipAddr));
   note.authoritative = payload.entry.authoritative != 0;
   return note;
}

ModuleSession::ModuleSession(const std::string &modulePath, const orr_ModuleInfo *linkedModule,
                             host::ViolationHandler violations)
   : forward_(std::move(violations))
{
   host_.setViolationHandler([this](const std::string &v) { report(v); });
   host::LoadOptions load;
   load.modulePath = modulePath;
   if (modulePath.empty()) {
      load.linkedModule = linkedModule;
   }
   int loaded = 1;
   try {
      loaded = host_.load(load);
   } catch (const std::runtime_error &e) {
      // An image the user named that cannot be opened is bad input.
      if (!modulePath.empty()) {
         throw InputError("--module " + modulePath + ": " + e.what());
      }
      throw;
   }
   if (loaded != 0) {
      throw std::runtime_error("the module failed to load");
   }
   host_.portsets().addPortset(kPortset);
}

ModuleSession::~ModuleSession()
{
   (void)finish();
}

host::FilterId ModuleSession::addPort(uint32_t portID, const std::string &name, const std::string &vmUuid)
{
   std::lock_guard guard(mutex_);
   host_.portsets().addPort(kPortset, portID);
   host::FilterConfig config;
   config.name = name;
   config.vmUuid = vmUuid;
   host::FilterId filter = 0;
   const orr_Status status = host_.sifra().createFilter(kAgent, portID, config, &filter);
   if (status != ORR_OK) {
      throw std::runtime_error("port " + name + " could not be made: " + orr_StatusToString(status));
   }
   filters_.push_back(filter);
   std::lock_guard ports(portsMutex_);
   ports_[filter] = PortInfo{portID, name, vmUuid, 0};
   return filter;
}

host::FilterId ModuleSession::ipv6FilterLocked(host::FilterId filter)
{
   PortInfo info;
   {
      std::lock_guard ports(portsMutex_);
      const auto found = ports_.find(filter);
      if (found == ports_.end()) {
         throw std::runtime_error("no such port");
      }
      if (found->second.ipv6 != 0) {
         return found->second.ipv6;
      }
      info = found->second;
   }
   if (!host_.sifra().fastPath(kIpv6Agent) && host_.plex().write(kAgentCreationProperty, kIpv6Agent) != ORR_OK) {
      throw std::runtime_error(std::string("the module did not make the agent ") + kIpv6Agent);
   }
   host::FilterConfig config;
   config.name = info.name;
   config.vmUuid = info.vmUuid;
   host::FilterId ipv6 = 0;
   const orr_Status status = host_.sifra().createFilter(kIpv6Agent, info.portID, config, &ipv6);
   if (status != ORR_OK) {
      throw std::runtime_error("port " + info.name + " could not get the IPv6 agent: " + orr_StatusToString(status));
   }
   filters_.push_back(ipv6);
   std::lock_guard ports(portsMutex_);
   ports_[filter].ipv6 = ipv6;
   return ipv6;
}

host::FilterId ModuleSession::ipv6Filter(host::FilterId filter)
{
   std::lock_guard guard(mutex_);
   return ipv6FilterLocked(filter);
}

std::optional<host::FilterId> ModuleSession::findIpv6Filter(host::FilterId filter)
{
   std::lock_guard ports(portsMutex_);
   const auto found = ports_.find(filter);
   if (found == ports_.end() || found->second.ipv6 == 0) {
      return std::nullopt;
   }
   return found->second.ipv6;
}

host::PacketsResult ModuleSession::judge(host::FilterId filter, uint32_t direction,
                                         std::span<const host::FrameView> frames)
{
   host::PacketsResult result = host_.sifra().processPackets(filter, direction, frames);
   const std::optional<host::FilterId> ipv6 = findIpv6Filter(filter);
   if (!ipv6 || result.kept.empty()) {
      return result;
   }
   std::vector<host::FrameView> kept;
   kept.reserve(result.kept.size());
   for (size_t index : result.kept) {
      kept.push_back(frames[index]);
   }
   const host::PacketsResult second = host_.sifra().processPackets(*ipv6, direction, kept);
   std::vector<size_t> both;
   both.reserve(second.kept.size());
   for (size_t index : second.kept) {
      both.push_back(result.kept[index]);
   }
   result.kept = std::move(both);
   result.released += second.released;
   if (result.status == ORR_OK) {
      result.status = second.status;
   }
   return result;
}

orr_Status ModuleSession::removeIpv6FilterLocked(host::FilterId filter)
{
   if (const std::optional<host::FilterId> ipv6 = findIpv6Filter(filter)) {
      const host::DestroyResult destroyed = host_.sifra().destroyFilterAsHypervisor(*ipv6);
      if (destroyed.status != ORR_OK) {
         return destroyed.status;
      }
      std::erase(filters_, *ipv6);
      std::lock_guard ports(portsMutex_);
      ports_[filter].ipv6 = 0;
   }
   return ORR_OK;
}

orr_Status ModuleSession::removePort(host::FilterId filter)
{
   std::lock_guard guard(mutex_);
   if (const orr_Status status = removeIpv6FilterLocked(filter); status != ORR_OK) {
      return status;
   }
   const host::DestroyResult destroyed = host_.sifra().destroyFilterAsHypervisor(filter);
   if (destroyed.status == ORR_OK) {
      std::erase(filters_, filter);
      std::lock_guard ports(portsMutex_);
      ports_.erase(filter);
   }
   return destroyed.status;
}

void ModuleSession::drainLogLocked()
{
   for (auto &record : host_.log().take()) {
      logTail_.push_back(std::move(record));
   }
}

// The module says why it refused in its log; its error lines written since
// `mark` are the message.
std::string ModuleSession::errorsSince(size_t mark)
{
   drainLogLocked();
   std::string message;
   for (size_t i = mark; i < logTail_.size(); ++i) {
      if (logTail_[i].severity >= 2) {
         message += (message.empty() ? "" : "; ") + withoutNewline(logTail_[i].text);
      }
   }
   return message;
}

void ModuleSession::writeProperty(const char *property, host::FilterId filter, const std::vector<uint8_t> &record)
{
   drainLogLocked();
   const size_t mark = logTail_.size();
   const orr_Status written = host_.sifra().writeProperty(property, filter, record);
   if (written != ORR_OK) {
      std::string message = errorsSince(mark);
      throw Refused("configuration refused: " + (message.empty() ? orr_StatusToString(written) : message));
   }
}

void ModuleSession::configure(host::FilterId filter, const std::vector<uint8_t> &record)
{
   std::lock_guard guard(mutex_);
   writeProperty(kSecurityProperty, filter, record);
}

void ModuleSession::configure(host::FilterId filter, const PortSecurityConfig &config)
{
   std::lock_guard guard(mutex_);
   // A port takes both agents' records or neither: the IPv6 one is checked
   // as its agent checks it before the IPv4 one is written.
   if (config.ipv6) {
      if (const std::optional<std::string> refusal = ipv6ConfigRefusal(*config.ipv6)) {
         throw Refused("configuration refused: " + *refusal);
      }
   }
   const std::optional<uint32_t> length = host_.sifra().pollProperty(kSecurityProperty, filter);
   std::vector<uint8_t> previous(length.value_or(0));
   if (previous.empty() || host_.sifra().readProperty(kSecurityProperty, filter, previous) != ORR_OK) {
      previous.clear();
   }
   writeProperty(kSecurityProperty, filter, configRecord(config));
   const std::optional<host::FilterId> hadIpv6 = findIpv6Filter(filter);
   try {
      if (config.ipv6) {
         writeProperty(kIpv6SecurityProperty, ipv6FilterLocked(filter), contract::fhsConfigRecord(*config.ipv6));
      } else if (hadIpv6) {
         writeProperty(kIpv6SecurityProperty, *hadIpv6, contract::fhsConfigRecord({}));
      }
   } catch (const std::runtime_error &e) {
      // Refused where only the module could tell: the IPv4 half goes back,
      // and an IPv6 agent made for this configuration goes.
      if (!hadIpv6) {
         (void)removeIpv6FilterLocked(filter);
      }
      const bool restored = !previous.empty() && host_.sifra().writeProperty(kSecurityProperty, filter, previous) == ORR_OK;
      throw Refused(std::string(e.what()) + (restored ? "; the port's previous IPv4 configuration is applied again"
                                                      : "; the port's previous IPv4 configuration could not be applied again"));
   }
}

void ModuleSession::clear(uint32_t portID, const std::optional<std::vector<std::string>> &key)
{
   std::lock_guard guard(mutex_);
   drainLogLocked();
   const size_t mark = logTail_.size();
   // An IPv6 address is the IPv6 agent's to clear (every binding of it on
   // the port); clearing all clears both agents' learned bindings.
   const bool ipv6Key = key && key->size() == 3 && (*key)[2].find(':') != std::string::npos;
   std::vector<int64_t> ipv6Ports;
   const bool hasIpv6 = host_.nexo().list("/ipv6", &ipv6Ports) == ORR_OK &&
                        std::find(ipv6Ports.begin(), ipv6Ports.end(), int64_t{portID}) != ipv6Ports.end();
   orr_Status status = ORR_OK;
   if (ipv6Key) {
      status = host_.nexo().set(ipv6Path(portID) + "/clear", {(*key)[2]});
   } else {
      std::vector<std::string> args{key ? "one" : "all"};
      if (key) {
         args.insert(args.end(), key->begin(), key->end());
      }
      status = host_.nexo().set(portPath(portID) + "/clearVmi", args);
      if (!key && hasIpv6 && (status == ORR_OK || status == ORR_NOT_FOUND)) {
         status = host_.nexo().set(ipv6Path(portID) + "/clear", {});
      }
   }
   if (status != ORR_OK) {
      std::string message = errorsSince(mark);
      throw Refused("clear refused: " + (message.empty() ? orr_StatusToString(status) : message));
   }
}

DropCounters ModuleSession::dropCounters(uint32_t portID)
{
   host::NexoRecord summary;
   DropCounters counters;
   if (host_.nexo().get(portPath(portID) + "/featureSummary", &summary) == ORR_OK) {
      counters = countersOf(kDropCounterFields, summary.values());
   }
   host::NexoRecord ipv6;
   if (host_.nexo().get(ipv6Path(portID) + "/summary", &ipv6) == ORR_OK) {
      counters.merge(countersOf(kIpv6CounterFields, ipv6.values()));
   }
   return counters;
}

std::optional<std::chrono::seconds> ModuleSession::soonestExpiry(uint32_t portID)
{
   const std::string path = portPath(portID) + "/vmi";
   std::vector<int64_t> instances;
   if (host_.nexo().list(path, &instances) != ORR_OK) {
      return std::nullopt;
   }
   std::optional<std::chrono::seconds> soonest;
   for (int64_t instance : instances) {
      host::NexoRecord vmi;
      if (host_.nexo().get(path + "/" + std::to_string(instance), &vmi) != ORR_OK) {
         return std::chrono::seconds(0);   // unknown: tick on
      }
      const auto values = vmi.values();
      const auto found = values.find("timeRemaining");
      if (found == values.end() || found->second == "N/A") {
         continue;   // a static binding does not expire
      }
      uint64_t seconds = 0;
      const char *end = found->second.data() + found->second.size();
      if (std::from_chars(found->second.data(), end, seconds).ec != std::errc{}) {
         return std::chrono::seconds(0);
      }
      const std::chrono::seconds left(seconds);
      soonest = soonest ? std::min(*soonest, left) : left;
   }
   return soonest;
}

std::optional<Ipv6PortState> ModuleSession::readIpv6State(uint32_t portID)
{
   const std::string port = ipv6Path(portID);
   host::NexoRecord summary;
   if (host_.nexo().get(port + "/summary", &summary) != ORR_OK) {
      return std::nullopt;
   }
   Ipv6PortState state;
   state.summary = summary.values();
   state.summaryText = summary.text();
   state.counters = countersOf(kIpv6CounterFields, state.summary);
   for (const NodeValues &values : tableValues(host_.nexo(), port + "/bindings")) {
      Ipv6Binding &binding = state.bindings.emplace_back();
      (void)parseCount(fieldOf(values, "vlanId"), binding.vlan);
      binding.mac = fieldOf(values, "mac");
      binding.ip = ipv6Text(fieldOf(values, "addr"));
      binding.method = fieldOf(values, "method");
      binding.timeRemaining = fieldOf(values, "timeRemaining");
   }
   return state;
}

PortState ModuleSession::readState(uint32_t portID)
{
   PortState state;
   state.ipv6 = readIpv6State(portID);
   const std::string port = portPath(portID);
   host::NexoRecord summary;
   if (host_.nexo().get(port + "/featureSummary", &summary) == ORR_OK) {
      state.featureSummary = summary.values();
      state.featureSummaryText = summary.text();
      state.counters = countersOf(kDropCounterFields, *state.featureSummary);
   }
   for (const NodeValues &values : tableValues(host_.nexo(), port + "/vmi")) {
      PortDbEntry &entry = state.portDb.emplace_back();
      (void)parseCount(fieldOf(values, "vlanId"), entry.vlan);
      entry.mac = fieldOf(values, "macAddr");
      entry.ip = fieldOf(values, "ipAddr");
      entry.method = fieldOf(values, "discoveryMethod");
      entry.timeRemaining = fieldOf(values, "timeRemaining");
      entry.chaddr = fieldOf(values, "chaddr");
      entry.clientIdLen = fieldOf(values, "clientIdLen");
      entry.serverIp = fieldOf(values, "serverIp");
      entry.leaseTime = fieldOf(values, "leaseTime");
   }
   return state;
}

std::vector<PortDbNotification> ModuleSession::takeNotifications()
{
   std::vector<PortDbNotification> notes;
   for (const auto &message : host_.portsets().takePosted()) {
      if (auto note = decodePortDbMessage(message)) {
         notes.push_back(std::move(*note));
      }
   }
   return notes;
}

std::vector<host::LogRecord> ModuleSession::takeLog()
{
   std::lock_guard guard(mutex_);
   drainLogLocked();
   std::vector<host::LogRecord> taken;
   taken.swap(logTail_);
   return taken;
}

void ModuleSession::report(const std::string &violation)
{
   std::lock_guard guard(violationsMutex_);
   violations_.push_back(violation);
   if (forward_) {
      forward_(violation);
   }
}

std::vector<std::string> ModuleSession::finish()
{
   std::lock_guard guard(mutex_);
   if (finished_ || !host_.loaded()) {
      finished_ = true;
      std::lock_guard violations(violationsMutex_);
      return violations_;
   }
   finished_ = true;
   for (host::FilterId filter : filters_) {
      const host::DestroyResult destroyed = host_.sifra().destroyFilterAsHypervisor(filter);
      if (destroyed.status != ORR_OK) {
         report(std::string("the port could not be destroyed: ") + orr_StatusToString(destroyed.status));
      }
   }
   filters_.clear();
   {
      std::lock_guard ports(portsMutex_);
      ports_.clear();
   }
   const orr_Status unloaded = host_.unload();
   if (unloaded != ORR_OK) {
      report(std::string("the module did not unload: ") + orr_StatusToString(unloaded));
   }
   drainLogLocked();
   std::lock_guard violations(violationsMutex_);
   return violations_;
}

}  // namespace swsec::session
