/* The first-hop security agent's management nodes. */
#include "fhs/fhs_nexo.h"

#include "fhs/fhs_agent.h"
#include "fhs/fhs_bindings.h"
#include "fhs/fhs_export.h"
#include "framework/sifra_generic.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_log.h"
#include "framework/sifra_generic_nexo.h"
#include "platform/orr_text.h"

#include <cstddef>

#define FHS_NEXO_TEXT(field, text) SIFRAGENERIC_NEXO_CHARS(FhsNexo_Summary, field, text)

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
   FHS_NEXO_TEXT(ndRateLimitErrEntryCnt, "ND error state entered"),
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
   .numElements = SifraGenericCountOf(fhsNexoMethodElements),
};

static constexpr Nexo_FieldDef fhsNexoBindingFields[] = {
   SIFRAGENERIC_NEXO_CHARS(FhsNexo_Binding, vlanId, "VLAN"),
   SIFRAGENERIC_NEXO_CHARS(FhsNexo_Binding, mac, "MAC"),
   SIFRAGENERIC_NEXO_CHARS(FhsNexo_Binding, addr, "IPv6 address"),
   SIFRAGENERIC_NEXO_FIELD(FhsNexo_Binding, method, "Learned by", NEXO_FIELD_ENUM32, &fhsNexoMethodEnum),
   SIFRAGENERIC_NEXO_CHARS(FhsNexo_Binding, timeRemaining, "Seconds left"),
};

constinit const Nexo_RecordDef fhsNexoSummaryRecord =
   SIFRAGENERIC_NEXO_RECORD(FhsNexo_Summary, "Fhs_Summary", "IPv6 first-hop security summary", fhsNexoSummaryFields);
constinit const Nexo_RecordDef fhsNexoBindingRecord =
   SIFRAGENERIC_NEXO_RECORD(FhsNexo_Binding, "Fhs_Binding", "IPv6 binding", fhsNexoBindingFields);

namespace {

/* The port of instance argument 0, locked as FhsLockPort does; FhsUnlockPort undoes it. */
orr_Status FhsNexoGet(const Nexo_ParamList *instanceArgs, bool write, SifraGenericFastPathAgent **agentOut,
                      FhsContext **ctxOut)
{
   int32_t key = 0;
   const orr_Status status = Nexo_ParamListGetInt32(instanceArgs, 0, &key);
   return status != ORR_OK ? status : FhsLockPort(static_cast<uint32_t>(key), write, agentOut, ctxOut);
}

/* Reads the port of instance argument 0 into `out` under its read lock. */
using FhsNexoReader = orr_Status (*)(const FhsContext *ctx, const Nexo_ParamList *instanceArgs, void *out);

orr_Status FhsNexoRead(const Nexo_ParamList *instanceArgs, FhsNexoReader read, void *out)
{
   SifraGenericFastPathAgent *agent = nullptr;
   FhsContext *ctx = nullptr;
   orr_Status status = FhsNexoGet(instanceArgs, false, &agent, &ctx);
   if (status != ORR_OK) {
      return status;
   }
   status = read(ctx, instanceArgs, out);
   FhsUnlockPort(agent, ctx, false);
   return status;
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

namespace {

orr_Status FhsNexoFillSummary(const FhsContext *ctx, const Nexo_ParamList *, void *output)
{
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
   Number(summary->ndRateLimitErrEntryCnt, sizeof(summary->ndRateLimitErrEntryCnt),
          __atomic_load_n(&ctx->counters.ndRateLimitErrEntryCnt, __ATOMIC_RELAXED));
   Number(summary->bindingsEvictedCnt, sizeof(summary->bindingsEvictedCnt), ctx->counters.bindingsEvictedCnt);
   return ORR_OK;
}

orr_Status FhsNexoListIndexes(const FhsContext *ctx, const Nexo_ParamList *, void *out)
{
   orr_Status status = ORR_OK;
   for (uint32_t index = 0; index < ctx->numBindings && status == ORR_OK; index++) {
      status = Nexo_ParamListAddInt(static_cast<Nexo_ParamList *>(out), index);
   }
   return status;
}

orr_Status FhsNexoFillBinding(const FhsContext *ctx, const Nexo_ParamList *instanceArgs, void *output)
{
   uint32_t index = 0;
   const orr_Status status = Nexo_ParamListGetUInt32(instanceArgs, 1, &index);
   const FhsBinding *binding = status == ORR_OK ? BindingAt(ctx, index) : nullptr;
   if (binding == nullptr) {
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
   return ORR_OK;
}

}  // namespace

orr_Status FhsNexoSummaryGet(const Nexo_NodeDef *, const Nexo_ParamList *instanceArgs, void *output)
{
   return FhsNexoRead(instanceArgs, FhsNexoFillSummary, output);
}

orr_Status FhsNexoListBindings(const Nexo_NodeDef *, const Nexo_ParamList *instanceArgs, Nexo_ParamList *list)
{
   return FhsNexoRead(instanceArgs, FhsNexoListIndexes, list);
}

orr_Status FhsNexoBindingGet(const Nexo_NodeDef *, const Nexo_ParamList *instanceArgs, void *output)
{
   return FhsNexoRead(instanceArgs, FhsNexoFillBinding, output);
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
