// Reading and writing saved-state files.
#include "session/state_file.h"

#include "session/atomic_file.h"
#include "session/whole_file.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace swsec::session {

namespace {

constexpr char kEnvelopeMagic[] = "swsecenv";

std::string systemError()
{
   return std::strerror(errno);
}

}  // namespace

std::vector<uint8_t> readStateFile(const std::string &path)
{
   // Non-blocking so that a FIFO does not wait for a writer before the
   // reader refuses it.
   const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOFOLLOW);
   if (fd < 0 && errno == ELOOP) {
      throw StateFileError(path + ": a symbolic link, not a saved state");
   }
   if (fd < 0) {
      throw StateFileError(path + ": cannot read: " + systemError());
   }
   std::vector<uint8_t> bytes;
   if (const auto refusal = readWholeFile(fd, path, kMaxStateFileBytes, "a saved state", bytes)) {
      throw StateFileError(*refusal);
   }
   return bytes;
}

std::vector<uint8_t> wrapState(std::span<const uint8_t> blob, int64_t savedAtUs)
{
   StateEnvelope envelope{};
   std::memcpy(envelope.magic, kEnvelopeMagic, sizeof envelope.magic);
   envelope.version = kStateEnvelopeVersion;
   envelope.headerLen = sizeof envelope;
   envelope.savedAtUs = savedAtUs;
   envelope.blobLen = blob.size();
   std::vector<uint8_t> bytes(sizeof envelope + blob.size());
   std::memcpy(bytes.data(), &envelope, sizeof envelope);
   std::copy(blob.begin(), blob.end(), bytes.begin() + sizeof envelope);
   return bytes;
}

StoredState unwrapState(std::vector<uint8_t> bytes, const std::string &path)
{
   if (bytes.size() < sizeof kEnvelopeMagic - 1 || std::memcmp(bytes.data(), kEnvelopeMagic, 8) != 0) {
      return {std::move(bytes), std::nullopt};
   }
   StateEnvelope envelope{};
   if (bytes.size() < sizeof envelope) {
      throw StateFileError(path + ": saved state refused: the envelope is cut short (" + std::to_string(bytes.size()) + " bytes)");
   }
   std::memcpy(&envelope, bytes.data(), sizeof envelope);
   if (envelope.version != kStateEnvelopeVersion || envelope.headerLen != sizeof envelope) {
      throw StateFileError(path + ": saved state refused: envelope version " + std::to_string(envelope.version) +
                           " (this tool reads version " + std::to_string(kStateEnvelopeVersion) + ")");
   }
   if (envelope.blobLen != bytes.size() - sizeof envelope) {
      throw StateFileError(path + ": saved state refused: the envelope announces " + std::to_string(envelope.blobLen) +
                           " bytes of saved state and holds " + std::to_string(bytes.size() - sizeof envelope));
   }
   bytes.erase(bytes.begin(), bytes.begin() + sizeof envelope);
   const int64_t savedAtUs = envelope.savedAtUs;
   return {std::move(bytes), savedAtUs};
}

StoredState readStoredState(const std::string &path)
{
   StoredState stored = unwrapState(readStateFile(path), path);
   // An empty blob would be taken as "nothing to restore"; a state file has one.
   if (stored.blob.empty()) {
      throw StateFileError(path + ": empty file, no saved state");
   }
   return stored;
}

void writeStateFile(const std::string &path, std::span<const uint8_t> bytes, mode_t mode)
{
   AtomicFile file(path, mode & ~currentUmask());
   file.write(bytes);
   file.commit();
}

}  // namespace swsec::session
