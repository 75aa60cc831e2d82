/*
 * The saved-state blob of a filter, carried across a migration, and the
 * replies of the two slow path state requests.
 *
 * A blob is a 48-byte header followed by the agent's part and the slow
 * path's part. Every header field is an unsigned 64-bit little-endian
 * number. The writer lays the parts back to back right after the header;
 * the reader accepts any offsets that keep the parts inside the blob,
 * after the header and in order (gaps allowed, overlap not).
 */
#pragma once

#include "framework/sifra_generic_magic.h"
#include "platform/orr_sifra.h"

#include <cstddef>
#include <cstdint>

#define SIFRAGENERIC_STATE_VERSION 1u

struct SifraGenericStateHeader {
   uint64_t magic;            /* SIFRAGENERIC_STATE_MAGIC: the bytes "sifgsave" */
   uint64_t version;          /* SIFRAGENERIC_STATE_VERSION */
   uint64_t agentOffset;      /* from the blob's start; written as 48 */
   uint64_t agentLen;
   uint64_t slowPathOffset;   /* written as 48 + agentLen */
   uint64_t slowPathLen;      /* 0: no slow path part */
};

static_assert(sizeof(SifraGenericStateHeader) == 48);
static_assert(offsetof(SifraGenericStateHeader, magic) == 0);
static_assert(offsetof(SifraGenericStateHeader, version) == 8);
static_assert(offsetof(SifraGenericStateHeader, agentOffset) == 16);
static_assert(offsetof(SifraGenericStateHeader, agentLen) == 24);
static_assert(offsetof(SifraGenericStateHeader, slowPathOffset) == 32);
static_assert(offsetof(SifraGenericStateHeader, slowPathLen) == 40);

constexpr uint64_t SIFRAGENERIC_STATE_HEADER_LEN = sizeof(SifraGenericStateHeader);

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
