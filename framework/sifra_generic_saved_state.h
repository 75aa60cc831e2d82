/*
 * The replies of the two slow path state requests. The blob the saved
 * state travels in is contract/state_blob.h.
 */
#pragma once

#include "contract/state_blob.h"
#include "platform/orr_sifra.h"

#include <cstdint>

/*
 * The host's reply to orr_SifraRetrieveSlowPathState: the slow path's
 * state (the host's bytes, copied here) or a failure. Takes the filter
 * lock; drops the reference the request took, on every path.
 */
void SifraGenericRetrieveSlowPathReply(orr_SifraFilter filter, void *cookie, const void *state,
                                       uint64_t length, orr_Status status);

/*
 * The host's reply to orr_SifraRestoreSlowPathState. Takes the filter
 * lock; drops the reference the request took, on every path.
 */
void SifraGenericRestoreSlowPathReply(orr_SifraFilter filter, void *cookie, orr_Status status);
