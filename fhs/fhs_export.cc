/*
 * Ports of the first-hop security agent by port ID, and the exported
 * binding queries. A query reads the port under its configLock shared,
 * inside the agent lock that keeps the port alive; a buffer handed out
 * holds the module (its use count) until it is given back.
 */
#include "fhs/fhs_export.h"

#include "fhs/fhs_agent.h"
#include "framework/sifra_generic.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_log.h"
#include "framework/sifra_generic_port.h"
#include "platform/orr_text.h"
#include "platform/orr_time.h"

#include <cstddef>

SifraGenericFastPathAgent *FhsFindAgent(void)
{
   for (orr_ListLinks *links = agentList.next; links != &agentList; links = links->next) {
      SifraGenericFastPathAgent *agent = SifraGenericAgentFromLinks(links);
      if (agent->ops == &fhsAgentOps) {
         return agent;
      }
   }
   return nullptr;
}

orr_Status FhsLockPort(uint32_t portId, bool write, SifraGenericFastPathAgent **agentOut, FhsContext **ctxOut)
{
   SifraGenericFastPathAgent *agent = FhsFindAgent();
   if (agent == nullptr) {
      return ORR_NOT_FOUND;
   }
   orr_SpinlockLock(agent->lock);
   for (orr_ListLinks *links = agent->filterList.next; links != &agent->filterList; links = links->next) {
      auto *ctx = static_cast<FhsContext *>(SifraGenericFilterFromLinks(links)->agentData);
      if (ctx != nullptr && ctx->portId == portId) {
         if (write) {
            orr_SpinlockWriteLock(ctx->configLock);
         } else {
            orr_SpinlockReadLock(ctx->configLock);
         }
         *agentOut = agent;
         *ctxOut = ctx;
         return ORR_OK;
      }
   }
   orr_SpinlockUnlock(agent->lock);
   return ORR_NOT_FOUND;
}

void FhsUnlockPort(SifraGenericFastPathAgent *agent, FhsContext *ctx, bool write)
{
   if (write) {
      orr_SpinlockWriteUnlock(ctx->configLock);
   } else {
      orr_SpinlockReadUnlock(ctx->configLock);
   }
   orr_SpinlockUnlock(agent->lock);
}

namespace {

uint32_t FhsSelectorMethods(uint32_t selector)
{
   switch (selector) {
   case FhsBindingsAuth:
      return FhsBindDhcpv6 | FhsBindStatic;
   case FhsBindingsNonAuth:
      return FhsBindFcfs;
   case FhsBindingsAll:
      return FhsBindDhcpv6 | FhsBindStatic | FhsBindFcfs;
   default:
      return 0;
   }
}

uint32_t FhsSelectorCount(const FhsContext *ctx, uint32_t methods)
{
   return ((methods & FhsBindDhcpv6) != 0 ? ctx->numByMethod[0] : 0) +
          ((methods & FhsBindStatic) != 0 ? ctx->numByMethod[1] : 0) +
          ((methods & FhsBindFcfs) != 0 ? ctx->numByMethod[2] : 0);
}

}  // namespace

extern "C" orr_Status Fhs_BindingsGetNumEntries(uint32_t portId, uint32_t selector, uint32_t *numEntries)
{
   if (numEntries == nullptr) {
      return ORR_BAD_PARAM;
   }
   SifraGenericFastPathAgent *agent = nullptr;
   FhsContext *ctx = nullptr;
   const orr_Status status = FhsLockPort(portId, false, &agent, &ctx);
   if (status != ORR_OK) {
      return status;
   }
   *numEntries = FhsSelectorCount(ctx, FhsSelectorMethods(selector));
   FhsUnlockPort(agent, ctx, false);
   return ORR_OK;
}

extern "C" orr_Status Fhs_BindingsGetEntries(uint32_t portId, uint32_t selector, void **entries,
                                             uint32_t *numEntries, void **buffer)
{
   if (numEntries == nullptr || entries == nullptr || buffer == nullptr) {
      return ORR_BAD_PARAM;
   }
   SifraGenericFastPathAgent *agent = nullptr;
   FhsContext *ctx = nullptr;
   orr_Status status = FhsLockPort(portId, false, &agent, &ctx);
   if (status != ORR_OK) {
      return status;
   }
   /* The port may go once it is unlocked: keep its name for the last message. */
   char filterName[SIFRAGENERIC_FILTER_NAME_LEN];
   orr_Strncpy(filterName, ctx->filter->name, sizeof(filterName) - 1);
   filterName[sizeof(filterName) - 1] = '\0';

   const uint32_t methods = FhsSelectorMethods(selector);
   const uint32_t count = FhsSelectorCount(ctx, methods);
   *numEntries = count;
   *entries = nullptr;
   *buffer = nullptr;
   if (count == 0) {
      FhsUnlockPort(agent, ctx, false);
      return ORR_OK;
   }
   auto *block = static_cast<FhsBindingEntry *>(SifraGenericAlloc(count * static_cast<uint32_t>(sizeof(FhsBindingEntry))));
   if (block == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "%s: IPv6 binding entries alloc failed", filterName);
      FhsUnlockPort(agent, ctx, false);
      return ORR_NO_MEMORY;
   }
   orr_TimeVal now = {};
   orr_GetUptime(&now);
   uint32_t filled = 0;
   for (orr_ListLinks *links = ctx->bindingList.next; links != &ctx->bindingList && filled < count;
        links = links->next) {
      const auto *binding =
         reinterpret_cast<const FhsBinding *>(reinterpret_cast<const char *>(links) - offsetof(FhsBinding, portLinks));
      if ((binding->method & methods) == 0) {
         continue;
      }
      FhsBindingEntry *entry = &block[filled++];
      entry->key = binding->key;
      entry->method = binding->method;
      entry->authoritative = binding->method != FhsBindFcfs ? 1 : 0;
      const int64_t expiry = __atomic_load_n(&binding->expiry, __ATOMIC_RELAXED);
      if (expiry != 0) {
         const int64_t left = expiry - now.sec;
         entry->timeRemaining = left <= 0 ? 0u : left > 0xffffffff ? 0xffffffffu : static_cast<uint32_t>(left);
      }
   }
   FhsUnlockPort(agent, ctx, false);

   status = SifraGenericHandOutBlock(filterName, portId, block);
   if (status == ORR_OK) {
      *entries = block;
      *buffer = block;
   }
   return status;
}

extern "C" orr_Status Fhs_BindingsReleaseBuf(void *buffer)
{
   return SifraGenericGiveBackBlock(buffer);
}
