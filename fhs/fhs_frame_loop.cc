/*
 * The frame loop of a first-hop security port: each frame's IPv6 header
 * chain is walked over the mapped bytes (or a copy of its first bytes when
 * the chain runs past them), then judged: header chain, RA guard, DHCPv6
 * guard, ND rate limit, ND inspection with first-come-first-served claims,
 * DHCPv6 learning and source guard.
 */
#include "fhs/fhs_agent.h"

#include "fhs/fhs_bindings.h"
#include "fhs/fhs_ipv6_chain.h"
#include "framework/sifra_generic.h"
#include "framework/sifra_generic_log.h"
#include "swsec/swsec_pkt_info.h"

namespace {

constexpr uint16_t kEtherTypeIpv6 = 0x86dd;
constexpr uint16_t kEtherTypeVlan = 0x8100;
constexpr uint16_t kEtherTypeQinQ = 0x88a8;
constexpr uint32_t kEthHeaderLen = 14;
constexpr uint32_t kEthSrcOffset = 6;
constexpr uint32_t kVlanTagLen = 4;
constexpr uint32_t kMaxTags = 2;
constexpr uint32_t kIpv6SrcOffset = 8;
constexpr uint32_t kUdpHeaderLen = 8;

enum : uint8_t {
   kIcmpMldReport = 131,
   kIcmpRouterSolicit = 133,
   kIcmpRouterAdvert = 134,
   kIcmpNeighborSolicit = 135,
   kIcmpNeighborAdvert = 136,
   kIcmpRedirect = 137,
   kIcmpMldv2Report = 143,
};
constexpr uint32_t kNdFixedLen = 24;       /* type, code, checksum, flags, target */
constexpr uint32_t kNdTargetOffset = 8;
constexpr uint8_t kNdOptSourceLinkAddr = 1;
constexpr uint8_t kNdOptTargetLinkAddr = 2;

uint16_t LoadBe16(const uint8_t *bytes)
{
   return static_cast<uint16_t>(bytes[0] << 8 | bytes[1]);
}

bool IsUnspecified(const uint8_t *addr)
{
   uint64_t low;
   uint64_t high;
   __builtin_memcpy(&low, addr, 8);
   __builtin_memcpy(&high, addr + 8, 8);
   return (low | high) == 0;
}

bool SameMac(const uint8_t *a, const uint8_t *b)
{
   return __builtin_memcmp(a, b, 6) == 0;
}

/* One frame as the loop sees it. */
struct FhsFrame {
   orr_Pkt *pkt;
   const uint8_t *bytes;     /* the mapped start */
   uint32_t frameLen;
   uint32_t mappedLen;       /* min(mapped, frame) */
   uint16_t vlanId;
   uint32_t l3Offset;
   const uint8_t *ip6;       /* the walk's view: mapped bytes or chainBuf */
   uint32_t viewLen;
   FhsIpv6Chain chain;
   uint8_t *copy;            /* a whole-frame heap copy, or null */
   uint8_t chainBuf[FHS_CHAIN_VIEW_LEN];
};

/*
 * The whole IPv6 packet contiguous: the mapped bytes when they hold the
 * frame, else a heap copy (kept in frame->copy). Null without memory or
 * when the frame cannot be read.
 */
const uint8_t *WholePacket(FhsFrame *frame)
{
   if (frame->mappedLen == frame->frameLen) {
      return frame->bytes + frame->l3Offset;
   }
   if (frame->copy == nullptr) {
      frame->copy = static_cast<uint8_t *>(SifraGenericAlloc(frame->frameLen));
      if (frame->copy == nullptr) {
         return nullptr;
      }
      if (orr_PktCopyBytesOut(frame->pkt, 0, frame->frameLen, frame->copy) != ORR_OK) {
         SifraGenericFree(frame->copy);
         frame->copy = nullptr;
         return nullptr;
      }
   }
   return frame->copy + frame->l3Offset;
}

/*
 * Counts an ND rate limiting event of a frame from the VM; true when the
 * frame is over its limit (and then counted as a drop). As for ARP: ND
 * frames over ndRateLimit a second put the port in the error state, in
 * which every frame the VM sends counts against errRateLimit; outside it a
 * frame that is not ND has nothing to count and skips the lock.
 */
bool NdRateLimitExceeded(FhsContext *ctx, bool isNd)
{
   if (!isNd && __atomic_load_n(&ctx->ndRateLimitErr, __ATOMIC_RELAXED) == 0) {
      return false;
   }
   bool over = false;
   orr_SpinlockLock(ctx->ndRateLimitLock);
   if (ctx->ndRateLimitErr != 0) {
      over = FhsRateLimitReached(&ctx->ndRateLimit);
   } else if (isNd && FhsRateLimitReached(&ctx->ndRateLimit)) {
      FhsRateLimitInit(&ctx->ndRateLimit, ctx->config.errRateLimit);
      __atomic_store_n(&ctx->ndRateLimitErr, 1, __ATOMIC_RELAXED);
      orr_TimeVal now = {};
      orr_GetUptime(&now);
      ctx->ndRateLimitErrEnd = now.sec + ctx->config.errRateLimitPeriod;
      FhsCountDrop(&ctx->counters.ndRateLimitErrEntryCnt);
      SG_LOG(ORR_LOG_ERROR, "%s: ND rate limit %u exceeded: error state for %u s", ctx->filter->name,
             ctx->config.ndRateLimit, ctx->config.errRateLimitPeriod);
      over = true;
   }
   orr_SpinlockUnlock(ctx->ndRateLimitLock);
   if (over) {
      FhsCountDrop(&ctx->counters.ndRateLimitDropCnt);
   }
   return over;
}

struct Judgement {
   orr_Status status;        /* ORR_BUSY: judge again under the exclusive lock */
   uint32_t verdict;
};

constexpr Judgement kPass = {ORR_OK, SwSecVerdictPass};
constexpr Judgement kDrop = {ORR_OK, SwSecVerdictDrop};
constexpr Judgement kNeedWrite = {ORR_BUSY, SwSecVerdictPass};

Judgement Drop(uint64_t *counter)
{
   FhsCountDrop(counter);
   return kDrop;
}

int64_t Now()
{
   orr_TimeVal now = {};
   orr_GetUptime(&now);
   return now.sec;
}

/*
 * A duplicate-address-detection claim of `target` by the VM: bound to the
 * port (first come, first served) unless another port of the bridge holds
 * it. False when the claim is refused (logged once a tick).
 */
bool ClaimAddress(FhsContext *ctx, const FhsFrame *frame, const uint8_t *target)
{
   const uint8_t *mac = frame->bytes + kEthSrcOffset;
   const int64_t now = Now();
   FhsBinding *own = FhsFindBinding(ctx, frame->vlanId, mac, target);
   if (own != nullptr) {
      if (own->method == FhsBindFcfs) {
         __atomic_store_n(&own->expiry, now + static_cast<int64_t>(ctx->fcfsLifetime), __ATOMIC_RELAXED);
      }
      return true;
   }
   if (FhsClaimedElsewhere(ctx, frame->vlanId, target, now)) {
      if (ctx->claimLogged == 0) {
         ctx->claimLogged = 1;
         char text[40];
         FhsFormatAddr(text, target);
         SG_LOG(ORR_LOG_ERROR, "%s: Claim of %s (VLAN %u) refused: bound to another port", ctx->filter->name, text,
                static_cast<unsigned>(frame->vlanId));
      }
      return false;
   }
   FhsBindingKey key;
   key.vlanId = frame->vlanId;
   __builtin_memcpy(key.mac, mac, sizeof(key.mac));
   __builtin_memcpy(key.addr, target, sizeof(key.addr));
   /* A full port or no memory leaves the address unbound; the VM's traffic from it then tells. */
   (void)FhsAddBinding(ctx, &key, FhsBindFcfs, now + static_cast<int64_t>(ctx->fcfsLifetime));
   return true;
}

/*
 * A neighbour solicitation or advertisement from the VM: its options well
 * formed with any link-layer address option equal to the frame's source,
 * a duplicate-address-detection claim judged, and with ND inspection its
 * source and, for an advertisement or a claim, its target bound.
 */
Judgement JudgeNeighborMessage(FhsContext *ctx, FhsFrame *frame, bool readLocked, bool enforce)
{
   const uint32_t features = ctx->config.featuresEnabled;
   const uint8_t *ip6 = WholePacket(frame);
   if (ip6 == nullptr) {
      return enforce && (features & FhsFeatureNdInspection) != 0 ? Drop(&ctx->counters.ndInspectionDropCnt) : kPass;
   }
   const uint8_t *icmp = ip6 + frame->chain.upperOffset;
   const uint32_t icmpLen = frame->chain.packetLen - frame->chain.upperOffset;
   const uint8_t type = icmp[0];
   const uint8_t *src = ip6 + kIpv6SrcOffset;
   const uint8_t *mac = frame->bytes + kEthSrcOffset;
   const bool inspect = enforce && (features & FhsFeatureNdInspection) != 0;

   if (icmpLen < kNdFixedLen) {
      return inspect ? Drop(&ctx->counters.ndInspectionDropCnt) : kPass;
   }
   const uint8_t *target = icmp + kNdTargetOffset;
   const uint8_t linkOption = type == kIcmpNeighborSolicit ? kNdOptSourceLinkAddr : kNdOptTargetLinkAddr;
   for (uint32_t offset = kNdFixedLen; offset < icmpLen;) {
      const uint32_t optionLen = icmpLen - offset >= 2 ? icmp[offset + 1] * 8u : 0;
      if (optionLen == 0 || optionLen > icmpLen - offset) {
         return inspect ? Drop(&ctx->counters.ndInspectionDropCnt) : kPass;
      }
      if (icmp[offset] == linkOption && (optionLen < 8 || !SameMac(icmp + offset + 2, mac))) {
         return inspect ? Drop(&ctx->counters.ndInspectionDropCnt) : kPass;
      }
      offset += optionLen;
   }

   const bool dad = type == kIcmpNeighborSolicit && IsUnspecified(src);
   if (dad && (features & FhsFeatureFcfs) != 0) {
      if (readLocked) {
         return kNeedWrite;
      }
      if (!ClaimAddress(ctx, frame, target)) {
         return enforce ? Drop(&ctx->counters.claimRefusedDropCnt) : kPass;
      }
   }
   if (!inspect) {
      return kPass;
   }
   if (!dad && FhsFindBinding(ctx, frame->vlanId, mac, src) == nullptr) {
      return Drop(&ctx->counters.ndInspectionDropCnt);
   }
   /* A solicitation's target is the neighbour asked about, unless the VM claims it. */
   if ((dad || type == kIcmpNeighborAdvert) && FhsFindBinding(ctx, frame->vlanId, mac, target) == nullptr) {
      return Drop(&ctx->counters.ndInspectionDropCnt);
   }
   return kPass;
}

/* The pending request a Reply answers: same VLAN, transaction and client DUID. */
FhsDhcpv6Pending *FindPending(FhsContext *ctx, uint16_t vlanId, const FhsDhcpv6Msg *msg)
{
   for (FhsDhcpv6Pending &pending : ctx->pending) {
      if (pending.expiry != 0 && pending.vlanId == vlanId && pending.xid == msg->xid &&
          pending.clientIdLen == msg->clientIdLen &&
          __builtin_memcmp(pending.clientId, msg->clientId, msg->clientIdLen) == 0) {
         return &pending;
      }
   }
   return nullptr;
}

/* Records a client's request: its own slot again, else a free one, else the oldest. */
void RecordPending(FhsContext *ctx, const FhsFrame *frame, const FhsDhcpv6Msg *msg, int64_t now)
{
   FhsDhcpv6Pending *slot = nullptr;
   for (FhsDhcpv6Pending &pending : ctx->pending) {
      if (pending.expiry != 0 && pending.vlanId == frame->vlanId && pending.clientIdLen == msg->clientIdLen &&
          __builtin_memcmp(pending.clientId, msg->clientId, msg->clientIdLen) == 0) {
         slot = &pending;
         break;
      }
   }
   for (FhsDhcpv6Pending &pending : ctx->pending) {
      if (slot == nullptr || (slot->expiry != 0 && pending.expiry < slot->expiry)) {
         slot = &pending;
      }
   }
   slot->expiry = now + FHS_DHCPV6_PENDING_SEC;
   slot->xid = msg->xid;
   slot->vlanId = frame->vlanId;
   __builtin_memcpy(slot->mac, frame->bytes + kEthSrcOffset, sizeof(slot->mac));
   slot->msgType = msg->msgType;
   slot->clientIdLen = static_cast<uint8_t>(msg->clientIdLen);
   __builtin_memcpy(slot->clientId, msg->clientId, msg->clientIdLen);
}

/*
 * DHCPv6 learning, under the exclusive lock: a client's Request, Renew,
 * Rebind, Confirm or Solicit from the VM awaits its Reply; its Release or
 * Decline removes the addresses it names; a Reply to the VM matching a
 * pending request binds each address for its valid lifetime (0 removes).
 */
void LearnDhcpv6(FhsContext *ctx, const FhsFrame *frame, const FhsDhcpv6Msg *msg, uint32_t direction)
{
   if (msg->clientId == nullptr) {
      return;
   }
   const int64_t now = Now();
   if (direction == SwSecDirectionTx) {
      switch (msg->msgType) {
      case FhsDhcpv6Solicit:
      case FhsDhcpv6Request:
      case FhsDhcpv6Confirm:
      case FhsDhcpv6Renew:
      case FhsDhcpv6Rebind:
         RecordPending(ctx, frame, msg, now);
         return;
      case FhsDhcpv6Release:
      case FhsDhcpv6Decline:
         for (uint32_t i = 0; i < msg->numAddrs; i++) {
            FhsBinding *binding =
               FhsFindBinding(ctx, frame->vlanId, frame->bytes + kEthSrcOffset, msg->addrs[i].addr);
            if (binding != nullptr && binding->method == FhsBindDhcpv6) {
               FhsRemoveBinding(ctx, binding);
            }
         }
         return;
      default:
         return;
      }
   }
   if (msg->msgType != FhsDhcpv6Reply) {
      return;
   }
   FhsDhcpv6Pending *pending = FindPending(ctx, frame->vlanId, msg);
   if (pending == nullptr) {
      return;
   }
   for (uint32_t i = 0; i < msg->numAddrs; i++) {
      FhsBindingKey key;
      key.vlanId = pending->vlanId;
      __builtin_memcpy(key.mac, pending->mac, sizeof(key.mac));
      __builtin_memcpy(key.addr, msg->addrs[i].addr, sizeof(key.addr));
      if (msg->addrs[i].validLifetime == 0) {
         FhsBinding *binding = FhsFindBinding(ctx, key.vlanId, key.mac, key.addr);
         if (binding != nullptr && binding->method != FhsBindStatic) {
            FhsRemoveBinding(ctx, binding);
         }
         continue;
      }
      (void)FhsAddBinding(ctx, &key, FhsBindDhcpv6, now + static_cast<int64_t>(msg->addrs[i].validLifetime));
   }
   pending->expiry = 0;
}

/*
 * A UDP datagram from the VM: the DHCPv6 guard. Sets `learn` when the
 * datagram is a DHCPv6 message to learn from, which waits until the frame
 * has passed the source guard.
 */
Judgement GuardUdp(FhsContext *ctx, FhsFrame *frame, uint32_t direction, bool enforce, bool *learn)
{
   const uint32_t features = ctx->config.featuresEnabled;
   const uint8_t *udp = frame->ip6 + frame->chain.upperOffset;
   const uint16_t srcPort = LoadBe16(udp);
   const uint16_t dstPort = LoadBe16(udp + 2);
   const bool dhcp = dstPort == FHS_DHCPV6_CLIENT_PORT || dstPort == FHS_DHCPV6_SERVER_PORT ||
                     srcPort == FHS_DHCPV6_SERVER_PORT;
   const uint32_t payloadOffset = frame->chain.upperOffset + kUdpHeaderLen;
   if (!dhcp || payloadOffset >= frame->chain.packetLen) {
      return kPass;
   }
   if (enforce && (features & FhsFeatureDhcpv6Guard) != 0) {
      /* The type is the payload's first byte: in the view, or read from the frame. */
      uint8_t type = 0;
      if (payloadOffset < frame->viewLen) {
         type = frame->ip6[payloadOffset];
      } else if (orr_PktCopyBytesOut(frame->pkt, frame->l3Offset + payloadOffset, 1, &type) != ORR_OK) {
         return Drop(&ctx->counters.dhcpv6GuardDropCnt);
      }
      if (type == FhsDhcpv6Advertise || type == FhsDhcpv6Reply || type == FhsDhcpv6Reconfigure ||
          type == FhsDhcpv6RelayReply) {
         return Drop(&ctx->counters.dhcpv6GuardDropCnt);
      }
   }
   const bool learnable = direction == SwSecDirectionTx ? dstPort == FHS_DHCPV6_SERVER_PORT
                                                         : srcPort == FHS_DHCPV6_SERVER_PORT &&
                                                              dstPort == FHS_DHCPV6_CLIENT_PORT;
   *learn = (features & FhsFeatureDhcpv6Snoop) != 0 && learnable && frame->chain.fragmented == 0;
   return kPass;
}

/*
 * DHCPv6 learning from a datagram that passed. Run after the source guard,
 * so that a Release sent from the address it gives back is judged while
 * that address is still bound, and reaches the server.
 */
Judgement LearnFromUdp(FhsContext *ctx, FhsFrame *frame, uint32_t direction, bool readLocked)
{
   if (readLocked) {
      return kNeedWrite;
   }
   const uint8_t *ip6 = WholePacket(frame);
   if (ip6 == nullptr) {
      return kPass;
   }
   const uint32_t payloadOffset = frame->chain.upperOffset + kUdpHeaderLen;
   const uint32_t udpLen = LoadBe16(ip6 + frame->chain.upperOffset + 4);
   if (udpLen < kUdpHeaderLen || udpLen > frame->chain.packetLen - frame->chain.upperOffset) {
      return kPass;
   }
   FhsDhcpv6Msg msg;
   if (FhsDhcpv6Parse(ip6 + payloadOffset, udpLen - kUdpHeaderLen, &msg) == 0) {
      LearnDhcpv6(ctx, frame, &msg, direction);
   }
   return kPass;
}

/*
 * The verdict on one frame. A frame judged again under the exclusive lock
 * (`again`) has been counted by the ND limiter already.
 */
Judgement JudgeFrame(FhsContext *ctx, FhsFrame *frame, uint32_t direction, bool readLocked, bool again)
{
   const FhsConfig &config = ctx->config;
   const bool enforce = direction == SwSecDirectionTx && config.trusted == 0;
   const bool rateLimit =
      enforce && !again && config.ndRateLimit != 0 && (config.featuresEnabled & FhsFeatureNdInspection) != 0;

   if (frame->mappedLen < kEthHeaderLen) {
      return kPass;
   }
   uint16_t etherType = LoadBe16(frame->bytes + 12);
   frame->l3Offset = kEthHeaderLen;
   for (uint32_t tags = 0; tags < kMaxTags && (etherType == kEtherTypeVlan || etherType == kEtherTypeQinQ); tags++) {
      if (frame->mappedLen < frame->l3Offset + kVlanTagLen) {
         return kPass;
      }
      etherType = LoadBe16(frame->bytes + frame->l3Offset + 2);
      frame->l3Offset += kVlanTagLen;
   }
   if (etherType != kEtherTypeIpv6) {
      return rateLimit && NdRateLimitExceeded(ctx, false) ? kDrop : kPass;
   }

   const uint32_t l3Len = frame->frameLen - frame->l3Offset;
   frame->ip6 = frame->bytes + frame->l3Offset;
   frame->viewLen = frame->mappedLen - frame->l3Offset;
   FhsChainVerdict walk = FhsWalkIpv6Chain(frame->ip6, frame->viewLen, l3Len, &frame->chain);
   if (walk == FhsChainNeedView) {
      const uint32_t viewLen = l3Len < FHS_CHAIN_VIEW_LEN ? l3Len : FHS_CHAIN_VIEW_LEN;
      if (orr_PktCopyBytesOut(frame->pkt, frame->l3Offset, viewLen, frame->chainBuf) != ORR_OK) {
         return enforce ? Drop(&ctx->counters.headerChainDropCnt) : kPass;
      }
      frame->ip6 = frame->chainBuf;
      frame->viewLen = viewLen;
      walk = FhsWalkIpv6Chain(frame->ip6, viewLen, l3Len, &frame->chain);
   }
   if (walk != FhsChainOk) {
      return enforce && (config.featuresEnabled & FhsFeatureHeaderChain) != 0 ? Drop(&ctx->counters.headerChainDropCnt)
                                                                              : kPass;
   }

   const FhsIpv6Chain &chain = frame->chain;
   uint8_t icmpType = 0;
   bool learnDhcpv6 = false;
   if (chain.laterFragment == 0 && chain.upperProto == FHS_PROTO_ICMPV6) {
      icmpType = frame->ip6[chain.upperOffset];
      const bool isNd = icmpType >= kIcmpRouterSolicit && icmpType <= kIcmpRedirect;
      if (enforce && isNd && chain.fragmented != 0 && (config.featuresEnabled & FhsFeatureHeaderChain) != 0) {
         return Drop(&ctx->counters.fragmentedNdDropCnt);
      }
      if (enforce && (icmpType == kIcmpRouterAdvert || icmpType == kIcmpRedirect) &&
          (config.featuresEnabled & FhsFeatureRaGuard) != 0) {
         return Drop(&ctx->counters.raGuardDropCnt);
      }
      if (rateLimit && NdRateLimitExceeded(ctx, isNd)) {
         return kDrop;
      }
      if (direction == SwSecDirectionTx &&
          (icmpType == kIcmpNeighborSolicit || icmpType == kIcmpNeighborAdvert) && chain.fragmented == 0) {
         const Judgement judgement = JudgeNeighborMessage(ctx, frame, readLocked, enforce);
         if (judgement.status != ORR_OK || judgement.verdict != SwSecVerdictPass) {
            return judgement;
         }
      }
   } else {
      if (rateLimit && NdRateLimitExceeded(ctx, false)) {
         return kDrop;
      }
      if (chain.laterFragment == 0 && chain.upperProto == FHS_PROTO_UDP) {
         const Judgement judgement = GuardUdp(ctx, frame, direction, enforce, &learnDhcpv6);
         if (judgement.status != ORR_OK || judgement.verdict != SwSecVerdictPass) {
            return judgement;
         }
      }
   }

   if (enforce && (config.featuresEnabled & FhsFeatureSourceGuard) != 0) {
      const uint8_t *src = frame->ip6 + kIpv6SrcOffset;
      if (IsUnspecified(src)) {
         /* Only duplicate-address detection, MLD reports and router solicitations come from no address. */
         const bool allowed = icmpType == kIcmpNeighborSolicit || icmpType == kIcmpMldReport ||
                              icmpType == kIcmpMldv2Report || icmpType == kIcmpRouterSolicit;
         if (!allowed) {
            return Drop(&ctx->counters.sourceGuardDropCnt);
         }
      } else {
         FhsBinding *binding = FhsFindBinding(ctx, frame->vlanId, frame->bytes + kEthSrcOffset, src);
         if (binding == nullptr) {
            return Drop(&ctx->counters.sourceGuardDropCnt);
         }
         if (binding->method == FhsBindFcfs && __atomic_load_n(&binding->seen, __ATOMIC_RELAXED) == 0) {
            __atomic_store_n(&binding->seen, 1, __ATOMIC_RELAXED);
         }
      }
   }
   return learnDhcpv6 ? LearnFromUdp(ctx, frame, direction, readLocked) : kPass;
}

}  // namespace

orr_Status FhsProcessPackets(SifraGenericFilter *filter, orr_PktList *pktList, uint32_t direction)
{
   auto *ctx = static_cast<FhsContext *>(filter->agentData);
   if (ctx == nullptr) {
      return ORR_OK;
   }
   alignas(void *) uint8_t iterStorage[ORR_PKT_LIST_ITER_MAX_SIZE];
   if (orr_PktListIterSizeOf() > sizeof(iterStorage)) {
      SG_LOG(ORR_LOG_ERROR, "%s: Frame list iterator too large", filter->name);
      return ORR_OK;
   }
   auto *iter = reinterpret_cast<orr_PktListIter *>(iterStorage);
   FhsFrame frame;
   frame.copy = nullptr;
   bool readLocked = true;

   orr_SpinlockReadLock(ctx->configLock);
   if (ctx->config.featuresEnabled == 0) {
      orr_SpinlockReadUnlock(ctx->configLock);
      return ORR_OK;
   }
   orr_PktListIterStart(pktList, iter);
   while (!orr_PktListIterIsAtEnd(iter)) {
      orr_Pkt *pkt = orr_PktListIterGetPkt(iter);
      frame.pkt = pkt;
      frame.bytes = orr_PktFrameMappedPointerGet(pkt);
      frame.frameLen = orr_PktFrameLenGet(pkt);
      const uint32_t mappedLen = orr_PktFrameMappedLenGet(pkt);
      frame.mappedLen = mappedLen < frame.frameLen ? mappedLen : frame.frameLen;
      frame.vlanId = orr_PktVlanIDGet(pkt);
      Judgement judgement = JudgeFrame(ctx, &frame, direction, readLocked, false);
      if (judgement.status == ORR_BUSY && readLocked) {
         /* Not atomic: another writer may run in between, so the frame is judged afresh. */
         orr_SpinlockReadUnlock(ctx->configLock);
         orr_SpinlockWriteLock(ctx->configLock);
         readLocked = false;
         judgement = JudgeFrame(ctx, &frame, direction, readLocked, true);
      }
      if (frame.copy != nullptr) {
         SifraGenericFree(frame.copy);
         frame.copy = nullptr;
      }
      if (judgement.verdict == SwSecVerdictDrop) {
         orr_PktRelease(orr_PktListIterRemovePkt(iter));
      } else {
         orr_PktListIterMove(iter);
      }
   }
   if (readLocked) {
      orr_SpinlockReadUnlock(ctx->configLock);
   } else {
      orr_SpinlockWriteUnlock(ctx->configLock);
   }
   return ORR_OK;
}
