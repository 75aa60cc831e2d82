/* Start and end of the port filter map. */
#include "swsec/swsec_port_filter_map.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_lock.h"
#include "framework/sifra_generic_log.h"

constinit SwSecPortFilterMapDb portFilterMapDb = {
   .hash = nullptr,
   .list = {&portFilterMapDb.list, &portFilterMapDb.list},
   .numPfm = 0,
   .lock = nullptr,
};

orr_Status SwSecInitPortFilterMap(void)
{
   portFilterMapDb.hash = nullptr;
   SifraGenericListInit(&portFilterMapDb.list);
   portFilterMapDb.numPfm = 0;
   portFilterMapDb.lock = nullptr;

   orr_Status status =
      SifraGenericCreateSpinlock(SWSEC_PORT_FILTER_MAP_LOCK_NAME, ORR_SPINLOCK_PLAIN,
                                 SifraGenericLockRank::PortFilterMap, &portFilterMapDb.lock);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Could not allocate portFilterMapDb lock");
      return status;
   }

   portFilterMapDb.hash = Hash_Alloc(sifraGenericHeapID, SWSEC_PORT_FILTER_MAP_BUCKETS);
   if (portFilterMapDb.hash == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "Could not allocate portFilterMapDb hash");
      return ORR_NO_MEMORY;
   }
   return ORR_OK;
}

void SwSecCleanupPortFilterMap(void)
{
   if (portFilterMapDb.hash != nullptr) {
      Hash_Free(portFilterMapDb.hash);
      portFilterMapDb.hash = nullptr;
   }
   if (portFilterMapDb.lock != nullptr) {
      orr_SpinlockDestroy(portFilterMapDb.lock);
      portFilterMapDb.lock = nullptr;
   }
}
