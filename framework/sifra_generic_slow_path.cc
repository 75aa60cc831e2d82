/* Slow path registration and the attachment of filters to slow paths. */
#include "framework/sifra_generic_slow_path.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_agent.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_lock.h"
#include "framework/sifra_generic_log.h"
#include "framework/sifra_generic_ops.h"

/* The statuses of a clear request after which the filter keeps its slow path. */
static bool SifraGenericIsTransientClearFailure(orr_Status status)
{
   return status == ORR_NO_MEMORY || status == ORR_BUSY || status == ORR_TRY_AGAIN;
}

/* Both locks of a filter, taken and released in rank order. */
static void SifraGenericLockBoth(SifraGenericFilter *filter)
{
   orr_SpinlockLock(filter->agent->lock);
   orr_SpinlockLock(filter->lock);
}

static void SifraGenericUnlockBoth(SifraGenericFilter *filter)
{
   orr_SpinlockUnlock(filter->lock);
   orr_SpinlockUnlock(filter->agent->lock);
}

static orr_Status SifraGenericRequestSetSlowPath(SifraGenericFilter *filter,
                                                 SifraGenericSlowPath *slowPath)
{
   return orr_SifraSetSlowPath(filter->handle, slowPath->slowPathID, SifraGenericSetSlowPathReply,
                               slowPath, static_cast<int32_t>(SIFRAGENERIC_SLOWPATH_TIMEOUT));
}

orr_Status SifraGenericSetAttachState(SifraGenericFilter *filter, uint32_t attachState)
{
   filter->attachState = attachState;
   const SifraGenericAgentOps *ops = filter->agent->ops;
   if (ops->attachStateChanged == nullptr) {
      return ORR_OK;
   }
   return ops->attachStateChanged(filter, attachState);
}

/* Forgets the filter's slow path without asking the host. Both locks held. */
static void SifraGenericLocalDetach(SifraGenericFilter *filter)
{
   SifraGenericSlowPath *slowPath = filter->slowPath;
   slowPath->numFilters--;
   slowPath->useCount--;
   filter->slowPath = nullptr;
   (void)SifraGenericSetAttachState(filter, SifraGenericAttachDetached);
}

/*
 * Schedules the attach callback, or asks the running one to scan again.
 * Agent lock held.
 *
 * A refused scheduling is not retried here: a timer queue that cannot take
 * a one-shot timer now would need another timer to be asked later, and the
 * events that can attach the waiting filters come anyway (the next
 * registration schedules again; a new filter attaches itself at creation;
 * a withdrawn slow path's filters are attached again at once).
 */
static void SifraGenericScheduleAttach(SifraGenericFastPathAgent *agent)
{
   if (agent->attachTimer != 0) {
      agent->attachRescan = 1;
      return;
   }
   orr_Timer timer = 0;
   const orr_Status status =
      orr_TimerSchedule(sifraGenericTimerQueue, SifraGenericAttachSlowPathsToFilters,
                        SifraGenericAgentHandle(agent), 0, ORR_TIMER_ONE_SHOT, 0,
                        sifraGenericLockDomain,
                        static_cast<uint32_t>(SifraGenericLockRank::AttachCallback), &timer);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not schedule callback (%#x): %s", agent->name,
             SifraGenericStatusValue(status), orr_StatusToString(status));
      return;
   }
   agent->attachTimer = timer;
}

orr_Status SifraGenericRegisterSlowPath(orr_SifraAgentHandle handle, uint32_t slowPathID,
                                        orr_SifraSlowPath *out)
{
   if (!SifraGenericAgentHandleIsValid(handle)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for fastPath");
      return ORR_BAD_PARAM;
   }
   SifraGenericFastPathAgent *agent = SifraGenericAgentFromHandle(handle);

   auto *slowPath =
      static_cast<SifraGenericSlowPath *>(SifraGenericAlloc(sizeof(SifraGenericSlowPath)));
   if (slowPath == nullptr) {
      return ORR_NO_MEMORY;
   }
   slowPath->magic = SIFRAGENERIC_SLOWPATH_MAGIC;
   slowPath->slowPathID = slowPathID;
   slowPath->useCount = 1;
   slowPath->agent = agent;

   orr_SpinlockLock(agent->lock);
   SifraGenericListAppend(&agent->slowPathList, &slowPath->links);
   *out = slowPath;
   SifraGenericScheduleAttach(agent);
   orr_SpinlockUnlock(agent->lock);
   /* The registration stands whatever the scheduling gave. */
   return ORR_OK;
}

/* The least loaded slow path of the agent, the oldest on a tie; null when none. */
static SifraGenericSlowPath *SifraGenericChooseSlowPath(SifraGenericFastPathAgent *agent)
{
   SifraGenericSlowPath *chosen = nullptr;
   for (orr_ListLinks *links = agent->slowPathList.next; links != &agent->slowPathList;
        links = links->next) {
      SifraGenericSlowPath *candidate = SifraGenericSlowPathFromLinks(links);
      if (chosen == nullptr || candidate->numFilters < chosen->numFilters) {
         chosen = candidate;
      }
   }
   return chosen;
}

void SifraGenericAttachSlowPath(SifraGenericFilter *filter)
{
   SifraGenericSlowPath *slowPath = SifraGenericChooseSlowPath(filter->agent);
   if (slowPath == nullptr) {
      return;
   }
   SG_LOG(ORR_LOG_INFO, "%s: Attaching to slow path #%u", filter->name, slowPath->slowPathID);
   filter->slowPath = slowPath;
   filter->attachRetries = 0;
   (void)SifraGenericSetAttachState(filter, SifraGenericAttachAttaching);
   slowPath->numFilters++;
   slowPath->useCount++;
   filter->refCount += 2;

   SifraGenericUnlockBoth(filter);
   const orr_Status status = SifraGenericRequestSetSlowPath(filter, slowPath);
   SifraGenericLockBoth(filter);
   filter->refCount--;

   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_INFO, "%s: Request to set slow path failed (%#x): %s", filter->name,
             SifraGenericStatusValue(status), orr_StatusToString(status));
      (void)SifraGenericDetachSlowPath(filter);
      /* No reply will come: its reference goes now. */
      filter->refCount--;
   }
}

void SifraGenericAttachSlowPathsToFilters(void *agentHandle)
{
   if (!SifraGenericAgentHandleIsValid(agentHandle)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for fastPath");
      return;
   }
   SifraGenericFastPathAgent *agent = SifraGenericAgentFromHandle(agentHandle);

   orr_SpinlockLock(agent->lock);
   do {
      agent->attachRescan = 0;
      if (SifraGenericListIsEmpty(&agent->slowPathList)) {
         break;
      }
      /*
       * An attach releases both locks around its request; the filter's
       * references keep it linked meanwhile, so its successor is read only
       * once the locks are held again.
       */
      orr_ListLinks *links = agent->filterList.next;
      while (links != &agent->filterList) {
         SifraGenericFilter *filter = SifraGenericFilterFromLinks(links);
         orr_SpinlockLock(filter->lock);
         if (filter->attachState == SifraGenericAttachDetached) {
            SifraGenericAttachSlowPath(filter);
         }
         links = links->next;
         orr_SpinlockUnlock(filter->lock);
      }
   } while (agent->attachRescan != 0);
   agent->attachTimer = 0;
   orr_SpinlockUnlock(agent->lock);
}

void SifraGenericSetSlowPathReply(orr_SifraFilter record, void *cookie, orr_Status status)
{
   if (!SifraGenericFilterIsValid(record)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return;
   }
   auto *filter = static_cast<SifraGenericFilter *>(record);
   auto *slowPath = static_cast<SifraGenericSlowPath *>(cookie);

   SifraGenericLockBoth(filter);
   if (status == ORR_OK) {
      SG_LOG(ORR_LOG_INFO, "%s: Successfully set slow path #%u", filter->name,
             slowPath->slowPathID);
      (void)SifraGenericSetAttachState(filter, SifraGenericAttachAttached);
      filter->refCount--;
      SifraGenericUnlockBoth(filter);
      return;
   }

   SG_LOG(ORR_LOG_INFO, "%s: Couldn't set slow path (%#x): %s", filter->name,
          SifraGenericStatusValue(status), orr_StatusToString(status));
   /*
    * A slow path that is being unregistered is not asked again: retrying
    * it would keep its unregistration busy for as long as it fails. The
    * filter leaves it and goes to the least loaded of the others (or stays
    * detached when none is left), as the unregistration would have moved it.
    */
   if (!SifraGenericListIsLinked(&slowPath->links)) {
      SG_LOG(ORR_LOG_INFO, "%s: Slow path #%u is being unregistered; not retrying it",
             filter->name, slowPath->slowPathID);
      (void)SifraGenericDetachSlowPath(filter);
      filter->refCount--;
      SifraGenericAttachSlowPath(filter);
      SifraGenericUnlockBoth(filter);
      return;
   }

   filter->attachRetries++;
   SG_LOG(ORR_LOG_INFO, "%s: Retry (#%d) to attach slow path #%u", filter->name,
          static_cast<int>(filter->attachRetries), slowPath->slowPathID);
   /*
    * The reply's reference passes on to the next reply once the request is
    * accepted, and that reply may come before the locks are taken back:
    * the call holds a reference of its own, as an attach's call does.
    */
   filter->refCount++;
   SifraGenericUnlockBoth(filter);
   const orr_Status resent = SifraGenericRequestSetSlowPath(filter, slowPath);
   SifraGenericLockBoth(filter);
   filter->refCount--;
   if (resent != ORR_OK) {
      SG_LOG(ORR_LOG_INFO, "%s: Request to set slow path failed (%#x): %s", filter->name,
             SifraGenericStatusValue(resent), orr_StatusToString(resent));
      (void)SifraGenericDetachSlowPath(filter);
      filter->refCount--;
   }
   SifraGenericUnlockBoth(filter);
}

orr_Status SifraGenericDetachSlowPath(SifraGenericFilter *filter)
{
   SG_LOG(ORR_LOG_INFO, "%s: Detaching from slow path #%u", filter->name,
          filter->slowPath->slowPathID);
   if (filter->attachState == SifraGenericAttachAttaching) {
      SifraGenericLocalDetach(filter);
      return ORR_OK;
   }
   /* A save may go on without the slow path's part. */
   if (filter->migrationState == SifraGenericMigrationFetching) {
      filter->migrationState = SifraGenericMigrationReady;
   }
   (void)SifraGenericSetAttachState(filter, SifraGenericAttachDetaching);
   filter->refCount++;
   SifraGenericUnlockBoth(filter);
   const orr_Status status = orr_SifraClearSlowPath(filter->handle);
   SifraGenericLockBoth(filter);
   filter->refCount--;

   if (SifraGenericIsTransientClearFailure(status)) {
      SG_LOG(ORR_LOG_ERROR, "%s: Transient failure in clearing slow path (%#x): %s", filter->name,
             SifraGenericStatusValue(status), orr_StatusToString(status));
      (void)SifraGenericSetAttachState(filter, SifraGenericAttachAttached);
      return ORR_BUSY;
   }
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Request to clear slow path failed (%#x): %s", filter->name,
             SifraGenericStatusValue(status), orr_StatusToString(status));
   }
   SifraGenericLocalDetach(filter);
   return ORR_OK;
}

orr_Status SifraGenericUnregisterSlowPath(orr_SifraSlowPath record)
{
   if (!SifraGenericSlowPathIsValid(record)) {
      /* ORR_OK: the host is not to retry a record that is no slow path. */
      SG_LOG(ORR_LOG_ERROR, "Bad magic for slowPath");
      return ORR_OK;
   }
   auto *slowPath = static_cast<SifraGenericSlowPath *>(record);
   SifraGenericFastPathAgent *agent = slowPath->agent;

   orr_SpinlockLock(agent->lock);
   if (SifraGenericListIsLinked(&slowPath->links)) {
      SifraGenericListUnlink(&slowPath->links);
   }
   /* As in the attach callback: the successor is read with the locks held again. */
   orr_ListLinks *links = agent->filterList.next;
   while (links != &agent->filterList) {
      SifraGenericFilter *filter = SifraGenericFilterFromLinks(links);
      orr_SpinlockLock(filter->lock);
      if (filter->attachState == SifraGenericAttachAttached && filter->slowPath == slowPath &&
          SifraGenericDetachSlowPath(filter) == ORR_OK) {
         SifraGenericAttachSlowPath(filter);
      }
      links = links->next;
      orr_SpinlockUnlock(filter->lock);
   }
   if (slowPath->useCount > 1) {
      SG_LOG(ORR_LOG_INFO, "Could not unregister slow path, use count = %u", slowPath->useCount);
      orr_SpinlockUnlock(agent->lock);
      return ORR_BUSY;
   }
   orr_SpinlockUnlock(agent->lock);
   slowPath->magic = ~SIFRAGENERIC_SLOWPATH_MAGIC;
   SifraGenericFree(slowPath);
   return ORR_OK;
}

void SifraGenericCancelAttach(SifraGenericFastPathAgent *agent)
{
   orr_SpinlockLock(agent->lock);
   const orr_Timer timer = agent->attachTimer;
   orr_SpinlockUnlock(agent->lock);
   if (timer == 0) {
      return;
   }
   /* Cancelled, or waited for when it runs: it ends by clearing attachTimer itself. */
   (void)orr_TimerRemoveSync(timer);
   agent->attachTimer = 0;
}
