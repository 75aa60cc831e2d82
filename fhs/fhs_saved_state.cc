/* The first-hop security agent's part of the saved state. */
#include "fhs/fhs_saved_state.h"

#include "fhs/fhs_agent.h"
#include "fhs/fhs_bindings.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_log.h"
#include "platform/orr_text.h"

namespace {

const FhsBinding *FromPortLinks(const orr_ListLinks *links)
{
   return reinterpret_cast<const FhsBinding *>(reinterpret_cast<const char *>(links) - offsetof(FhsBinding, portLinks));
}

int64_t Now()
{
   orr_TimeVal now = {};
   orr_GetUptime(&now);
   return now.sec;
}

uint32_t NumDynamic(const FhsContext *ctx)
{
   return ctx->numBindings - ctx->config.numStatic;
}

}  // namespace

uint64_t FhsGetSavedStateLen(SifraGenericFilter *filter)
{
   auto *ctx = static_cast<FhsContext *>(filter->agentData);
   if (ctx == nullptr) {
      return 0;
   }
   orr_SpinlockReadLock(ctx->configLock);
   const uint64_t length = sizeof(FhsSavedState) + FhsConfigLength(ctx->config.numStatic) +
                           sizeof(FhsSavedBinding) * static_cast<uint64_t>(NumDynamic(ctx));
   orr_SpinlockReadUnlock(ctx->configLock);
   return length;
}

void FhsSaveState(SifraGenericFilter *filter, void *agentPart, uint64_t agentLen)
{
   auto *ctx = static_cast<FhsContext *>(filter->agentData);
   if (ctx == nullptr || agentLen < sizeof(FhsSavedState)) {
      return;
   }
   auto *part = static_cast<uint8_t *>(agentPart);
   const int64_t now = Now();
   orr_SpinlockReadLock(ctx->configLock);
   FhsSavedState header = {};
   header.magic = FHS_SAVED_MAGIC;
   const uint64_t configLen = FhsConfigLength(ctx->config.numStatic);
   /* The part was sized by an earlier call: what was learned since is left out, statics first. */
   if (sizeof(FhsSavedState) + configLen > agentLen) {
      orr_SpinlockReadUnlock(ctx->configLock);
      return;
   }
   header.configLen = static_cast<uint32_t>(configLen);
   uint8_t *config = part + sizeof(FhsSavedState);
   uint8_t *out = config + sizeof(FhsConfig);
   orr_Memcpy(config, &ctx->config, sizeof(FhsConfig));
   uint64_t position = sizeof(FhsSavedState) + configLen;
   for (const orr_ListLinks *links = ctx->bindingList.next; links != &ctx->bindingList; links = links->next) {
      const FhsBinding *binding = FromPortLinks(links);
      if (binding->method == FhsBindStatic) {
         orr_Memcpy(out, &binding->key, sizeof(FhsBindingKey));
         out += sizeof(FhsBindingKey);
         continue;
      }
      const int64_t expiry = __atomic_load_n(&binding->expiry, __ATOMIC_RELAXED);
      const bool seen = binding->method == FhsBindFcfs && __atomic_load_n(&binding->seen, __ATOMIC_RELAXED) != 0;
      const int64_t remaining = seen ? ctx->fcfsLifetime : expiry - now;
      if (remaining <= 0 || position + sizeof(FhsSavedBinding) > agentLen) {
         continue;
      }
      FhsSavedBinding saved = {};
      saved.key = binding->key;
      saved.method = binding->method;
      saved.remaining = remaining > 0xffffffff ? 0xffffffffu : static_cast<uint32_t>(remaining);
      orr_Memcpy(part + position, &saved, sizeof(saved));
      position += sizeof(saved);
      header.numBindings++;
   }
   orr_SpinlockLock(ctx->ndRateLimitLock);
   header.ndRateLimitErr = ctx->ndRateLimitErr;
   header.ndRateLimitErrRemaining = ctx->ndRateLimitErr != 0 && ctx->ndRateLimitErrEnd > now ? ctx->ndRateLimitErrEnd - now : 0;
   orr_SpinlockUnlock(ctx->ndRateLimitLock);
   /* Frames judged meanwhile raise the counters: each is read whole. */
   FhsDropCounters counters;
   for (uint32_t i = 0; i < sizeof(FhsDropCounters) / sizeof(uint64_t); i++) {
      reinterpret_cast<uint64_t *>(&counters)[i] =
         __atomic_load_n(reinterpret_cast<uint64_t *>(&ctx->counters) + i, __ATOMIC_RELAXED);
   }
   orr_Memcpy(part + offsetof(FhsSavedState, counters), &counters, sizeof(counters));
   orr_SpinlockReadUnlock(ctx->configLock);
   orr_Memcpy(part, &header, offsetof(FhsSavedState, counters));
}

orr_Status FhsRestoreState(SifraGenericFilter *filter, const void *agentPart, uint64_t agentLen)
{
   auto *ctx = static_cast<FhsContext *>(filter->agentData);
   const auto *part = static_cast<const uint8_t *>(agentPart);
   if (ctx == nullptr || agentLen < sizeof(FhsSavedState)) {
      SG_LOG(ORR_LOG_ERROR, "%s: IPv6 saved state too short (%lu bytes)", filter->name,
             static_cast<unsigned long>(agentLen));
      return ORR_FAILURE;
   }
   FhsSavedState header;
   orr_Memcpy(&header, part, sizeof(header));
   const uint64_t bindingsAt = sizeof(FhsSavedState) + static_cast<uint64_t>(header.configLen);
   if (header.magic != FHS_SAVED_MAGIC || bindingsAt + sizeof(FhsSavedBinding) * uint64_t{header.numBindings} > agentLen) {
      SG_LOG(ORR_LOG_ERROR, "%s: IPv6 saved state corrupt (magic %#x, %u bytes of config, %u bindings, %lu bytes)",
             filter->name, header.magic, header.configLen, header.numBindings, static_cast<unsigned long>(agentLen));
      return ORR_FAILURE;
   }
   for (uint32_t i = 0; i < header.numBindings; i++) {
      FhsSavedBinding saved;
      orr_Memcpy(&saved, part + bindingsAt + i * sizeof(FhsSavedBinding), sizeof(saved));
      if ((saved.method != FhsBindDhcpv6 && saved.method != FhsBindFcfs) || saved.remaining == 0) {
         SG_LOG(ORR_LOG_ERROR, "%s: IPv6 saved binding %u corrupt", filter->name, i);
         return ORR_FAILURE;
      }
   }

   orr_SpinlockWriteLock(ctx->configLock);
   orr_Status status = FhsConfigure(ctx, part + sizeof(FhsSavedState), header.configLen);
   if (status != ORR_OK) {
      orr_SpinlockWriteUnlock(ctx->configLock);
      return ORR_FAILURE;
   }
   const int64_t now = Now();
   for (uint32_t i = 0; i < header.numBindings && status == ORR_OK; i++) {
      FhsSavedBinding saved;
      orr_Memcpy(&saved, part + bindingsAt + i * sizeof(FhsSavedBinding), sizeof(saved));
      status = FhsAddBinding(ctx, &saved.key, saved.method, now + saved.remaining);
   }
   if (status == ORR_OK) {
      ctx->counters = header.counters;
      if (header.ndRateLimitErr != 0 && header.ndRateLimitErrRemaining > 0 && ctx->config.ndRateLimit != 0) {
         FhsRateLimitInit(&ctx->ndRateLimit, ctx->config.errRateLimit);
         ctx->ndRateLimitErr = 1;
         ctx->ndRateLimitErrEnd = now + header.ndRateLimitErrRemaining;
      }
   }
   orr_SpinlockWriteUnlock(ctx->configLock);
   return status == ORR_OK ? ORR_OK : ORR_FAILURE;
}
