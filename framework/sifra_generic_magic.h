/*
 * Record magics: eight ASCII bytes read as one little-endian 64-bit value,
 * so that the record's first bytes in memory spell the text. A released
 * record carries the bitwise complement of its magic.
 */
#pragma once

#include "contract/state_blob.h"

#include <cstdint>

static_assert(__BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__,
              "magics are stored as little-endian 64-bit values");

constexpr uint64_t SifraGenericMagic(const char (&text)[9])
{
   uint64_t value = 0;
   for (unsigned i = 0; i < 8; i++) {
      value |= static_cast<uint64_t>(static_cast<uint8_t>(text[i])) << (8u * i);
   }
   return value;
}

constexpr uint64_t SIFRAGENERIC_AGENT_MAGIC = SifraGenericMagic("sifgfast");
constexpr uint64_t SIFRAGENERIC_FILTER_MAGIC = SifraGenericMagic("sifgfilt");
constexpr uint64_t SIFRAGENERIC_SLOWPATH_MAGIC = SifraGenericMagic("sifgslow");

static_assert(SIFRAGENERIC_AGENT_MAGIC == 0x7473616667666973ull);
static_assert(SIFRAGENERIC_FILTER_MAGIC == 0x746c696667666973ull);
static_assert(SIFRAGENERIC_SLOWPATH_MAGIC == 0x776f6c7367666973ull);
static_assert(SifraGenericMagic("sifgsave") == SIFRAGENERIC_STATE_MAGIC);
