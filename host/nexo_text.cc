// Text parsing the module asks of the host for management requests.
#include "host/state.h"

#include <cctype>
#include <cstring>

ORR_API orr_Status Net_StrToMac(const char *text, uint8_t *mac)
{
   if (auto status = swsec::host::detail::requireState("Net_StrToMac").faults.hit(swsec::host::faultPoint("Net_StrToMac"))) {
      return *status;
   }
   if (text == nullptr || mac == nullptr) {
      return ORR_BAD_PARAM;
   }
   // Six groups of one or two hex digits, separated by ':', nothing after.
   uint8_t bytes[6] = {};
   const char *at = text;
   for (size_t group = 0; group < 6; ++group) {
      if (group > 0) {
         if (*at != ':') {
            return ORR_BAD_PARAM;
         }
         ++at;
      }
      unsigned value = 0;
      size_t digits = 0;
      while (digits < 2 && std::isxdigit(static_cast<unsigned char>(*at))) {
         const char c = static_cast<char>(std::tolower(static_cast<unsigned char>(*at)));
         value = value * 16 + static_cast<unsigned>(c <= '9' ? c - '0' : c - 'a' + 10);
         ++digits;
         ++at;
      }
      if (digits == 0) {
         return ORR_BAD_PARAM;
      }
      bytes[group] = static_cast<uint8_t>(value);
   }
   if (*at != '\0') {
      return ORR_BAD_PARAM;
   }
   std::memcpy(mac, bytes, sizeof bytes);
   return ORR_OK;
}
