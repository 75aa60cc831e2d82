/* Recognising a DHCP message in a UDP frame. */
#pragma once

#include "swsec/swsec_context.h"
#include "swsec/swsec_pkt_info.h"

/* Names of the DHCP message types by value (1 to 8); entry 0 is empty. */
extern const char *const dhcpMsgTypeStr[9];

/*
 * 0 when the frame carries a well-formed DHCP message and info's DHCP
 * fields point at its header and options; -1 otherwise (logged).
 */
int SwSecDhcpParse(SwSecContext *ctx, orr_Pkt *pkt, SwSecPktInfo *info);
/*
 * `length` contiguous bytes of the frame at `*offset`, read in place when
 * possible, else from one whole-frame copy in info->pktCopy; the offset
 * advances on success. Null when the range is not in the frame or the copy
 * fails.
 */
uint8_t *SwSecGetMappedPtr(orr_Pkt *pkt, uint32_t *offset, uint32_t length, SwSecPktInfo *info);
