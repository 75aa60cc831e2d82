/* A port's IPv6 bindings and the bridge table across ports. */
#include "fhs/fhs_bindings.h"
#include "fhs/fhs_notify.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_log.h"
#include "platform/orr_text.h"

#include <cstddef>

#include "framework/sifra_generic_lock.h"

constinit FhsBridgeTable fhsBridge = {.users = ORR_MUTEX_INITIALIZER("sifg.fhs.bridgeUsers"), .numPorts = 0,
                                      .lock = nullptr, .buckets = {}};

orr_Status FhsBridgeJoin(void)
{
   orr_Status status = ORR_OK;
   orr_MutexLock(&fhsBridge.users);
   if (fhsBridge.numPorts == 0) {
      status = SifraGenericCreateSpinlock("sifg.fhs.bridge", ORR_SPINLOCK_PLAIN, SifraGenericLockRank::PortFilterMap,
                                          &fhsBridge.lock);
      for (orr_ListLinks &bucket : fhsBridge.buckets) {
         SifraGenericListInit(&bucket);
      }
   }
   if (status == ORR_OK) {
      fhsBridge.numPorts++;
   }
   orr_MutexUnlock(&fhsBridge.users);
   return status;
}

void FhsBridgeLeave(void)
{
   orr_MutexLock(&fhsBridge.users);
   if (--fhsBridge.numPorts == 0) {
      orr_SpinlockDestroy(fhsBridge.lock);
      fhsBridge.lock = nullptr;
   }
   orr_MutexUnlock(&fhsBridge.users);
}

namespace {

FhsBinding *FromPortLinks(orr_ListLinks *links)
{
   return reinterpret_cast<FhsBinding *>(reinterpret_cast<char *>(links) - offsetof(FhsBinding, portLinks));
}

FhsBinding *FromHashLinks(orr_ListLinks *links)
{
   return reinterpret_cast<FhsBinding *>(reinterpret_cast<char *>(links) - offsetof(FhsBinding, hashLinks));
}

FhsBinding *FromBridgeLinks(orr_ListLinks *links)
{
   return reinterpret_cast<FhsBinding *>(reinterpret_cast<char *>(links) - offsetof(FhsBinding, bridgeLinks));
}

bool SameAddr(const uint8_t *a, const uint8_t *b)
{
   uint64_t a0, a1, b0, b1;
   __builtin_memcpy(&a0, a, 8);
   __builtin_memcpy(&a1, a + 8, 8);
   __builtin_memcpy(&b0, b, 8);
   __builtin_memcpy(&b1, b + 8, 8);
   return ((a0 ^ b0) | (a1 ^ b1)) == 0;
}

bool SameMac(const uint8_t *a, const uint8_t *b)
{
   uint32_t a0, b0;
   uint16_t a1, b1;
   __builtin_memcpy(&a0, a, 4);
   __builtin_memcpy(&b0, b, 4);
   __builtin_memcpy(&a1, a + 4, 2);
   __builtin_memcpy(&b1, b + 4, 2);
   return ((a0 ^ b0) | static_cast<uint32_t>(a1 ^ b1)) == 0;
}

/* The bridge bucket of an address: bridge, VLAN and address, not the MAC. */
orr_ListLinks *BridgeBucket(const orr_Portset *portset, uint16_t vlanId, const uint8_t *addr)
{
   uint64_t low;
   uint64_t high;
   __builtin_memcpy(&low, addr, 8);
   __builtin_memcpy(&high, addr + 8, 8);
   const uint64_t mixed = (reinterpret_cast<uintptr_t>(portset) ^ vlanId) * 0x9e37'79b9'7f4a'7c15ull +
                          low * 0xc2b2'ae3d'27d4'eb4full + high * 0x1656'67b1'9e37'79f9ull;
   return &fhsBridge.buckets[((mixed ^ (mixed >> 29)) >> 32) & (FHS_BRIDGE_BUCKETS - 1)];
}

uint32_t MethodIndex(uint8_t method)
{
   return method == FhsBindDhcpv6 ? 0 : method == FhsBindStatic ? 1 : 2;
}

/* The oldest binding that is not static, or null. */
FhsBinding *OldestDynamic(FhsContext *ctx)
{
   for (orr_ListLinks *links = ctx->bindingList.next; links != &ctx->bindingList; links = links->next) {
      FhsBinding *binding = FromPortLinks(links);
      if (binding->method != FhsBindStatic) {
         return binding;
      }
   }
   return nullptr;
}

}  // namespace

void FhsFormatAddr(char *text, const uint8_t *addr)
{
   static constexpr char kHex[] = "0123456789abcdef";
   char *out = text;
   for (uint32_t group = 0; group < 8; group++) {
      const uint32_t value = static_cast<uint32_t>(addr[2 * group] << 8 | addr[2 * group + 1]);
      bool started = false;
      for (int shift = 12; shift >= 0; shift -= 4) {
         const uint32_t digit = (value >> shift) & 0xf;
         if (digit != 0 || started || shift == 0) {
            *out++ = kHex[digit];
            started = true;
         }
      }
      if (group != 7) {
         *out++ = ':';
      }
   }
   *out = '\0';
}

FhsBinding *FhsFindBinding(FhsContext *ctx, uint16_t vlanId, const uint8_t *mac, const uint8_t *addr)
{
   orr_ListLinks *bucket = &ctx->buckets[FhsBindingHash(vlanId, mac, addr) & (FHS_PORT_HASH_BUCKETS - 1)];
   for (orr_ListLinks *links = bucket->next; links != bucket; links = links->next) {
      FhsBinding *binding = FromHashLinks(links);
      if (binding->key.vlanId == vlanId && SameMac(binding->key.mac, mac) && SameAddr(binding->key.addr, addr)) {
         return binding;
      }
   }
   return nullptr;
}

FhsBinding *FhsFindDynamicAddress(FhsContext *ctx, const uint8_t *addr)
{
   for (orr_ListLinks *links = ctx->bindingList.next; links != &ctx->bindingList; links = links->next) {
      FhsBinding *binding = FromPortLinks(links);
      if (binding->method != FhsBindStatic && SameAddr(binding->key.addr, addr)) {
         return binding;
      }
   }
   return nullptr;
}

orr_Status FhsAddBinding(FhsContext *ctx, const FhsBindingKey *key, uint8_t method, int64_t expiry)
{
   FhsBinding *existing = FhsFindBinding(ctx, key->vlanId, key->mac, key->addr);
   if (existing != nullptr) {
      if (existing->method != FhsBindStatic) {
         if (existing->method != method) {
            ctx->numByMethod[MethodIndex(existing->method)]--;
            ctx->numByMethod[MethodIndex(method)]++;
            existing->method = method;
         }
         __atomic_store_n(&existing->expiry, expiry, __ATOMIC_RELAXED);
      }
      return ORR_OK;
   }

   char text[40];
   if (ctx->numBindings >= ctx->bindingLimit) {
      FhsBinding *oldest = OldestDynamic(ctx);
      if (oldest == nullptr) {
         FhsFormatAddr(text, key->addr);
         SG_LOG(ORR_LOG_ERROR, "%s: Binding limit %u reached, %s not bound", ctx->filter->name,
                ctx->bindingLimit, text);
         return ORR_FAILURE;
      }
      FhsFormatAddr(text, oldest->key.addr);
      SG_LOG(ORR_LOG_ERROR, "%s: Binding limit %u reached: evicted %s (VLAN %u)", ctx->filter->name,
             ctx->bindingLimit, text, static_cast<unsigned>(oldest->key.vlanId));
      FhsRemoveBinding(ctx, oldest);
      FhsCountDrop(&ctx->counters.bindingsEvictedCnt);
   }

   auto *binding = static_cast<FhsBinding *>(SifraGenericAlloc(sizeof(FhsBinding)));
   if (binding == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "%s: Failed to allocate memory for a binding", ctx->filter->name);
      return ORR_NO_MEMORY;
   }
   binding->key = *key;
   binding->method = method;
   binding->expiry = expiry;
   binding->owner = ctx;
   SifraGenericListAppend(&ctx->bindingList, &binding->portLinks);
   SifraGenericListAppend(&ctx->buckets[FhsBindingHash(key->vlanId, key->mac, key->addr) & (FHS_PORT_HASH_BUCKETS - 1)],
                          &binding->hashLinks);
   orr_SpinlockLock(fhsBridge.lock);
   SifraGenericListAppend(BridgeBucket(ctx->portset, key->vlanId, key->addr), &binding->bridgeLinks);
   orr_SpinlockUnlock(fhsBridge.lock);
   ctx->numBindings++;
   ctx->numByMethod[MethodIndex(method)]++;
   FhsPostBindingMsg(ctx, FhsBindingOpAdded, binding);
   return ORR_OK;
}

void FhsRemoveBinding(FhsContext *ctx, FhsBinding *binding)
{
   orr_SpinlockLock(fhsBridge.lock);
   SifraGenericListUnlink(&binding->bridgeLinks);
   orr_SpinlockUnlock(fhsBridge.lock);
   SifraGenericListUnlink(&binding->hashLinks);
   SifraGenericListUnlink(&binding->portLinks);
   ctx->numBindings--;
   ctx->numByMethod[MethodIndex(binding->method)]--;
   FhsPostBindingMsg(ctx, FhsBindingOpRemoved, binding);
   SifraGenericFree(binding);
}

uint32_t FhsClearBindings(FhsContext *ctx, uint32_t methods)
{
   uint32_t removed = 0;
   orr_ListLinks *links = ctx->bindingList.next;
   while (links != &ctx->bindingList) {
      FhsBinding *binding = FromPortLinks(links);
      links = links->next;
      if ((binding->method & methods) != 0) {
         FhsRemoveBinding(ctx, binding);
         removed++;
      }
   }
   return removed;
}

bool FhsClaimedElsewhere(FhsContext *ctx, uint16_t vlanId, const uint8_t *addr, int64_t now)
{
   bool claimed = false;
   orr_SpinlockLock(fhsBridge.lock);
   orr_ListLinks *bucket = BridgeBucket(ctx->portset, vlanId, addr);
   for (orr_ListLinks *links = bucket->next; links != bucket; links = links->next) {
      const FhsBinding *binding = FromBridgeLinks(links);
      if (binding->owner == ctx || binding->owner->portset != ctx->portset || binding->key.vlanId != vlanId ||
          !SameAddr(binding->key.addr, addr)) {
         continue;
      }
      const int64_t expiry = __atomic_load_n(&binding->expiry, __ATOMIC_RELAXED);
      if (expiry == 0 || expiry > now) {
         claimed = true;
         break;
      }
   }
   orr_SpinlockUnlock(fhsBridge.lock);
   return claimed;
}

void FhsAgeBindings(FhsContext *ctx, int64_t now)
{
   orr_ListLinks *links = ctx->bindingList.next;
   while (links != &ctx->bindingList) {
      FhsBinding *binding = FromPortLinks(links);
      links = links->next;
      if (binding->method == FhsBindStatic) {
         continue;
      }
      if (binding->method == FhsBindFcfs && __atomic_load_n(&binding->seen, __ATOMIC_RELAXED) != 0) {
         __atomic_store_n(&binding->seen, 0, __ATOMIC_RELAXED);
         __atomic_store_n(&binding->expiry, now + static_cast<int64_t>(ctx->fcfsLifetime), __ATOMIC_RELAXED);
         continue;
      }
      if (binding->expiry <= now) {
         char text[40];
         FhsFormatAddr(text, binding->key.addr);
         SG_LOG(ORR_LOG_INFO, "%s: Binding of %s (VLAN %u) expired", ctx->filter->name, text,
                static_cast<unsigned>(binding->key.vlanId));
         FhsRemoveBinding(ctx, binding);
      }
   }
}
