/* Reading DHCPv6 client and server messages. */
#include "fhs/fhs_dhcpv6.h"

namespace {

constexpr uint16_t kOptClientId = 1;
constexpr uint16_t kOptIaNa = 3;
constexpr uint16_t kOptIaTa = 4;
constexpr uint16_t kOptIaAddr = 5;
constexpr uint32_t kHeaderLen = 4;
constexpr uint32_t kOptionHeaderLen = 4;
constexpr uint32_t kIaNaFixedLen = 12;    /* IAID, T1, T2 */
constexpr uint32_t kIaTaFixedLen = 4;     /* IAID */
constexpr uint32_t kIaAddrFixedLen = 24;  /* address, preferred and valid lifetimes */

uint16_t LoadBe16(const uint8_t *bytes)
{
   return static_cast<uint16_t>(bytes[0] << 8 | bytes[1]);
}

uint32_t LoadBe32(const uint8_t *bytes)
{
   return static_cast<uint32_t>(bytes[0]) << 24 | static_cast<uint32_t>(bytes[1]) << 16 |
          static_cast<uint32_t>(bytes[2]) << 8 | bytes[3];
}

/*
 * Walks the options in [bytes, bytes + length); each must fit whole. For
 * every option calls `visit(code, data, dataLen)`, which may refuse (-1).
 */
template <typename Visit>
int ForEachOption(const uint8_t *bytes, uint32_t length, Visit visit)
{
   uint32_t offset = 0;
   while (offset < length) {
      if (length - offset < kOptionHeaderLen) {
         return -1;
      }
      const uint16_t code = LoadBe16(bytes + offset);
      const uint32_t dataLen = LoadBe16(bytes + offset + 2);
      offset += kOptionHeaderLen;
      if (dataLen > length - offset) {
         return -1;
      }
      if (visit(code, bytes + offset, dataLen) != 0) {
         return -1;
      }
      offset += dataLen;
   }
   return 0;
}

/* The addresses of one IA's options. */
int ReadIaOptions(const uint8_t *bytes, uint32_t length, FhsDhcpv6Msg *msg)
{
   return ForEachOption(bytes, length, [msg](uint16_t code, const uint8_t *data, uint32_t dataLen) {
      if (code != kOptIaAddr) {
         return 0;
      }
      if (dataLen < kIaAddrFixedLen) {
         return -1;
      }
      if (msg->numAddrs == FHS_DHCPV6_MAX_ADDRS) {
         msg->numAddrsSkipped++;
         return 0;
      }
      FhsDhcpv6Addr *addr = &msg->addrs[msg->numAddrs++];
      __builtin_memcpy(addr->addr, data, sizeof(addr->addr));
      addr->validLifetime = LoadBe32(data + 20);
      return 0;
   });
}

}  // namespace

int FhsDhcpv6Parse(const uint8_t *bytes, uint32_t length, FhsDhcpv6Msg *msg)
{
   msg->clientId = nullptr;
   msg->clientIdLen = 0;
   msg->numAddrs = 0;
   msg->numAddrsSkipped = 0;
   if (length < kHeaderLen) {
      return -1;
   }
   msg->msgType = bytes[0];
   if (msg->msgType == FhsDhcpv6RelayForw || msg->msgType == FhsDhcpv6RelayReply) {
      return -1;
   }
   msg->xid = static_cast<uint32_t>(bytes[1]) << 16 | static_cast<uint32_t>(bytes[2]) << 8 | bytes[3];

   return ForEachOption(bytes + kHeaderLen, length - kHeaderLen,
                        [msg](uint16_t code, const uint8_t *data, uint32_t dataLen) {
                           switch (code) {
                           case kOptClientId:
                              if (msg->clientId != nullptr || dataLen == 0 || dataLen > FHS_DHCPV6_DUID_MAX) {
                                 return -1;
                              }
                              msg->clientId = data;
                              msg->clientIdLen = dataLen;
                              return 0;
                           case kOptIaNa:
                              if (dataLen < kIaNaFixedLen) {
                                 return -1;
                              }
                              return ReadIaOptions(data + kIaNaFixedLen, dataLen - kIaNaFixedLen, msg);
                           case kOptIaTa:
                              if (dataLen < kIaTaFixedLen) {
                                 return -1;
                              }
                              return ReadIaOptions(data + kIaTaFixedLen, dataLen - kIaTaFixedLen, msg);
                           default:
                              return 0;
                           }
                        });
}
