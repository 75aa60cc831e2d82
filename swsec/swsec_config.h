/*
 * Applying a port's security configuration, switching it off, and the
 * port's periodic timer.
 */
#pragma once

#include "swsec/swsec_context.h"

/*
 * Checks a header's feature combination and ARP rate limits; logs a
 * refusal. Reads nothing but the header.
 */
bool SwSecConfigIsValid(const SwSecContext *ctx, const SwSecConfig *config);

/* Checks a frame guard block (the length of its list); logs a refusal. */
bool SwSecFrameGuardIsValid(const SwSecContext *ctx, const SwSecFrameGuard *guard);

/*
 * The frame guard block of a whole record: after the static entries in
 * version 2; the defaults (all zero) for a record without one.
 */
SwSecFrameGuard SwSecConfigFrameGuard(const SwSecConfig *config);

/*
 * Validates and applies a configuration record (header, its numStatic
 * static entries and, in version 2, the frame guard block, all readable). ORR_BAD_PARAM for an invalid combination
 * or range, or the port database's refusal; on any failure the active
 * configuration, database, limiters and counters are as they were. An
 * accepted record clears the drop counters. configLock held exclusive.
 */
orr_Status SwSecConfigFeatures(SwSecContext *ctx, const SwSecConfig *config);

/*
 * Switches every feature off (the port database is emptied and the port
 * leaves the port filter map). ORR_BUSY while a reader holds the port's
 * map entry; the features then stay on. configLock held exclusive.
 */
orr_Status SwSecClearFeatures(SwSecContext *ctx);

/* The port timer's callback (every 10 s, argument the context); takes configLock itself. */
void SwSecTimerCb(void *ctx);

/* Ends the error-rate-limit state once its period is over. configLock held exclusive. */
void SwSecArpRateLimitTimerCb(SwSecContext *ctx);
