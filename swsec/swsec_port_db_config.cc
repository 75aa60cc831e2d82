/*
 * Applying a new configuration to a port database: enabling and
 * reconfiguring it (with its static entries, its port filter map entry and
 * its timer), or disabling and emptying it.
 *
 * Everything that can fail is done before the database changes, so a
 * refused configuration leaves the old one in force.
 */
#include "swsec/swsec_port_db.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_agent.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_log.h"
#include "framework/sifra_generic_port.h"
#include "platform/orr_text.h"
#include "swsec/swsec_config.h"
#include "swsec/swsec_port_db_links.h"
#include "swsec/swsec_port_filter_map.h"

/* Only ports of the built-in agent are entered in the port filter map. */
static bool SwSecIsBuiltinAgentPort(const SwSecContext *ctx)
{
   const SifraGenericFilter *filter = ctx->filter;
   if (filter == nullptr || filter->agent == nullptr) {
      return false;
   }
   return orr_Strncmp(filter->agent->name, SIFRAGENERIC_BUILTIN_AGENT_NAME,
                      SIFRAGENERIC_AGENT_NAME_LEN) == 0;
}

static void SwSecDelVmisInMask(SwSecContext *ctx, uint8_t methodMask)
{
   orr_ListLinks *next = nullptr;
   for (orr_ListLinks *links = ctx->portDbList.next; links != &ctx->portDbList; links = next) {
      next = links->next;
      SwSecVmi *vmi = SwSecVmiFromListLinks(links);
      if ((vmi->discoveryMethod & methodMask) != 0) {
         SwSecDelVmi(ctx, vmi);
      }
   }
}

static void SwSecFreeVmiList(orr_ListLinks *head)
{
   while (!SifraGenericListIsEmpty(head)) {
      SwSecVmi *vmi = SwSecVmiFromListLinks(head->next);
      SifraGenericListUnlink(&vmi->listLinks);
      SifraGenericFree(vmi);
   }
}

/*
 * Allocates the static entries of `cfg`, in order, onto `head`. On failure
 * frees what it made and returns ORR_NO_MEMORY.
 */
static orr_Status SwSecPreAllocStatics(const SwSecConfig *cfg, uint32_t numStatic,
                                       orr_ListLinks *head)
{
   const auto *keys = reinterpret_cast<const uint8_t *>(cfg) + sizeof(SwSecConfig);
   for (uint32_t i = 0; i < numStatic; i++) {
      auto *vmi = static_cast<SwSecVmi *>(SifraGenericAlloc(sizeof(SwSecVmi)));
      if (vmi == nullptr) {
         SwSecFreeVmiList(head);
         return ORR_NO_MEMORY;
      }
      SwSecVmiKey key;
      orr_Memcpy(&key, keys + static_cast<size_t>(i) * sizeof(SwSecVmiKey), sizeof(key));
      vmi->vlanId = key.vlanId;
      orr_Memcpy(vmi->macAddr, key.macAddr, sizeof(vmi->macAddr));
      vmi->ipAddr = key.ipAddr;
      vmi->discoveryMethod = SwSecDiscStatic;
      SifraGenericListAppend(head, &vmi->listLinks);
   }
   return ORR_OK;
}

/* (Re)initialises an enabled database with the new record `cfg`. */
static orr_Status SwSecInitPortDb(SwSecContext *ctx, const SwSecConfig *cfg)
{
   const char *name = ctx->filter->name;
   const uint32_t portDbSize = cfg->portDbSize;
   const uint8_t trusted = cfg->trusted;
   const uint32_t numStatic = cfg->numStatic;

   if (portDbSize < SWSEC_PORT_DB_SIZE_MIN || portDbSize > SWSEC_PORT_DB_SIZE_MAX) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid portDbSize: %u. Expected in the range [%u %u]", name,
             portDbSize, SWSEC_PORT_DB_SIZE_MIN, SWSEC_PORT_DB_SIZE_MAX);
      return ORR_FAILURE;
   }

   /* What survives: learned entries (less the non-authoritative ones when leaving trusted mode) and the new statics. */
   const bool leavesTrusted = ctx->config.trusted != 0 && ctx->config.trusted != trusted;
   int64_t required = static_cast<int64_t>(ctx->numVmiEntries) -
                      static_cast<int64_t>(ctx->config.numStatic) + static_cast<int64_t>(numStatic);
   if (leavesTrusted) {
      required -= static_cast<int64_t>(ctx->numNonAuthVmiEntries);
   }
   if (static_cast<int64_t>(portDbSize) < required) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid portDbSize: %u %u", name, portDbSize,
             static_cast<uint32_t>(required));
      return ORR_FAILURE;
   }

   orr_ListLinks statics;
   SifraGenericListInit(&statics);
   orr_Status status = SwSecPreAllocStatics(cfg, numStatic, &statics);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Vmi pre alloc failed", name);
      return status;
   }

   /*
    * A database that will hold two or more entries needs a hash table;
    * obtaining it now means the static entries added below cannot be
    * refused for want of one after the old configuration is gone.
    */
   Hash_Table *preallocHash = nullptr;
   if (required >= 2 && ctx->portDbHash == nullptr && ctx->sparePortDbHash == nullptr) {
      preallocHash = Hash_Alloc(sifraGenericHeapID, SWSEC_PORT_DB_HASH_BUCKETS);
      if (preallocHash == nullptr) {
         SG_LOG(ORR_LOG_ERROR, "%s: Vmi pre alloc failed", name);
         status = ORR_NO_MEMORY;
         goto out_free_statics;
      }
   }

   SwSecPortFilterMap *newEntry;
   newEntry = nullptr;
   if (SwSecIsBuiltinAgentPort(ctx)) {
      status = SwSecNewPortFilterMap(ctx, &newEntry);
      if (status != ORR_OK) {
         SG_LOG(ORR_LOG_ERROR, "%s: Pfm add failed: %s", name, orr_StatusToString(status));
         goto out_free_hash;
      }
   }

   if (ctx->portDbTimer == 0) {
      status = SifraGenericAddPortTimer(ctx->filter, SwSecTimerCb, ctx, &ctx->portDbTimer);
      if (status != ORR_OK) {
         goto out_free_map_entry;
      }
   }

   /* From here on nothing fails. */
   {
      const uint8_t deleteMask =
         leavesTrusted ? static_cast<uint8_t>(SwSecDiscStatic | SwSecDiscNonAuthoritativeMask)
                       : static_cast<uint8_t>(SwSecDiscStatic);
      if (required > 1) {
         ctx->keepPortDbHash = 1;
      }
      SwSecDelVmisInMask(ctx, deleteMask);
      ctx->keepPortDbHash = 0;
   }
   if (preallocHash != nullptr) {
      /* Both slots were empty when it was made, and removals only shrink the database. */
      ctx->sparePortDbHash = preallocHash;
   }

   ctx->config.trusted = trusted;
   ctx->config.portDbSize = portDbSize;

   while (!SifraGenericListIsEmpty(&statics)) {
      SwSecVmi *vmi = SwSecVmiFromListLinks(statics.next);
      SifraGenericListUnlink(&vmi->listLinks);
      if (SwSecAddVmi(ctx, vmi) != 0) {
         /* The same key listed twice: the first one stands. */
         SifraGenericFree(vmi);
      }
   }

   if (newEntry != nullptr) {
      SwSecInsertPortFilterMap(newEntry);
   }

   SG_LOG(ORR_LOG_INFO, "%s: Config success: trusted = %u portDbSize = %u numStatic = %u", name,
          static_cast<unsigned>(trusted), portDbSize, numStatic);
   return ORR_OK;

out_free_map_entry:
   if (newEntry != nullptr) {
      SwSecFreePortFilterMap(newEntry);
   }
out_free_hash:
   if (preallocHash != nullptr) {
      Hash_Free(preallocHash);
   }
out_free_statics:
   SwSecFreeVmiList(&statics);
   return status;
}

orr_Status SwSecConfigPortDb(SwSecContext *ctx, const SwSecConfig *config)
{
   const bool enabled = (ctx->config.featuresEnabled & SwSecFeatureIpDiscovery) != 0;
   const bool enabling = (config->featuresEnabled & SwSecFeatureIpDiscovery) != 0;

   if (enabling) {
      return SwSecInitPortDb(ctx, config);
   }
   if (!enabled) {
      return ORR_OK;
   }

   if (SwSecIsBuiltinAgentPort(ctx)) {
      orr_Status status = SwSecDelPortFilterMap(ctx);
      if (status != ORR_OK) {
         return status;
      }
   }

   orr_ListLinks *next = nullptr;
   for (orr_ListLinks *links = ctx->portDbList.next; links != &ctx->portDbList; links = next) {
      next = links->next;
      SwSecDelVmi(ctx, SwSecVmiFromListLinks(links));
   }
   for (orr_ListLinks *links = ctx->dhcpReqList.next; links != &ctx->dhcpReqList; links = next) {
      next = links->next;
      SwSecDelDhcpReq(ctx, SwSecDhcpReqFromLinks(links));
   }
   return ORR_OK;
}
