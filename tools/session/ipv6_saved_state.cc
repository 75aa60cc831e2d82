// The IPv6 agent's saved part, through the contract's layout records.
#include "session/ipv6_saved_state.h"

#include "session/blob_record.h"
#include "session/ipv6_config.h"
#include "session/serializer.h"

#include <algorithm>
#include <cstring>
#include <optional>
#include <string>

namespace swsec::session {

namespace {

const char *ipv6MethodName(uint8_t method)
{
   return method == FhsBindDhcpv6 ? "DHCPv6" : method == FhsBindStatic ? "Static" : "First come first served";
}

std::string ipv6FeatureNames(uint32_t features)
{
   std::string text;
#define SWSEC_SESSION_FEATURE_TEXT(name, bit, summary) \
   if ((features & (bit)) != 0) {                      \
      text += summary;                                 \
   }
   FHS_FEATURE_LIST(SWSEC_SESSION_FEATURE_TEXT)
#undef SWSEC_SESSION_FEATURE_TEXT
   if (!text.empty()) {
      text.pop_back();
   }
   return text.empty() ? "none" : text;
}

// The rules FhsConfigure holds a record to.
void checkIpv6Config(const FhsConfig &config, const std::vector<FhsBindingKey> &statics)
{
   const uint32_t limit = config.bindingLimit == 0 ? FHS_DEFAULT_BINDING_LIMIT : config.bindingLimit;
   if (config.version != FHS_CONFIG_VERSION || limit > FHS_BINDING_LIMIT_MAX || config.numStatic > limit) {
      throw BadSavedState("IPv6 configuration refused: version " + number(config.version) + ", binding limit " +
                          number(config.bindingLimit) + " with " + number(config.numStatic) + " static");
   }
   if (config.ndRateLimit != 0 &&
       (config.ndRateLimit > FHS_ND_RATE_LIMIT_MAX || config.errRateLimit >= config.ndRateLimit ||
        config.errRateLimit > FHS_ERR_RATE_LIMIT_MAX || config.errRateLimitPeriod < FHS_ERR_RATE_LIMIT_PERIOD_MIN)) {
      throw BadSavedState("IPv6 configuration refused: ND rate limit " + number(config.ndRateLimit) + ", " +
                          number(config.errRateLimit) + " for " + number(config.errRateLimitPeriod) + " s");
   }
   static constexpr uint8_t kUnspecified[16] = {};
   for (const FhsBindingKey &key : statics) {
      if (key.addr[0] == 0xff || std::memcmp(key.addr, kUnspecified, sizeof kUnspecified) == 0 || key.vlanId > 4095) {
         throw BadSavedState("IPv6 configuration refused: static binding " + ipv6Text(key.addr));
      }
   }
}

}  // namespace

bool isIpv6SavedState(std::span<const uint8_t> blob)
{
   if (blob.size() < sizeof(SifraGenericStateHeader)) {
      return false;
   }
   const auto header = recordAt<SifraGenericStateHeader>(blob.data());
   uint64_t end = 0;
   return header.agentLen >= sizeof(uint32_t) &&
          !__builtin_add_overflow(header.agentOffset, uint64_t{sizeof(uint32_t)}, &end) && end <= blob.size() &&
          recordAt<uint32_t>(blob.data() + header.agentOffset) == FHS_SAVED_MAGIC;
}

SavedIpv6State decodeIpv6SavedState(std::span<const uint8_t> blob)
{
   SavedIpv6State state;
   state.header = decodeSavedStateHeader(blob);
   const std::span<const uint8_t> part = blob.subspan(static_cast<size_t>(state.header.agentOffset),
                                                      static_cast<size_t>(state.header.agentLen));
   if (part.size() < sizeof(FhsSavedState)) {
      throw BadSavedState("the IPv6 agent's part is " + number(part.size()) + " bytes, under its 104-byte fixed part");
   }
   const auto fixed = recordAt<FhsSavedState>(part.data());
   const uint64_t bindingsAt = sizeof(FhsSavedState) + uint64_t{fixed.configLen};
   if (fixed.magic != FHS_SAVED_MAGIC || fixed.configLen < sizeof(FhsConfig) ||
       bindingsAt + sizeof(FhsSavedBinding) * uint64_t{fixed.numBindings} > part.size()) {
      throw BadSavedState("the IPv6 agent's part is corrupt (" + number(fixed.configLen) + " bytes of configuration, " +
                          number(fixed.numBindings) + " bindings, " + number(part.size()) + " bytes)");
   }
   state.config = recordAt<FhsConfig>(part.data() + sizeof(FhsSavedState));
   if (fixed.configLen != FhsConfigLength(state.config.numStatic)) {
      throw BadSavedState("the IPv6 configuration is " + number(fixed.configLen) + " bytes for " +
                          number(state.config.numStatic) + " static bindings");
   }
   for (uint32_t i = 0; i < state.config.numStatic; ++i) {
      state.statics.push_back(
         recordAt<FhsBindingKey>(part.data() + sizeof(FhsSavedState) + sizeof(FhsConfig) + i * sizeof(FhsBindingKey)));
   }
   checkIpv6Config(state.config, state.statics);
   for (uint32_t i = 0; i < fixed.numBindings; ++i) {
      const auto binding = recordAt<FhsSavedBinding>(part.data() + bindingsAt + i * sizeof(FhsSavedBinding));
      if ((binding.method != FhsBindDhcpv6 && binding.method != FhsBindFcfs) || binding.remaining == 0) {
         throw BadSavedState("IPv6 binding " + number(i) + " is corrupt (method " + number(binding.method) + ", " +
                             number(binding.remaining) + " s left)");
      }
      state.bindings.push_back(binding);
   }
   state.ndRateLimitErr = fixed.ndRateLimitErr != 0;
   state.ndRateLimitErrRemaining = fixed.ndRateLimitErrRemaining;
   state.counters = fixed.counters;
   return state;
}

std::vector<uint8_t> ageIpv6SavedState(std::span<const uint8_t> blob, int64_t elapsedSeconds)
{
   const SavedIpv6State state = decodeIpv6SavedState(blob);
   std::vector<uint8_t> out(blob.begin(), blob.end());
   if (elapsedSeconds <= 0) {
      return out;
   }
   const size_t agent = static_cast<size_t>(state.header.agentOffset);
   FhsSavedState fixed = recordAt<FhsSavedState>(blob.data() + agent);
   if (fixed.ndRateLimitErr != 0) {
      fixed.ndRateLimitErrRemaining = std::max<int64_t>(fixed.ndRateLimitErrRemaining - elapsedSeconds, 0);
      fixed.ndRateLimitErr = fixed.ndRateLimitErrRemaining > 0 ? 1 : 0;
   }
   // The bindings still alive are rewritten over the first slots; the rest
   // of the blob (the slow path's part) moves up behind them.
   const size_t first = agent + sizeof(FhsSavedState) + fixed.configLen;
   size_t write = first;
   for (FhsSavedBinding binding : state.bindings) {
      if (binding.remaining > elapsedSeconds) {
         binding.remaining -= static_cast<uint32_t>(elapsedSeconds);
         std::memcpy(out.data() + write, &binding, sizeof binding);
         write += sizeof binding;
      }
   }
   const size_t end = first + state.bindings.size() * sizeof(FhsSavedBinding);
   out.erase(out.begin() + static_cast<std::ptrdiff_t>(write), out.begin() + static_cast<std::ptrdiff_t>(end));
   fixed.numBindings = static_cast<uint32_t>((write - first) / sizeof(FhsSavedBinding));
   std::memcpy(out.data() + agent, &fixed, sizeof fixed);
   auto header = recordAt<SifraGenericStateHeader>(out.data());
   header.agentLen -= end - write;
   header.slowPathOffset -= end - write;
   std::memcpy(out.data(), &header, sizeof header);
   return out;
}

nlohmann::json ipv6SavedStateJson(const SavedIpv6State &state)
{
   using nlohmann::json;
   const SavedPortState &h = state.header;
   json counters = json::object();
#define SWSEC_SESSION_COUNTER(name, text) counters[#name] = state.counters.name;
   FHS_DROP_LIST(SWSEC_SESSION_COUNTER)
#undef SWSEC_SESSION_COUNTER
   counters["ndRateLimitErrEntryCnt"] = state.counters.ndRateLimitErrEntryCnt;
   counters["bindingsEvictedCnt"] = state.counters.bindingsEvictedCnt;
   json bindings = json::array();
   auto add = [&bindings](const FhsBindingKey &key, uint8_t method, std::optional<uint32_t> remaining) {
      Ipv6Binding binding{key.vlanId, macText(key.mac), ipv6Text(key.addr), ipv6MethodName(method),
                          remaining ? std::to_string(*remaining) : "never"};
      bindings.push_back(ipv6BindingJson(binding));
   };
   for (const FhsBindingKey &key : state.statics) {
      add(key, FhsBindStatic, std::nullopt);
   }
   for (const FhsSavedBinding &binding : state.bindings) {
      add(binding.key, binding.method, uint32_t{binding.remaining});
   }
   const FhsConfig &c = state.config;
   return {{"header",
            {{"version", h.version},
             {"agentOffset", h.agentOffset},
             {"agentLen", h.agentLen},
             {"slowPathOffset", h.slowPathOffset},
             {"slowPathLen", h.slowPathLen}}},
           {"ipv6",
            {{"config",
              {{"featuresEnabled", uint32_t{c.featuresEnabled}},
               {"features", ipv6FeatureNames(uint32_t{c.featuresEnabled})},
               {"trusted", c.trusted != 0},
               {"bindingLimit", uint32_t{c.bindingLimit}},
               {"numStatic", uint32_t{c.numStatic}},
               {"ndRateLimit", uint32_t{c.ndRateLimit}},
               {"errRateLimit", uint32_t{c.errRateLimit}},
               {"errRateLimitPeriod", uint32_t{c.errRateLimitPeriod}},
               {"fcfsLifetime", uint32_t{c.fcfsLifetime}}}},
             {"ndErrorState", {{"active", state.ndRateLimitErr}, {"remainingSeconds", state.ndRateLimitErrRemaining}}},
             {"counters", std::move(counters)},
             {"bindings", std::move(bindings)}}}};
}

void printIpv6SavedState(std::ostream &out, const SavedIpv6State &state)
{
   const nlohmann::json doc = ipv6SavedStateJson(state);
   const nlohmann::json &ipv6 = doc["ipv6"];
   const FhsConfig &c = state.config;
   out << "Saved IPv6 first-hop security state, version " << state.header.version << ": agent part "
       << state.header.agentLen << " bytes at " << state.header.agentOffset << "\n\nConfiguration\n"
       << "   features:       " << ipv6["config"]["features"].get<std::string>() << "\n"
       << "   port mode:      " << (c.trusted != 0 ? "trusted" : "untrusted") << "\n"
       << "   binding limit:  " << c.bindingLimit << " (0: the default) with " << c.numStatic << " static\n"
       << "   ND rate limit:  " << c.ndRateLimit << "/s, " << c.errRateLimit << "/s for " << c.errRateLimitPeriod
       << " s after a burst\n"
       << "   ND error state: "
       << (state.ndRateLimitErr ? "active, " + std::to_string(state.ndRateLimitErrRemaining) + " s left" : "not active")
       << "\n\nCounters\n";
   for (const auto &[name, value] : ipv6["counters"].items()) {
      out << "   " << name << ": " << value.dump() << "\n";
   }
   std::vector<std::vector<std::string>> rows{{"VLAN", "MAC", "IPv6", "method", "remaining"}};
   for (const auto &b : ipv6["bindings"]) {
      rows.push_back({b["vlan"].dump(), b["mac"].get<std::string>(), b["ip"].get<std::string>(),
                      b["method"].get<std::string>(), b["timeRemaining"].is_null() ? "never" : b["timeRemaining"].dump()});
   }
   out << "\nBindings (" << rows.size() - 1 << ")\n" << textTable(rows, "   ");
}

}  // namespace swsec::session
