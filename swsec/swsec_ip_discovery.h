/* IP discovery: DHCP and ARP snooping into the port database. */
#pragma once

#include "swsec/swsec_context.h"
#include "swsec/swsec_pkt_info.h"

/*
 * Watches one frame and keeps the database current. 0 with a verdict;
 * ORR_BUSY when the frame needs configLock exclusive (nothing changed yet);
 * ORR_NO_MEMORY when an allocation failed.
 */
orr_Status SwSecIpDiscovery(SwSecContext *ctx, orr_Pkt *pkt, SwSecPktInfo *info,
                            uint32_t direction, uint32_t *verdict);

/* The first DHCP VMI of the client on the VLAN, in list order, or null. */
SwSecVmi *SwSecFindDhcpClientVmi(SwSecContext *ctx, uint16_t vlanId, const uint8_t *chaddr,
                                 uint32_t clientIdLen, const uint8_t *clientId);

/*
 * Compares a stored client identity with a message's: 0 when they match
 * (equal identifier lengths, then the identifier bytes, or the 6 hardware
 * address bytes when there is no identifier); -1 when the lengths differ,
 * else the byte comparison's result.
 */
int SwSecDhcpClientIdCmp(const SwSecVmi *vmi, const uint8_t *chaddr, uint32_t clientIdLen,
                         const uint8_t *clientId);
int SwSecDhcpClientIdCmp(const SwSecDhcpReq *req, const uint8_t *chaddr, uint32_t clientIdLen,
                         const uint8_t *clientId);
