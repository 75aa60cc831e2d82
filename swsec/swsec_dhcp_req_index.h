/*
 * The pending DHCP requests of a port: dhcpReqList in arrival order (the
 * order ageing walks and every "first match" follows) and, once more than a
 * handful are pending, an index beside it so that a lookup costs the same
 * with a hundred thousand requests as with one.
 *
 * The index has two tables of the same size:
 *  - by client: VLAN and client identity (the identifier, or the hardware
 *    address when there is none). A port keeps at most one request per
 *    client (a repeated request updates the one it has), so the match is
 *    the only one;
 *  - by answer: VLAN, xid and hardware address, what a server's ACK or NAK
 *    is matched by. Several clients may share these; each bucket is kept in
 *    arrival order, so its first match is the list's first match.
 *
 * Everything runs with the port's configLock held exclusive.
 */
#pragma once

#include "swsec/swsec_context.h"

#include <cstdint>

/* Appends a filled request to dhcpReqList and the index; the port owns it from here. */
void SwSecLinkDhcpReq(SwSecContext *ctx, SwSecDhcpReq *req);
/* Takes a request off dhcpReqList and the index (SwSecDelDhcpReq frees it). */
void SwSecUnlinkDhcpReq(SwSecContext *ctx, SwSecDhcpReq *req);
/* Stores a repeated request's new xid, moving it to its new answer bucket. */
void SwSecSetDhcpReqXid(SwSecContext *ctx, SwSecDhcpReq *req, uint32_t xid);

/* The pending request of the client on the VLAN, or null. */
SwSecDhcpReq *SwSecFindDhcpReqByClient(SwSecContext *ctx, uint16_t vlanId, const uint8_t *chaddr,
                                       uint32_t clientIdLen, const uint8_t *clientId);
/* The first pending request (arrival order) that an answer with this VLAN, xid and chaddr matches. */
SwSecDhcpReq *SwSecFindDhcpReqByAnswer(SwSecContext *ctx, uint16_t vlanId, uint32_t xid,
                                       const uint8_t *chaddr);

/* Whether the index is built (tests). */
bool SwSecDhcpReqIndexBuilt(const SwSecContext *ctx);
