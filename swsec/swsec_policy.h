/* The per-packet security policy and the rate limiter it counts against. */
#pragma once

#include "swsec/swsec_context.h"
#include "swsec/swsec_pkt_info.h"

/*
 * Judges one frame under configLock (normally shared). On ORR_OK `*verdict`
 * is set; any other status comes from IP discovery (ORR_BUSY: judge the
 * frame again under the exclusive lock).
 */
orr_Status SwSecProcessPkt(SwSecContext *ctx, orr_Pkt *pkt, SwSecPktInfo *info,
                           uint32_t direction, uint32_t *verdict);

/* Counts one event; true when the current interval's limit is exceeded. */
bool SifraGenericRateLimitReached(SifraGenericRateLimit *rateLimit);
/* Restarts a limiter: one-second interval, already ended, count 0. */
void SifraGenericRateLimitInit(SifraGenericRateLimit *rateLimit, uint32_t limit);
