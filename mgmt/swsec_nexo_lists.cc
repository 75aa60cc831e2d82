/* The instance lists of the branch: ports under "security", VMIs under "vmi". */
#include "mgmt/swsec_nexo.h"

#include "framework/sifra_generic_log.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_port_filter_map.h"

#include <cstddef>

static const SwSecPortFilterMap *SwSecNexoMapEntryFromListLinks(const orr_ListLinks *links)
{
   return reinterpret_cast<const SwSecPortFilterMap *>(reinterpret_cast<const char *>(links) -
                                                       offsetof(SwSecPortFilterMap, listLinks));
}

orr_Status SwSecNexoListPortIds(const Nexo_NodeDef *, const Nexo_ParamList *, Nexo_ParamList *list)
{
   orr_Status status = ORR_OK;
   orr_SpinlockLock(portFilterMapDb.lock);
   for (orr_ListLinks *links = portFilterMapDb.list.next; links != &portFilterMapDb.list; links = links->next) {
      const SwSecPortFilterMap *entry = SwSecNexoMapEntryFromListLinks(links);
      status = Nexo_ParamListAddInt(list, entry->portId);
      if (status != ORR_OK) {
         SG_LOG(ORR_LOG_ERROR, "Nexo_ParamListAddInt() failed: (%#x): %s", SifraGenericStatusValue(status),
                orr_StatusToString(status));
         break;
      }
   }
   orr_SpinlockUnlock(portFilterMapDb.lock);
   return status;
}

orr_Status SwSecNexoListVmi(const Nexo_NodeDef *, const Nexo_ParamList *instanceArgs, Nexo_ParamList *list)
{
   uint32_t portId = 0;
   SwSecContext *ctx = nullptr;
   orr_Status status = SwSecNexoGetFilter(instanceArgs, &portId, &ctx, SwSecNexoLockMode::Read);
   if (status != ORR_OK) {
      return status;
   }
   if ((ctx->config.featuresEnabled & SwSecFeatureIpDiscovery) != 0) {
      const int32_t numVmiEntries = static_cast<int32_t>(ctx->numVmiEntries);
      for (int32_t index = 0; index < numVmiEntries; index++) {
         status = Nexo_ParamListAddInt(list, index);
         if (status != ORR_OK) {
            break;
         }
      }
   }
   SwSecNexoPutFilter(portId, ctx, SwSecNexoLockMode::Read);
   return status;
}
