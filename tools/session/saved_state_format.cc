// Decoding a saved-state blob through the layout records the module
// writes, each copied out only after the blob's length was checked to hold it.
#include "session/saved_state_format.h"

#include "contract/saved_state_layout.h"
#include "session/blob_record.h"
#include "session/serializer.h"

#include <algorithm>
#include <cinttypes>
#include <cstdio>
#include <cstring>

namespace swsec::session {

namespace {

constexpr uint64_t kFixedLen = sizeof(SwSecSavedState);
constexpr uint64_t kEntryLen = sizeof(SwSecSavedVmi);
constexpr uint8_t kDhcpSnooping = SwSecDiscDhcpSnooping;
constexpr uint8_t kStatic = SwSecDiscStatic;

std::string hexText(const std::vector<uint8_t> &bytes)
{
   std::string text;
   for (uint8_t byte : bytes) {
      char pair[3];
      std::snprintf(pair, sizeof pair, "%02x", byte);
      text += pair;
   }
   return text;
}

void decodeHeader(std::span<const uint8_t> blob, SavedPortState &state)
{
   if (blob.size() < sizeof(SifraGenericStateHeader)) {
      throw BadSavedState("too short for the 48-byte header (" + number(blob.size()) + " bytes)");
   }
   const auto header = recordAt<SifraGenericStateHeader>(blob.data());
   if (header.magic != SIFRAGENERIC_STATE_MAGIC) {
      char text[19];
      std::snprintf(text, sizeof text, "0x%016" PRIx64, header.magic);
      throw BadSavedState(std::string("not a saved state (magic ") + text + ", expected \"sifgsave\")");
   }
   state.version = header.version;
   state.agentOffset = header.agentOffset;
   state.agentLen = header.agentLen;
   state.slowPathOffset = header.slowPathOffset;
   state.slowPathLen = header.slowPathLen;
   if (state.version != SIFRAGENERIC_STATE_VERSION) {
      throw BadSavedState("version " + number(state.version) + " (this tool reads version 1)");
   }
   uint64_t slowPathEnd = 0;
   if (__builtin_add_overflow(state.slowPathOffset, state.slowPathLen, &slowPathEnd) || slowPathEnd > blob.size()) {
      throw BadSavedState("the slow path's part (offset " + number(state.slowPathOffset) + ", " +
                          number(state.slowPathLen) + " bytes) runs past the " + number(blob.size()) +
                          "-byte blob");
   }
   uint64_t agentEnd = 0;
   if (state.agentOffset < SIFRAGENERIC_STATE_HEADER_LEN || __builtin_add_overflow(state.agentOffset, state.agentLen, &agentEnd) ||
       state.slowPathOffset < agentEnd) {
      throw BadSavedState("bad part offsets (agent at " + number(state.agentOffset) + ", " + number(state.agentLen) +
                          " bytes; slow path at " + number(state.slowPathOffset) + ")");
   }
}

// Remaining times as the module keeps them: unsigned 32-bit seconds.
constexpr int64_t kMaxSeconds = UINT32_MAX;

bool isSeconds(int64_t value)
{
   return value >= 0 && value <= kMaxSeconds;
}

// The rules a new configuration is held to, which the module's restore
// applies to a saved one.
void checkConfig(const SavedPortState &state, uint32_t numSaved)
{
   const uint32_t features = state.featuresEnabled;
   if ((features & SwSecFeaturesNeedingDiscovery) != 0 &&
       ((features & SwSecFeatureIpDiscovery) == 0 || state.trusted != 0)) {
      throw BadSavedState("configuration refused: features " + featureNames(features) +
                          (state.trusted != 0 ? " on a trusted port" : " without ip-discovery"));
   }
   if ((features & SwSecFeatureDai) != 0 && state.arpRateLimit != 0 &&
       (state.arpRateLimit > SWSEC_ARP_RATE_LIMIT_MAX || state.errRateLimit >= state.arpRateLimit ||
        state.errRateLimit > SWSEC_ERR_RATE_LIMIT_MAX || state.errRateLimitPeriod < SWSEC_ERR_RATE_LIMIT_PERIOD_MIN)) {
      throw BadSavedState("configuration refused: ARP rate limit " + number(state.arpRateLimit) + ", " +
                          number(state.errRateLimit) + " for " + number(state.errRateLimitPeriod) + " s");
   }
   if ((features & SwSecFeatureIpDiscovery) == 0) {
      return;
   }
   const std::string sizes =
      "configuration refused: port database of " + number(state.portDbSize) + " entries with " + number(numSaved) + " saved";
   if (state.portDbSize < SWSEC_PORT_DB_SIZE_MIN || state.portDbSize > SWSEC_PORT_DB_SIZE_MAX) {
      throw BadSavedState(sizes);
   }
   // The module's restore drops the bindings past the size; a save never
   // makes such a file, so the tool refuses it rather than guess which go.
   if (numSaved > state.portDbSize) {
      throw BadSavedState(sizes, false);
   }
}

SavedBinding decodeBinding(const SwSecSavedVmi &entry)
{
   SavedBinding binding;
   binding.vlan = entry.vlanId;
   std::memcpy(binding.mac.data(), entry.macAddr, binding.mac.size());
   const uint32_t ip = entry.ipAddr;   // network order, as the bytes stand
   std::memcpy(binding.ip.data(), &ip, binding.ip.size());
   binding.method = entry.discoveryMethod;
   binding.timeRemaining = entry.timeRemaining;
   if (binding.method == kDhcpSnooping) {
      std::memcpy(binding.chaddr.data(), entry.chaddr, binding.chaddr.size());
      const uint32_t serverIp = entry.serverIp;
      std::memcpy(binding.serverIp.data(), &serverIp, binding.serverIp.size());
      binding.leaseTime = entry.leaseTime;
   }
   return binding;
}

// The frame guard block after the entries at `position`, as the module's
// restore reads it: whole, or absent from a version-1 configuration.
void decodeFrameGuard(std::span<const uint8_t> part, uint64_t position, SavedPortState &state)
{
   if (part.size() - position < sizeof(SwSecSavedFrameGuard)) {
      if (SwSecConfigHasFrameGuard(state.configVersion)) {
         throw BadSavedState("a version " + number(state.configVersion) + " configuration without its " +
                             number(sizeof(SwSecSavedFrameGuard)) + "-byte frame guard after the bindings");
      }
      return;
   }
   const auto saved = recordAt<SwSecSavedFrameGuard>(part.data() + position);
   const SwSecFrameGuard guard = saved.guard;
   if (guard.numEtherTypes > SWSEC_ETHERTYPES_MAX) {
      throw BadSavedState("frame guard of " + number(guard.numEtherTypes) + " ethertypes (at most " +
                          number(SWSEC_ETHERTYPES_MAX) + ")");
   }
   state.allowTagged = (guard.flags & SwSecFrameGuardAllowTagged) != 0;
   for (uint32_t i = 0; i < guard.numEtherTypes; ++i) {
      state.etherTypes.push_back(guard.etherTypes[i]);
   }
   state.taggedDropCnt = saved.taggedDropCnt;
   state.etherTypeDropCnt = saved.etherTypeDropCnt;
}

// "0x0800,0x0806", or "any" for no list.
std::string etherTypeText(const std::vector<uint16_t> &types)
{
   std::string text;
   for (const uint16_t type : types) {
      char one[8];
      std::snprintf(one, sizeof one, "0x%04x", static_cast<unsigned>(type));
      text += (text.empty() ? "" : ",") + std::string(one);
   }
   return text.empty() ? "any" : text;
}

void decodeAgentPart(std::span<const uint8_t> part, SavedPortState &state)
{
   if (part.size() < kFixedLen) {
      throw BadSavedState("the agent's part has " + number(part.size()) + " bytes, fewer than its fixed 96");
   }
   const auto fixed = recordAt<SwSecSavedState>(part.data());
   state.configVersion = fixed.config.version;
   state.featuresEnabled = fixed.config.featuresEnabled;
   state.trusted = fixed.config.trusted;
   state.portDbSize = fixed.config.portDbSize;
   state.numStatic = fixed.config.numStatic;
   state.arpRateLimit = fixed.config.arpRateLimit;
   state.errRateLimit = fixed.config.errRateLimit;
   state.errRateLimitPeriod = fixed.config.errRateLimitPeriod;
   const uint32_t numSaved = fixed.numSavedVmis;
   state.txRateLimitErr = fixed.txRateLimitErr != 0;
   state.txRateLimitErrRemaining = fixed.txRateLimitErrRemaining;
   const SwSecDropCounters counters = fixed.counters;
   state.counters = {counters.dhcpSnoopingDropCnt,    counters.daiDropCnt,         counters.txRateLimitDropCnt,
                     counters.txRateLimitErrEntryCnt, counters.rxRateLimitDropCnt, counters.ipSrcGuardDropCnt};
   if (numSaved != 0 && (state.featuresEnabled & SwSecFeatureIpDiscovery) == 0) {
      throw BadSavedState(number(numSaved) + " bindings saved with IP discovery off");
   }
   checkConfig(state, numSaved);
   if (state.txRateLimitErr && !isSeconds(state.txRateLimitErrRemaining)) {
      throw BadSavedState("error-rate-limit state with " + std::to_string(state.txRateLimitErrRemaining) +
                          " s left, outside 0 to " + number(kMaxSeconds), false);
   }

   uint64_t position = kFixedLen;
   for (uint32_t i = 0; i < numSaved; ++i) {
      if (kEntryLen > part.size() - position) {
         throw BadSavedState("binding " + number(i + 1) + " of " + number(numSaved) + " runs past the agent's " +
                             number(part.size()) + "-byte part");
      }
      const auto entry = recordAt<SwSecSavedVmi>(part.data() + position);
      SavedBinding binding = decodeBinding(entry);
      if (methodName(binding.method).starts_with("unknown")) {
         throw BadSavedState("binding " + number(i + 1) + " of " + number(numSaved) + ": discovery method " +
                             number(binding.method) + " (known: 1, 2, 4, 8)", false);
      }
      if (!isSeconds(binding.timeRemaining)) {
         throw BadSavedState("binding " + number(i + 1) + " of " + number(numSaved) + ": " +
                             std::to_string(binding.timeRemaining) + " s left, outside 0 to " + number(kMaxSeconds),
                             false);
      }
      const uint8_t clientIdLen = binding.method == kDhcpSnooping ? entry.clientIdLen : 0;
      if (kEntryLen + clientIdLen > part.size() - position) {
         throw BadSavedState("binding " + number(i + 1) + " of " + number(numSaved) + " runs past the agent's " +
                             number(part.size()) + "-byte part");
      }
      const uint8_t *clientId = part.data() + position + kEntryLen;
      binding.clientId.assign(clientId, clientId + clientIdLen);
      state.bindings.push_back(std::move(binding));
      position += kEntryLen + clientIdLen;
   }
   decodeFrameGuard(part, position, state);
}

}  // namespace

SavedPortState decodeSavedState(std::span<const uint8_t> blob)
{
   SavedPortState state;
   decodeHeader(blob, state);
   if (state.agentLen != 0) {
      decodeAgentPart(blob.subspan(static_cast<size_t>(state.agentOffset), static_cast<size_t>(state.agentLen)), state);
   }
   return state;
}

SavedPortState decodeSavedStateHeader(std::span<const uint8_t> blob)
{
   SavedPortState state;
   decodeHeader(blob, state);
   return state;
}

std::vector<uint8_t> ageSavedState(std::span<const uint8_t> blob, int64_t elapsedSeconds)
{
   const SavedPortState state = decodeSavedState(blob);
   std::vector<uint8_t> out(blob.begin(), blob.end());
   if (state.agentLen == 0 || elapsedSeconds <= 0) {
      return out;
   }
   auto put = [&out](size_t at, uint64_t value, size_t size) {
      for (size_t i = 0; i < size; ++i) {
         out[at + i] = static_cast<uint8_t>(value >> (8 * i));
      }
   };
   const size_t agent = static_cast<size_t>(state.agentOffset);
   if (state.txRateLimitErr) {
      const int64_t left = state.txRateLimitErrRemaining - elapsedSeconds;
      out[agent + offsetof(SwSecSavedState, txRateLimitErr)] = left > 0 ? 1 : 0;
      put(agent + offsetof(SwSecSavedState, txRateLimitErrRemaining), static_cast<uint64_t>(std::max<int64_t>(left, 0)),
          8);
   }
   // Entries are rewritten in place and the survivors moved up over those
   // whose time ran out; whatever followed the part moves up with them.
   size_t read = agent + kFixedLen;
   size_t write = read;
   uint32_t kept = 0;
   for (const SavedBinding &binding : state.bindings) {
      const size_t length = kEntryLen + binding.clientId.size();
      const int64_t left = binding.timeRemaining - elapsedSeconds;
      if (binding.method == kStatic || left > 0) {
         std::memcpy(out.data() + write, blob.data() + read, length);
         if (binding.method != kStatic) {
            put(write + offsetof(SwSecSavedVmi, timeRemaining), static_cast<uint64_t>(left), 8);
         }
         write += length;
         ++kept;
      }
      read += length;
   }
   const size_t removed = read - write;
   out.erase(out.begin() + static_cast<std::ptrdiff_t>(write), out.begin() + static_cast<std::ptrdiff_t>(read));
   put(agent + offsetof(SwSecSavedState, numSavedVmis), kept, 4);
   put(offsetof(SifraGenericStateHeader, agentLen), state.agentLen - removed, 8);
   put(offsetof(SifraGenericStateHeader, slowPathOffset), state.slowPathOffset - removed, 8);
   return out;
}

std::string methodName(uint8_t method)
{
   switch (method) {
   case 1:
      return "DHCP Snooping";
   case 2:
      return "Static";
   case 4:
      return "TOFU";
   case 8:
      return "ARP Snooping";
   default:
      return "unknown (" + number(method) + ")";
   }
}

std::string featureNames(uint32_t features)
{
   static constexpr std::pair<uint32_t, const char *> kNames[] = {
      {0x01, "bpdu-filter"}, {0x02, "block-dhcp-server"}, {0x04, "ip-discovery"}, {0x08, "dai"}, {0x10, "ip-source-guard"}};
   std::string text;
   for (const auto &[bit, name] : kNames) {
      if ((features & bit) != 0) {
         text += (text.empty() ? "" : ",") + std::string(name);
      }
   }
   if ((features & ~0x1fu) != 0) {
      char rest[16];
      std::snprintf(rest, sizeof rest, "0x%x", features & ~0x1fu);
      text += (text.empty() ? "" : ",") + std::string(rest);
   }
   return text.empty() ? "none" : text;
}

nlohmann::json savedStateJson(const SavedPortState &state)
{
   using nlohmann::json;
   json doc;
   doc["header"] = {{"version", state.version},
                    {"agentOffset", state.agentOffset},
                    {"agentLen", state.agentLen},
                    {"slowPathOffset", state.slowPathOffset},
                    {"slowPathLen", state.slowPathLen}};
   if (state.agentLen == 0) {
      doc["config"] = nullptr;
      doc["errorRateLimit"] = nullptr;
      doc["frameGuard"] = nullptr;
      doc["counters"] = nullptr;
      doc["bindings"] = json::array();
      return doc;
   }
   doc["config"] = {{"version", state.configVersion},
                    {"featuresEnabled", state.featuresEnabled},
                    {"features", featureNames(state.featuresEnabled)},
                    {"trusted", state.trusted != 0},
                    {"portDbSize", state.portDbSize},
                    {"numStatic", state.numStatic},
                    {"arpRateLimit", state.arpRateLimit},
                    {"errRateLimit", state.errRateLimit},
                    {"errRateLimitPeriod", state.errRateLimitPeriod}};
   doc["errorRateLimit"] = {{"active", state.txRateLimitErr}, {"remainingSeconds", state.txRateLimitErrRemaining}};
   // An empty list allows any ethertype.
   doc["frameGuard"] = {{"allowTagged", state.allowTagged}, {"etherTypes", state.etherTypes}};
   json counters = json::object();
   for (size_t i = 0; i < state.counters.size(); ++i) {
      counters[kSavedCounterNames[i]] = state.counters[i];
   }
   counters["taggedDropCnt"] = state.taggedDropCnt;
   counters["etherTypeDropCnt"] = state.etherTypeDropCnt;
   doc["counters"] = std::move(counters);
   json bindings = json::array();
   for (const SavedBinding &b : state.bindings) {
      // As the port's "vmi" node would show it once restored, plus the
      // client identifier the node gives only the length of.
      const bool dhcp = b.method == kDhcpSnooping;
      PortDbEntry entry;
      entry.vlan = b.vlan;
      entry.mac = macText(b.mac.data());
      entry.ip = ipText(b.ip.data());
      entry.method = methodName(b.method);
      entry.timeRemaining = b.method == kStatic ? "N/A" : std::to_string(b.timeRemaining) + " sec";
      entry.chaddr = dhcp ? macText(b.chaddr.data()) : "N/A";
      entry.clientIdLen = dhcp ? std::to_string(b.clientId.size()) : "N/A";
      entry.serverIp = dhcp ? ipText(b.serverIp.data()) : "N/A";
      entry.leaseTime = dhcp ? std::to_string(b.leaseTime) : "N/A";
      json shown = bindingJson(entry);
      shown["clientId"] = dhcp ? json(hexText(b.clientId)) : json(nullptr);
      bindings.push_back(std::move(shown));
   }
   doc["bindings"] = std::move(bindings);
   return doc;
}

void printSavedState(std::ostream &out, const SavedPortState &state)
{
   out << "Saved state, version " << state.version << ": agent part " << state.agentLen << " bytes at "
       << state.agentOffset << ", slow path part " << state.slowPathLen << " bytes at " << state.slowPathOffset
       << "\n";
   if (state.agentLen == 0) {
      out << "No agent part.\n";
      return;
   }
   out << "\nConfiguration\n"
       << "   features:            " << featureNames(state.featuresEnabled) << "\n"
       << "   port mode:           " << (state.trusted != 0 ? "trusted" : "untrusted") << "\n"
       << "   port database size:  " << state.portDbSize << " (" << state.numStatic << " static)\n"
       << "   ARP rate limit:      " << state.arpRateLimit << "/s, " << state.errRateLimit << "/s for "
       << state.errRateLimitPeriod << " s after a burst\n"
       << "   tagged frames:       " << (state.allowTagged ? "allowed" : "dropped") << "\n"
       << "   ethertypes:          " << etherTypeText(state.etherTypes) << "\n";
   out << "   error rate limit:    ";
   if (state.txRateLimitErr) {
      out << "active, " << state.txRateLimitErrRemaining << " s left\n";
   } else {
      out << "not active\n";
   }
   out << "\nCounters\n";
   for (size_t i = 0; i < state.counters.size(); ++i) {
      out << "   " << kSavedCounterNames[i] << ": " << state.counters[i] << "\n";
   }
   out << "   taggedDropCnt: " << state.taggedDropCnt << "\n"
       << "   etherTypeDropCnt: " << state.etherTypeDropCnt << "\n";
   out << "\nBindings (" << state.bindings.size() << ")\n";
   for (const SavedBinding &b : state.bindings) {
      out << "   vlan " << b.vlan << "  " << macText(b.mac.data()) << "  " << ipText(b.ip.data()) << "  " << methodName(b.method);
      if (b.method != kStatic) {
         out << "  " << b.timeRemaining << " s left";
      }
      if (b.method == kDhcpSnooping) {
         out << "  chaddr " << macText(b.chaddr.data()) << "  server " << ipText(b.serverIp.data()) << "  lease " << b.leaseTime
             << " s  client id " << (b.clientId.empty() ? std::string("none") : hexText(b.clientId));
      }
      out << "\n";
   }
}

}  // namespace swsec::session
