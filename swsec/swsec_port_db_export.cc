/*
 * The exported port database queries. Each call holds a reference on the
 * port's map entry, so the port cannot lose its database meanwhile, and
 * reads the database under the port's configLock shared; a buffer handed
 * out holds the module (its use count) until it is given back.
 */
#include "swsec/swsec_port_db_export.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_log.h"
#include "framework/sifra_generic_port.h"
#include "platform/orr_text.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_port_db.h"
#include "swsec/swsec_port_filter_map.h"

/* The counter of a selector, and the discovery methods it selects. */
static uint32_t SwSecSelectorCount(const SwSecContext *ctx, uint32_t selector)
{
   switch (selector) {
   case SwSecPortDbAuth:
      return ctx->numAuthVmiEntries;
   case SwSecPortDbNonAuth:
      return ctx->numNonAuthVmiEntries;
   case SwSecPortDbAll:
      return ctx->numVmiEntries;
   default:
      return 0;
   }
}

static uint8_t SwSecSelectorMask(uint32_t selector)
{
   switch (selector) {
   case SwSecPortDbAuth:
      return SwSecDiscAuthoritativeMask;
   case SwSecPortDbNonAuth:
      return SwSecDiscNonAuthoritativeMask;
   case SwSecPortDbAll:
      return SwSecDiscAllMask;
   default:
      return 0;
   }
}

extern "C" orr_Status SwSec_PortDBGetNumEntries(uint32_t portId, uint32_t selector,
                                                uint32_t *numEntries)
{
   if (numEntries == nullptr) {
      return ORR_BAD_PARAM;
   }
   SwSecContext *ctx = nullptr;
   orr_Status status = SwSecRefPortFilterMap(portId, &ctx);
   if (status != ORR_OK) {
      return status;
   }
   orr_SpinlockReadLock(ctx->configLock);
   *numEntries = SwSecSelectorCount(ctx, selector);
   orr_SpinlockReadUnlock(ctx->configLock);
   SwSecReleasePortFilterMap(portId, ctx);
   return ORR_OK;
}

extern "C" orr_Status SwSec_PortDBGetEntries(uint32_t portId, uint32_t selector, void **entries,
                                             uint32_t *numEntries, void **buffer)
{
   if (numEntries == nullptr || entries == nullptr || buffer == nullptr) {
      return ORR_BAD_PARAM;
   }
   SwSecContext *ctx = nullptr;
   orr_Status status = SwSecRefPortFilterMap(portId, &ctx);
   if (status != ORR_OK) {
      return status;
   }
   /* The port may go once the reference is dropped: keep its name for the last message. */
   char filterName[SIFRAGENERIC_FILTER_NAME_LEN];
   orr_Strncpy(filterName, ctx->filter->name, sizeof(filterName) - 1);
   filterName[sizeof(filterName) - 1] = '\0';

   orr_SpinlockReadLock(ctx->configLock);
   const uint32_t count = SwSecSelectorCount(ctx, selector);
   *numEntries = count;
   if (count == 0) {
      *entries = nullptr;
      *buffer = nullptr;
      orr_SpinlockReadUnlock(ctx->configLock);
      SwSecReleasePortFilterMap(portId, ctx);
      return ORR_OK;
   }

   void *block = SifraGenericAlloc(count * static_cast<uint32_t>(sizeof(SwSecPortDbEntry)));
   if (block == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "%s: Dbentry alloc failed", filterName);
      orr_SpinlockReadUnlock(ctx->configLock);
      SwSecReleasePortFilterMap(portId, ctx);
      return ORR_NO_MEMORY;
   }
   SwSecQueryPortDb(ctx, block, SWSEC_QUERY_ENTRY, SwSecSelectorMask(selector));
   *entries = block;
   *buffer = block;
   orr_SpinlockReadUnlock(ctx->configLock);
   SwSecReleasePortFilterMap(portId, ctx);

   status = SifraGenericHandOutBlock(filterName, portId, block);
   if (status != ORR_OK) {
      *entries = nullptr;
      *buffer = nullptr;
   }
   return status;
}

extern "C" orr_Status SwSec_PortDBReleaseBuf(void *buffer)
{
   return SifraGenericGiveBackBlock(buffer);
}
