// Text, memory and name helpers, and status texts. These touch no host
// state, so they work with or without a Host (module objects linked into
// unit tests use them too); only orr_StringFormat, a fault point, needs one.
#include "host/state.h"

#include <algorithm>
#include <cstdarg>
#include <cstdio>
#include <cstring>

ORR_API const char *orr_StatusToString(orr_Status status)
{
   switch (status) {
#define ORR_STATUS_TEXT(name, value, text) \
   case name:                              \
      return text;
      ORR_STATUS_LIST(ORR_STATUS_TEXT)
#undef ORR_STATUS_TEXT
   }
   return "Unknown status";
}

ORR_API void orr_NameInitialize(orr_Name *name, const char *text)
{
   std::memset(name->name, 0, sizeof name->name);
   if (text != nullptr) {
      std::memcpy(name->name, text, strnlen(text, sizeof name->name - 1));
   }
}

ORR_API void orr_NameCopy(orr_Name *dst, const orr_Name *src)
{
   std::memcpy(dst->name, src->name, sizeof dst->name);
   dst->name[sizeof dst->name - 1] = '\0';
}

ORR_API char *orr_Strchr(const char *text, int c)
{
   return const_cast<char *>(std::strchr(text, c));
}

ORR_API char *orr_Strncpy(char *dst, const char *src, size_t n)
{
   return std::strncpy(dst, src, n);
}

ORR_API int orr_Strncmp(const char *a, const char *b, size_t n)
{
   return std::strncmp(a, b, n);
}

ORR_API size_t orr_Strnlen(const char *text, size_t n)
{
   return strnlen(text, n);
}

ORR_API void *orr_Memcpy(void *dst, const void *src, size_t n)
{
   return std::memcpy(dst, src, n);
}

ORR_API void *orr_Memset(void *dst, int c, size_t n)
{
   return std::memset(dst, c, n);
}

ORR_API int orr_Memcmp(const void *a, const void *b, size_t n)
{
   return std::memcmp(a, b, n);
}

ORR_API int orr_Sprintf(char *buffer, size_t size, const char *format, ...)
{
   va_list args;
   va_start(args, format);
   const int wanted = std::vsnprintf(buffer, size, format, args);
   va_end(args);
   if (wanted < 0) {
      if (size != 0) {
         buffer[0] = '\0';
      }
      return 0;
   }
   // What was written, not what would have been: callers advance through
   // their buffer by the result.
   const size_t written = std::min(static_cast<size_t>(wanted), size == 0 ? 0 : size - 1);
   return static_cast<int>(written);
}

ORR_API orr_Status orr_StringFormat(char *buffer, size_t size, uint32_t flags, const char *format, ...)
{
   auto &state = swsec::host::detail::requireState("orr_StringFormat");
   if (auto status = state.faults.hit(swsec::host::faultPoint("orr_StringFormat"))) {
      return *status;
   }
   if (buffer == nullptr || size == 0 || flags != 0 || format == nullptr) {
      return ORR_BAD_PARAM;
   }
   va_list args;
   va_start(args, format);
   const int wanted = std::vsnprintf(buffer, size, format, args);
   va_end(args);
   if (wanted < 0) {
      buffer[0] = '\0';
      return ORR_FAILURE;
   }
   // The text is cut to fit and terminated either way; a cut is reported so
   // that the caller does not pass on a truncated name as a whole one.
   return static_cast<size_t>(wanted) < size ? ORR_OK : ORR_BUFFER_TOO_SMALL;
}
