/* "featureSummary": a port's configuration, database counts and drop counters as text. */
#include "mgmt/swsec_nexo.h"

#include "mgmt/swsec_nexo_records.h"
#include "platform/orr_text.h"
#include "swsec/swsec_context.h"

static constexpr const char SwSecNexoNotApplicable[] = "N/A";

void SwSecNexoFormatFeatures(char *text, size_t size, uint32_t features)
{
   if (features == 0) {
      (void)orr_Sprintf(text, size, "None");
      return;
   }
   size_t used = 0;
   text[0] = '\0';
#define SWSEC_NEXO_APPEND_FEATURE(name, bit, summary)                                     \
   if ((features & (bit)) != 0) {                                                        \
      used += static_cast<size_t>(orr_Sprintf(text + used, size - used, "%s", summary)); \
   }
   SWSEC_FEATURE_LIST(SWSEC_NEXO_APPEND_FEATURE)
#undef SWSEC_NEXO_APPEND_FEATURE
   /* Only bits outside the named ones: nothing written, nothing to cut. */
   if (used > 0) {
      text[used - 1] = '\0';
   }
}

/* Frames raise the counters atomically under the shared configLock: read them the same way. */
static void SwSecNexoFormatCount(char *field, size_t size, const uint64_t &counter)
{
   const uint64_t count = __atomic_load_n(&counter, __ATOMIC_RELAXED);
   (void)orr_Sprintf(field, size, "%lu", static_cast<unsigned long>(count));
}

static void SwSecNexoFormatNumber(char *field, size_t size, uint32_t number)
{
   (void)orr_Sprintf(field, size, "%u", number);
}

template <size_t N>
static void SwSecNexoSetText(char (&field)[N], const char *text)
{
   (void)orr_Sprintf(field, N, "%s", text);
}

static void SwSecNexoFillDiscovery(SwSec_FeatureSummary *summary, const SwSecContext *ctx)
{
   if ((ctx->config.featuresEnabled & SwSecFeatureIpDiscovery) == 0) {
      SwSecNexoSetText(summary->portMode, SwSecNexoNotApplicable);
      SwSecNexoSetText(summary->portDbSize, SwSecNexoNotApplicable);
      SwSecNexoSetText(summary->numStaticEntries, SwSecNexoNotApplicable);
      SwSecNexoSetText(summary->numVmiEntries, SwSecNexoNotApplicable);
      SwSecNexoSetText(summary->numAuthVmiEntries, SwSecNexoNotApplicable);
      SwSecNexoSetText(summary->numNonAuthVmiEntries, SwSecNexoNotApplicable);
      SwSecNexoSetText(summary->dhcpSnoopingDropCnt, SwSecNexoNotApplicable);
      return;
   }
   SwSecNexoSetText(summary->portMode, ctx->config.trusted != 0 ? "Trusted" : "Untrusted");
   SwSecNexoFormatNumber(summary->portDbSize, sizeof summary->portDbSize, ctx->config.portDbSize);
   SwSecNexoFormatNumber(summary->numStaticEntries, sizeof summary->numStaticEntries, ctx->config.numStatic);
   SwSecNexoFormatNumber(summary->numVmiEntries, sizeof summary->numVmiEntries, ctx->numVmiEntries);
   SwSecNexoFormatNumber(summary->numAuthVmiEntries, sizeof summary->numAuthVmiEntries,
                         ctx->numAuthVmiEntries);
   SwSecNexoFormatNumber(summary->numNonAuthVmiEntries, sizeof summary->numNonAuthVmiEntries,
                         ctx->numNonAuthVmiEntries);
   SwSecNexoFormatCount(summary->dhcpSnoopingDropCnt, sizeof summary->dhcpSnoopingDropCnt,
                        ctx->counters.dhcpSnoopingDropCnt);
}

static void SwSecNexoFillRateLimits(SwSec_FeatureSummary *summary, const SwSecContext *ctx)
{
   if ((ctx->config.featuresEnabled & SwSecFeatureDai) == 0 || ctx->config.arpRateLimit == 0) {
      SwSecNexoSetText(summary->arpRateLimit, SwSecNexoNotApplicable);
      SwSecNexoSetText(summary->errRateLimit, SwSecNexoNotApplicable);
      SwSecNexoSetText(summary->errRateLimitPeriod, SwSecNexoNotApplicable);
      SwSecNexoSetText(summary->txRateLimitDropCnt, SwSecNexoNotApplicable);
      SwSecNexoSetText(summary->txRateLimitErr, SwSecNexoNotApplicable);
      SwSecNexoSetText(summary->txRateLimitErrEntryCnt, SwSecNexoNotApplicable);
      SwSecNexoSetText(summary->rxRateLimitDropCnt, SwSecNexoNotApplicable);
      return;
   }
   (void)orr_Sprintf(summary->arpRateLimit, sizeof summary->arpRateLimit, "%u pps", ctx->config.arpRateLimit);
   (void)orr_Sprintf(summary->errRateLimit, sizeof summary->errRateLimit, "%u pps", ctx->config.errRateLimit);
   (void)orr_Sprintf(summary->errRateLimitPeriod, sizeof summary->errRateLimitPeriod, "%u sec",
                     ctx->config.errRateLimitPeriod);
   SwSecNexoFormatCount(summary->txRateLimitDropCnt, sizeof summary->txRateLimitDropCnt,
                        ctx->counters.txRateLimitDropCnt);
   SwSecNexoSetText(summary->txRateLimitErr, __atomic_load_n(&ctx->txRateLimitErr, __ATOMIC_RELAXED) != 0 ? "Yes" : "No");
   SwSecNexoFormatCount(summary->txRateLimitErrEntryCnt, sizeof summary->txRateLimitErrEntryCnt,
                        ctx->counters.txRateLimitErrEntryCnt);
   SwSecNexoFormatCount(summary->rxRateLimitDropCnt, sizeof summary->rxRateLimitDropCnt,
                        ctx->counters.rxRateLimitDropCnt);
}

/* What the VM may send besides the features' checks, and what was dropped for it. */
static void SwSecNexoFillFrameGuard(SwSec_FeatureSummary *summary, const SwSecContext *ctx)
{
   const SwSecFrameGuard &guard = ctx->frameGuard;
   SwSecNexoSetText(summary->allowTagged, (guard.flags & SwSecFrameGuardAllowTagged) != 0 ? "Allowed" : "Dropped");
   if (guard.numEtherTypes == 0) {
      SwSecNexoSetText(summary->etherTypes, "Any");
   } else {
      /* "0x%04x" and a comma each: the whole list always fits. */
      static_assert(SWSEC_ETHERTYPES_MAX * 7 < sizeof(SwSec_FeatureSummary::etherTypes));
      size_t used = 0;
      for (uint32_t i = 0; i < guard.numEtherTypes && i < SWSEC_ETHERTYPES_MAX; i++) {
         used += static_cast<size_t>(orr_Sprintf(summary->etherTypes + used, sizeof summary->etherTypes - used,
                                                 i == 0 ? "0x%04x" : ",0x%04x",
                                                 static_cast<unsigned>(guard.etherTypes[i])));
      }
   }
   SwSecNexoFormatCount(summary->taggedDropCnt, sizeof summary->taggedDropCnt,
                        ctx->frameGuardCounters.taggedDropCnt);
   SwSecNexoFormatCount(summary->etherTypeDropCnt, sizeof summary->etherTypeDropCnt,
                        ctx->frameGuardCounters.etherTypeDropCnt);
}

orr_Status SwSecNexoFeatureSummaryGet(const Nexo_NodeDef *, const Nexo_ParamList *instanceArgs, void *output)
{
   uint32_t portId = 0;
   SwSecContext *ctx = nullptr;
   orr_Status status = SwSecNexoGetFilter(instanceArgs, &portId, &ctx, SwSecNexoLockMode::Read);
   if (status != ORR_OK) {
      return status;
   }
   auto *summary = static_cast<SwSec_FeatureSummary *>(output);
   const uint32_t features = ctx->config.featuresEnabled;

   summary->version = ctx->config.version;
   summary->highestSupportedVersion = SWSEC_CONFIG_VERSION_MAX;
   summary->lowestSupportedVersion = SWSEC_CONFIG_VERSION;
   SwSecNexoFormatFeatures(summary->featuresEnabled, sizeof summary->featuresEnabled, features);
   SwSecNexoFillDiscovery(summary, ctx);
   SwSecNexoFillRateLimits(summary, ctx);
   SwSecNexoFillFrameGuard(summary, ctx);
   if ((features & SwSecFeatureDai) != 0) {
      SwSecNexoFormatCount(summary->daiDropCnt, sizeof summary->daiDropCnt, ctx->counters.daiDropCnt);
   } else {
      SwSecNexoSetText(summary->daiDropCnt, SwSecNexoNotApplicable);
   }
   if ((features & SwSecFeatureIpSrcGuard) != 0) {
      SwSecNexoFormatCount(summary->ipSrcGuardDropCnt, sizeof summary->ipSrcGuardDropCnt,
                           ctx->counters.ipSrcGuardDropCnt);
   } else {
      SwSecNexoSetText(summary->ipSrcGuardDropCnt, SwSecNexoNotApplicable);
   }

   SwSecNexoPutFilter(portId, ctx, SwSecNexoLockMode::Read);
   return ORR_OK;
}
