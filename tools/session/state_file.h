// Saved-state files: a module's saved-state blob, stored as the bytes the
// framework produced, read back bounded and written whole or not at all.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <span>
#include <stdexcept>
#include <string>
#include <vector>

namespace swsec::session {

// A state file that cannot be read or written: `what()` names the file
// and the problem on one line.
class StateFileError : public std::runtime_error {
public:
   using std::runtime_error::runtime_error;
};

// The largest file taken as a saved state: the agent's part is under 10 KiB;
// the rest leaves room for a slow path's part.
inline constexpr uint64_t kMaxStateFileBytes = uint64_t{16} << 20;

// Reads the whole file; refuses one larger than kMaxStateFileBytes before
// reading it.
std::vector<uint8_t> readStateFile(const std::string &path);

// Writes `bytes` to a temporary file beside `path` (with `mode` less the
// umask), syncs it and renames it over `path`; on any failure no file is left.
void writeStateFile(const std::string &path, std::span<const uint8_t> bytes, mode_t mode = 0666);

}  // namespace swsec::session
