/* Number and address texts of management requests, read within a bound. */
#include "mgmt/swsec_nexo_text.h"

static bool SwSecNexoIsSpace(char c)
{
   return c == ' ' || c == '\t' || c == '\n' || c == '\v' || c == '\f' || c == '\r';
}

static int SwSecNexoDigitValue(char c)
{
   if (c >= '0' && c <= '9') {
      return c - '0';
   }
   if (c >= 'a' && c <= 'f') {
      return c - 'a' + 10;
   }
   if (c >= 'A' && c <= 'F') {
      return c - 'A' + 10;
   }
   return 99;
}

bool SwSecNexoParseU16(const char *text, uint16_t *value)
{
   size_t at = 0;
   while (at < SWSEC_NEXO_TEXT_MAX && SwSecNexoIsSpace(text[at])) {
      at++;
   }
   bool negative = false;
   if (at < SWSEC_NEXO_TEXT_MAX && (text[at] == '+' || text[at] == '-')) {
      negative = text[at] == '-';
      at++;
   }
   uint16_t number = 0;
   size_t digits = 0;
   while (at < SWSEC_NEXO_TEXT_MAX && text[at] >= '0' && text[at] <= '9') {
      number = static_cast<uint16_t>(number * 10u + static_cast<uint16_t>(text[at] - '0'));
      at++;
      digits++;
   }
   if (digits == 0) {
      return false;
   }
   *value = negative ? static_cast<uint16_t>(0u - number) : number;
   return true;
}

/*
 * One number of an address at `*at`: base from its prefix; false when no
 * digit follows or it passes 32 bits.
 */
static bool SwSecNexoParseAddressPart(const char *text, size_t *at, uint32_t *part)
{
   size_t pos = *at;
   uint32_t base = 10;
   if (pos < SWSEC_NEXO_TEXT_MAX && text[pos] == '0') {
      base = 8;
      pos++;
      if (pos < SWSEC_NEXO_TEXT_MAX && (text[pos] == 'x' || text[pos] == 'X')) {
         base = 16;
         pos++;
      }
   }
   const bool leadingZero = base != 10;
   uint64_t number = 0;
   size_t digits = 0;
   while (pos < SWSEC_NEXO_TEXT_MAX) {
      const int digit = SwSecNexoDigitValue(text[pos]);
      if (digit >= static_cast<int>(base)) {
         break;
      }
      number = number * base + static_cast<uint32_t>(digit);
      if (number > 0xffffffffu) {
         return false;
      }
      pos++;
      digits++;
   }
   /* "0" alone is a number; "0x" with no digit after it is not. */
   if (digits == 0 && (!leadingZero || base == 16)) {
      return false;
   }
   *part = static_cast<uint32_t>(number);
   *at = pos;
   return true;
}

bool SwSecNexoParseIpv4(const char *text, uint32_t *ipAddr)
{
   uint32_t parts[4] = {};
   size_t numParts = 0;
   size_t at = 0;
   for (;;) {
      if (at >= SWSEC_NEXO_TEXT_MAX || SwSecNexoDigitValue(text[at]) > 9) {
         return false;
      }
      if (!SwSecNexoParseAddressPart(text, &at, &parts[numParts])) {
         return false;
      }
      numParts++;
      if (at < SWSEC_NEXO_TEXT_MAX && text[at] == '.' && numParts < 4) {
         at++;
         continue;
      }
      break;
   }
   if (at >= SWSEC_NEXO_TEXT_MAX || (text[at] != '\0' && !SwSecNexoIsSpace(text[at]))) {
      return false;
   }
   /* Leading numbers are one byte each; the last fills what is left. */
   uint32_t host = 0;
   for (size_t i = 0; i + 1 < numParts; i++) {
      if (parts[i] > 0xffu) {
         return false;
      }
      host |= parts[i] << (24 - 8 * i);
   }
   const uint32_t last = parts[numParts - 1];
   const uint32_t lastMax = numParts == 1 ? 0xffffffffu : (0xffffffffu >> (8 * (numParts - 1)));
   if (last > lastMax) {
      return false;
   }
   host |= last;
   /* Network order: the first byte of the address first in memory. */
   auto *bytes = reinterpret_cast<uint8_t *>(ipAddr);
   bytes[0] = static_cast<uint8_t>(host >> 24);
   bytes[1] = static_cast<uint8_t>(host >> 16);
   bytes[2] = static_cast<uint8_t>(host >> 8);
   bytes[3] = static_cast<uint8_t>(host);
   return true;
}
