// Saved-state files: a module's saved-state blob, stored as the bytes the
// framework produced, read back bounded and written whole or not at all.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <optional>
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
// reading it, and anything but a regular file (a FIFO, a device, a
// symbolic link) without waiting on it.
std::vector<uint8_t> readStateFile(const std::string &path);

// The daemon's state files carry the blob in an envelope that says when
// it was saved, so that a restore can count the time since. Packed,
// little-endian; the blob follows.
struct __attribute__((packed)) StateEnvelope {
   char magic[8];          // "swsecenv"
   uint32_t version;       // kStateEnvelopeVersion
   uint32_t headerLen;     // sizeof(StateEnvelope): a later version may grow it
   int64_t savedAtUs;      // wall clock of the save, microseconds since 1970
   uint64_t blobLen;       // the bytes after the header, all of them
};
static_assert(sizeof(StateEnvelope) == 32);
static_assert(offsetof(StateEnvelope, version) == 8);
static_assert(offsetof(StateEnvelope, headerLen) == 12);
static_assert(offsetof(StateEnvelope, savedAtUs) == 16);
static_assert(offsetof(StateEnvelope, blobLen) == 24);
inline constexpr uint32_t kStateEnvelopeVersion = 1;

struct StoredState {
   std::vector<uint8_t> blob;            // the module's saved state
   std::optional<int64_t> savedAtUs;     // none: a bare blob (swsec replay --save-state)
};

std::vector<uint8_t> wrapState(std::span<const uint8_t> blob, int64_t savedAtUs);
// A file's bytes, enveloped or a bare blob; throws StateFileError naming
// `path` for an envelope that is not whole or of another version.
StoredState unwrapState(std::vector<uint8_t> bytes, const std::string &path);
// readStateFile, then unwrapState; an empty blob is refused.
StoredState readStoredState(const std::string &path);

// Writes `bytes` whole or not at all (AtomicFile: a symbolic link at `path`
// is replaced, not followed), with `mode` less the umask; throws InputError.
void writeStateFile(const std::string &path, std::span<const uint8_t> bytes, mode_t mode = 0666);

}  // namespace swsec::session
