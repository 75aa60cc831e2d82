/*
 * Recognising a DHCP message in a UDP frame: the fixed header and the
 * options that IP discovery reads (message type, client identifier, lease
 * time), found in place where the frame's bytes are contiguous and in one
 * whole-frame copy otherwise. Nothing in the frame or the port changes.
 */
#include "swsec/swsec_dhcp_parse.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_log.h"
#include "platform/orr_pkt.h"
#include "platform/orr_text.h"

#include <cstddef>
#include <cstdint>

/* Names of the DHCP message types, indexed by value; entry 0 is unused. */
const char *const dhcpMsgTypeStr[9] = {
   "",
   "DHCPDISCOVER",
   "DHCPOFFER",
   "DHCPREQUEST",
   "DHCPDECLINE",
   "DHCPACK",
   "DHCPNAK",
   "DHCPRELEASE",
   "DHCPINFORM",
};

namespace {

/* Layout of the fixed header (offsets from the start of the UDP payload). */
constexpr uint32_t UDP_HDR_LEN = 8;
constexpr uint32_t DHCP_HTYPE_OFFSET = 1;
constexpr uint32_t DHCP_HLEN_OFFSET = 2;
constexpr uint32_t DHCP_COOKIE_OFFSET = 236;
constexpr uint32_t DHCP_FIXED_HDR_LEN = 240;
static_assert(DHCP_COOKIE_OFFSET + 4 == DHCP_FIXED_HDR_LEN);

constexpr uint8_t DHCP_HTYPE_ETHERNET = 1;
constexpr uint8_t DHCP_HLEN_ETHERNET = 6;
constexpr uint8_t DHCP_COOKIE[4] = {99, 130, 83, 99};

enum DhcpOptionCode : uint8_t {
   DHCP_OPT_PAD = 0,
   DHCP_OPT_LEASE_TIME = 51,
   DHCP_OPT_MSG_TYPE = 53,
   DHCP_OPT_CLIENT_ID = 61,
   DHCP_OPT_END = 255,
};

/* Bytes that IP discovery reads from the value of each fixed-size option. */
constexpr uint32_t DHCP_MSG_TYPE_LEN = 1;
constexpr uint32_t DHCP_LEASE_TIME_LEN = 4;

constexpr uint8_t DHCP_MSG_TYPE_ACK = 5;

const char *FilterName(const SwSecContext *ctx)
{
   return ctx->filter != nullptr ? ctx->filter->name : "";
}

}  // namespace

uint8_t *SwSecGetMappedPtr(orr_Pkt *pkt, uint32_t *offset, uint32_t length, SwSecPktInfo *info)
{
   /* 64-bit so that offset + length cannot wrap past the check. */
   const uint64_t start = *offset;
   const uint64_t end = start + length;
   if (end > info->frameLen) {
      return nullptr;
   }

   uint8_t *ptr = nullptr;
   if (info->pktCopy != nullptr) {
      ptr = info->pktCopy + start;
   } else if (end <= info->mappedLen) {
      ptr = info->frame + start;
   } else {
      ptr = SifraGenericFindSGEntry(pkt, *offset, static_cast<uint32_t>(end));
   }

   if (ptr == nullptr) {
      /* The range straddles elements: one copy of the whole frame serves every later access. */
      uint8_t *copy = static_cast<uint8_t *>(SifraGenericAlloc(info->frameLen));
      if (copy == nullptr) {
         SG_LOG(ORR_LOG_ERROR, "Failed to alloc pktCopy: %u", info->frameLen);
         return nullptr;
      }
      const orr_Status status = orr_PktCopyBytesOut(pkt, 0, info->frameLen, copy);
      if (status != ORR_OK) {
         SG_LOG(ORR_LOG_ERROR, "Failed to copy pkt: %s(%u)", orr_StatusToString(status),
                info->frameLen);
         SifraGenericFree(copy);
         return nullptr;
      }
      info->pktCopy = copy;
      ptr = copy + start;
   }

   *offset = static_cast<uint32_t>(end);
   return ptr;
}

int SwSecDhcpParse(SwSecContext *ctx, orr_Pkt *pkt, SwSecPktInfo *info)
{
   info->dhcpHdr = nullptr;
   info->dhcpMsgType = nullptr;
   info->dhcpClientIdLen = 0;
   info->dhcpClientId = nullptr;
   info->dhcpLeaseTime = nullptr;

   const char *name = FilterName(ctx);
   const uint32_t udpOffset = info->l4Entry->offset;
   const uint32_t udpLen = static_cast<uint32_t>(info->udpHdr[4] << 8 | info->udpHdr[5]);
   if (udpLen < UDP_HDR_LEN + DHCP_FIXED_HDR_LEN ||
       static_cast<uint64_t>(udpOffset) + udpLen > info->frameLen) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid frame len", name);
      return -1;
   }

   uint32_t offset = udpOffset + UDP_HDR_LEN;
   uint8_t *hdr = SwSecGetMappedPtr(pkt, &offset, DHCP_FIXED_HDR_LEN, info);
   if (hdr == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "%s: Can't access DHCP hdr", name);
      return -1;
   }
   info->dhcpHdr = hdr;

   const uint8_t htype = hdr[DHCP_HTYPE_OFFSET];
   const uint8_t hlen = hdr[DHCP_HLEN_OFFSET];
   if (htype != DHCP_HTYPE_ETHERNET || hlen != DHCP_HLEN_ETHERNET) {
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid htype/hlen: [%u %u]", name, htype, hlen);
      return -1;
   }

   const uint8_t *cookie = hdr + DHCP_COOKIE_OFFSET;
   if (orr_Memcmp(cookie, DHCP_COOKIE, sizeof(DHCP_COOKIE)) != 0) {
      uint32_t cookieValue = 0;
      orr_Memcpy(&cookieValue, cookie, sizeof(cookieValue));
      SG_LOG(ORR_LOG_ERROR, "%s: Invalid cookie: 0x%08x", name, cookieValue);
      return -1;
   }

   /* The frame's length, not the UDP length, bounds the walk. */
   while (offset < info->frameLen) {
      const uint32_t codeOffset = offset;
      const uint8_t *code = SwSecGetMappedPtr(pkt, &offset, 1, info);
      if (code == nullptr) {
         SG_LOG(ORR_LOG_ERROR, "%s: Can't access DHCP option code: %u", name, codeOffset);
         return -1;
      }
      if (*code == DHCP_OPT_PAD) {
         continue;
      }
      if (*code == DHCP_OPT_END) {
         if (info->dhcpMsgType == nullptr) {
            SG_LOG(ORR_LOG_ERROR, "%s: Invalid options: %d %p", name, 1,
                   static_cast<void *>(info->dhcpMsgType));
            return -1;
         }
         if (*info->dhcpMsgType == DHCP_MSG_TYPE_ACK && info->dhcpLeaseTime == nullptr) {
            SG_LOG(ORR_LOG_ERROR, "%s: No lease time option in DHCPACK", name);
            return -1;
         }
         return 0;
      }

      const uint32_t lenOffset = offset;
      const uint8_t *lenByte = SwSecGetMappedPtr(pkt, &offset, 1, info);
      if (lenByte == nullptr) {
         SG_LOG(ORR_LOG_ERROR, "%s: Can't access DHCP option len: %u", name, lenOffset);
         return -1;
      }
      const uint32_t valueLen = *lenByte;
      const uint32_t valueOffset = offset;
      uint8_t *value = nullptr;
      if (valueLen != 0) {
         value = SwSecGetMappedPtr(pkt, &offset, valueLen, info);
         if (value == nullptr) {
            SG_LOG(ORR_LOG_ERROR, "%s: Can't access DHCP option: %u", name, valueOffset);
            return -1;
         }
      }

      /*
       * The last occurrence of an option wins. A message type shorter than
       * 1 byte or a lease time shorter than 4 bytes cannot be read without
       * stepping past the option's value, so such an occurrence counts as
       * the option being absent: a message left without a type is refused
       * at the end option, as is a DHCPACK left without a lease time. Longer
       * values are read by their first bytes.
       */
      switch (*code) {
      case DHCP_OPT_MSG_TYPE:
         info->dhcpMsgType = valueLen >= DHCP_MSG_TYPE_LEN ? value : nullptr;
         break;
      case DHCP_OPT_LEASE_TIME:
         info->dhcpLeaseTime = valueLen >= DHCP_LEASE_TIME_LEN ? value : nullptr;
         break;
      case DHCP_OPT_CLIENT_ID:
         /* An empty identifier identifies the client by its hardware address. */
         info->dhcpClientIdLen = valueLen;
         info->dhcpClientId = valueLen != 0 ? value : nullptr;
         break;
      default:
         break;
      }
   }

   SG_LOG(ORR_LOG_ERROR, "%s: Invalid options: %d %p", name, 0,
          static_cast<void *>(info->dhcpMsgType));
   return -1;
}
