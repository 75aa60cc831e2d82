// Helpers of the saved-state decoders: records copied out of a blob, and
// the numbers in the messages that refuse one.
#pragma once

#include <cstdint>
#include <cstring>
#include <string>
#include <type_traits>

namespace swsec::session {

// A record copied out of bytes already checked to hold it.
template <typename Record>
Record recordAt(const uint8_t *bytes)
{
   static_assert(std::is_trivially_copyable_v<Record>);
   Record record;
   std::memcpy(&record, bytes, sizeof record);
   return record;
}

inline std::string number(uint64_t value)
{
   return std::to_string(value);
}

}  // namespace swsec::session
