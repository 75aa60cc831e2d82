/* The port filter map: start, end, entries and references. */
#include "swsec/swsec_port_filter_map.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_lock.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_log.h"
#include "swsec/swsec_context.h"

#include <cstddef>

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

static SwSecPortFilterMap *SwSecPortFilterMapFromHashLinks(orr_ListLinks *links)
{
   return reinterpret_cast<SwSecPortFilterMap *>(reinterpret_cast<uint8_t *>(links) -
                                                 offsetof(SwSecPortFilterMap, hashLinks));
}

static orr_ListLinks *SwSecPortFilterMapBucket(uint32_t portId)
{
   Hash_Table *table = portFilterMapDb.hash;
   uint32_t hash = HashFunc_HashBytes(&portId, sizeof(portId));
   return &table->buckets[hash & table->bucketMask];
}

SwSecPortFilterMap *SwSecFindPortFilterMap(uint32_t portId)
{
   orr_ListLinks *bucket = SwSecPortFilterMapBucket(portId);
   for (orr_ListLinks *links = bucket->next; links != bucket; links = links->next) {
      SwSecPortFilterMap *entry = SwSecPortFilterMapFromHashLinks(links);
      if (entry->portId == portId) {
         return entry;
      }
   }
   return nullptr;
}

orr_Status SwSecRefPortFilterMap(uint32_t portId, SwSecContext **context)
{
   orr_SpinlockLock(portFilterMapDb.lock);
   SwSecPortFilterMap *entry = SwSecFindPortFilterMap(portId);
   if (entry == nullptr || entry->removePending != 0) {
      orr_SpinlockUnlock(portFilterMapDb.lock);
      return ORR_NOT_FOUND;
   }
   *context = entry->context;
   entry->refCount++;
   orr_SpinlockUnlock(portFilterMapDb.lock);
   return ORR_OK;
}

void SwSecReleasePortFilterMap(uint32_t portId, SwSecContext * /* context */)
{
   orr_SpinlockLock(portFilterMapDb.lock);
   /* A referenced entry cannot be removed, so it is still there. */
   SwSecPortFilterMap *entry = SwSecFindPortFilterMap(portId);
   if (entry != nullptr && entry->refCount > 0) {
      entry->refCount--;
   }
   orr_SpinlockUnlock(portFilterMapDb.lock);
}

orr_Status SwSecNewPortFilterMap(SwSecContext *context, SwSecPortFilterMap **entry)
{
   *entry = nullptr;
   orr_SpinlockLock(portFilterMapDb.lock);
   const bool present = SwSecFindPortFilterMap(context->portId) != nullptr;
   orr_SpinlockUnlock(portFilterMapDb.lock);
   if (present) {
      return ORR_OK;
   }

   auto *created = static_cast<SwSecPortFilterMap *>(SifraGenericAlloc(sizeof(SwSecPortFilterMap)));
   if (created == nullptr) {
      return ORR_NO_MEMORY;
   }
   created->portId = context->portId;
   created->context = context;
   *entry = created;
   return ORR_OK;
}

void SwSecInsertPortFilterMap(SwSecPortFilterMap *entry)
{
   orr_SpinlockLock(portFilterMapDb.lock);
   if (SwSecFindPortFilterMap(entry->portId) != nullptr) {
      orr_SpinlockUnlock(portFilterMapDb.lock);
      SifraGenericFree(entry);
      return;
   }
   SifraGenericListAppend(SwSecPortFilterMapBucket(entry->portId), &entry->hashLinks);
   SifraGenericListAppend(&portFilterMapDb.list, &entry->listLinks);
   portFilterMapDb.numPfm++;
   orr_SpinlockUnlock(portFilterMapDb.lock);
}

void SwSecFreePortFilterMap(SwSecPortFilterMap *entry)
{
   SifraGenericFree(entry);
}

orr_Status SwSecDelPortFilterMap(SwSecContext *context)
{
   orr_SpinlockLock(portFilterMapDb.lock);
   SwSecPortFilterMap *entry = SwSecFindPortFilterMap(context->portId);
   if (entry == nullptr) {
      orr_SpinlockUnlock(portFilterMapDb.lock);
      return ORR_OK;
   }
   if (entry->refCount != 0) {
      const uint32_t refCount = entry->refCount;
      const uint32_t numPfm = portFilterMapDb.numPfm;
      SG_LOG(ORR_LOG_ERROR, "%s: PFM busy: pfm: %u -> %p(%u): numPfm = %u", context->filter->name,
             entry->portId, static_cast<void *>(entry->context), refCount, numPfm);
      entry->removePending = 1;
      orr_SpinlockUnlock(portFilterMapDb.lock);
      return ORR_BUSY;
   }
   SifraGenericListUnlink(&entry->hashLinks);
   SifraGenericListUnlink(&entry->listLinks);
   portFilterMapDb.numPfm--;
   orr_SpinlockUnlock(portFilterMapDb.lock);
   SifraGenericFree(entry);
   return ORR_OK;
}
