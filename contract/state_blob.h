/*
 * The saved-state blob of a filter, carried across a migration: a 48-byte
 * header followed by the agent's part and the slow path's part. Every
 * header field is an unsigned 64-bit little-endian number. The writer lays
 * the parts back to back right after the header; the reader accepts any
 * offsets that keep the parts inside the blob, after the header and in
 * order (gaps allowed, overlap not).
 *
 * Wire contract: freestanding, shared by the module and the tools.
 */
#pragma once

#include <cstddef>
#include <cstdint>

static_assert(__BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__, "saved states are little-endian");

#define SIFRAGENERIC_STATE_VERSION 1u

/* The bytes "sifgsave" read as one little-endian 64-bit value. */
constexpr uint64_t SIFRAGENERIC_STATE_MAGIC = 0x6576617367666973ull;

struct SifraGenericStateHeader {
   uint64_t magic;            /* SIFRAGENERIC_STATE_MAGIC */
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
