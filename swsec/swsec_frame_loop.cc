/* The frame loop of a switch-security port: parse, judge, drop. */
#include "swsec/swsec_filter.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_log.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_pkt_info.h"
#include "swsec/swsec_policy.h"
#include "swsec/swsec_wire.h"

namespace {

constexpr uint16_t kEtherTypeIpv4 = 0x0800;
constexpr uint16_t kEtherTypeIpv6 = 0x86dd;
constexpr uint16_t kIpProtoUdp = 17;

/*
 * Fills the parse record of one frame: lengths, then the layer 2, 3 and 4
 * headers as far as the host finds and maps them. A failure stops the parse
 * where it is; the policy judges the frame on what was found.
 */
/* A field added to the record must be reset below. */
static_assert(sizeof(SwSecPktInfo) == 136, "reset every field of SwSecPktInfo in SwSecParseFrame");

void SwSecParseFrame(orr_Pkt *pkt, SwSecPktInfo *info)
{
   /*
    * Field by field rather than a whole-record clear, which the compiler
    * turns into a string store that costs more than the rest of the parse.
    */
   info->flags = 0;
   info->pktCopy = nullptr;
   info->ethEntry = nullptr;
   info->ethHdr = nullptr;
   info->vlanId = 0;
   info->ipEntry = nullptr;
   info->ipHdr = nullptr;
   info->l4Entry = nullptr;
   info->udpHdr = nullptr;
   info->dhcpHdr = nullptr;
   info->dhcpMsgType = nullptr;
   info->dhcpClientIdLen = 0;
   info->dhcpClientId = nullptr;
   info->dhcpLeaseTime = nullptr;

   info->frame = orr_PktFrameMappedPointerGet(pkt);
   info->frameLen = orr_PktFrameLenGet(pkt);
   const uint32_t mappedLen = orr_PktFrameMappedLenGet(pkt);
   info->mappedLen = mappedLen < info->frameLen ? mappedLen : info->frameLen;

   if (orr_PktHeaderFind(pkt, ORR_PKT_LAYER_2, ORR_PKT_HEADER_CLASS_L2, 1, &info->ethEntry, 0) !=
          ORR_OK ||
       orr_PktHeaderDataGet(pkt, info->ethEntry, &info->ethHdr) != ORR_OK) {
      return;
   }
   info->flags |= SWSEC_PKT_ETH;
   info->vlanId = orr_PktVlanIDGet(pkt);

   const uint16_t etherType = SwSecNetToHost16(info->ethEntry->nextProto);
   if (etherType != kEtherTypeIpv4 && etherType != kEtherTypeIpv6) {
      return;
   }
   if (orr_PktHeaderFind(pkt, ORR_PKT_LAYER_3, ORR_PKT_HEADER_CLASS_L3, 1, &info->ipEntry, 0) !=
          ORR_OK ||
       orr_PktHeaderDataGet(pkt, info->ipEntry, &info->ipHdr) != ORR_OK) {
      return;
   }
   info->flags |= etherType == kEtherTypeIpv4 ? SWSEC_PKT_IPV4 : SWSEC_PKT_IPV6;

   if (info->ipEntry->nextProto != kIpProtoUdp) {
      return;
   }
   if (orr_PktHeaderFind(pkt, ORR_PKT_LAYER_4, ORR_PKT_HEADER_CLASS_L4, 1, &info->l4Entry, 0) !=
          ORR_OK ||
       orr_PktHeaderDataGet(pkt, info->l4Entry, &info->udpHdr) != ORR_OK) {
      return;
   }
   info->flags |= SWSEC_PKT_UDP;
}

/* Gives back the header mappings, innermost first, and a parser's copy. */
[[gnu::always_inline]] inline void SwSecReleaseFrame(orr_Pkt *pkt, SwSecPktInfo *info)
{
   if ((info->flags & (SWSEC_PKT_L4 | SWSEC_PKT_UDP)) != 0) {
      orr_PktHeaderDataRelease(pkt, info->l4Entry, info->udpHdr, 0);
   }
   if ((info->flags & (SWSEC_PKT_IPV4 | SWSEC_PKT_IPV6)) != 0) {
      orr_PktHeaderDataRelease(pkt, info->ipEntry, info->ipHdr, 0);
   }
   if ((info->flags & SWSEC_PKT_ETH) != 0) {
      orr_PktHeaderDataRelease(pkt, info->ethEntry, info->ethHdr, 0);
   }
   info->flags = 0;
   if (info->pktCopy != nullptr) {
      SifraGenericFree(info->pktCopy);
      info->pktCopy = nullptr;
   }
}

/*
 * The verdict on one frame. When the policy needs configLock exclusive
 * while it is held shared, the lock is upgraded (not atomically: another
 * writer may run in between) and the frame parsed and judged again.
 */
uint32_t SwSecJudgeFrame(SwSecContext *ctx, orr_Pkt *pkt, SwSecPktInfo *info, uint32_t direction)
{
   for (;;) {
      SwSecParseFrame(pkt, info);
      uint32_t verdict = SwSecVerdictPass;
      orr_Status status = ORR_OK;
      /* A frame without a mapped Ethernet header passes unexamined. */
      if ((info->flags & SWSEC_PKT_ETH) != 0) {
         status = SwSecProcessPkt(ctx, pkt, info, direction, &verdict);
      }
      if (status != ORR_OK && info->readLocked != 0) {
         orr_SpinlockReadUnlock(ctx->configLock);
         orr_SpinlockWriteLock(ctx->configLock);
         info->readLocked = 0;
         SwSecReleaseFrame(pkt, info);
         continue;
      }
      if (status != ORR_OK) {
         /*
          * A failure under the exclusive lock (IP discovery out of memory)
          * cannot be cured by another attempt: the frame keeps the pass
          * verdict it had before the call, as a port whose bookkeeping
          * failed should not cut its VM off, and the loop goes on.
          */
         verdict = SwSecVerdictPass;
      }
      SwSecReleaseFrame(pkt, info);
      return verdict;
   }
}

}  // namespace

orr_Status SwSecProcessPackets(SifraGenericFilter *filter, orr_PktList *pktList,
                               uint32_t direction)
{
   auto *ctx = static_cast<SwSecContext *>(filter->agentData);
   if (ctx == nullptr) {
      return ORR_OK;
   }
   SwSecPktInfo info = {};

   orr_SpinlockReadLock(ctx->configLock);
   info.readLocked = 1;
   if (ctx->config.featuresEnabled == 0) {
      orr_SpinlockReadUnlock(ctx->configLock);
      return ORR_OK;
   }

   /* The iterator lives on the stack, in storage of the host's stated size. */
   alignas(void *) uint8_t iterStorage[ORR_PKT_LIST_ITER_MAX_SIZE];
   if (orr_PktListIterSizeOf() > sizeof(iterStorage)) {
      /* A host whose iterator does not fit cannot be walked: pass the list unjudged. */
      orr_SpinlockReadUnlock(ctx->configLock);
      SG_LOG(ORR_LOG_ERROR, "%s: Frame list iterator too large", filter->name);
      return ORR_OK;
   }
   auto *iter = reinterpret_cast<orr_PktListIter *>(iterStorage);

   orr_PktListIterStart(pktList, iter);
   while (!orr_PktListIterIsAtEnd(iter)) {
      orr_Pkt *pkt = orr_PktListIterGetPkt(iter);
      if (SwSecJudgeFrame(ctx, pkt, &info, direction) == SwSecVerdictDrop) {
         orr_PktRelease(orr_PktListIterRemovePkt(iter));
      } else {
         orr_PktListIterMove(iter);
      }
   }

   if (info.readLocked != 0) {
      orr_SpinlockReadUnlock(ctx->configLock);
   } else {
      orr_SpinlockWriteUnlock(ctx->configLock);
   }
   return ORR_OK;
}
