// JSON from and to text where the text comes from outside: nesting is
// bounded before anything is built, and dumping never throws on bytes that
// are not UTF-8 (they become U+FFFD), so that a port name or a message
// quoting a bad file cannot take down whoever prints it.
#pragma once

#include <nlohmann/json.hpp>

#include <cstddef>
#include <string>
#include <string_view>

namespace swsec::session {

// Deep enough for any configuration or request; shallow enough that every
// recursive walk over the document (dump, compare, describe) stays small.
inline constexpr size_t kMaxJsonDepth = 64;

// The deepest nesting of arrays and objects in `text`, strings skipped;
// counting stops once it passes `limit`.
size_t jsonDepth(std::string_view text, size_t limit = kMaxJsonDepth);

// The value as one line (or indented by `indent`), invalid UTF-8 replaced.
std::string jsonText(const nlohmann::json &value, int indent = -1);

}  // namespace swsec::session
