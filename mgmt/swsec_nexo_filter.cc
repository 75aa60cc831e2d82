/* The steps every per-port management handler shares: find, hold and lock the port. */
#include "mgmt/swsec_nexo.h"

#include "framework/sifra_generic_log.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_port_filter_map.h"

orr_Status SwSecNexoGetFilter(const Nexo_ParamList *instanceArgs, uint32_t *portId, SwSecContext **ctx,
                              SwSecNexoLockMode mode)
{
   *ctx = nullptr;
   int32_t key = 0;
   orr_Status status = Nexo_ParamListGetInt32(instanceArgs, 0, &key);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Nexo_ParamListGetInt32() failed: (%#x): %s", SifraGenericStatusValue(status),
             orr_StatusToString(status));
      return status;
   }
   /* Port IDs travel as the 32-bit pattern of the key. */
   *portId = static_cast<uint32_t>(key);
   SwSecContext *found = nullptr;
   status = SwSecRefPortFilterMap(*portId, &found);
   if (status != ORR_OK) {
      return status;
   }
   if (mode == SwSecNexoLockMode::Read) {
      orr_SpinlockReadLock(found->configLock);
   } else {
      orr_SpinlockWriteLock(found->configLock);
   }
   *ctx = found;
   return ORR_OK;
}

void SwSecNexoPutFilter(uint32_t portId, SwSecContext *ctx, SwSecNexoLockMode mode)
{
   if (ctx == nullptr) {
      return;
   }
   if (mode == SwSecNexoLockMode::Read) {
      orr_SpinlockReadUnlock(ctx->configLock);
   } else {
      orr_SpinlockWriteUnlock(ctx->configLock);
   }
   SwSecReleasePortFilterMap(portId, ctx);
}
