/*
 * The port database's records: lookup, addition with replacement, removal,
 * clearing, ageing and the pending DHCP requests.
 *
 * The hash table exists only while the port holds two or more VMIs; a
 * single VMI is found by comparing the list's first entry.
 */
#include "swsec/swsec_port_db.h"
#include "swsec/swsec_dhcp_req_index.h"
#include "swsec/swsec_wire.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_log.h"
#include "platform/orr_text.h"
#include "swsec/swsec_notify.h"
#include "swsec/swsec_port_db_links.h"

int64_t SifraGenericGetExpirySec(uint32_t seconds)
{
   orr_TimeVal now{};
   orr_GetUptime(&now);
   return now.sec + static_cast<int64_t>(seconds);
}

/*
 * All three parts compared without early exits: a bucket walk then has one
 * branch an entry, where the frame path's lookups of random sources would
 * otherwise mispredict one of three.
 */
static bool SwSecVmiHasKey(const SwSecVmi *vmi, uint16_t vlanId, const uint8_t *mac,
                           uint32_t ipAddr)
{
   return (static_cast<unsigned>(vmi->vlanId == vlanId) & static_cast<unsigned>(SwSecSameMac(vmi->macAddr, mac)) &
           static_cast<unsigned>(vmi->ipAddr == ipAddr)) != 0;
}

static SwSecVmiKey SwSecVmiKeyOf(const SwSecVmi *vmi)
{
   SwSecVmiKey key{};
   key.vlanId = vmi->vlanId;
   orr_Memcpy(key.macAddr, vmi->macAddr, sizeof(key.macAddr));
   key.ipAddr = vmi->ipAddr;
   return key;
}

SwSecVmi *SwSecFindVmi(SwSecContext *ctx, uint16_t vlanId, const uint8_t *mac, uint32_t ipAddr)
{
   if (ctx->numVmiEntries == 0) {
      return nullptr;
   }
   if (ctx->numVmiEntries == 1) {
      SwSecVmi *only = SwSecVmiFromListLinks(ctx->portDbList.next);
      return SwSecVmiHasKey(only, vlanId, mac, ipAddr) ? only : nullptr;
   }

   SwSecVmiKey key{};
   key.vlanId = vlanId;
   __builtin_memcpy(key.macAddr, mac, sizeof(key.macAddr));
   key.ipAddr = ipAddr;
   orr_ListLinks *bucket = SwSecVmiBucket(ctx->portDbHash, &key);
   for (orr_ListLinks *links = bucket->next; links != bucket; links = links->next) {
      SwSecVmi *vmi = SwSecVmiFromHashLinks(links);
      if (SwSecVmiHasKey(vmi, vlanId, mac, ipAddr)) {
         return vmi;
      }
   }
   return nullptr;
}

static bool SwSecDiscMethodIsValid(uint8_t method)
{
   return method == SwSecDiscDhcpSnooping || method == SwSecDiscStatic ||
          method == SwSecDiscTofu || method == SwSecDiscApSnooping;
}

/*
 * Whether a new entry may take the place of an existing one with the same
 * key: a static entry replaces a learned one, a DHCP entry replaces a
 * non-authoritative one; nothing replaces a static entry.
 */
static bool SwSecVmiReplaces(uint8_t existing, uint8_t added)
{
   if (existing == SwSecDiscStatic) {
      return false;
   }
   if (added == SwSecDiscStatic) {
      return true;
   }
   return added == SwSecDiscDhcpSnooping && (existing & SwSecDiscNonAuthoritativeMask) != 0;
}

/* Puts a hash table no longer in use away: parked during a reconfiguration, else freed. */
static void SwSecRetirePortDbHash(SwSecContext *ctx, Hash_Table *table)
{
   if (ctx->keepPortDbHash != 0 && ctx->sparePortDbHash == nullptr) {
      ctx->sparePortDbHash = table;
      return;
   }
   Hash_Free(table);
}

int SwSecAddVmi(SwSecContext *ctx, SwSecVmi *vmi)
{
   const uint8_t method = vmi->discoveryMethod;
   if (!SwSecDiscMethodIsValid(method)) {
      return -1;
   }

   SwSecVmi *existing = SwSecFindVmi(ctx, vmi->vlanId, vmi->macAddr, vmi->ipAddr);
   if (existing != nullptr) {
      if (!SwSecVmiReplaces(existing->discoveryMethod, method)) {
         return -1;
      }
      /*
       * The replacement must not fail for want of a hash table: a table
       * emptied by the removal is parked and taken again just below.
       */
      const uint8_t keep = ctx->keepPortDbHash;
      ctx->keepPortDbHash = 1;
      SwSecDelVmi(ctx, existing);
      ctx->keepPortDbHash = keep;
   }

   if (ctx->numVmiEntries >= ctx->config.portDbSize) {
      const uint32_t portDbSize = ctx->config.portDbSize;
      SG_LOG(ORR_LOG_ERROR, "%s: Exceeding the max portDbSize %u", ctx->filter->name, portDbSize);
      return -1;
   }

   if (ctx->numVmiEntries == 1) {
      Hash_Table *table = ctx->sparePortDbHash;
      if (table != nullptr) {
         ctx->sparePortDbHash = nullptr;
      } else {
         table = Hash_Alloc(sifraGenericHeapID, SWSEC_PORT_DB_HASH_BUCKETS);
         if (table == nullptr) {
            return -1;
         }
      }
      ctx->portDbHash = table;
      SwSecVmi *first = SwSecVmiFromListLinks(ctx->portDbList.next);
      SwSecVmiKey firstKey = SwSecVmiKeyOf(first);
      SifraGenericListAppend(SwSecVmiBucket(table, &firstKey), &first->hashLinks);
   }
   SifraGenericListAppend(&ctx->portDbList, &vmi->listLinks);
   if (ctx->portDbHash != nullptr) {
      SwSecVmiKey key = SwSecVmiKeyOf(vmi);
      SifraGenericListAppend(SwSecVmiBucket(ctx->portDbHash, &key), &vmi->hashLinks);
   }

   ctx->numVmiEntries++;
   if ((method & SwSecDiscAuthoritativeMask) != 0) {
      ctx->numAuthVmiEntries++;
      if (method == SwSecDiscStatic) {
         ctx->config.numStatic++;
      } else {
         ctx->totalClientIdLen += vmi->clientIdLen;
      }
   } else {
      ctx->numNonAuthVmiEntries++;
   }

   SwSecPostPortDbMsg(ctx, SwSecPortDbOpAdded, vmi);
   return 0;
}

void SwSecDelVmi(SwSecContext *ctx, SwSecVmi *vmi)
{
   SifraGenericListUnlink(&vmi->listLinks);
   if (ctx->numVmiEntries >= 2) {
      SifraGenericListUnlink(&vmi->hashLinks);
   }

   ctx->numVmiEntries--;
   if (ctx->numVmiEntries == 1) {
      SwSecVmi *remaining = SwSecVmiFromListLinks(ctx->portDbList.next);
      SifraGenericListUnlink(&remaining->hashLinks);
      Hash_Table *table = ctx->portDbHash;
      ctx->portDbHash = nullptr;
      SwSecRetirePortDbHash(ctx, table);
   }

   if (vmi->clientIdStr != nullptr) {
      SifraGenericFree(vmi->clientIdStr);
      vmi->clientIdStr = nullptr;
   }

   const uint8_t method = vmi->discoveryMethod;
   if ((method & SwSecDiscAuthoritativeMask) != 0) {
      ctx->numAuthVmiEntries--;
      if (method == SwSecDiscStatic) {
         ctx->config.numStatic--;
      } else {
         ctx->totalClientIdLen -= vmi->clientIdLen;
      }
   } else {
      ctx->numNonAuthVmiEntries--;
   }

   SwSecPostPortDbMsg(ctx, SwSecPortDbOpRemoved, vmi);
   SifraGenericFree(vmi);
}

orr_Status SwSecClearVmi(SwSecContext *ctx, bool all, uint32_t count, const SwSecVmiKey *keys)
{
   if ((ctx->config.featuresEnabled & SwSecFeatureIpDiscovery) == 0) {
      return ORR_OK;
   }

   if (all) {
      orr_ListLinks *next = nullptr;
      for (orr_ListLinks *links = ctx->portDbList.next; links != &ctx->portDbList; links = next) {
         next = links->next;
         SwSecVmi *vmi = SwSecVmiFromListLinks(links);
         if (vmi->discoveryMethod != SwSecDiscStatic) {
            SwSecDelVmi(ctx, vmi);
         }
      }
      return ORR_OK;
   }

   for (uint32_t i = 0; i < count; i++) {
      SwSecVmiKey key{};
      orr_Memcpy(&key, &keys[i], sizeof(key));
      SwSecVmi *vmi = SwSecFindVmi(ctx, key.vlanId, key.macAddr, key.ipAddr);
      if (vmi == nullptr) {
         continue;
      }
      if (vmi->discoveryMethod == SwSecDiscStatic) {
         uint8_t ip[4];
         orr_Memcpy(ip, &key.ipAddr, sizeof(ip));
         SG_LOG(ORR_LOG_ERROR,
                "%s: Trying to delete a static entry: %u %02hhx:%02hhx:%02hhx:%02hhx:%02hhx:%02hhx "
                "%u.%u.%u.%u",
                ctx->filter->name, static_cast<unsigned>(key.vlanId), key.macAddr[0],
                key.macAddr[1], key.macAddr[2], key.macAddr[3], key.macAddr[4], key.macAddr[5],
                static_cast<unsigned>(ip[0]), static_cast<unsigned>(ip[1]),
                static_cast<unsigned>(ip[2]), static_cast<unsigned>(ip[3]));
         continue;
      }
      SwSecDelVmi(ctx, vmi);
   }
   return ORR_OK;
}

void SwSecDelDhcpReq(SwSecContext *ctx, SwSecDhcpReq *req)
{
   SwSecUnlinkDhcpReq(ctx, req);
   if (req->clientIdLen != 0 && req->clientIdStr != nullptr) {
      SifraGenericFree(req->clientIdStr);
      req->clientIdStr = nullptr;
   }
   SifraGenericFree(req);
}

void SwSecPortDbTimerCb(SwSecContext *ctx)
{
   orr_TimeVal now{};
   orr_GetUptime(&now);

   orr_ListLinks *next = nullptr;
   for (orr_ListLinks *links = ctx->portDbList.next; links != &ctx->portDbList; links = next) {
      next = links->next;
      SwSecVmi *vmi = SwSecVmiFromListLinks(links);
      if (vmi->discoveryMethod != SwSecDiscStatic && vmi->expiryTime < now.sec) {
         SwSecDelVmi(ctx, vmi);
      }
   }

   for (orr_ListLinks *links = ctx->dhcpReqList.next; links != &ctx->dhcpReqList; links = next) {
      next = links->next;
      SwSecDhcpReq *req = SwSecDhcpReqFromLinks(links);
      if (req->expiryTime < now.sec) {
         SwSecDelDhcpReq(ctx, req);
      }
   }
}

void SwSecPortDbDestroy(SwSecContext *ctx)
{
   if (ctx->sparePortDbHash != nullptr) {
      Hash_Free(ctx->sparePortDbHash);
      ctx->sparePortDbHash = nullptr;
   }
}
