/* The first-hop security agent's management nodes. */
#include "fhs/fhs_nexo.h"

#include "fhs/fhs_agent.h"
#include "fhs/fhs_bindings.h"
#include "fhs/fhs_export.h"
#include "framework/sifra_generic.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_log.h"
#include "platform/orr_text.h"

#include <cstddef>

#define FHS_NEXO_TEXT(field, text) \
   {.name = #field, .label = text, .type = NEXO_FIELD_CHARS, .offset = offsetof(FhsNexo_Summary, field), \
    .size = sizeof(FhsNexo_Summary::field), .enumDef = nullptr}

static constexpr Nexo_FieldDef fhsNexoSummaryFields[] = {
   FHS_NEXO_TEXT(featuresEnabled, "Features enabled"),
   FHS_NEXO_TEXT(portMode, "Port mode"),
   FHS_NEXO_TEXT(bindingLimit, "Binding limit"),
   FHS_NEXO_TEXT(numBindings, "Bindings"),
   FHS_NEXO_TEXT(numDhcpv6, "DHCPv6 bindings"),
   FHS_NEXO_TEXT(numStatic, "Static bindings"),
   FHS_NEXO_TEXT(numFcfs, "First come first served bindings"),
   FHS_NEXO_TEXT(ndRateLimit, "ND rate limit"),
   FHS_NEXO_TEXT(ndRateLimitErr, "In ND error state"),
#define FHS_NEXO_DROP_DEF(field, text) FHS_NEXO_TEXT(field, "Dropped: " text),
   FHS_DROP_LIST(FHS_NEXO_DROP_DEF)
#undef FHS_NEXO_DROP_DEF
   FHS_NEXO_TEXT(bindingsEvictedCnt, "Bindings evicted"),
};

static constexpr Nexo_EnumElement fhsNexoMethodElements[] = {
   {.value = FhsBindDhcpv6, .name = "FhsBindDhcpv6", .label = "DHCPv6"},
   {.value = FhsBindStatic, .name = "FhsBindStatic", .label = "Static"},
   {.value = FhsBindFcfs, .name = "FhsBindFcfs", .label = "First come first served"},
};

static constexpr Nexo_EnumDef fhsNexoMethodEnum = {
   .name = "FhsBindMethodEnum",
   .label = "IPv6 binding method",
   .elements = fhsNexoMethodElements,
   .numElements = sizeof(fhsNexoMethodElements) / sizeof(fhsNexoMethodElements[0]),
};

static constexpr Nexo_FieldDef fhsNexoBindingFields[] = {
   {.name = "vlanId", .label = "VLAN", .type = NEXO_FIELD_CHARS, .offset = offsetof(FhsNexo_Binding, vlanId),
    .size = sizeof(FhsNexo_Binding::vlanId), .enumDef = nullptr},
   {.name = "mac", .label = "MAC", .type = NEXO_FIELD_CHARS, .offset = offsetof(FhsNexo_Binding, mac),
    .size = sizeof(FhsNexo_Binding::mac), .enumDef = nullptr},
   {.name = "addr", .label = "IPv6 address", .type = NEXO_FIELD_CHARS, .offset = offsetof(FhsNexo_Binding, addr),
    .size = sizeof(FhsNexo_Binding::addr), .enumDef = nullptr},
   {.name = "method", .label = "Learned by", .type = NEXO_FIELD_ENUM32, .offset = offsetof(FhsNexo_Binding, method),
    .size = sizeof(FhsNexo_Binding::method), .enumDef = &fhsNexoMethodEnum},
   {.name = "timeRemaining", .label = "Seconds left", .type = NEXO_FIELD_CHARS,
    .offset = offsetof(FhsNexo_Binding, timeRemaining), .size = sizeof(FhsNexo_Binding::timeRemaining),
    .enumDef = nullptr},
};

constinit const Nexo_RecordDef fhsNexoSummaryRecord = {
   .name = "Fhs_Summary",
   .label = "IPv6 first-hop security summary",
   .size = sizeof(FhsNexo_Summary),
   .fields = fhsNexoSummaryFields,
   .numFields = sizeof(fhsNexoSummaryFields) / sizeof(fhsNexoSummaryFields[0]),
};

constinit const Nexo_RecordDef fhsNexoBindingRecord = {
   .name = "Fhs_Binding",
   .label = "IPv6 binding",
   .size = sizeof(FhsNexo_Binding),
   .fields = fhsNexoBindingFields,
   .numFields = sizeof(fhsNexoBindingFields) / sizeof(fhsNexoBindingFields[0]),
};

namespace {

/* The port of instance argument 0, locked as FhsLockPort does; FhsUnlockPort undoes it. */
orr_Status FhsNexoGet(const Nexo_ParamList *instanceArgs, bool write, SifraGenericFastPathAgent **agentOut,
                      FhsContext **ctxOut)
{
   int32_t key = 0;
   const orr_Status status = Nexo_ParamListGetInt32(instanceArgs, 0, &key);
   return status != ORR_OK ? status : FhsLockPort(static_cast<uint32_t>(key), write, agentOut, ctxOut);
}

void Number(char *field, size_t size, uint64_t value)
{
   (void)orr_StringFormat(field, size, 0, "%lu", static_cast<unsigned long>(value));
}

const FhsBinding *BindingAt(const FhsContext *ctx, uint32_t index)
{
   for (const orr_ListLinks *links = ctx->bindingList.next; links != &ctx->bindingList; links = links->next) {
      if (index-- == 0) {
         return reinterpret_cast<const FhsBinding *>(reinterpret_cast<const char *>(links) -
                                                     offsetof(FhsBinding, portLinks));
      }
   }
   return nullptr;
}

int HexDigit(char c)
{
   return c >= '0' && c <= '9' ? c - '0' : c >= 'a' && c <= 'f' ? c - 'a' + 10 : c >= 'A' && c <= 'F' ? c - 'A' + 10 : -1;
}

}  // namespace

bool FhsParseIpv6(const char *text, uint8_t *addr)
{
   uint16_t groups[8] = {};
   int count = 0;
   int gap = -1;   /* where "::" stands, in groups */
   const char *p = text;
   if (p[0] == ':' && p[1] == ':') {
      gap = 0;
      p += 2;
   }
   while (*p != '\0') {
      if (count == 8) {
         return false;
      }
      uint32_t value = 0;
      int digits = 0;
      for (int d; (d = HexDigit(*p)) >= 0; p++) {
         if (++digits > 4) {
            return false;
         }
         value = value << 4 | static_cast<uint32_t>(d);
      }
      if (digits == 0) {
         return false;
      }
      groups[count++] = static_cast<uint16_t>(value);
      if (*p == '\0') {
         break;
      }
      if (*p != ':') {
         return false;
      }
      p++;
      if (*p == ':') {
         if (gap >= 0) {
            return false;
         }
         gap = count;
         p++;
      } else if (*p == '\0') {
         return false;
      }
   }
   if ((gap < 0 && count != 8) || (gap >= 0 && count > 7)) {
      return false;
   }
   uint16_t full[8] = {};
   const int tail = gap < 0 ? 0 : count - gap;
   for (int i = 0; i < count; i++) {
      full[gap >= 0 && i >= gap ? 8 - tail + (i - gap) : i] = groups[i];
   }
   for (int i = 0; i < 8; i++) {
      addr[2 * i] = static_cast<uint8_t>(full[i] >> 8);
      addr[2 * i + 1] = static_cast<uint8_t>(full[i]);
   }
   return true;
}

orr_Status FhsNexoListPorts(const Nexo_NodeDef *, const Nexo_ParamList *, Nexo_ParamList *list)
{
   SifraGenericFastPathAgent *agent = FhsFindAgent();
   if (agent == nullptr) {
      return ORR_OK;
   }
   orr_Status status = ORR_OK;
   orr_SpinlockLock(agent->lock);
   for (orr_ListLinks *links = agent->filterList.next; links != &agent->filterList && status == ORR_OK;
        links = links->next) {
      const auto *ctx = static_cast<const FhsContext *>(SifraGenericFilterFromLinks(links)->agentData);
      if (ctx != nullptr) {
         status = Nexo_ParamListAddInt(list, ctx->portId);
      }
   }
   orr_SpinlockUnlock(agent->lock);
   return status;
}

orr_Status FhsNexoSummaryGet(const Nexo_NodeDef *, const Nexo_ParamList *instanceArgs, void *output)
{
   SifraGenericFastPathAgent *agent = nullptr;
   FhsContext *ctx = nullptr;
   const orr_Status status = FhsNexoGet(instanceArgs, false, &agent, &ctx);
   if (status != ORR_OK) {
      return status;
   }
   auto *summary = static_cast<FhsNexo_Summary *>(output);
   orr_Memset(summary, 0, sizeof(*summary));
   const uint32_t features = ctx->config.featuresEnabled;
   size_t used = 0;
#define FHS_NEXO_FEATURE_TEXT(name, bit, text)                                                           \
   if ((features & (bit)) != 0 && used + sizeof(text) <= sizeof(summary->featuresEnabled)) {             \
      orr_Memcpy(summary->featuresEnabled + used, text, sizeof(text) - 1);                                \
      used += sizeof(text) - 1;                                                                           \
   }
   FHS_FEATURE_LIST(FHS_NEXO_FEATURE_TEXT)
#undef FHS_NEXO_FEATURE_TEXT
   if (features == 0) {
      orr_Memcpy(summary->featuresEnabled, "None", 4);
   }
   orr_Memcpy(summary->portMode, ctx->config.trusted != 0 ? "trusted" : "untrusted", ctx->config.trusted != 0 ? 7 : 9);
   Number(summary->bindingLimit, sizeof(summary->bindingLimit), ctx->bindingLimit);
   Number(summary->numBindings, sizeof(summary->numBindings), ctx->numBindings);
   Number(summary->numDhcpv6, sizeof(summary->numDhcpv6), ctx->numByMethod[0]);
   Number(summary->numStatic, sizeof(summary->numStatic), ctx->numByMethod[1]);
   Number(summary->numFcfs, sizeof(summary->numFcfs), ctx->numByMethod[2]);
   if (ctx->config.ndRateLimit == 0) {
      orr_Memcpy(summary->ndRateLimit, "off", 3);
   } else {
      (void)orr_StringFormat(summary->ndRateLimit, sizeof(summary->ndRateLimit), 0, "%u/s, error state %u/s for %u s",
                             ctx->config.ndRateLimit, ctx->config.errRateLimit, ctx->config.errRateLimitPeriod);
   }
   const bool inError = __atomic_load_n(&ctx->ndRateLimitErr, __ATOMIC_RELAXED) != 0;
   orr_Memcpy(summary->ndRateLimitErr, inError ? "yes" : "no", inError ? 3 : 2);
#define FHS_NEXO_DROP_FILL(name, text) \
   Number(summary->name, sizeof(summary->name), __atomic_load_n(&ctx->counters.name, __ATOMIC_RELAXED));
   FHS_DROP_LIST(FHS_NEXO_DROP_FILL)
#undef FHS_NEXO_DROP_FILL
   Number(summary->bindingsEvictedCnt, sizeof(summary->bindingsEvictedCnt), ctx->counters.bindingsEvictedCnt);
   FhsUnlockPort(agent, ctx, false);
   return ORR_OK;
}

orr_Status FhsNexoListBindings(const Nexo_NodeDef *, const Nexo_ParamList *instanceArgs, Nexo_ParamList *list)
{
   SifraGenericFastPathAgent *agent = nullptr;
   FhsContext *ctx = nullptr;
   orr_Status status = FhsNexoGet(instanceArgs, false, &agent, &ctx);
   if (status != ORR_OK) {
      return status;
   }
   for (uint32_t index = 0; index < ctx->numBindings && status == ORR_OK; index++) {
      status = Nexo_ParamListAddInt(list, index);
   }
   FhsUnlockPort(agent, ctx, false);
   return status;
}

orr_Status FhsNexoBindingGet(const Nexo_NodeDef *, const Nexo_ParamList *instanceArgs, void *output)
{
   SifraGenericFastPathAgent *agent = nullptr;
   FhsContext *ctx = nullptr;
   orr_Status status = FhsNexoGet(instanceArgs, false, &agent, &ctx);
   if (status != ORR_OK) {
      return status;
   }
   uint32_t index = 0;
   status = Nexo_ParamListGetUInt32(instanceArgs, 1, &index);
   const FhsBinding *binding = status == ORR_OK ? BindingAt(ctx, index) : nullptr;
   if (binding == nullptr) {
      FhsUnlockPort(agent, ctx, false);
      return status != ORR_OK ? status : ORR_NOT_FOUND;
   }
   auto *record = static_cast<FhsNexo_Binding *>(output);
   orr_Memset(record, 0, sizeof(*record));
   Number(record->vlanId, sizeof(record->vlanId), binding->key.vlanId);
   const uint8_t *mac = binding->key.mac;
   (void)orr_StringFormat(record->mac, sizeof(record->mac), 0, "%02x:%02x:%02x:%02x:%02x:%02x", mac[0], mac[1], mac[2],
                          mac[3], mac[4], mac[5]);
   FhsFormatAddr(record->addr, binding->key.addr);
   record->method = binding->method;
   if (binding->method == FhsBindStatic) {
      orr_Memcpy(record->timeRemaining, "never", 5);
   } else {
      orr_TimeVal now = {};
      orr_GetUptime(&now);
      const int64_t left = __atomic_load_n(&binding->expiry, __ATOMIC_RELAXED) - now.sec;
      Number(record->timeRemaining, sizeof(record->timeRemaining), left > 0 ? static_cast<uint64_t>(left) : 0);
   }
   FhsUnlockPort(agent, ctx, false);
   return ORR_OK;
}

orr_Status FhsNexoClear(const Nexo_NodeDef *, const Nexo_ParamList *instanceArgs, const Nexo_ParamList *input)
{
   uint32_t count = 0;
   orr_Status status = Nexo_ParamListUsedCount(input, &count);
   if (status != ORR_OK) {
      return status;
   }
   uint8_t addr[16];
   if (count > 1) {
      SG_LOG(ORR_LOG_ERROR, "Invalid number of arguments to clear IPv6 bindings: %u", count);
      return ORR_BAD_PARAM;
   }
   if (count == 1) {
      const char *text = nullptr;
      status = Nexo_ParamListGetString(input, 0, &text);
      if (status != ORR_OK) {
         return status;
      }
      if (!FhsParseIpv6(text, addr)) {
         SG_LOG(ORR_LOG_ERROR, "Invalid IPv6 address to clear: %s", text);
         return ORR_BAD_PARAM;
      }
   }
   SifraGenericFastPathAgent *agent = nullptr;
   FhsContext *ctx = nullptr;
   status = FhsNexoGet(instanceArgs, true, &agent, &ctx);
   if (status != ORR_OK) {
      return status;
   }
   uint32_t removed = 0;
   if (count == 0) {
      removed = FhsClearBindings(ctx, FhsBindDhcpv6 | FhsBindFcfs);
   } else {
      for (FhsBinding *binding; (binding = FhsFindDynamicAddress(ctx, addr)) != nullptr; removed++) {
         FhsRemoveBinding(ctx, binding);
      }
   }
   SG_LOG(ORR_LOG_INFO, "%s: Cleared %u IPv6 bindings", ctx->filter->name, removed);
   FhsUnlockPort(agent, ctx, true);
   return ORR_OK;
}
