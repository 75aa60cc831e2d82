/*
 * Saving a switch-security port into its part of the saved state, and
 * rebuilding a port from one: configuration, error-rate-limit state,
 * counters and port database, lifetimes re-based on the local clock.
 */
#include "swsec/swsec_saved_state.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_log.h"
#include "platform/orr_text.h"
#include "swsec/swsec_config.h"
#include "swsec/swsec_policy.h"
#include "swsec/swsec_port_db.h"
#include "swsec/swsec_port_db_links.h"

/* Bytes an entry takes in the part: a DHCP entry carries its client identifier. */
static uint64_t SwSecSavedVmiLen(uint8_t discoveryMethod, uint8_t clientIdLen)
{
   return sizeof(SwSecSavedVmi) + (discoveryMethod == SwSecDiscDhcpSnooping ? clientIdLen : 0u);
}

/* Seconds from now until `end`, or 0 when it has passed; a fresh uptime reading. */
static int64_t SwSecSecondsUntil(int64_t end)
{
   orr_TimeVal now{};
   orr_GetUptime(&now);
   return end > now.sec ? end - now.sec : 0;
}

uint64_t SwSecGetSavedStateLen(SifraGenericFilter *filter)
{
   auto *ctx = static_cast<SwSecContext *>(filter->agentData);
   if (ctx == nullptr) {
      return 0;
   }
   orr_SpinlockReadLock(ctx->configLock);
   /* At most 9832: the sum cannot overflow 32 bits. */
   const uint32_t length = static_cast<uint32_t>(sizeof(SwSecSavedState)) +
                           static_cast<uint32_t>(sizeof(SwSecSavedVmi)) * ctx->numVmiEntries +
                           ctx->totalClientIdLen + static_cast<uint32_t>(sizeof(SwSecSavedFrameGuard));
   orr_SpinlockReadUnlock(ctx->configLock);
   return length;
}

/*
 * Writes the entries in list order after the fixed part, as many as fit
 * in `agentLen`; returns how many, and in `*end` where they end.
 * configLock held shared.
 */
static uint32_t SwSecSavePortDb(SwSecContext *ctx, uint8_t *part, uint64_t agentLen, uint64_t *end)
{
   uint32_t numSaved = 0;
   uint64_t &position = *end;
   for (orr_ListLinks *links = ctx->portDbList.next; links != &ctx->portDbList;
        links = links->next) {
      const SwSecVmi *vmi = SwSecVmiFromListLinks(links);
      const uint8_t method = vmi->discoveryMethod;
      const uint64_t entryLen = SwSecSavedVmiLen(method, vmi->clientIdLen);
      /*
       * The framework sized the part by an earlier call; entries learned
       * since then may not fit. The list is oldest first, so what is left
       * out is what was learned last, and the part stays within its bytes.
       */
      if (entryLen > agentLen - position) {
         break;
      }
      SwSecSavedVmi entry;
      orr_Memset(&entry, 0, sizeof(entry));
      entry.vlanId = vmi->vlanId;
      orr_Memcpy(entry.macAddr, vmi->macAddr, sizeof(entry.macAddr));
      entry.ipAddr = vmi->ipAddr;
      entry.discoveryMethod = method;
      if (method != SwSecDiscStatic) {
         entry.timeRemaining = SwSecSecondsUntil(vmi->expiryTime);
      }
      if (method == SwSecDiscDhcpSnooping) {
         orr_Memcpy(entry.chaddr, vmi->chaddr, sizeof(entry.chaddr));
         entry.clientIdLen = vmi->clientIdLen;
         entry.serverIp = vmi->serverIp;
         entry.leaseTime = vmi->leaseTime;
      }
      orr_Memcpy(part + position, &entry, sizeof(entry));
      if (method == SwSecDiscDhcpSnooping && vmi->clientIdLen != 0) {
         orr_Memcpy(part + position + sizeof(entry), vmi->clientIdStr, vmi->clientIdLen);
      }
      position += entryLen;
      numSaved++;
   }
   return numSaved;
}

void SwSecSaveState(SifraGenericFilter *filter, void *agentPart, uint64_t agentLen)
{
   auto *ctx = static_cast<SwSecContext *>(filter->agentData);
   if (ctx == nullptr || agentLen < sizeof(SwSecSavedState)) {
      return;
   }
   auto *part = static_cast<uint8_t *>(agentPart);
   SwSecSavedState state;
   orr_Memset(&state, 0, sizeof(state));

   orr_SpinlockReadLock(ctx->configLock);
   orr_Memcpy(&state.config, &ctx->config, sizeof(state.config));
   /*
    * Frames judged meanwhile (configLock is only shared) change the error
    * state under the transmit limiter's lock and raise the counters with
    * atomic adds: both are read the same way, so neither is torn.
    */
   orr_SpinlockLock(ctx->txRateLimitLock);
   const uint8_t inErrorState = ctx->txRateLimitErr;
   const int64_t errorStateEnd = ctx->txRateLimitErrEnd;
   orr_SpinlockUnlock(ctx->txRateLimitLock);
   state.txRateLimitErr = inErrorState;
   if (inErrorState != 0) {
      state.txRateLimitErrRemaining = SwSecSecondsUntil(errorStateEnd);
   }
   SwSecDropCounters counters;
   counters.dhcpSnoopingDropCnt = __atomic_load_n(&ctx->counters.dhcpSnoopingDropCnt, __ATOMIC_RELAXED);
   counters.daiDropCnt = __atomic_load_n(&ctx->counters.daiDropCnt, __ATOMIC_RELAXED);
   counters.txRateLimitDropCnt = __atomic_load_n(&ctx->counters.txRateLimitDropCnt, __ATOMIC_RELAXED);
   counters.txRateLimitErrEntryCnt =
      __atomic_load_n(&ctx->counters.txRateLimitErrEntryCnt, __ATOMIC_RELAXED);
   counters.rxRateLimitDropCnt = __atomic_load_n(&ctx->counters.rxRateLimitDropCnt, __ATOMIC_RELAXED);
   counters.ipSrcGuardDropCnt = __atomic_load_n(&ctx->counters.ipSrcGuardDropCnt, __ATOMIC_RELAXED);
   orr_Memcpy(&state.counters, &counters, sizeof(counters));
   /* The frame guard block goes after the entries; they fit in what it leaves. */
   const bool withGuard = agentLen >= sizeof(SwSecSavedState) + sizeof(SwSecSavedFrameGuard);
   const uint64_t vmiRoom = withGuard ? agentLen - sizeof(SwSecSavedFrameGuard) : agentLen;
   uint64_t position = sizeof(SwSecSavedState);
   if ((ctx->config.featuresEnabled & SwSecFeatureIpDiscovery) != 0) {
      state.numSavedVmis = SwSecSavePortDb(ctx, part, vmiRoom, &position);
   }
   if (withGuard) {
      SwSecSavedFrameGuard saved;
      orr_Memset(&saved, 0, sizeof(saved));
      saved.guard = ctx->frameGuard;
      saved.taggedDropCnt = __atomic_load_n(&ctx->frameGuardCounters.taggedDropCnt, __ATOMIC_RELAXED);
      saved.etherTypeDropCnt = __atomic_load_n(&ctx->frameGuardCounters.etherTypeDropCnt, __ATOMIC_RELAXED);
      orr_Memcpy(part + position, &saved, sizeof(saved));
   }
   orr_SpinlockReadUnlock(ctx->configLock);

   orr_Memcpy(part, &state, sizeof(state));
}

/* Frees a local list of decoded records with their client identifiers. */
static void SwSecFreeDecodedVmis(orr_ListLinks *head)
{
   while (!SifraGenericListIsEmpty(head)) {
      SwSecVmi *vmi = SwSecVmiFromListLinks(head->next);
      SifraGenericListUnlink(&vmi->listLinks);
      if (vmi->clientIdStr != nullptr) {
         SifraGenericFree(vmi->clientIdStr);
      }
      SifraGenericFree(vmi);
   }
}

/*
 * Checks that the fixed part and all `numSavedVmis` entries with their
 * client identifiers lie within `agentLen` bytes, and that entries come
 * only with IP discovery on; logs a refusal. Reads nothing past agentLen.
 */
static bool SwSecSavedStateIsWellFormed(const SifraGenericFilter *filter, const uint8_t *part,
                                        uint64_t agentLen, const SwSecSavedState *state,
                                        uint64_t *entriesEnd)
{
   /*
    * Entries in a part whose configuration has IP discovery off cannot
    * come from a save: they would be added to a disabled database that
    * nothing ages or looks up. Such a part is refused as corrupt.
    */
   if (state->numSavedVmis != 0 && (state->config.featuresEnabled & SwSecFeatureIpDiscovery) == 0) {
      SG_LOG(ORR_LOG_ERROR, "%s: Saved state has %u VMIs but IP discovery is off", filter->name,
             state->numSavedVmis);
      return false;
   }
   uint64_t position = sizeof(SwSecSavedState);
   for (uint32_t i = 0; i < state->numSavedVmis; i++) {
      SwSecSavedVmi entry;
      if (sizeof(entry) > agentLen - position) {
         SG_LOG(ORR_LOG_ERROR, "%s: Saved state VMI %u of %u runs past the part's %zu bytes",
                filter->name, i + 1, state->numSavedVmis, static_cast<size_t>(agentLen));
         return false;
      }
      orr_Memcpy(&entry, part + position, sizeof(entry));
      const uint64_t entryLen = SwSecSavedVmiLen(entry.discoveryMethod, entry.clientIdLen);
      if (entryLen > agentLen - position) {
         SG_LOG(ORR_LOG_ERROR, "%s: Saved state VMI %u of %u runs past the part's %zu bytes",
                filter->name, i + 1, state->numSavedVmis, static_cast<size_t>(agentLen));
         return false;
      }
      position += entryLen;
   }
   *entriesEnd = position;
   return true;
}

/*
 * The frame guard block after the entries at `position`, into `saved`:
 * zero (the defaults) when the part ends there and its configuration is
 * version 1. False, logged, for a version-2 configuration without it or a
 * block that is not valid.
 */
static bool SwSecSavedFrameGuardGet(SwSecContext *ctx, const uint8_t *part, uint64_t agentLen,
                                    uint64_t position, const SwSecSavedState *state,
                                    SwSecSavedFrameGuard *saved)
{
   orr_Memset(saved, 0, sizeof(*saved));
   if (agentLen - position >= sizeof(*saved)) {
      orr_Memcpy(saved, part + position, sizeof(*saved));
   } else if (SwSecConfigHasFrameGuard(state->config.version)) {
      SG_LOG(ORR_LOG_ERROR, "%s: Saved state of a version %u configuration lacks its frame guard",
             ctx->filter->name, static_cast<unsigned>(state->config.version));
      return false;
   }
   return SwSecFrameGuardIsValid(ctx, &saved->guard);
}

/*
 * Decodes the entries of a well-formed part onto `head`, in blob order,
 * expiries re-based on the local uptime. On failure frees what it made.
 */
static orr_Status SwSecDecodeSavedVmis(const SifraGenericFilter *filter, const uint8_t *part,
                                       uint32_t numSavedVmis, orr_ListLinks *head)
{
   uint64_t position = sizeof(SwSecSavedState);
   for (uint32_t i = 0; i < numSavedVmis; i++) {
      SwSecSavedVmi entry;
      orr_Memcpy(&entry, part + position, sizeof(entry));
      auto *vmi = static_cast<SwSecVmi *>(SifraGenericAlloc(sizeof(SwSecVmi)));
      if (vmi == nullptr) {
         SG_LOG(ORR_LOG_ERROR, "%s: Vmi alloc failed", filter->name);
         SwSecFreeDecodedVmis(head);
         return ORR_NO_MEMORY;
      }
      orr_Memset(vmi, 0, sizeof(*vmi));
      vmi->vlanId = entry.vlanId;
      orr_Memcpy(vmi->macAddr, entry.macAddr, sizeof(vmi->macAddr));
      vmi->ipAddr = entry.ipAddr;
      vmi->discoveryMethod = entry.discoveryMethod;
      if (entry.discoveryMethod == SwSecDiscDhcpSnooping) {
         orr_Memcpy(vmi->chaddr, entry.chaddr, sizeof(vmi->chaddr));
         vmi->clientIdLen = entry.clientIdLen;
         vmi->serverIp = entry.serverIp;
         vmi->leaseTime = entry.leaseTime;
         if (entry.clientIdLen != 0) {
            vmi->clientIdStr = static_cast<uint8_t *>(SifraGenericAlloc(entry.clientIdLen));
            if (vmi->clientIdStr == nullptr) {
               SG_LOG(ORR_LOG_ERROR, "%s: Vmi clientIdStr alloc failed", filter->name);
               SifraGenericFree(vmi);
               SwSecFreeDecodedVmis(head);
               return ORR_NO_MEMORY;
            }
            orr_Memcpy(vmi->clientIdStr, part + position + sizeof(entry), entry.clientIdLen);
         }
      }
      if (entry.discoveryMethod != SwSecDiscStatic) {
         /* The remaining seconds count from now, whatever the source's clock said. */
         vmi->expiryTime = SifraGenericGetExpirySec(static_cast<uint32_t>(entry.timeRemaining));
      }
      SifraGenericListAppend(head, &vmi->listLinks);
      position += SwSecSavedVmiLen(entry.discoveryMethod, entry.clientIdLen);
   }
   return ORR_OK;
}

/* Rebuilds the port database from the part. configLock held exclusive. */
static orr_Status SwSecRestorePortDb(SwSecContext *ctx, const uint8_t *part,
                                     const SwSecSavedState *state)
{
   orr_ListLinks decoded;
   SifraGenericListInit(&decoded);
   orr_Status status = SwSecDecodeSavedVmis(ctx->filter, part, state->numSavedVmis, &decoded);
   if (status != ORR_OK) {
      return status;
   }

   /*
    * The additions below must not fail for want of a hash table, so one is
    * parked beforehand whenever the database may reach two entries: with
    * two or more decoded entries, and also with one when the port already
    * holds one of its own. An empty table already parked serves as well as
    * a fresh one and is kept.
    */
   Hash_Table *madeSpare = nullptr;
   const uint64_t mayHold = static_cast<uint64_t>(state->numSavedVmis) + ctx->numVmiEntries;
   if (state->numSavedVmis != 0 && mayHold >= 2 && ctx->sparePortDbHash == nullptr) {
      madeSpare = Hash_Alloc(sifraGenericHeapID, SWSEC_PORT_DB_HASH_BUCKETS);
      if (madeSpare == nullptr) {
         SwSecFreeDecodedVmis(&decoded);
         return ORR_NO_MEMORY;
      }
      ctx->sparePortDbHash = madeSpare;
   }

   /* The static entries travel as saved VMIs: the configuration brings none of its own. */
   SwSecConfig config;
   orr_Memcpy(&config, &state->config, sizeof(config));
   config.numStatic = 0;
   status = SwSecConfigPortDb(ctx, &config);
   if (status != ORR_OK) {
      if (madeSpare != nullptr && ctx->sparePortDbHash == madeSpare) {
         ctx->sparePortDbHash = nullptr;
         Hash_Free(madeSpare);
      }
      SwSecFreeDecodedVmis(&decoded);
      return status;
   }

   /* Blob order, so that the list keeps the source's order; each addition is announced. */
   while (!SifraGenericListIsEmpty(&decoded)) {
      SwSecVmi *vmi = SwSecVmiFromListLinks(decoded.next);
      SifraGenericListUnlink(&vmi->listLinks);
      if (SwSecAddVmi(ctx, vmi) != 0) {
         if (vmi->clientIdStr != nullptr) {
            SifraGenericFree(vmi->clientIdStr);
         }
         SifraGenericFree(vmi);
      }
   }
   return ORR_OK;
}

orr_Status SwSecRestoreState(SifraGenericFilter *filter, const void *agentPart, uint64_t agentLen)
{
   auto *ctx = static_cast<SwSecContext *>(filter->agentData);
   if (ctx == nullptr) {
      return ORR_FAILURE;
   }
   const auto *part = static_cast<const uint8_t *>(agentPart);
   /*
    * The part is read only within the length the blob's header gave it: a
    * part too short for its fixed bytes, or whose counts run past its
    * end, is refused before anything changes.
    */
   if (agentLen < sizeof(SwSecSavedState)) {
      SG_LOG(ORR_LOG_ERROR, "%s: Saved state too short (%zu bytes)", filter->name,
             static_cast<size_t>(agentLen));
      return ORR_FAILURE;
   }
   SwSecSavedState state;
   orr_Memcpy(&state, part, sizeof(state));
   uint64_t entriesEnd = 0;
   SwSecSavedFrameGuard savedGuard;
   if (!SwSecSavedStateIsWellFormed(filter, part, agentLen, &state, &entriesEnd) ||
       !SwSecSavedFrameGuardGet(ctx, part, agentLen, entriesEnd, &state, &savedGuard)) {
      return ORR_FAILURE;
   }
   /*
    * The saved header is held to the rules of a new configuration: a part
    * the save did not make must not switch on a combination that the
    * property and the ioctl refuse.
    */
   if (!SwSecConfigIsValid(ctx, &state.config)) {
      return ORR_FAILURE;
   }

   orr_SpinlockWriteLock(ctx->configLock);
   const orr_Status status = SwSecRestorePortDb(ctx, part, &state);
   if (status != ORR_OK) {
      orr_SpinlockWriteUnlock(ctx->configLock);
      return status;
   }

   ctx->config.version = state.config.version;
   ctx->config.featuresEnabled = state.config.featuresEnabled;
   ctx->config.arpRateLimit = state.config.arpRateLimit;
   ctx->config.errRateLimit = state.config.errRateLimit;
   ctx->config.errRateLimitPeriod = state.config.errRateLimitPeriod;

   /* No frame is judged under the exclusive configLock: the limiters need no lock of their own. */
   if ((state.config.featuresEnabled & SwSecFeatureDai) != 0 && state.config.arpRateLimit != 0) {
      if (state.txRateLimitErr == 0) {
         SifraGenericRateLimitInit(&ctx->txRateLimit, state.config.arpRateLimit);
         ctx->txRateLimitErr = 0;
      } else {
         SifraGenericRateLimitInit(&ctx->txRateLimit, state.config.errRateLimit);
         ctx->txRateLimitErr = 1;
         ctx->txRateLimitErrEnd =
            SifraGenericGetExpirySec(static_cast<uint32_t>(state.txRateLimitErrRemaining));
      }
      SifraGenericRateLimitInit(&ctx->rxRateLimit, state.config.arpRateLimit);
   }
   orr_Memcpy(&ctx->counters, &state.counters, sizeof(ctx->counters));
   ctx->frameGuard = savedGuard.guard;
   ctx->frameGuardCounters.taggedDropCnt = savedGuard.taggedDropCnt;
   ctx->frameGuardCounters.etherTypeDropCnt = savedGuard.etherTypeDropCnt;
   orr_SpinlockWriteUnlock(ctx->configLock);
   return ORR_OK;
}
