/* Text and memory helpers of the host kernel. */
#pragma once

#include "platform/orr_base.h"

#include <cstdarg>

ORR_API char *orr_Strchr(const char *text, int c);
ORR_API char *orr_Strncpy(char *dst, const char *src, size_t n);
ORR_API int orr_Strncmp(const char *a, const char *b, size_t n);
ORR_API size_t orr_Strnlen(const char *text, size_t n);
ORR_API void *orr_Memcpy(void *dst, const void *src, size_t n);
ORR_API void *orr_Memset(void *dst, int c, size_t n);
ORR_API int orr_Memcmp(const void *a, const void *b, size_t n);
/* vsnprintf into `buffer`; returns the number of characters written. */
ORR_API int orr_Sprintf(char *buffer, size_t size, const char *format, ...) ORR_PRINTF(3, 4);
/* Formats into `buffer` of `size` bytes; `flags` is 0. */
ORR_API orr_Status orr_StringFormat(char *buffer, size_t size, uint32_t flags,
                                    const char *format, ...) ORR_PRINTF(4, 5);

/*
 * Parses a MAC address "xx:xx:xx:xx:xx:xx" (one or two hex digits a group)
 * into 6 bytes. ORR_BAD_PARAM for any other text.
 */
ORR_API orr_Status Net_StrToMac(const char *text, uint8_t *mac);
