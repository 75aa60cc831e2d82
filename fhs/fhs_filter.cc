/* Creation, configuration and destruction of a first-hop security port. */
#include "fhs/fhs_agent.h"

#include "fhs/fhs_bindings.h"
#include "framework/sifra_generic.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_lock.h"
#include "framework/sifra_generic_log.h"
#include "framework/sifra_generic_port.h"
#include "platform/orr_text.h"

#define FHS_CONFIG_LOCK_NAME "sifg.fhs.config"
#define FHS_ND_RATE_LIMIT_LOCK_NAME "sifg.fhs.ndratelimit"

/* Ethernet, two tags, the fixed header and TCP's: the common path reads no further. */
constexpr uint32_t FHS_MIN_MAPPED_LEN = 14 + 8 + 40 + 20;
constexpr uint32_t FHS_MAPPED_BOTH_DIRECTIONS = 3;

FhsContext *FhsContextOf(const void *filter)
{
   if (!SifraGenericFilterIsValid(filter)) {
      return nullptr;
   }
   const auto *record = static_cast<const SifraGenericFilter *>(filter);
   if (record->agent == nullptr || record->agent->ops != &fhsAgentOps) {
      return nullptr;
   }
   return static_cast<FhsContext *>(record->agentData);
}

namespace {

bool ConfigIsValid(const FhsContext *ctx, const FhsConfig *config, const uint8_t *statics)
{
   const char *name = ctx->filter->name;
   const FhsConfigFault fault = FhsCheckConfig(*config);
   if (fault == FhsConfigBadBindingLimit) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid IPv6 config: bindingLimit = %u numStatic = %u", name,
             config->bindingLimit, config->numStatic);
      return false;
   }
   if (fault == FhsConfigBadNdRateLimit) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid ND rate limit config: %u %u %u", name, config->ndRateLimit,
             config->errRateLimit, config->errRateLimitPeriod);
      return false;
   }
   for (uint32_t i = 0; i < config->numStatic; i++) {
      FhsBindingKey key;
      orr_Memcpy(&key, statics + i * sizeof(FhsBindingKey), sizeof(key));
      if (!FhsStaticKeyUsable(key)) {
         SG_LOG(ORR_LOG_ERROR, "%s: Invalid static IPv6 binding %u", name, i);
         return false;
      }
   }
   return true;
}

}  // namespace

orr_Status FhsConfigure(FhsContext *ctx, const uint8_t *record, uint64_t length)
{
   if (length < sizeof(FhsConfig)) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid IPv6 config length %lu", ctx->filter->name,
             static_cast<unsigned long>(length));
      return ORR_BAD_PARAM;
   }
   FhsConfig config;
   orr_Memcpy(&config, record, sizeof(config));
   if (config.version != FHS_CONFIG_VERSION) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid IPv6 config version. Got %u, expecting %u", ctx->filter->name,
             static_cast<unsigned>(config.version), static_cast<unsigned>(FHS_CONFIG_VERSION));
      return ORR_BAD_PARAM;
   }
   if (length != FhsConfigLength(config.numStatic)) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid IPv6 config length. Got %lu, expecting %lu", ctx->filter->name,
             static_cast<unsigned long>(length), static_cast<unsigned long>(FhsConfigLength(config.numStatic)));
      return ORR_BAD_PARAM;
   }
   const uint8_t *statics = record + sizeof(FhsConfig);
   if (!ConfigIsValid(ctx, &config, statics)) {
      return ORR_BAD_PARAM;
   }

   /* Static bindings are replaced whole; dynamic ones stay, the oldest going past a lower limit. */
   FhsClearBindings(ctx, FhsBindStatic);
   ctx->bindingLimit = config.bindingLimit == 0 ? FHS_DEFAULT_BINDING_LIMIT : config.bindingLimit;
   ctx->fcfsLifetime = config.fcfsLifetime == 0 ? FHS_DEFAULT_FCFS_LIFETIME : config.fcfsLifetime;
   uint32_t added = 0;
   for (uint32_t i = 0; i < config.numStatic; i++) {
      FhsBindingKey key;
      orr_Memcpy(&key, statics + i * sizeof(FhsBindingKey), sizeof(key));
      if (FhsFindBinding(ctx, key.vlanId, key.mac, key.addr) != nullptr) {
         /* A dynamic binding of the key gives way to the static one. */
         FhsRemoveBinding(ctx, FhsFindBinding(ctx, key.vlanId, key.mac, key.addr));
      }
      if (FhsAddBinding(ctx, &key, FhsBindStatic, 0) != ORR_OK) {
         break;
      }
      added++;
   }
   ctx->config = config;
   ctx->config.numStatic = added;
   if (config.ndRateLimit != 0) {
      FhsRateLimitInit(&ctx->ndRateLimit, config.ndRateLimit);
   }
   ctx->ndRateLimitErr = 0;
   orr_Memset(&ctx->counters, 0, sizeof(ctx->counters));
   SG_LOG(ORR_LOG_INFO, "%s: IPv6 featuresEnabled = 0x%x trusted = %u: Configured successfully", ctx->filter->name,
          config.featuresEnabled, static_cast<unsigned>(config.trusted));
   return added == config.numStatic ? ORR_OK : ORR_NO_MEMORY;
}

void FhsTimerCb(void *data)
{
   auto *ctx = static_cast<FhsContext *>(data);
   orr_TimeVal now = {};
   orr_GetUptime(&now);
   orr_SpinlockWriteLock(ctx->configLock);
   FhsAgeBindings(ctx, now.sec);
   for (FhsDhcpv6Pending &pending : ctx->pending) {
      if (pending.expiry != 0 && pending.expiry <= now.sec) {
         pending.expiry = 0;
      }
   }
   if (ctx->ndRateLimitErr != 0 && now.sec > ctx->ndRateLimitErrEnd) {
      FhsRateLimitInit(&ctx->ndRateLimit, ctx->config.ndRateLimit);
      __atomic_store_n(&ctx->ndRateLimitErr, 0, __ATOMIC_RELAXED);
   }
   ctx->claimLogged = 0;
   orr_SpinlockWriteUnlock(ctx->configLock);
}

orr_Status FhsCreateFilter(SifraGenericFilter *filter)
{
   auto *ctx = static_cast<FhsContext *>(SifraGenericAlloc(sizeof(FhsContext)));
   if (ctx == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "%s: Failed to allocate memory for IPv6 context", filter->name);
      return ORR_NO_MEMORY;
   }
   filter->agentData = ctx;
   ctx->filter = filter;
   SifraGenericListInit(&ctx->bindingList);
   for (orr_ListLinks &bucket : ctx->buckets) {
      SifraGenericListInit(&bucket);
   }
   ctx->bindingLimit = FHS_DEFAULT_BINDING_LIMIT;
   ctx->fcfsLifetime = FHS_DEFAULT_FCFS_LIFETIME;

   /* Each failure below is undone by FhsDestroyFilter, which knows what exists. */
   orr_Status status = SifraGenericFindPort(filter, &ctx->portId, &ctx->portset);
   if (status != ORR_OK) {
      goto out_destroy_context;
   }
   status = SifraGenericCreateSpinlock(FHS_CONFIG_LOCK_NAME, ORR_SPINLOCK_RW, SifraGenericLockRank::PortConfig,
                                       &ctx->configLock);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not allocate IPv6 configuration lock", filter->name);
      goto out_destroy_context;
   }
   status = FhsBridgeJoin();
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not allocate the bridge table lock", filter->name);
      goto out_destroy_context;
   }
   ctx->joinedBridge = 1;
   status = SifraGenericCreateSpinlock(FHS_ND_RATE_LIMIT_LOCK_NAME, ORR_SPINLOCK_PLAIN, SifraGenericLockRank::RateLimit,
                                       &ctx->ndRateLimitLock);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not allocate ND rate limit lock", filter->name);
      goto out_destroy_context;
   }
   status = orr_SifraSetMinPktMappedLen(filter->handle, FHS_MIN_MAPPED_LEN, FHS_MAPPED_BOTH_DIRECTIONS);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not set minimum mapped packet length", filter->name);
      goto out_destroy_context;
   }
   status = SifraGenericAddPortTimer(filter, FhsTimerCb, ctx, &ctx->timer);
   if (status != ORR_OK) {
      goto out_destroy_context;
   }
   {
      /* A new port learns on a trusted port and enforces nothing. */
      FhsConfig defaults = {};
      defaults.version = FHS_CONFIG_VERSION;
      defaults.featuresEnabled = FhsFeatureDhcpv6Snoop | FhsFeatureFcfs;
      defaults.trusted = 1;
      orr_SpinlockWriteLock(ctx->configLock);
      status = FhsConfigure(ctx, reinterpret_cast<const uint8_t *>(&defaults), sizeof(defaults));
      orr_SpinlockWriteUnlock(ctx->configLock);
      if (status != ORR_OK) {
         goto out_destroy_context;
      }
   }
   return ORR_OK;

out_destroy_context:
   (void)FhsDestroyFilter(filter);
   return status;
}

orr_Status FhsDestroyFilter(SifraGenericFilter *filter)
{
   auto *ctx = static_cast<FhsContext *>(filter->agentData);
   if (ctx == nullptr) {
      return ORR_OK;
   }
   /* Waits for a running tick, which takes configLock: no lock may be held here. */
   SifraGenericRemovePortTimer(&ctx->timer);
   if (ctx->configLock != nullptr) {
      orr_SpinlockWriteLock(ctx->configLock);
      FhsClearBindings(ctx, FhsBindDhcpv6 | FhsBindStatic | FhsBindFcfs);
      orr_SpinlockWriteUnlock(ctx->configLock);
      orr_SpinlockDestroy(ctx->configLock);
      ctx->configLock = nullptr;
   }
   if (ctx->ndRateLimitLock != nullptr) {
      orr_SpinlockDestroy(ctx->ndRateLimitLock);
      ctx->ndRateLimitLock = nullptr;
   }
   if (ctx->joinedBridge != 0) {
      FhsBridgeLeave();
   }
   SifraGenericFree(ctx);
   filter->agentData = nullptr;
   return ORR_OK;
}

/* ---- the agent's security property: the configuration record */

namespace {

#define FHS_PROPERTY_NAME_LEN 128

orr_Status FhsPropWrite(orr_SifraFilter filter, void * /* extra */, const void *data, uint32_t length)
{
   FhsContext *ctx = FhsContextOf(filter);
   if (ctx == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "IPv6 filter not found: %p", filter);
      return ORR_INVALID_HANDLE;
   }
   if (data == nullptr || length == 0) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid IPv6 config", ctx->filter->name);
      return ORR_BAD_PARAM;
   }
   orr_SpinlockWriteLock(ctx->configLock);
   const orr_Status status = FhsConfigure(ctx, static_cast<const uint8_t *>(data), length);
   orr_SpinlockWriteUnlock(ctx->configLock);
   return status;
}

/* The record as written, with the static bindings the port holds. */
orr_Status FhsPropRead(orr_SifraFilter filter, void * /* extra */, void *buffer, uint32_t length)
{
   FhsContext *ctx = FhsContextOf(filter);
   if (ctx == nullptr) {
      return ORR_INVALID_HANDLE;
   }
   orr_SpinlockReadLock(ctx->configLock);
   if (length < FhsConfigLength(ctx->config.numStatic)) {
      orr_SpinlockReadUnlock(ctx->configLock);
      return ORR_BAD_PARAM;
   }
   auto *out = static_cast<uint8_t *>(buffer);
   orr_Memcpy(out, &ctx->config, sizeof(FhsConfig));
   out += sizeof(FhsConfig);
   for (orr_ListLinks *links = ctx->bindingList.next; links != &ctx->bindingList; links = links->next) {
      const FhsBinding *binding =
         reinterpret_cast<const FhsBinding *>(reinterpret_cast<char *>(links) - offsetof(FhsBinding, portLinks));
      if (binding->method == FhsBindStatic) {
         orr_Memcpy(out, &binding->key, sizeof(FhsBindingKey));
         out += sizeof(FhsBindingKey);
      }
   }
   orr_SpinlockReadUnlock(ctx->configLock);
   return ORR_OK;
}

bool FhsPropPoll(orr_SifraFilter filter, void * /* extra */, uint32_t *length)
{
   FhsContext *ctx = FhsContextOf(filter);
   if (ctx == nullptr) {
      return false;
   }
   orr_SpinlockReadLock(ctx->configLock);
   *length = static_cast<uint32_t>(FhsConfigLength(ctx->config.numStatic));
   orr_SpinlockReadUnlock(ctx->configLock);
   return true;
}

void FhsPropCleanup(void)
{
}

constinit const orr_SifraPropertyOps fhsPropOps = {
   .write = FhsPropWrite,
   .read = FhsPropRead,
   .poll = FhsPropPoll,
   .cleanup = FhsPropCleanup,
};

}  // namespace

orr_Status FhsInitProperty(SifraGenericFastPathAgent *agent)
{
   agent->propHandle = nullptr;
   char propertyName[FHS_PROPERTY_NAME_LEN];
   orr_Status status = orr_StringFormat(propertyName, sizeof(propertyName), 0, "%s.security", agent->name);
   if (status == ORR_OK) {
      orr_SifraPropertyHandle handle = nullptr;
      status = orr_SifraPropertyRegister(&handle, propertyName, &fhsPropOps);
      if (status == ORR_OK) {
         agent->propHandle = handle;
         SG_LOG(ORR_LOG_INFO, "%s: Registered security rules property handler", agent->name);
         return ORR_OK;
      }
   }
   SG_LOG(ORR_LOG_ERROR, "%s: Failed to register security property handler (%#x): %s", agent->name,
          SifraGenericStatusValue(status), orr_StatusToString(status));
   return status;
}

void FhsCleanupProperty(SifraGenericFastPathAgent *agent)
{
   if (agent->propHandle != nullptr) {
      SG_LOG(ORR_LOG_INFO, "%s: Unregistering security property handler", agent->name);
      orr_SifraPropertyUnregister(agent->propHandle);
      agent->propHandle = nullptr;
   }
}
