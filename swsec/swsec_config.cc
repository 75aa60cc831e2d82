/* Applying and clearing a port's security configuration; the port timer. */
#include "swsec/swsec_config.h"

#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_log.h"
#include "platform/orr_text.h"
#include "swsec/swsec_policy.h"
#include "swsec/swsec_port_db.h"

bool SwSecConfigIsValid(const SwSecContext *ctx, const SwSecConfig *config)
{
   const uint32_t features = config->featuresEnabled;
   /*
    * Bits above SwSecFeatureIpSrcGuard are stored and read by nothing: a
    * newer manager may set them, and refusing them would refuse its whole
    * configuration for features this port cannot give anyway.
    */
   if ((features & SwSecFeaturesNeedingDiscovery) != 0 &&
       ((features & SwSecFeatureIpDiscovery) == 0 || config->trusted != 0)) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid config: featuresEnabled = 0x%x trusted = %d",
             ctx->filter->name, features, config->trusted);
      return false;
   }
   if ((features & SwSecFeatureDai) != 0 && config->arpRateLimit != 0) {
      if (config->arpRateLimit > SWSEC_ARP_RATE_LIMIT_MAX ||
          config->errRateLimit >= config->arpRateLimit ||
          config->errRateLimit > SWSEC_ERR_RATE_LIMIT_MAX ||
          config->errRateLimitPeriod < SWSEC_ERR_RATE_LIMIT_PERIOD_MIN) {
         SG_LOG(ORR_LOG_ERROR, "%s: Invalid ARP rate limit config: %u %u %u", ctx->filter->name,
                config->arpRateLimit, config->errRateLimit, config->errRateLimitPeriod);
         return false;
      }
   }
   return true;
}

bool SwSecFrameGuardIsValid(const SwSecContext *ctx, const SwSecFrameGuard *guard)
{
   if (guard->numEtherTypes > SWSEC_ETHERTYPES_MAX) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid frame guard config: %u ethertypes (at most %u)",
             ctx->filter->name, static_cast<unsigned>(guard->numEtherTypes), SWSEC_ETHERTYPES_MAX);
      return false;
   }
   return true;
}

SwSecFrameGuard SwSecConfigFrameGuard(const SwSecConfig *config)
{
   SwSecFrameGuard guard;
   orr_Memset(&guard, 0, sizeof(guard));
   if (SwSecConfigHasFrameGuard(config->version)) {
      const auto *record = reinterpret_cast<const uint8_t *>(config);
      orr_Memcpy(&guard, record + SwSecConfigLength(config->numStatic), sizeof(guard));
   }
   return guard;
}

static void SwSecClearDropCounters(SwSecContext *ctx)
{
   orr_Memset(&ctx->counters, 0, sizeof(ctx->counters));
   orr_Memset(&ctx->frameGuardCounters, 0, sizeof(ctx->frameGuardCounters));
}

orr_Status SwSecConfigFeatures(SwSecContext *ctx, const SwSecConfig *config)
{
   const SwSecFrameGuard guard = SwSecConfigFrameGuard(config);
   if (!SwSecConfigIsValid(ctx, config) || !SwSecFrameGuardIsValid(ctx, &guard)) {
      return ORR_BAD_PARAM;
   }
   const orr_Status status = SwSecConfigPortDb(ctx, config);
   if (status != ORR_OK) {
      return status;
   }

   ctx->config.version = config->version;
   ctx->config.featuresEnabled = config->featuresEnabled;
   ctx->config.arpRateLimit = config->arpRateLimit;
   ctx->config.errRateLimit = config->errRateLimit;
   ctx->config.errRateLimitPeriod = config->errRateLimitPeriod;
   ctx->frameGuard = guard;

   /*
    * No frame is judged while configLock is held exclusive, so the limiters
    * are restarted without their own locks.
    */
   if ((config->featuresEnabled & SwSecFeatureDai) != 0 && config->arpRateLimit != 0) {
      SifraGenericRateLimitInit(&ctx->txRateLimit, config->arpRateLimit);
      SifraGenericRateLimitInit(&ctx->rxRateLimit, config->arpRateLimit);
      ctx->txRateLimitErr = 0;
      SG_LOG(ORR_LOG_ERROR, "%s: ARP rate limiting enabled: %u %u %u", ctx->filter->name,
             config->arpRateLimit, config->errRateLimit, config->errRateLimitPeriod);
   }
   SG_LOG(ORR_LOG_ERROR, "%s: featuresEnabled = 0x%x: Configured successfully", ctx->filter->name,
          config->featuresEnabled);
   SwSecClearDropCounters(ctx);
   return ORR_OK;
}

orr_Status SwSecClearFeatures(SwSecContext *ctx)
{
   if (ctx->config.featuresEnabled == 0) {
      return ORR_OK;
   }
   const SwSecConfig off = {};
   const orr_Status status = SwSecConfigPortDb(ctx, &off);
   if (status != ORR_OK) {
      return status;
   }
   SwSecClearDropCounters(ctx);
   ctx->config.featuresEnabled = 0;
   return ORR_OK;
}

void SifraGenericRateLimitInit(SifraGenericRateLimit *rateLimit, uint32_t limit)
{
   rateLimit->periodSec = 1;
   rateLimit->limit = limit;
   /* The interval ends now, so the next event opens a fresh one. */
   rateLimit->intervalEnd = orr_GetTimerCycles();
   rateLimit->count = 0;
}

void SwSecArpRateLimitTimerCb(SwSecContext *ctx)
{
   if (ctx->config.arpRateLimit == 0 || ctx->txRateLimitErr == 0) {
      return;
   }
   orr_TimeVal now = {};
   orr_GetUptime(&now);
   if (now.sec > ctx->txRateLimitErrEnd) {
      SifraGenericRateLimitInit(&ctx->txRateLimit, ctx->config.arpRateLimit);
      ctx->txRateLimitErr = 0;
   }
}

void SwSecTimerCb(void *data)
{
   auto *ctx = static_cast<SwSecContext *>(data);
   orr_SpinlockWriteLock(ctx->configLock);
   const uint32_t features = ctx->config.featuresEnabled;
   if ((features & SwSecFeatureIpDiscovery) != 0) {
      SwSecPortDbTimerCb(ctx);
      /* DAI is refused without IP discovery, so the ARP part never runs alone. */
      if ((features & SwSecFeatureDai) != 0) {
         SwSecArpRateLimitTimerCb(ctx);
      }
   }
   orr_SpinlockWriteUnlock(ctx->configLock);
}
