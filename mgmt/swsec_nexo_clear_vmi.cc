/* "clearVmi": removes the learned VMIs of a port, all of them or one VLAN/MAC/IP. */
#include "mgmt/swsec_nexo.h"

#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_log.h"
#include "mgmt/swsec_nexo_text.h"
#include "platform/orr_text.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_port_db.h"

/* The request forms: the argument count of each. */
constexpr uint32_t SWSEC_NEXO_CLEAR_ALL_ARGS = 1;
constexpr uint32_t SWSEC_NEXO_CLEAR_ONE_ARGS = 4;

/*
 * Reads arguments 1 to 3 (VLAN, MAC, IP) into a key. Argument 0 names the
 * request and is not read. An argument that is not text has no text to
 * show, so its message shows which argument it was.
 */
static orr_Status SwSecNexoReadClearKey(const SwSecContext *ctx, const Nexo_ParamList *input, SwSecVmiKey *key)
{
   const char *filterName = ctx->filter->name;
   const char *text = nullptr;

   orr_Status status = Nexo_ParamListGetString(input, 1, &text);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid vlan str = %s", filterName, "(argument 1)");
      return status;
   }
   uint16_t vlanId = 0;
   if (!SwSecNexoParseU16(text, &vlanId)) {
      return ORR_BAD_PARAM;
   }
   key->vlanId = vlanId;

   status = Nexo_ParamListGetString(input, 2, &text);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid Mac str = %s", filterName, "(argument 2)");
      return status;
   }
   status = Net_StrToMac(text, key->macAddr);
   if (status != ORR_OK) {
      return status;
   }

   status = Nexo_ParamListGetString(input, 3, &text);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid IP str = %s", filterName, "(argument 3)");
      return status;
   }
   uint32_t ipAddr = 0;
   if (!SwSecNexoParseIpv4(text, &ipAddr)) {
      return ORR_BAD_PARAM;
   }
   key->ipAddr = ipAddr;
   return ORR_OK;
}

orr_Status SwSecNexoClearVmi(const Nexo_NodeDef *, const Nexo_ParamList *instanceArgs, const Nexo_ParamList *input)
{
   uint32_t count = 0;
   orr_Status status = Nexo_ParamListUsedCount(input, &count);
   if (status != ORR_OK) {
      return status;
   }
   /* Checked before the port is looked up: a malformed request touches nothing. */
   if (count != SWSEC_NEXO_CLEAR_ALL_ARGS && count != SWSEC_NEXO_CLEAR_ONE_ARGS) {
      SG_LOG(ORR_LOG_ERROR, "Invalid no. of arguments: %d", static_cast<int>(count));
      return ORR_BAD_PARAM;
   }
   uint32_t portId = 0;
   SwSecContext *ctx = nullptr;
   status = SwSecNexoGetFilter(instanceArgs, &portId, &ctx, SwSecNexoLockMode::Write);
   if (status != ORR_OK) {
      return status;
   }
   if (count == SWSEC_NEXO_CLEAR_ALL_ARGS) {
      (void)SwSecClearVmi(ctx, true, 0, nullptr);
   } else {
      SwSecVmiKey key{};
      status = SwSecNexoReadClearKey(ctx, input, &key);
      if (status == ORR_OK) {
         /* Absent VMIs are no error: the clear's result is not looked at. */
         (void)SwSecClearVmi(ctx, false, 1, &key);
      }
   }
   SwSecNexoPutFilter(portId, ctx, SwSecNexoLockMode::Write);
   return status;
}
