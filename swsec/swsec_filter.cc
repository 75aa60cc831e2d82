/* Creation and destruction of a switch-security port context. */
#include "swsec/swsec_filter.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_lock.h"
#include "framework/sifra_generic_log.h"
#include "framework/sifra_generic_port.h"
#include "swsec/swsec_config.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_port_db.h"

#define SWSEC_CONFIG_LOCK_NAME "sifg.sec.config"
#define SWSEC_TX_RATE_LIMIT_LOCK_NAME "sifg.sec.txratelimit"
#define SWSEC_RX_RATE_LIMIT_LOCK_NAME "sifg.sec.rxratelimit"

/* Bytes of every frame the policy reads from the mapped part (headers up to UDP and ARP). */
constexpr uint32_t SWSEC_MIN_MAPPED_LEN = 66;
constexpr uint32_t SWSEC_MAPPED_BOTH_DIRECTIONS = 3;

/* A destroy refused with ORR_BUSY is tried this many times in all, this far apart. */
constexpr int32_t SWSEC_DESTROY_ATTEMPTS = 20;
constexpr uint64_t SWSEC_DESTROY_RETRY_US = 10000;

/* A new port: IP discovery on a trusted port, 32 VMIs, nothing else. */
constexpr uint32_t SWSEC_DEFAULT_PORT_DB_SIZE = 32;

orr_Status SwSecCreateFilter(SifraGenericFilter *filter)
{
   auto *ctx = static_cast<SwSecContext *>(SifraGenericAlloc(sizeof(SwSecContext)));
   if (ctx == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "%s: Failed to allocate memory for agent context", filter->name);
      return ORR_NO_MEMORY;
   }
   filter->agentData = ctx;
   ctx->filter = filter;
   SifraGenericListInit(&ctx->portDbList);
   SifraGenericListInit(&ctx->dhcpReqList);
   ctx->portDbTimer = 0;

   /* Each failure below is undone by SwSecDestroyFilter, which knows what exists. */
   orr_Status status = SifraGenericFindPort(filter, &ctx->portId, &ctx->portset);
   if (status != ORR_OK) {
      goto out_destroy_context;
   }
   status = SifraGenericCreateSpinlock(SWSEC_CONFIG_LOCK_NAME, ORR_SPINLOCK_RW,
                                       SifraGenericLockRank::PortConfig, &ctx->configLock);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not allocate configuration lock", filter->name);
      goto out_destroy_context;
   }
   status = SifraGenericCreateSpinlock(SWSEC_TX_RATE_LIMIT_LOCK_NAME, ORR_SPINLOCK_PLAIN,
                                       SifraGenericLockRank::RateLimit, &ctx->txRateLimitLock);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not allocate Tx rate limit lock", filter->name);
      goto out_destroy_context;
   }
   status = SifraGenericCreateSpinlock(SWSEC_RX_RATE_LIMIT_LOCK_NAME, ORR_SPINLOCK_PLAIN,
                                       SifraGenericLockRank::RateLimit, &ctx->rxRateLimitLock);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not allocate Rx rate limit lock", filter->name);
      goto out_destroy_context;
   }
   status = orr_SifraSetMinPktMappedLen(filter->handle, SWSEC_MIN_MAPPED_LEN,
                                        SWSEC_MAPPED_BOTH_DIRECTIONS);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not set minimum mapped packet length", filter->name);
      goto out_destroy_context;
   }
   {
      SwSecConfig defaults = {};
      defaults.version = SWSEC_CONFIG_VERSION;
      defaults.featuresEnabled = SwSecFeatureIpDiscovery;
      defaults.trusted = 1;
      defaults.portDbSize = SWSEC_DEFAULT_PORT_DB_SIZE;
      orr_SpinlockWriteLock(ctx->configLock);
      status = SwSecConfigFeatures(ctx, &defaults);
      orr_SpinlockWriteUnlock(ctx->configLock);
      if (status != ORR_OK) {
         SG_LOG(ORR_LOG_ERROR, "%s: Failed to init switch security: %s (0x%x)", filter->name,
                orr_StatusToString(status), SifraGenericStatusValue(status));
         goto out_destroy_context;
      }
   }
   return ORR_OK;

out_destroy_context:
   /* Nothing but ORR_BUSY can fail there, and a port that never got its map entry cannot be busy. */
   (void)SwSecDestroyFilter(filter);
   return status;
}

orr_Status SwSecDestroyFilter(SifraGenericFilter *filter)
{
   auto *ctx = static_cast<SwSecContext *>(filter->agentData);
   if (ctx == nullptr) {
      filter->agentData = nullptr;
      return ORR_OK;
   }

   if (ctx->configLock != nullptr) {
      for (int32_t retry = 0;; retry++) {
         orr_SpinlockWriteLock(ctx->configLock);
         const orr_Status status = SwSecClearFeatures(ctx);
         orr_SpinlockWriteUnlock(ctx->configLock);
         if (status == ORR_OK) {
            break;
         }
         if (status == ORR_BUSY && retry < SWSEC_DESTROY_ATTEMPTS - 1) {
            SG_LOG(ORR_LOG_ERROR, "%s: Got ORR_BUSY: to retry (%d) ...", filter->name, retry);
            orr_WorldSleep(SWSEC_DESTROY_RETRY_US);
            continue;
         }
         SG_LOG(ORR_LOG_ERROR, "%s: Destroy didn't succeed after %d retries(%s)", filter->name,
                retry, orr_StatusToString(status));
         return status;
      }
      /* Waits for a running tick, which takes configLock: no lock may be held here. */
      SifraGenericRemovePortTimer(&ctx->portDbTimer);
      orr_SpinlockDestroy(ctx->configLock);
      ctx->configLock = nullptr;
   }
   /* The database is empty now; a hash table parked by a reconfiguration may remain. */
   SwSecPortDbDestroy(ctx);

   if (ctx->txRateLimitLock != nullptr) {
      orr_SpinlockDestroy(ctx->txRateLimitLock);
      ctx->txRateLimitLock = nullptr;
   }
   if (ctx->rxRateLimitLock != nullptr) {
      orr_SpinlockDestroy(ctx->rxRateLimitLock);
      ctx->rxRateLimitLock = nullptr;
   }
   SifraGenericFree(ctx);
   filter->agentData = nullptr;
   return ORR_OK;
}
