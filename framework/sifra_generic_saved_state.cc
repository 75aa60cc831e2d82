/*
 * The saved state of a filter across a migration: prefetching the slow
 * path's part, the blob's length, the save and the restore, with the two
 * asynchronous slow path requests.
 *
 * All of it serialises on the filter lock, which is released around each
 * host request; the filter's refCount keeps the record alive meanwhile
 * (2 taken before a request: one for the call, one for its reply).
 */
#include "framework/sifra_generic_saved_state.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_agent.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_log.h"
#include "framework/sifra_generic_ops.h"
#include "platform/orr_text.h"

/* The request takes two references: one for the call, one for its reply. */
static void SifraGenericTakeRequestRefs(SifraGenericFilter *filter)
{
   filter->refCount += 2;
}

static void SifraGenericDropRef(SifraGenericFilter *filter)
{
   filter->refCount--;
}

static void SifraGenericFreeSlowPathState(SifraGenericFilter *filter)
{
   if (filter->slowPathState != nullptr) {
      SifraGenericFree(filter->slowPathState);
   }
   filter->slowPathState = nullptr;
   filter->slowPathStateLen = 0;
}

/* Drops what a prefetch prepared: the save is given up. Filter lock held. */
static void SifraGenericCancelSave(SifraGenericFilter *filter)
{
   SifraGenericFreeSlowPathState(filter);
   filter->migrationState = SifraGenericMigrationIdle;
}

/* The agent's part's length; an agent without the callback has none. Filter lock held. */
static uint64_t SifraGenericAgentStateLen(SifraGenericFilter *filter)
{
   const SifraGenericAgentOps *ops = filter->agent->ops;
   return ops->getSavedStateLen != nullptr ? ops->getSavedStateLen(filter) : 0;
}

void SifraGenericPrefetchSavedState(orr_SifraFilter record)
{
   if (!SifraGenericFilterIsValid(record)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return;
   }
   auto *filter = static_cast<SifraGenericFilter *>(record);

   orr_SpinlockLock(filter->lock);
   if (filter->migrationState != SifraGenericMigrationIdle) {
      SG_LOG(ORR_LOG_INFO, "%s: Ignoring state prefetch request; wrong state (%u)", filter->name,
             filter->migrationState);
      orr_SpinlockUnlock(filter->lock);
      return;
   }
   if (filter->attachState != SifraGenericAttachAttached) {
      /* No slow path to ask: the save carries the agent's part alone. */
      filter->migrationState = SifraGenericMigrationReady;
      orr_SpinlockUnlock(filter->lock);
      return;
   }

   SifraGenericTakeRequestRefs(filter);
   filter->migrationState = SifraGenericMigrationFetching;
   void *cookie = filter->slowPath;
   orr_SpinlockUnlock(filter->lock);
   const orr_Status status =
      orr_SifraRetrieveSlowPathState(filter->handle, SifraGenericRetrieveSlowPathReply, cookie,
                                     static_cast<uint32_t>(SIFRAGENERIC_SLOWPATH_TIMEOUT));
   orr_SpinlockLock(filter->lock);
   SifraGenericDropRef(filter);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Requesting slow path state failed (%#x): %s", filter->name,
             SifraGenericStatusValue(status), orr_StatusToString(status));
      SifraGenericDropRef(filter);
      filter->migrationState = SifraGenericMigrationIdle;
   }
   orr_SpinlockUnlock(filter->lock);
}

void SifraGenericRetrieveSlowPathReply(orr_SifraFilter record, void * /* cookie */,
                                       const void *state, uint64_t length, orr_Status status)
{
   if (!SifraGenericFilterIsValid(record)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return;
   }
   auto *filter = static_cast<SifraGenericFilter *>(record);

   orr_SpinlockLock(filter->lock);
   if (filter->migrationState != SifraGenericMigrationFetching) {
      /* The save was cancelled, or a detach made the filter ready without this part. */
      SG_LOG(ORR_LOG_INFO, "%s: Ignoring slow path state reply; wrong state (%u)", filter->name,
             filter->migrationState);
   } else if (status != ORR_OK) {
      SG_LOG(ORR_LOG_INFO, "%s: Failed to retrieve slow path state (%#x): %s", filter->name,
             SifraGenericStatusValue(status), orr_StatusToString(status));
      filter->migrationState = SifraGenericMigrationIdle;
   } else if (length == 0) {
      filter->migrationState = SifraGenericMigrationReady;
   } else {
      /* The heap takes 32-bit sizes: a longer state counts as a failed allocation. */
      void *copy = length <= UINT32_MAX ? SifraGenericAlloc(static_cast<uint32_t>(length)) : nullptr;
      if (copy == nullptr || state == nullptr) {
         if (copy != nullptr) {
            SifraGenericFree(copy);
         }
         SG_LOG(ORR_LOG_INFO, "%s: Failed to alloc %zu bytes for state buffer", filter->name,
                static_cast<size_t>(length));
         filter->migrationState = SifraGenericMigrationIdle;
      } else {
         orr_Memcpy(copy, state, static_cast<size_t>(length));
         filter->slowPathState = copy;
         filter->slowPathStateLen = length;
         filter->migrationState = SifraGenericMigrationReady;
      }
   }
   SifraGenericDropRef(filter);
   orr_SpinlockUnlock(filter->lock);
}

orr_Status SifraGenericGetSavedStateLen(orr_SifraFilter record, uint64_t *length)
{
   if (!SifraGenericFilterIsValid(record)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   auto *filter = static_cast<SifraGenericFilter *>(record);

   orr_Status status = ORR_FAILURE;
   orr_SpinlockLock(filter->lock);
   if (length == nullptr) {
      SifraGenericCancelSave(filter);
      status = ORR_OK;
   } else if (filter->migrationState == SifraGenericMigrationFetching) {
      SG_LOG(ORR_LOG_INFO, "%s: Slow path agent state is not yet available", filter->name);
      status = ORR_NOT_READY;
   } else if (filter->migrationState == SifraGenericMigrationReady) {
      /* The agent's part is at most a few kilobytes and the slow path's fits in 32 bits: no wrap. */
      *length = SIFRAGENERIC_STATE_HEADER_LEN + SifraGenericAgentStateLen(filter) +
                filter->slowPathStateLen;
      status = ORR_OK;
   }
   orr_SpinlockUnlock(filter->lock);
   return status;
}

orr_Status SifraGenericSaveState(orr_SifraFilter record, void *buffer, uint64_t *length)
{
   if (!SifraGenericFilterIsValid(record)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   auto *filter = static_cast<SifraGenericFilter *>(record);

   orr_SpinlockLock(filter->lock);
   if (buffer == nullptr || length == nullptr) {
      SifraGenericCancelSave(filter);
      orr_SpinlockUnlock(filter->lock);
      return ORR_OK;
   }

   orr_Status status = ORR_OK;
   if (filter->migrationState != SifraGenericMigrationReady) {
      SG_LOG(ORR_LOG_ERROR, "%s: Unexpected request to save state", filter->name);
      status = ORR_INVALID_HANDLE;
   } else {
      const uint64_t agentLen = SifraGenericAgentStateLen(filter);
      const uint64_t total = SIFRAGENERIC_STATE_HEADER_LEN + agentLen + filter->slowPathStateLen;
      if (total > *length) {
         SG_LOG(ORR_LOG_ERROR, "%s: Buffer too short for saved state (requested %zu, got %zu)",
                filter->name, static_cast<size_t>(total), static_cast<size_t>(*length));
         status = ORR_BUFFER_TOO_SMALL;
      } else {
         auto *bytes = static_cast<uint8_t *>(buffer);
         orr_Memset(bytes, 0, static_cast<size_t>(total));
         SifraGenericStateHeader header;
         header.magic = SIFRAGENERIC_STATE_MAGIC;
         header.version = SIFRAGENERIC_STATE_VERSION;
         header.agentOffset = SIFRAGENERIC_STATE_HEADER_LEN;
         header.agentLen = agentLen;
         header.slowPathOffset = SIFRAGENERIC_STATE_HEADER_LEN + agentLen;
         header.slowPathLen = filter->slowPathStateLen;
         /* The host's buffer need not be aligned for the header's fields. */
         orr_Memcpy(bytes, &header, sizeof(header));
         const SifraGenericAgentOps *ops = filter->agent->ops;
         if (agentLen != 0 && ops->saveState != nullptr) {
            ops->saveState(filter, bytes + header.agentOffset, agentLen);
         }
         if (filter->slowPathState != nullptr) {
            orr_Memcpy(bytes + header.slowPathOffset, filter->slowPathState,
                       static_cast<size_t>(filter->slowPathStateLen));
         }
         *length = total;
      }
   }
   /* Whatever the outcome, the prepared state is spent: a new save needs a new prefetch. */
   SifraGenericCancelSave(filter);
   orr_SpinlockUnlock(filter->lock);
   return status;
}

/*
 * Judges a blob's header without the filter lock; logs and returns false
 * when the blob is refused. `header` receives the fields.
 */
static bool SifraGenericStateHeaderIsValid(const SifraGenericFilter *filter, const void *buffer,
                                           uint64_t length, SifraGenericStateHeader *header)
{
   if (length < SIFRAGENERIC_STATE_HEADER_LEN) {
      SG_LOG(ORR_LOG_ERROR, "%s: Buffer too short for header (%zu bytes)", filter->name,
             static_cast<size_t>(length));
      return false;
   }
   orr_Memcpy(header, buffer, sizeof(*header));
   if (header->magic != SIFRAGENERIC_STATE_MAGIC) {
      SG_LOG(ORR_LOG_ERROR, "%s: Bad state header magic (got 0x%lx)", filter->name,
             static_cast<unsigned long>(header->magic));
      return false;
   }
   if (header->version != SIFRAGENERIC_STATE_VERSION) {
      SG_LOG(ORR_LOG_ERROR, "%s: Bad state header verison (expected %u, got %lu)", filter->name,
             SIFRAGENERIC_STATE_VERSION, static_cast<unsigned long>(header->version));
      return false;
   }
   /*
    * The sums are taken in 64 bits and a header whose sums wrap is refused
    * too: a wrapped sum would pass the comparisons and point outside the
    * blob. A wrap in the first sum is reported as the part running past
    * the end (it does); one in the second as bad offsets.
    */
   uint64_t slowPathEnd = 0;
   if (__builtin_add_overflow(header->slowPathOffset, header->slowPathLen, &slowPathEnd) ||
       slowPathEnd > length) {
      SG_LOG(ORR_LOG_ERROR, "%s: Buffer not large enough (expected %zu, got %zu)", filter->name,
             static_cast<size_t>(slowPathEnd), static_cast<size_t>(length));
      return false;
   }
   uint64_t agentEnd = 0;
   if (header->agentOffset < SIFRAGENERIC_STATE_HEADER_LEN ||
       __builtin_add_overflow(header->agentOffset, header->agentLen, &agentEnd) ||
       header->slowPathOffset < agentEnd) {
      SG_LOG(ORR_LOG_ERROR, "%s: Bad state header offsets (%zu %zu %zu %zu)", filter->name,
             static_cast<size_t>(header->agentOffset), static_cast<size_t>(header->agentLen),
             static_cast<size_t>(header->slowPathOffset), static_cast<size_t>(header->slowPathLen));
      return false;
   }
   return true;
}

orr_Status SifraGenericRestoreState(orr_SifraFilter record, const void *buffer, uint64_t length)
{
   if (!SifraGenericFilterIsValid(record)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   auto *filter = static_cast<SifraGenericFilter *>(record);
   if (buffer == nullptr || length == 0) {
      return ORR_OK;
   }
   SifraGenericStateHeader header;
   if (!SifraGenericStateHeaderIsValid(filter, buffer, length, &header)) {
      return ORR_FAILURE;
   }
   const auto *bytes = static_cast<const uint8_t *>(buffer);

   orr_SpinlockLock(filter->lock);
   if (filter->migrationState != SifraGenericMigrationIdle) {
      SG_LOG(ORR_LOG_INFO, "%s: Ignoring state restore request; wrong state (%u)", filter->name,
             filter->migrationState);
      orr_SpinlockUnlock(filter->lock);
      return ORR_FAILURE;
   }
   const bool sendSlowPathPart = header.slowPathLen != 0 && filter->slowPath != nullptr;
   if (header.slowPathLen != 0 && filter->slowPath == nullptr) {
      SG_LOG(ORR_LOG_INFO, "%s: Have saved slow path state, but no slow path", filter->name);
      if (filter->failurePolicy == 0) {
         orr_SpinlockUnlock(filter->lock);
         return ORR_FAILURE;
      }
      /* Any other policy restores the agent's part and drops the slow path's. */
   }
   if (header.agentLen != 0) {
      const SifraGenericAgentOps *ops = filter->agent->ops;
      /*
       * A part for an agent that cannot read one is refused rather than
       * dropped: the port would come up without the state it was given.
       */
      const orr_Status agentStatus =
         ops->restoreState != nullptr
            ? ops->restoreState(filter, bytes + header.agentOffset, header.agentLen)
            : ORR_FAILURE;
      if (agentStatus != ORR_OK) {
         SG_LOG(ORR_LOG_ERROR, "%s: Failed to restore fast path agent state", filter->name);
         orr_SpinlockUnlock(filter->lock);
         return ORR_FAILURE;
      }
   }
   if (!sendSlowPathPart) {
      SG_LOG(ORR_LOG_INFO, "%s: Finished restoring state", filter->name);
      orr_SpinlockUnlock(filter->lock);
      return ORR_OK;
   }

   SifraGenericTakeRequestRefs(filter);
   filter->migrationState = SifraGenericMigrationRestoring;
   void *cookie = filter->slowPath;
   orr_SpinlockUnlock(filter->lock);
   const orr_Status status = orr_SifraRestoreSlowPathState(
      filter->handle, bytes + header.slowPathOffset, header.slowPathLen,
      SifraGenericRestoreSlowPathReply, cookie, static_cast<uint32_t>(SIFRAGENERIC_SLOWPATH_TIMEOUT));
   orr_SpinlockLock(filter->lock);
   SifraGenericDropRef(filter);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_INFO, "%s: Couldn't request slow path state restore (%#x): %s", filter->name,
             SifraGenericStatusValue(status), orr_StatusToString(status));
      SifraGenericDropRef(filter);
      filter->migrationState = SifraGenericMigrationIdle;
   }
   orr_SpinlockUnlock(filter->lock);
   return status;
}

void SifraGenericRestoreSlowPathReply(orr_SifraFilter record, void * /* cookie */,
                                      orr_Status status)
{
   if (!SifraGenericFilterIsValid(record)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return;
   }
   auto *filter = static_cast<SifraGenericFilter *>(record);

   orr_SpinlockLock(filter->lock);
   if (filter->migrationState != SifraGenericMigrationRestoring) {
      SG_LOG(ORR_LOG_ERROR, "%s: Unexpected restore slow path state reply", filter->name);
   } else {
      if (status != ORR_OK) {
         SG_LOG(ORR_LOG_ERROR, "%s: Failed to restore slow path state (%#x): %s", filter->name,
                SifraGenericStatusValue(status), orr_StatusToString(status));
      } else {
         SG_LOG(ORR_LOG_INFO, "%s: Finished restoring slow path state", filter->name);
      }
      filter->migrationState = SifraGenericMigrationIdle;
   }
   SifraGenericDropRef(filter);
   orr_SpinlockUnlock(filter->lock);
}
