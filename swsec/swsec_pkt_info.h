/*
 * The per-frame parse record that the frame loop keeps on its stack and
 * hands to the policy, IP discovery and the DHCP parser.
 */
#pragma once

#include "platform/orr_pkt.h"

#include <cstdint>

enum SwSecPktFlags : uint32_t {
   SWSEC_PKT_ETH = 0x1,    /* Ethernet header found and mapped */
   SWSEC_PKT_IPV4 = 0x2,   /* layer 3 found, ethertype 0x0800 */
   SWSEC_PKT_IPV6 = 0x4,   /* layer 3 found, ethertype 0x86DD */
   SWSEC_PKT_L4 = 0x8,     /* never set; released together with SWSEC_PKT_UDP */
   SWSEC_PKT_UDP = 0x10,   /* UDP header found and mapped */
};

enum SwSecVerdict : uint32_t {
   SwSecVerdictDrop = 1,
   SwSecVerdictPass = 2,
};

/* Frame list directions. */
enum SwSecDirection : uint32_t {
   SwSecDirectionRx = 1,   /* to the VM */
   SwSecDirectionTx = 2,   /* from the VM */
};

struct SwSecPktInfo {
   uint32_t flags;
   uint8_t *frame;                   /* start of the mapped bytes */
   uint32_t frameLen;
   uint32_t mappedLen;               /* min(frame length, mapped length) */
   uint8_t *pktCopy;                 /* whole-frame heap copy made by a parser, or null */
   orr_PktHeaderEntry *ethEntry;
   uint8_t *ethHdr;
   uint16_t vlanId;
   orr_PktHeaderEntry *ipEntry;
   uint8_t *ipHdr;
   orr_PktHeaderEntry *l4Entry;
   uint8_t *udpHdr;
   uint8_t *dhcpHdr;
   uint8_t *dhcpMsgType;
   uint32_t dhcpClientIdLen;
   uint8_t *dhcpClientId;
   uint8_t *dhcpLeaseTime;
   uint8_t readLocked;               /* configLock held shared only */
};
