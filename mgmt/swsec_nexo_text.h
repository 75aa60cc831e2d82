/*
 * Bounded parsers for the texts of management requests. The module links
 * no C library beyond its memory and string functions, so these stand in
 * for sscanf("%hu") and inet_aton with the same acceptance rules; each reads
 * at most SWSEC_NEXO_TEXT_MAX bytes of its text.
 */
#pragma once

#include <cstddef>
#include <cstdint>

constexpr size_t SWSEC_NEXO_TEXT_MAX = 64;

/*
 * As sscanf(text, "%hu", value) == 1: leading white space, an optional
 * sign, at least one decimal digit; the rest of the text is ignored. The
 * number is taken modulo 2^16 (negated for '-'), as the C library does.
 */
bool SwSecNexoParseU16(const char *text, uint16_t *value);

/*
 * As inet_aton(text, addr) != 0: one to four numbers separated by dots,
 * each decimal, octal (leading 0) or hexadecimal (0x); the last number
 * fills the bytes left over; white space may end the text. `*ipAddr` is
 * in network order.
 */
bool SwSecNexoParseIpv4(const char *text, uint32_t *ipAddr);
