// Bounded JSON nesting and dumping that cannot throw on bad UTF-8.
#include "session/json_text.h"

namespace swsec::session {

size_t jsonDepth(std::string_view text, size_t limit)
{
   size_t depth = 0;
   size_t deepest = 0;
   bool inString = false;
   bool escaped = false;
   for (const char c : text) {
      if (inString) {
         if (escaped) {
            escaped = false;
         } else if (c == '\\') {
            escaped = true;
         } else if (c == '"') {
            inString = false;
         }
         continue;
      }
      if (c == '"') {
         inString = true;
      } else if (c == '[' || c == '{') {
         deepest = std::max(deepest, ++depth);
         if (deepest > limit) {
            return deepest;
         }
      } else if ((c == ']' || c == '}') && depth > 0) {
         --depth;
      }
   }
   return deepest;
}

std::string jsonText(const nlohmann::json &value, int indent)
{
   return value.dump(indent, ' ', false, nlohmann::json::error_handler_t::replace);
}

}  // namespace swsec::session
