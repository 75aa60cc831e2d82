/*
 * IP discovery: follows the DHCP exchanges of the port's clients and, on a
 * trusted port, the ARP the virtual machine sends, and keeps the port
 * database current. Runs on the frame path under the port's configLock;
 * lookups and expiry refreshes are done under the shared lock, every other
 * change first asks for the exclusive lock with ORR_BUSY.
 */
#include "swsec/swsec_ip_discovery.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_log.h"
#include "platform/orr_hash.h"
#include "platform/orr_text.h"
#include "swsec/swsec_dhcp_parse.h"
#include "swsec/swsec_dhcp_req_index.h"
#include "swsec/swsec_notify.h"
#include "swsec/swsec_port_db.h"
#include "swsec/swsec_port_db_links.h"

#include <cstddef>
#include <cstdint>

namespace {

/* Lifetimes, in seconds. */
constexpr uint32_t DHCP_REQ_LIFETIME_SEC = 60;
constexpr uint32_t NON_AUTH_LIFETIME_SEC = 180;

constexpr uint16_t DHCP_SERVER_PORT = 67;
constexpr uint16_t DHCP_CLIENT_PORT = 68;
constexpr uint16_t ETHERTYPE_IPV4 = 0x0800;
constexpr uint16_t ETHERTYPE_ARP = 0x0806;
constexpr uint32_t IPV4_BROADCAST = 0xffffffffu;

/* IPv4 header fields. */
constexpr uint32_t IPV4_FRAG_OFFSET = 6;
constexpr uint16_t IPV4_MORE_FRAGMENTS = 0x2000;
constexpr uint16_t IPV4_FRAG_OFFSET_MASK = 0x1fff;
constexpr uint32_t IPV4_SRC_OFFSET = 12;
constexpr uint32_t IPV4_DST_OFFSET = 16;

/* Ethernet header fields. */
constexpr uint32_t ETH_SRC_OFFSET = 6;

/* DHCP fixed header fields. */
constexpr uint32_t DHCP_XID_OFFSET = 4;
constexpr uint32_t DHCP_CIADDR_OFFSET = 12;
constexpr uint32_t DHCP_YIADDR_OFFSET = 16;
constexpr uint32_t DHCP_SIADDR_OFFSET = 20;
constexpr uint32_t DHCP_CHADDR_OFFSET = 28;
constexpr uint32_t MAC_LEN = 6;

enum DhcpMsgType : uint8_t {
   DHCP_DISCOVER = 1,
   DHCP_REQUEST = 3,
   DHCP_DECLINE = 4,
   DHCP_ACK = 5,
   DHCP_NAK = 6,
   DHCP_RELEASE = 7,
};

/* An ARP packet for IPv4 over Ethernet. */
struct __attribute__((packed)) ArpPacket {
   uint8_t hardwareType[2];
   uint8_t protocolType[2];
   uint8_t hardwareLength;
   uint8_t protocolLength;
   uint8_t operation[2];
   uint8_t senderMac[6];
   uint8_t senderIp[4];
   uint8_t targetMac[6];
   uint8_t targetIp[4];
};
static_assert(sizeof(ArpPacket) == 28);
static_assert(offsetof(ArpPacket, operation) == 6);
static_assert(offsetof(ArpPacket, senderMac) == 8);
static_assert(offsetof(ArpPacket, senderIp) == 14);
static_assert(offsetof(ArpPacket, targetMac) == 18);
static_assert(offsetof(ArpPacket, targetIp) == 24);

constexpr uint16_t ARP_HW_ETHERNET = 1;
constexpr uint16_t ARP_OP_REQUEST = 1;
constexpr uint16_t ARP_OP_REPLY = 2;

uint16_t LoadBe16(const uint8_t *bytes)
{
   return static_cast<uint16_t>(bytes[0] << 8 | bytes[1]);
}

uint32_t LoadBe32(const uint8_t *bytes)
{
   return static_cast<uint32_t>(bytes[0]) << 24 | static_cast<uint32_t>(bytes[1]) << 16 |
          static_cast<uint32_t>(bytes[2]) << 8 | static_cast<uint32_t>(bytes[3]);
}

/* Four bytes as they lie in memory (addresses and xid keep the wire's order). */
uint32_t LoadRaw32(const uint8_t *bytes)
{
   uint32_t value = 0;
   orr_Memcpy(&value, bytes, sizeof(value));
   return value;
}

const char *FilterName(const SwSecContext *ctx)
{
   return ctx->filter != nullptr ? ctx->filter->name : "";
}

SwSecVmi *VmiOfListLinks(orr_ListLinks *links)
{
   return reinterpret_cast<SwSecVmi *>(reinterpret_cast<uint8_t *>(links) -
                                       offsetof(SwSecVmi, listLinks));
}

bool IsNonAuthoritative(const SwSecVmi *vmi)
{
   return (vmi->discoveryMethod & SwSecDiscNonAuthoritativeMask) != 0;
}

/* Refreshing under the shared lock: one untorn store, racing only with equal refreshes. */
void RefreshExpiry(SwSecVmi *vmi)
{
   __atomic_store_n(&vmi->expiryTime, SifraGenericGetExpirySec(NON_AUTH_LIFETIME_SEC),
                    __ATOMIC_RELAXED);
}

int ClientIdCmp(const uint8_t *storedChaddr, uint8_t storedLen, const uint8_t *storedId,
                const uint8_t *chaddr, uint32_t clientIdLen, const uint8_t *clientId)
{
   if (storedLen != clientIdLen) {
      return -1;
   }
   if (clientIdLen != 0) {
      return orr_Memcmp(storedId, clientId, clientIdLen);
   }
   return orr_Memcmp(storedChaddr, chaddr, MAC_LEN);
}

/* Records a client's request as pending for 60 seconds (SwSecAddDhcpReq). */
orr_Status SwSecAddDhcpReq(SwSecContext *ctx, const SwSecPktInfo *info)
{
   const uint8_t *hdr = info->dhcpHdr;
   /* The identifier's length came from one option length byte. */
   const auto clientIdLen = static_cast<uint8_t>(info->dhcpClientIdLen);

   auto *req = static_cast<SwSecDhcpReq *>(SifraGenericAlloc(sizeof(SwSecDhcpReq)));
   if (req == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "%s: Alloc of dhcpReq failed", FilterName(ctx));
      return ORR_NO_MEMORY;
   }
   if (clientIdLen != 0) {
      req->clientIdStr = static_cast<uint8_t *>(SifraGenericAlloc(clientIdLen));
      if (req->clientIdStr == nullptr) {
         SG_LOG(ORR_LOG_ERROR, "%s: Alloc of dhcpReq clientIdStr failed", FilterName(ctx));
         SifraGenericFree(req);
         return ORR_NO_MEMORY;
      }
      orr_Memcpy(req->clientIdStr, info->dhcpClientId, clientIdLen);
   }
   req->vlanId = info->vlanId;
   req->xid = LoadRaw32(hdr + DHCP_XID_OFFSET);
   req->clientIdLen = clientIdLen;
   orr_Memcpy(req->chaddr, hdr + DHCP_CHADDR_OFFSET, MAC_LEN);
   req->expiryTime = SifraGenericGetExpirySec(DHCP_REQ_LIFETIME_SEC);
   SwSecLinkDhcpReq(ctx, req);
   return ORR_OK;
}

/* The hash bucket that holds `vmi` under its current key; the table must exist. */
orr_ListLinks *BucketOf(SwSecContext *ctx, const SwSecVmi *vmi)
{
   SwSecVmiKey key{};
   key.vlanId = vmi->vlanId;
   orr_Memcpy(key.macAddr, vmi->macAddr, MAC_LEN);
   key.ipAddr = vmi->ipAddr;
   return SwSecVmiBucket(ctx->portDbHash, &key);
}

void LogAddressChange(SwSecContext *ctx, const SwSecVmi *vmi, uint32_t newIp)
{
   const auto *o = reinterpret_cast<const uint8_t *>(&vmi->ipAddr);
   const auto *n = reinterpret_cast<const uint8_t *>(&newIp);
   const uint8_t *m = vmi->macAddr;
   SG_LOG(ORR_LOG_INFO,
          "%s: IP address change on renewal: %u %02hhx:%02hhx:%02hhx:%02hhx:%02hhx:%02hhx "
          "%u.%u.%u.%u->%u.%u.%u.%u",
          FilterName(ctx), vmi->vlanId, m[0], m[1], m[2], m[3], m[4], m[5], o[0], o[1], o[2],
          o[3], n[0], n[1], n[2], n[3]);
}

/*
 * Renews a client's DHCP entry with the lease (and address) of an ACK. The
 * entry may have to be filed under a key that another entry already holds
 * (same VLAN and MAC, the new address). So that the database never holds
 * two entries with one key: a non-authoritative holder (TOFU, ARP Snooping)
 * is deleted, as an addition of the DHCP entry would replace it; an
 * authoritative holder (Static, or a DHCP entry of another client identity)
 * already binds the new address, and the renewing entry is deleted: its old
 * address is no longer leased, and it cannot take the new key.
 */
void RenewDhcpVmi(SwSecContext *ctx, SwSecVmi *vmi, uint32_t leaseTime, uint32_t newIp)
{
   vmi->leaseTime = leaseTime;
   vmi->expiryTime = SifraGenericGetExpirySec(leaseTime);
   if (newIp == vmi->ipAddr) {
      return;
   }

   LogAddressChange(ctx, vmi, newIp);
   SwSecVmi *holder = SwSecFindVmi(ctx, vmi->vlanId, vmi->macAddr, newIp);
   if (holder != nullptr) {
      if (!IsNonAuthoritative(holder)) {
         SwSecDelVmi(ctx, vmi);
         return;
      }
      SwSecDelVmi(ctx, holder);
   }

   SwSecPostPortDbMsg(ctx, SwSecPortDbOpRemoved, vmi);
   if (ctx->numVmiEntries >= 2) {
      SifraGenericListUnlink(&vmi->hashLinks);
      vmi->ipAddr = newIp;
      SifraGenericListAppend(BucketOf(ctx, vmi), &vmi->hashLinks);
   } else {
      vmi->ipAddr = newIp;
   }
   SwSecPostPortDbMsg(ctx, SwSecPortDbOpAdded, vmi);
}

/* A DHCPACK towards the VM (FwProcessDhcpAck). */
orr_Status FwProcessDhcpAck(SwSecContext *ctx, const SwSecPktInfo *info, uint32_t *verdict)
{
   const uint8_t *hdr = info->dhcpHdr;
   SwSecDhcpReq *req = SwSecFindDhcpReqByAnswer(ctx, info->vlanId, LoadRaw32(hdr + DHCP_XID_OFFSET),
                                        hdr + DHCP_CHADDR_OFFSET);
   if (req == nullptr) {
      /* An acknowledgement that answers no request of this port is not delivered. */
      *verdict = SwSecVerdictDrop;
      return ORR_OK;
   }

   const uint32_t leaseTime = LoadBe32(info->dhcpLeaseTime);
   const uint32_t yiaddr = LoadRaw32(hdr + DHCP_YIADDR_OFFSET);
   SwSecVmi *vmi =
      SwSecFindDhcpClientVmi(ctx, req->vlanId, req->chaddr, req->clientIdLen, req->clientIdStr);
   if (vmi != nullptr) {
      RenewDhcpVmi(ctx, vmi, leaseTime, yiaddr);
      SwSecDelDhcpReq(ctx, req);
      return ORR_OK;
   }

   vmi = static_cast<SwSecVmi *>(SifraGenericAlloc(sizeof(SwSecVmi)));
   if (vmi == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "%s: Vmi alloc failed", FilterName(ctx));
      SwSecDelDhcpReq(ctx, req);
      return ORR_NO_MEMORY;
   }
   if (req->clientIdLen != 0) {
      vmi->clientIdStr = static_cast<uint8_t *>(SifraGenericAlloc(req->clientIdLen));
      if (vmi->clientIdStr == nullptr) {
         SG_LOG(ORR_LOG_ERROR, "%s: Vmi clientIdStr alloc failed", FilterName(ctx));
         SifraGenericFree(vmi);
         SwSecDelDhcpReq(ctx, req);
         return ORR_NO_MEMORY;
      }
      orr_Memcpy(vmi->clientIdStr, req->clientIdStr, req->clientIdLen);
   }
   vmi->vlanId = req->vlanId;
   orr_Memcpy(vmi->macAddr, req->chaddr, MAC_LEN);
   orr_Memcpy(vmi->chaddr, req->chaddr, MAC_LEN);
   vmi->discoveryMethod = SwSecDiscDhcpSnooping;
   vmi->ipAddr = yiaddr;
   vmi->clientIdLen = req->clientIdLen;
   vmi->serverIp = LoadRaw32(hdr + DHCP_SIADDR_OFFSET);
   vmi->leaseTime = leaseTime;
   vmi->expiryTime = SifraGenericGetExpirySec(leaseTime);
   if (SwSecAddVmi(ctx, vmi) != 0) {
      /* Full, or the key is held by a stronger method: the frame still passes. */
      if (vmi->clientIdStr != nullptr) {
         SifraGenericFree(vmi->clientIdStr);
      }
      SifraGenericFree(vmi);
   }
   SwSecDelDhcpReq(ctx, req);
   return ORR_OK;
}

/* Deletes the client's DHCP entry on the VLAN, if it has one. */
void DelDhcpClientVmi(SwSecContext *ctx, uint16_t vlanId, const uint8_t *chaddr,
                      uint32_t clientIdLen, const uint8_t *clientId)
{
   SwSecVmi *vmi = SwSecFindDhcpClientVmi(ctx, vlanId, chaddr, clientIdLen, clientId);
   if (vmi != nullptr) {
      SwSecDelVmi(ctx, vmi);
   }
}

/* A DHCP message from the VM to a server. */
orr_Status ClientSideDhcp(SwSecContext *ctx, orr_Pkt *pkt, SwSecPktInfo *info, uint32_t *verdict)
{
   if (info->readLocked) {
      return ORR_BUSY;
   }
   if (SwSecDhcpParse(ctx, pkt, info) != 0) {
      return ORR_OK;
   }

   const uint8_t *hdr = info->dhcpHdr;
   const uint8_t *chaddr = hdr + DHCP_CHADDR_OFFSET;
   if (!ctx->config.trusted && orr_Memcmp(chaddr, info->ethHdr + ETH_SRC_OFFSET, MAC_LEN) != 0) {
      SwSecCountDrop(&ctx->counters.dhcpSnoopingDropCnt);
      *verdict = SwSecVerdictDrop;
      return ORR_OK;
   }

   const uint32_t clientIdLen = info->dhcpClientIdLen;
   const uint8_t *clientId = info->dhcpClientId;
   switch (*info->dhcpMsgType) {
   case DHCP_DISCOVER:
   case DHCP_DECLINE:
   case DHCP_RELEASE: {
      SwSecDhcpReq *req = SwSecFindDhcpReqByClient(ctx, info->vlanId, chaddr, clientIdLen, clientId);
      if (req != nullptr) {
         SwSecDelDhcpReq(ctx, req);
      }
      DelDhcpClientVmi(ctx, info->vlanId, chaddr, clientIdLen, clientId);
      return ORR_OK;
   }
   case DHCP_REQUEST: {
      /* Selecting or rebooting, not renewing: the old binding is over. */
      if (LoadRaw32(info->ipHdr + IPV4_DST_OFFSET) == IPV4_BROADCAST &&
          LoadRaw32(hdr + DHCP_CIADDR_OFFSET) == 0) {
         DelDhcpClientVmi(ctx, info->vlanId, chaddr, clientIdLen, clientId);
      }
      SwSecDhcpReq *req = SwSecFindDhcpReqByClient(ctx, info->vlanId, chaddr, clientIdLen, clientId);
      if (req != nullptr) {
         /* A repeated request follows the latest xid but keeps its first expiry. */
         SwSecSetDhcpReqXid(ctx, req, LoadRaw32(hdr + DHCP_XID_OFFSET));
         return ORR_OK;
      }
      return SwSecAddDhcpReq(ctx, info);
   }
   default:
      return ORR_OK;
   }
}

/* A DHCP message from a server to the VM. */
orr_Status ServerSideDhcp(SwSecContext *ctx, orr_Pkt *pkt, SwSecPktInfo *info, uint32_t *verdict)
{
   if (info->readLocked) {
      return ORR_BUSY;
   }
   if (SwSecDhcpParse(ctx, pkt, info) != 0) {
      return ORR_OK;
   }

   switch (*info->dhcpMsgType) {
   case DHCP_ACK:
      return FwProcessDhcpAck(ctx, info, verdict);
   case DHCP_NAK: {
      const uint8_t *hdr = info->dhcpHdr;
      SwSecDhcpReq *req = SwSecFindDhcpReqByAnswer(ctx, info->vlanId, LoadRaw32(hdr + DHCP_XID_OFFSET),
                                           hdr + DHCP_CHADDR_OFFSET);
      if (req == nullptr) {
         return ORR_OK;
      }
      DelDhcpClientVmi(ctx, req->vlanId, req->chaddr, req->clientIdLen, req->clientIdStr);
      SwSecDelDhcpReq(ctx, req);
      return ORR_OK;
   }
   default:
      return ORR_OK;
   }
}

/* ARP from the VM on a trusted port (SwSecArpSnoop). */
orr_Status SwSecArpSnoop(SwSecContext *ctx, SwSecPktInfo *info)
{
   const uint32_t arpOffset = info->ethEntry->nextHdrOffset;
   if (static_cast<uint64_t>(arpOffset) + sizeof(ArpPacket) > info->mappedLen) {
      return ORR_OK;
   }
   const auto *arp = reinterpret_cast<const ArpPacket *>(info->frame + arpOffset);
   if (LoadBe16(arp->hardwareType) != ARP_HW_ETHERNET ||
       LoadBe16(arp->protocolType) != ETHERTYPE_IPV4 || arp->hardwareLength != MAC_LEN ||
       arp->protocolLength != 4) {
      return ORR_OK;
   }
   const uint32_t senderIp = LoadRaw32(arp->senderIp);
   if (senderIp == 0) {
      return ORR_OK;
   }
   const uint16_t op = LoadBe16(arp->operation);
   if (op != ARP_OP_REQUEST && !(op == ARP_OP_REPLY && senderIp == LoadRaw32(arp->targetIp))) {
      return ORR_OK;
   }

   SwSecVmi *vmi = SwSecFindVmi(ctx, info->vlanId, arp->senderMac, senderIp);
   if (vmi != nullptr) {
      if (IsNonAuthoritative(vmi)) {
         RefreshExpiry(vmi);
      }
      return ORR_OK;
   }
   if (info->readLocked) {
      return ORR_BUSY;
   }

   vmi = static_cast<SwSecVmi *>(SifraGenericAlloc(sizeof(SwSecVmi)));
   if (vmi == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "%s: Vmi alloc failed", FilterName(ctx));
      return ORR_NO_MEMORY;
   }
   vmi->vlanId = info->vlanId;
   orr_Memcpy(vmi->macAddr, arp->senderMac, MAC_LEN);
   vmi->ipAddr = senderIp;
   vmi->discoveryMethod = SwSecDiscApSnooping;
   vmi->expiryTime = SifraGenericGetExpirySec(NON_AUTH_LIFETIME_SEC);
   if (SwSecAddVmi(ctx, vmi) != 0) {
      SifraGenericFree(vmi);
   }
   return ORR_OK;
}

bool IsIpv4Fragment(const SwSecPktInfo *info)
{
   const uint16_t fragment = LoadBe16(info->ipHdr + IPV4_FRAG_OFFSET);
   return (fragment & (IPV4_MORE_FRAGMENTS | IPV4_FRAG_OFFSET_MASK)) != 0;
}

}  // namespace

int SwSecDhcpClientIdCmp(const SwSecVmi *vmi, const uint8_t *chaddr, uint32_t clientIdLen,
                         const uint8_t *clientId)
{
   return ClientIdCmp(vmi->chaddr, vmi->clientIdLen, vmi->clientIdStr, chaddr, clientIdLen,
                      clientId);
}

int SwSecDhcpClientIdCmp(const SwSecDhcpReq *req, const uint8_t *chaddr, uint32_t clientIdLen,
                         const uint8_t *clientId)
{
   return ClientIdCmp(req->chaddr, req->clientIdLen, req->clientIdStr, chaddr, clientIdLen,
                      clientId);
}

SwSecVmi *SwSecFindDhcpClientVmi(SwSecContext *ctx, uint16_t vlanId, const uint8_t *chaddr,
                                 uint32_t clientIdLen, const uint8_t *clientId)
{
   for (orr_ListLinks *l = ctx->portDbList.next; l != &ctx->portDbList; l = l->next) {
      SwSecVmi *vmi = VmiOfListLinks(l);
      if (vmi->vlanId == vlanId && vmi->discoveryMethod == SwSecDiscDhcpSnooping &&
          SwSecDhcpClientIdCmp(vmi, chaddr, clientIdLen, clientId) == 0) {
         return vmi;
      }
   }
   return nullptr;
}

orr_Status SwSecIpDiscovery(SwSecContext *ctx, orr_Pkt *pkt, SwSecPktInfo *info,
                            uint32_t direction, uint32_t *verdict)
{
   *verdict = SwSecVerdictPass;
   const bool fromVm = direction == SwSecDirectionTx;

   const uint32_t ipv4Udp = SWSEC_PKT_IPV4 | SWSEC_PKT_UDP;
   if ((info->flags & ipv4Udp) == ipv4Udp && !IsIpv4Fragment(info)) {
      const uint16_t dstPort = LoadBe16(info->udpHdr + 2);
      if (fromVm && dstPort == DHCP_SERVER_PORT) {
         return ClientSideDhcp(ctx, pkt, info, verdict);
      }
      if (!fromVm) {
         return dstPort == DHCP_CLIENT_PORT ? ServerSideDhcp(ctx, pkt, info, verdict) : ORR_OK;
      }
   }

   if (!fromVm || !ctx->config.trusted || (info->flags & SWSEC_PKT_ETH) == 0) {
      return ORR_OK;
   }
   /* The layer-2 entry carries the ethertype behind any VLAN tag, in network order. */
   const uint16_t etherType = LoadBe16(reinterpret_cast<const uint8_t *>(&info->ethEntry->nextProto));
   if (etherType == ETHERTYPE_ARP) {
      return SwSecArpSnoop(ctx, info);
   }
   if ((info->flags & SWSEC_PKT_IPV4) != 0) {
      SwSecVmi *vmi = SwSecFindVmi(ctx, info->vlanId, info->ethHdr + ETH_SRC_OFFSET,
                                   LoadRaw32(info->ipHdr + IPV4_SRC_OFFSET));
      if (vmi != nullptr && IsNonAuthoritative(vmi)) {
         RefreshExpiry(vmi);
      }
   }
   return ORR_OK;
}
