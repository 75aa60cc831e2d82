/*
 * The port database of a switch-security port: at most 32 VMIs in a list in
 * insertion order, with a 16-bucket hash table while it holds two or more,
 * and the pending DHCP requests that IP discovery keeps. Every addition and
 * removal is announced on the port's portset.
 *
 * Every operation but SwSecFindVmi and SifraGenericGetExpirySec needs the
 * port's configLock held exclusive; SwSecFindVmi may run under it shared.
 */
#pragma once

#include "swsec/swsec_context.h"

/* The uptime plus `seconds`: how every expiry is computed. */
int64_t SifraGenericGetExpirySec(uint32_t seconds);

/* The VMI with all three key parts, or null. */
SwSecVmi *SwSecFindVmi(SwSecContext *ctx, uint16_t vlanId, const uint8_t *mac, uint32_t ipAddr);
/*
 * Adds a filled record, replacing a weaker entry of the same key. 0: the
 * database owns it (and its clientIdStr); -1: refused, the caller still owns it.
 */
int SwSecAddVmi(SwSecContext *ctx, SwSecVmi *vmi);
/* Removes and frees an entry of this database, announcing it. */
void SwSecDelVmi(SwSecContext *ctx, SwSecVmi *vmi);
/* Removes learned entries: all of them, or those of `count` keys. Always 0. */
orr_Status SwSecClearVmi(SwSecContext *ctx, bool all, uint32_t count, const SwSecVmiKey *keys);
/* Removes and frees a pending request. */
void SwSecDelDhcpReq(SwSecContext *ctx, SwSecDhcpReq *req);
/* One ageing pass; configLock exclusive, IP discovery on. */
void SwSecPortDbTimerCb(SwSecContext *ctx);
/*
 * Applies the port-database part of a new configuration (header and
 * `numStatic` keys behind it): enables, reconfigures or empties the
 * database and the port filter map entry. Runs before the caller copies the
 * rest of the header; on failure nothing changed.
 */
orr_Status SwSecConfigPortDb(SwSecContext *ctx, const SwSecConfig *config);
/*
 * Frees what a port database may still hold once it is empty: the hash
 * table parked by a reconfiguration. Called by the context's destruction
 * after the database was disabled.
 */
void SwSecPortDbDestroy(SwSecContext *ctx);

/* Record formats of SwSecQueryPortDb. */
enum SwSecQueryFormat : uint32_t {
   SWSEC_QUERY_VMI = 0,      /* whole SwSecVmi records */
   SWSEC_QUERY_ENTRY = 1,    /* 32-byte SwSecPortDbEntry records */
   SWSEC_QUERY_KEY = 2,      /* 12-byte SwSecVmiKey records */
};

/*
 * Writes one record of `format` per VMI whose method is in `methodMask`, in
 * list order, back to back at `out`, which has room for as many as the
 * matching counter says. configLock held, shared or exclusive.
 */
void SwSecQueryPortDb(SwSecContext *ctx, void *out, SwSecQueryFormat format, uint8_t methodMask);
