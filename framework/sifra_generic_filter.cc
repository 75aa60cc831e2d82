/* Filter creation, destruction and the dispatch of host calls to the agent. */
#include "framework/sifra_generic_filter.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_agent.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_lock.h"
#include "framework/sifra_generic_log.h"
#include "framework/sifra_generic_ops.h"
#include "framework/sifra_generic_slow_path.h"

orr_Status SifraGenericReadConfiguration(SifraGenericFilter *filter)
{
   orr_Status status = orr_SifraGetName(filter->handle, filter->name, sizeof(filter->name));
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Could not get filter name (%#x): %s", SifraGenericStatusValue(status),
             orr_StatusToString(status));
      return status;
   }
   status = orr_SifraGetFailurePolicy(filter->handle, &filter->failurePolicy);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not get filter failure policy (%#x): %s", filter->name,
             SifraGenericStatusValue(status), orr_StatusToString(status));
      return status;
   }
   status = orr_SifraGetEndPointType(filter->handle, &filter->endPointType);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not get filter endpoint type (%#x): %s", filter->name,
             SifraGenericStatusValue(status), orr_StatusToString(status));
      return status;
   }

   filter->vmUuid[0] = '\0';
   filter->vnicIndex = -1;
   /* Only a VM's vNIC has a VM UUID and a vNIC index to ask for. */
   if (filter->endPointType != SIFRAGENERIC_ENDPOINT_VM_VNIC) {
      return ORR_OK;
   }

   status = orr_SifraGetVMUUID(filter->handle, filter->vmUuid, sizeof(filter->vmUuid));
   if (status != ORR_OK && status != ORR_NO_VM_UUID) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not get filter vm uuid (%#x): %s", filter->name,
             SifraGenericStatusValue(status), orr_StatusToString(status));
      return status;
   }
   if (status == ORR_NO_VM_UUID) {
      /* A VM without a UUID is tolerated; whatever the host left is not a UUID. */
      filter->vmUuid[0] = '\0';
   }
   status = orr_SifraGetVnicIndex(filter->handle, &filter->vnicIndex);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not get filter vnic index (%#x): %s", filter->name,
             SifraGenericStatusValue(status), orr_StatusToString(status));
      return status;
   }
   return ORR_OK;
}

/* The creation flag of the host's call means nothing to the module and is ignored. */
orr_Status SifraGenericCreateFilter(orr_SifraAgentHandle agentHandle, orr_SifraFilterHandle handle,
                                    orr_SifraFilter *out, uint8_t /* flags */)
{
   if (!SifraGenericAgentHandleIsValid(agentHandle)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for fastPath");
      return ORR_BAD_PARAM;
   }
   SifraGenericFastPathAgent *agent = SifraGenericAgentFromHandle(agentHandle);

   auto *filter = static_cast<SifraGenericFilter *>(SifraGenericAlloc(sizeof(SifraGenericFilter)));
   if (filter == nullptr) {
      SG_LOG(ORR_LOG_INFO, "%s: Failed to allocate memory for filter", agent->name);
      return ORR_NO_MEMORY;
   }
   filter->magic = SIFRAGENERIC_FILTER_MAGIC;
   filter->handle = handle;
   filter->refCount = 1;
   filter->agent = agent;
   filter->attachState = SifraGenericAttachDetached;
   filter->migrationState = SifraGenericMigrationIdle;

   orr_Status status = SifraGenericReadConfiguration(filter);
   if (status != ORR_OK) {
      goto out_free_filter;
   }
   status = SifraGenericCreateSpinlock(SIFRAGENERIC_FILTER_LOCK_NAME, ORR_SPINLOCK_PLAIN,
                                       SifraGenericLockRank::Filter, &filter->lock);
   if (status != ORR_OK) {
      goto out_free_filter;
   }
   if (agent->ops->createFilter != nullptr) {
      status = agent->ops->createFilter(filter);
      if (status != ORR_OK) {
         goto out_destroy_lock;
      }
   }

   *out = filter;

   orr_SpinlockLock(agent->lock);
   SifraGenericListAppend(&agent->filterList, &filter->links);
   orr_SpinlockLock(filter->lock);
   SifraGenericAttachSlowPath(filter);
   orr_SpinlockUnlock(filter->lock);
   orr_SpinlockUnlock(agent->lock);
   /* The filter works without a slow path; the attachment does not change the result. */
   return ORR_OK;

out_destroy_lock:
   orr_SpinlockDestroy(filter->lock);
out_free_filter:
   filter->magic = ~SIFRAGENERIC_FILTER_MAGIC;
   SifraGenericFree(filter);
   return status;
}

orr_Status SifraGenericDestroyFilter(orr_SifraFilter record)
{
   if (!SifraGenericFilterIsValid(record)) {
      /* ORR_OK: the host is not to retry a record that is no filter. */
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_OK;
   }
   auto *filter = static_cast<SifraGenericFilter *>(record);
   SifraGenericFastPathAgent *agent = filter->agent;

   orr_SpinlockLock(agent->lock);
   orr_SpinlockLock(filter->lock);
   /*
    * An attached filter is detached first. After a transient clear failure
    * it is still attached and counted by its slow path: freeing it would
    * leave that count up for good (and the slow path's unregistration busy
    * for ever), so the host is asked to call again.
    */
   if (filter->attachState == SifraGenericAttachAttached &&
       SifraGenericDetachSlowPath(filter) == ORR_BUSY) {
      orr_SpinlockUnlock(filter->lock);
      orr_SpinlockUnlock(agent->lock);
      return ORR_BUSY;
   }
   if (filter->refCount > 1) {
      orr_SpinlockUnlock(filter->lock);
      orr_SpinlockUnlock(agent->lock);
      return ORR_BUSY;
   }
   if (SifraGenericListIsLinked(&filter->links)) {
      SifraGenericListUnlink(&filter->links);
   }
   orr_SpinlockUnlock(filter->lock);
   orr_SpinlockUnlock(agent->lock);

   if (agent->ops->destroyFilter != nullptr) {
      const orr_Status status = agent->ops->destroyFilter(filter);
      if (status != ORR_OK) {
         /* Unlinked but kept whole: the host's next call starts over. */
         return status;
      }
   }
   orr_SpinlockDestroy(filter->lock);
   if (filter->slowPathState != nullptr) {
      SifraGenericFree(filter->slowPathState);
      filter->slowPathState = nullptr;
      filter->slowPathStateLen = 0;
   }
   filter->magic = ~SIFRAGENERIC_FILTER_MAGIC;
   SifraGenericFree(filter);
   return ORR_OK;
}

/*
 * The dispatchers take no lock and add one magic test and one indirect
 * call: the agent's callback does its own locking.
 */
orr_Status SifraGenericProcessPackets(orr_SifraFilter record, orr_PktList *pktList,
                                      uint32_t direction)
{
   if (!SifraGenericFilterIsValid(record)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   auto *filter = static_cast<SifraGenericFilter *>(record);
   const SifraGenericAgentOps *ops = filter->agent->ops;
   if (ops->processPackets == nullptr) {
      return ORR_OK;
   }
   return ops->processPackets(filter, pktList, direction);
}

orr_Status SifraGenericProcessSlowPathPackets(orr_SifraFilter record, orr_PktList *pktList,
                                              uint32_t direction)
{
   if (!SifraGenericFilterIsValid(record)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   auto *filter = static_cast<SifraGenericFilter *>(record);
   const SifraGenericAgentOps *ops = filter->agent->ops;
   if (ops->processSlowPathPackets == nullptr) {
      return ORR_FAILURE;
   }
   return ops->processSlowPathPackets(filter, pktList, direction);
}

/*
 * A bad record in the ioctl and configuration-change calls is refused with
 * ORR_BAD_PARAM, as the frame calls do: the host's signatures carry a status.
 */
orr_Status SifraGenericProcessFilterIoctl(orr_SifraFilter record, uint32_t requestId,
                                          void *payload, uint64_t payloadSize)
{
   if (!SifraGenericFilterIsValid(record)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   auto *filter = static_cast<SifraGenericFilter *>(record);
   const SifraGenericAgentOps *ops = filter->agent->ops;
   if (ops->filterIoctlRequest == nullptr) {
      return ORR_OK;
   }
   return ops->filterIoctlRequest(filter, requestId, payload, payloadSize);
}

orr_Status SifraGenericProcessSlowPathIoctl(orr_SifraSlowPath record, uint32_t requestId,
                                            void *payload, uint64_t payloadSize)
{
   if (!SifraGenericSlowPathIsValid(record)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for slowPath");
      return ORR_BAD_PARAM;
   }
   auto *slowPath = static_cast<SifraGenericSlowPath *>(record);
   const SifraGenericAgentOps *ops = slowPath->agent->ops;
   if (ops->slowPathIoctlRequest == nullptr) {
      return ORR_OK;
   }
   return ops->slowPathIoctlRequest(slowPath, requestId, payload, payloadSize);
}

orr_Status SifraGenericConfigurationChanged(orr_SifraFilter record)
{
   if (!SifraGenericFilterIsValid(record)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   auto *filter = static_cast<SifraGenericFilter *>(record);
   /* Whatever could be read stays; a failure has been logged and changes nothing else. */
   (void)SifraGenericReadConfiguration(filter);
   const SifraGenericAgentOps *ops = filter->agent->ops;
   if (ops->configurationChanged == nullptr) {
      return ORR_OK;
   }
   return ops->configurationChanged(filter);
}

uint8_t *SifraGenericFindSGEntry(orr_Pkt *pkt, uint32_t startOffset, uint32_t endOffset)
{
   const orr_SgArray *array = orr_PktSgArrayGet(pkt);
   if (array == nullptr || array->numElems == 0) {
      return nullptr;
   }
   /* Element bounds in 64 bits: a sum of u32 lengths must not wrap past a start offset. */
   uint64_t elementBegin = 0;
   for (uint16_t index = 0; index < array->numElems; index++) {
      const orr_SgElem *elem = orr_PktSgElemGet(pkt, index);
      if (elem == nullptr) {
         return nullptr;
      }
      const uint64_t elementEnd = elementBegin + elem->length;
      if (elementEnd > startOffset) {
         /* This element holds the start; the range must end within it. */
         if (endOffset > elementEnd) {
            return nullptr;
         }
         void *va = nullptr;
         if (orr_MA2VA(elem->addr, elem->length, &va) != ORR_OK) {
            return nullptr;
         }
         return static_cast<uint8_t *>(va) + (startOffset - elementBegin);
      }
      elementBegin = elementEnd;
   }
   return nullptr;
}
