/* Reading multi-byte fields of frames and records at any alignment. */
#pragma once

#include <cstdint>

static_assert(__BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__, "the host's byte order is little-endian");

/* A 16-bit field in network order, as a number. */
static inline uint16_t SwSecLoadBe16(const uint8_t *bytes)
{
   return static_cast<uint16_t>(bytes[0] << 8 | bytes[1]);
}

/* A u16 that was loaded from network-order bytes as it lay in memory, as a number. */
static inline uint16_t SwSecNetToHost16(uint16_t raw)
{
   return __builtin_bswap16(raw);
}

/* Four bytes as a u32 in memory order (an IPv4 address stays in network order). */
static inline uint32_t SwSecLoadRaw32(const uint8_t *bytes)
{
   uint32_t value;
   __builtin_memcpy(&value, bytes, sizeof(value));
   return value;
}

/* A u32 in the host's byte order at any alignment. */
static inline uint32_t SwSecLoadHost32(const uint8_t *bytes)
{
   return SwSecLoadRaw32(bytes);
}

static inline void SwSecStoreHost32(uint8_t *bytes, uint32_t value)
{
   __builtin_memcpy(bytes, &value, sizeof(value));
}

/* Two MAC addresses compared as a u32 and a u16: no call on the frame path. */
static inline bool SwSecSameMac(const uint8_t *a, const uint8_t *b)
{
   uint16_t aTail;
   uint16_t bTail;
   __builtin_memcpy(&aTail, a + 4, sizeof(aTail));
   __builtin_memcpy(&bTail, b + 4, sizeof(bTail));
   return ((SwSecLoadRaw32(a) ^ SwSecLoadRaw32(b)) | static_cast<uint32_t>(aTail ^ bTail)) == 0;
}
