/* The per-packet security policy and the ARP rate limiter. */
#include "swsec/swsec_policy.h"

#include "contract/frame_walk.h"
#include "swsec/swsec_ip_discovery.h"
#include "swsec/swsec_port_db.h"
#include "swsec/swsec_wire.h"

namespace {

constexpr uint16_t kEtherTypeArp = 0x0806;
constexpr uint16_t kDhcpServerPortV4 = 67;
constexpr uint16_t kDhcpServerPortV6 = 547;

/* An Ethernet/IPv4 ARP header: hardware type 1, protocol 0x0800, lengths 6 and 4. */
constexpr uint8_t kArpEthernetIpv4[6] = {0x00, 0x01, 0x08, 0x00, 0x06, 0x04};
constexpr uint32_t kArpHeaderLen = 28;
constexpr uint32_t kArpSenderMacOffset = 8;
constexpr uint32_t kArpSenderIpOffset = 14;

/* Spanning-tree destinations: IEEE STP and the per-VLAN variant. */
constexpr uint8_t kStpMac[6] = {0x01, 0x80, 0xc2, 0x00, 0x00, 0x00};
constexpr uint8_t kPvstMac[6] = {0x01, 0x00, 0x0c, 0xcc, 0xcc, 0xcd};

constexpr uint32_t kEthSrcMacOffset = 6;
constexpr uint32_t kIpv4SrcOffset = 12;
constexpr uint32_t kUdpSrcPortOffset = 0;
constexpr uint32_t kUdpDstPortOffset = 2;

/*
 * Counts an ARP rate limiting event in `direction`; true when the frame is
 * over its limit (and then counted as a drop).
 */
bool SwSecArpRateLimitExceeded(SwSecContext *ctx, uint32_t direction, bool isArp)
{
   bool over = false;
   if (direction == SwSecDirectionRx) {
      orr_SpinlockLock(ctx->rxRateLimitLock);
      over = SifraGenericRateLimitReached(&ctx->rxRateLimit);
      orr_SpinlockUnlock(ctx->rxRateLimitLock);
      if (over) {
         SwSecCountDrop(&ctx->counters.rxRateLimitDropCnt);
      }
      return over;
   }

   /*
    * A frame that is not ARP counts only in the error state, and only an
    * ARP frame (under this lock) or the write-locked configuration and
    * timer change that state. So a non-ARP frame that sees the state clear
    * has nothing to count, and skips the lock pair every frame of a busy
    * VM would otherwise take; it is ordered as if it came just before a
    * racing ARP frame that enters the state.
    */
   if (!isArp && __atomic_load_n(&ctx->txRateLimitErr, __ATOMIC_RELAXED) == 0) {
      return false;
   }
   orr_SpinlockLock(ctx->txRateLimitLock);
   if (ctx->txRateLimitErr != 0) {
      /* In the error state every frame the VM sends counts, against errRateLimit. */
      over = SifraGenericRateLimitReached(&ctx->txRateLimit);
   } else if (isArp && SifraGenericRateLimitReached(&ctx->txRateLimit)) {
      SifraGenericRateLimitInit(&ctx->txRateLimit, ctx->config.errRateLimit);
      __atomic_store_n(&ctx->txRateLimitErr, 1, __ATOMIC_RELAXED);   /* peeked at without the lock */
      orr_TimeVal now = {};
      orr_GetUptime(&now);
      ctx->txRateLimitErrEnd = now.sec + ctx->config.errRateLimitPeriod;
      SwSecCountDrop(&ctx->counters.txRateLimitErrEntryCnt);
      over = true;
   }
   orr_SpinlockUnlock(ctx->txRateLimitLock);
   if (over) {
      SwSecCountDrop(&ctx->counters.txRateLimitDropCnt);
   }
   return over;
}

/*
 * Dynamic ARP inspection of an ARP frame from the VM: true when its sender
 * is not bound on its VLAN. Frames too short or not Ethernet/IPv4, and
 * probes (sender 0.0.0.0), are not inspected.
 */
bool SwSecArpSenderUnknown(SwSecContext *ctx, const SwSecPktInfo *info)
{
   const uint32_t arpOffset = info->ethEntry->nextHdrOffset;
   if (info->mappedLen < static_cast<uint64_t>(arpOffset) + kArpHeaderLen) {
      return false;
   }
   const uint8_t *arp = info->frame + arpOffset;
   if (__builtin_memcmp(arp, kArpEthernetIpv4, sizeof(kArpEthernetIpv4)) != 0) {
      return false;
   }
   const uint32_t senderIp = SwSecLoadRaw32(arp + kArpSenderIpOffset);
   if (senderIp == 0) {
      return false;
   }
   return SwSecFindVmi(ctx, info->vlanId, arp + kArpSenderMacOffset, senderIp) == nullptr;
}

/*
 * The frame guard on a frame from the VM: true when it is dropped (and
 * counted). A tag in the bytes sits inside the VLAN the switch gave the
 * port; unless the port allows tagged frames it is dropped, and so is a
 * stack the walk could not see the end of, allowed or not. With an
 * ethertype list, the type after the tags must be in it: an 802.3 length
 * (LLC/SNAP) or a type nobody listed does not get round the checks.
 */
bool SwSecFrameGuardDrops(SwSecContext *ctx, const SwSecPktInfo *info, uint16_t etherType)
{
   const SwSecFrameGuard &guard = ctx->frameGuard;
   if (SwSecIsTagTpid(SwSecLoadBe16(info->ethHdr + SWSEC_ETH_TYPE_OFFSET)) &&
       ((guard.flags & SwSecFrameGuardAllowTagged) == 0 || SwSecIsTagTpid(etherType))) {
      SwSecCountDrop(&ctx->frameGuardCounters.taggedDropCnt);
      return true;
   }
   if (guard.numEtherTypes == 0) {
      return false;
   }
   for (uint32_t i = 0; i < guard.numEtherTypes && i < SWSEC_ETHERTYPES_MAX; i++) {
      if (guard.etherTypes[i] == etherType) {
         return false;
      }
   }
   SwSecCountDrop(&ctx->frameGuardCounters.etherTypeDropCnt);
   return true;
}

}  // namespace

bool SifraGenericRateLimitReached(SifraGenericRateLimit *rateLimit)
{
   const uint64_t now = orr_GetTimerCycles();
   if (now > rateLimit->intervalEnd) {
      rateLimit->intervalEnd = now + rateLimit->periodSec * orr_TimerCyclesPerSecond();
      rateLimit->count = 1;
   } else {
      rateLimit->count++;
   }
   return rateLimit->count > rateLimit->limit;
}

orr_Status SwSecProcessPkt(SwSecContext *ctx, orr_Pkt *pkt, SwSecPktInfo *info,
                           uint32_t direction, uint32_t *verdict)
{
   const uint32_t features = ctx->config.featuresEnabled;
   const uint8_t *eth = info->ethHdr;
   /* The type after any tags, where the header lookup found the next header. */
   const uint16_t etherType = SwSecNetToHost16(info->ethEntry->nextProto);
   const bool isArp = etherType == kEtherTypeArp;
   *verdict = SwSecVerdictPass;

   if (direction == SwSecDirectionTx && SwSecFrameGuardDrops(ctx, info, etherType)) {
      *verdict = SwSecVerdictDrop;
      return ORR_OK;
   }

   if ((features & SwSecFeatureDai) != 0) {
      if (ctx->config.arpRateLimit != 0) {
         /* Frames to the VM are limited only when they are ARP. */
         if (direction == SwSecDirectionRx && !isArp) {
            goto bpdu_filter;
         }
         if (SwSecArpRateLimitExceeded(ctx, direction, isArp)) {
            *verdict = SwSecVerdictDrop;
            return ORR_OK;
         }
      }
      if (direction == SwSecDirectionTx && isArp && SwSecArpSenderUnknown(ctx, info)) {
         SwSecCountDrop(&ctx->counters.daiDropCnt);
         *verdict = SwSecVerdictDrop;
         return ORR_OK;
      }
   }

bpdu_filter:
   if ((features & SwSecFeatureBpduFilter) != 0 && (SwSecSameMac(eth, kStpMac) || SwSecSameMac(eth, kPvstMac))) {
      *verdict = SwSecVerdictDrop;
      return ORR_OK;
   }

   if ((features & SwSecFeatureBlockDhcpServer) != 0 && direction == SwSecDirectionTx &&
       (info->flags & SWSEC_PKT_UDP) != 0) {
      const uint16_t serverPort =
         (info->flags & SWSEC_PKT_IPV4) != 0 ? kDhcpServerPortV4 : kDhcpServerPortV6;
      if (SwSecLoadBe16(info->udpHdr + kUdpSrcPortOffset) == serverPort) {
         *verdict = SwSecVerdictDrop;
         return ORR_OK;
      }
   }

   if ((features & SwSecFeatureIpDiscovery) != 0) {
      const orr_Status status = SwSecIpDiscovery(ctx, pkt, info, direction, verdict);
      if (status != ORR_OK || *verdict != SwSecVerdictPass) {
         return status;
      }
   }

   if ((features & SwSecFeatureIpSrcGuard) != 0 && direction == SwSecDirectionTx &&
       (info->flags & SWSEC_PKT_IPV4) != 0) {
      /* A DHCP client has no address yet: its way to the server stays open. */
      const bool toDhcpServer = (info->flags & SWSEC_PKT_UDP) != 0 &&
                                SwSecLoadBe16(info->udpHdr + kUdpDstPortOffset) == kDhcpServerPortV4;
      if (!toDhcpServer &&
          SwSecFindVmi(ctx, info->vlanId, eth + kEthSrcMacOffset,
                       SwSecLoadRaw32(info->ipHdr + kIpv4SrcOffset)) == nullptr) {
         SwSecCountDrop(&ctx->counters.ipSrcGuardDropCnt);
         *verdict = SwSecVerdictDrop;
         return ORR_OK;
      }
   }

   *verdict = SwSecVerdictPass;
   return ORR_OK;
}
