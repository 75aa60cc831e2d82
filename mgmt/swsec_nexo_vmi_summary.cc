/* "vmi": the summary of one port database entry, chosen by its index in list order. */
#include "mgmt/swsec_nexo.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_log.h"
#include "mgmt/swsec_nexo_records.h"
#include "platform/orr_text.h"
#include "platform/orr_time.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_port_db.h"

static constexpr const char SwSecNexoNotApplicable[] = "N/A";

template <size_t N>
static void SwSecNexoFormatMac(char (&field)[N], const uint8_t *mac)
{
   (void)orr_Sprintf(field, N, "%02hhx:%02hhx:%02hhx:%02hhx:%02hhx:%02hhx", mac[0], mac[1], mac[2], mac[3],
                     mac[4], mac[5]);
}

/* An address in network order: its bytes as they lie, first byte first. */
template <size_t N>
static void SwSecNexoFormatIp(char (&field)[N], const uint32_t &ipAddr)
{
   const auto *bytes = reinterpret_cast<const uint8_t *>(&ipAddr);
   (void)orr_Sprintf(field, N, "%u.%u.%u.%u", bytes[0], bytes[1], bytes[2], bytes[3]);
}

static void SwSecNexoFillVmiSummary(SwSec_VmiSummary *summary, uint32_t portId, const SwSecVmi *vmi)
{
   (void)orr_Sprintf(summary->portID, sizeof summary->portID, "%u", portId);
   (void)orr_Sprintf(summary->vlanId, sizeof summary->vlanId, "%u", static_cast<unsigned>(vmi->vlanId));
   SwSecNexoFormatMac(summary->macAddr, vmi->macAddr);
   SwSecNexoFormatIp(summary->ipAddr, vmi->ipAddr);
   summary->discoveryMethod = vmi->discoveryMethod;

   if (vmi->discoveryMethod == SwSecDiscStatic) {
      (void)orr_Sprintf(summary->timeRemaining, sizeof summary->timeRemaining, "%s", SwSecNexoNotApplicable);
   } else {
      orr_TimeVal now{};
      orr_GetUptime(&now);
      const int64_t remaining = now.sec < vmi->expiryTime ? vmi->expiryTime - now.sec : 0;
      (void)orr_Sprintf(summary->timeRemaining, sizeof summary->timeRemaining, "%u sec",
                        static_cast<uint32_t>(remaining));
   }

   if (vmi->discoveryMethod == SwSecDiscDhcpSnooping) {
      SwSecNexoFormatMac(summary->chaddr, vmi->chaddr);
      (void)orr_Sprintf(summary->clientIdLen, sizeof summary->clientIdLen, "%d",
                        static_cast<int>(vmi->clientIdLen));
      SwSecNexoFormatIp(summary->serverIp, vmi->serverIp);
      (void)orr_Sprintf(summary->leaseTime, sizeof summary->leaseTime, "%u", vmi->leaseTime);
   } else {
      (void)orr_Sprintf(summary->chaddr, sizeof summary->chaddr, "%s", SwSecNexoNotApplicable);
      (void)orr_Sprintf(summary->clientIdLen, sizeof summary->clientIdLen, "%s", SwSecNexoNotApplicable);
      (void)orr_Sprintf(summary->serverIp, sizeof summary->serverIp, "%s", SwSecNexoNotApplicable);
      (void)orr_Sprintf(summary->leaseTime, sizeof summary->leaseTime, "%s", SwSecNexoNotApplicable);
   }
}

orr_Status SwSecNexoVmiSummaryGet(const Nexo_NodeDef *, const Nexo_ParamList *instanceArgs, void *output)
{
   uint32_t portId = 0;
   SwSecContext *ctx = nullptr;
   orr_Status status = SwSecNexoGetFilter(instanceArgs, &portId, &ctx, SwSecNexoLockMode::Read);
   if (status != ORR_OK) {
      return status;
   }
   uint32_t index = 0;
   SwSecVmi *copy = nullptr;
   status = Nexo_ParamListGetUInt32(instanceArgs, 1, &index);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Nexo_ParamListGetUInt32() failed: (%#x): %s", SifraGenericStatusValue(status),
             orr_StatusToString(status));
      goto out_put_filter;
   }
   if ((ctx->config.featuresEnabled & SwSecFeatureIpDiscovery) == 0 || index >= ctx->numVmiEntries) {
      status = ORR_NOT_FOUND;
      goto out_put_filter;
   }
   /* At most SWSEC_PORT_DB_SIZE_MAX records: the size cannot overflow. */
   copy = static_cast<SwSecVmi *>(SifraGenericAlloc(static_cast<uint32_t>(sizeof(SwSecVmi) * ctx->numVmiEntries)));
   if (copy == nullptr) {
      status = ORR_NO_MEMORY;
      goto out_put_filter;
   }
   SwSecQueryPortDb(ctx, copy, SWSEC_QUERY_VMI, SwSecDiscAllMask);
   SwSecNexoFillVmiSummary(static_cast<SwSec_VmiSummary *>(output), ctx->portId, &copy[index]);
   SifraGenericFree(copy);

out_put_filter:
   SwSecNexoPutFilter(portId, ctx, SwSecNexoLockMode::Read);
   return status;
}
