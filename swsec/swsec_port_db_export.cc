/* The exported port database queries. */
#include "swsec/swsec_port_db_export.h"

#include "framework/sifra_generic.h"
#include "platform/orr_module.h"

/*
 * The port filter map gets its entries when filters with IP discovery
 * exist; until then no port has a database to count or read.
 */
extern "C" orr_Status SwSec_PortDBGetNumEntries(uint32_t /* portId */, uint32_t /* selector */,
                                                uint32_t *numEntries)
{
   if (numEntries == nullptr) {
      return ORR_BAD_PARAM;
   }
   return ORR_NOT_FOUND;
}

extern "C" orr_Status SwSec_PortDBGetEntries(uint32_t /* portId */, uint32_t /* selector */,
                                             void **entries, uint32_t *numEntries, void **buffer)
{
   if (numEntries == nullptr || entries == nullptr || buffer == nullptr) {
      return ORR_BAD_PARAM;
   }
   return ORR_NOT_FOUND;
}

extern "C" orr_Status SwSec_PortDBReleaseBuf(void *buffer)
{
   if (buffer == nullptr) {
      return ORR_BAD_PARAM;
   }
   SifraGenericFree(buffer);
   orr_ModuleDecUseCount(sifraGenericModuleID);
   return ORR_OK;
}
