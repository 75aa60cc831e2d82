/* Walking an IPv6 header chain within fixed limits. */
#include "fhs/fhs_ipv6_chain.h"

namespace {

constexpr uint8_t kProtoEsp = 50;
constexpr uint8_t kProtoNoNext = 59;
constexpr uint8_t kProtoMobility = 135;
constexpr uint8_t kProtoHip = 139;
constexpr uint8_t kProtoShim6 = 140;
constexpr uint32_t kFragmentHeaderLen = 8;
constexpr uint16_t kFragmentOffsetMask = 0xfff8;

uint16_t LoadBe16(const uint8_t *bytes)
{
   return static_cast<uint16_t>(bytes[0] << 8 | bytes[1]);
}

/* Bytes the walk makes sure of after the chain, by upper-layer protocol. */
uint32_t UpperHeaderLen(uint8_t proto)
{
   switch (proto) {
   case FHS_PROTO_TCP:
      return 20;
   case FHS_PROTO_UDP:
      return 8;
   case FHS_PROTO_ICMPV6:
      return 4;
   default:
      return 0;
   }
}

bool IsExtensionHeader(uint8_t proto)
{
   switch (proto) {
   case FHS_PROTO_HOP_BY_HOP:
   case FHS_PROTO_ROUTING:
   case FHS_PROTO_FRAGMENT:
   case FHS_PROTO_AH:
   case FHS_PROTO_DEST_OPTS:
   case kProtoMobility:
   case kProtoHip:
   case kProtoShim6:
      return true;
   default:
      return false;
   }
}

}  // namespace

FhsChainVerdict FhsWalkIpv6Chain(const uint8_t *ip6, uint32_t viewLen, uint32_t l3Len, FhsIpv6Chain *chain)
{
   chain->fragmented = 0;
   chain->laterFragment = 0;
   chain->numHeaders = 0;
   if (l3Len < FHS_IPV6_HEADER_LEN) {
      return FhsChainMalformed;
   }
   if (viewLen < FHS_IPV6_HEADER_LEN) {
      return FhsChainNeedView;
   }
   if ((ip6[0] >> 4) != 6) {
      return FhsChainMalformed;
   }
   const uint32_t packetLen = FHS_IPV6_HEADER_LEN + LoadBe16(ip6 + 4);
   if (packetLen > l3Len) {
      return FhsChainMalformed;
   }
   chain->packetLen = packetLen;
   /* Past the packet there is only padding: the view ends with the packet. */
   const uint32_t view = viewLen < packetLen ? viewLen : packetLen;

   uint8_t next = ip6[6];
   uint32_t offset = FHS_IPV6_HEADER_LEN;
   while (IsExtensionHeader(next)) {
      /* A first fragment must hold the chain: what runs past it is not malformed but incomplete. */
      const FhsChainVerdict cut = chain->fragmented != 0 ? FhsChainNotInFirstFragment : FhsChainMalformed;
      if (chain->numHeaders == FHS_CHAIN_MAX_HEADERS) {
         return FhsChainOverLimit;
      }
      if (next == FHS_PROTO_HOP_BY_HOP && chain->numHeaders != 0) {
         return FhsChainMalformed;
      }
      if (offset + 2 > packetLen) {
         return cut;
      }
      if (offset + 2 > view) {
         return FhsChainNeedView;
      }
      uint32_t length;
      if (next == FHS_PROTO_FRAGMENT) {
         length = kFragmentHeaderLen;
      } else if (next == FHS_PROTO_AH) {
         length = (ip6[offset + 1] + 2u) * 4u;
      } else {
         length = (ip6[offset + 1] + 1u) * 8u;
      }
      if (offset + length - FHS_IPV6_HEADER_LEN > FHS_CHAIN_MAX_BYTES) {
         return FhsChainOverLimit;
      }
      if (offset + length > packetLen) {
         return cut;
      }
      if (offset + length > view) {
         return FhsChainNeedView;
      }
      chain->numHeaders++;
      if (next == FHS_PROTO_FRAGMENT) {
         if (chain->fragmented != 0) {
            return FhsChainMalformed;
         }
         chain->fragmented = 1;
         if ((LoadBe16(ip6 + offset + 2) & kFragmentOffsetMask) != 0) {
            /* What follows a later fragment's header is data, not headers. */
            chain->laterFragment = 1;
            chain->upperProto = ip6[offset];
            chain->upperOffset = offset + length;
            return FhsChainOk;
         }
      }
      next = ip6[offset];
      offset += length;
   }

   chain->upperProto = next;
   chain->upperOffset = offset;
   if (next == kProtoNoNext || next == kProtoEsp) {
      return FhsChainOk;
   }
   const uint32_t upperLen = UpperHeaderLen(next);
   if (offset + upperLen > packetLen) {
      return chain->fragmented != 0 ? FhsChainNotInFirstFragment : FhsChainMalformed;
   }
   if (offset + upperLen > view) {
      return FhsChainNeedView;
   }
   return FhsChainOk;
}
