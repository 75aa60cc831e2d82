// Migrations as the hypervisor drives them: the module's saved-state
// operations called with guarded buffers, and the two slow path state
// requests the module makes, answered by scripted outcomes whose replies
// are delivered when the test chooses.
#pragma once

#include "host/faults.h"
#include "host/host.h"
#include "host/locks.h"
#include "host/sifra_registry.h"
#include "host/violations.h"

#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

namespace swsec::host {

// An exact-size buffer between guard bytes. The guards are poisoned for
// AddressSanitizer (a read outside is caught there) and hold a pattern
// that check() compares (a write outside is reported in every build).
class GuardedBuffer {
public:
   explicit GuardedBuffer(size_t size);
   ~GuardedBuffer();
   GuardedBuffer(const GuardedBuffer &) = delete;
   GuardedBuffer &operator=(const GuardedBuffer &) = delete;

   uint8_t *data() { return storage_.get() + kGuard; }
   const uint8_t *data() const { return storage_.get() + kGuard; }
   size_t size() const { return size_; }
   bool contains(const void *begin, uint64_t length) const;
   // Nothing when both guards are intact; else what was overwritten.
   std::optional<std::string> check() const;

private:
   static constexpr size_t kGuard = 64;
   static constexpr uint8_t kPattern = 0xfd;
   size_t size_;
   std::unique_ptr<uint8_t[]> storage_;
};

class MigrationService final : public Migration {
public:
   MigrationService(Violations &violations, FaultTable &faults, LockRegistry &locks, SifraRegistry &sifra);
   ~MigrationService() override;

   // Platform operations.
   orr_Status retrieveSlowPathState(orr_SifraFilterHandle handle, orr_SifraRetrieveSlowPathStateReply reply,
                                    void *cookie, uint32_t timeoutMs);
   orr_Status restoreSlowPathState(orr_SifraFilterHandle handle, const void *state, uint64_t length,
                                   orr_SifraRestoreSlowPathStateReply reply, void *cookie, uint32_t timeoutMs);

   // Reports and drops replies still owed.
   std::vector<std::string> purge(std::string_view when);

   // Migration
   void prefetch(FilterId id) override;
   orr_Status length(FilterId id, uint64_t *length) override;
   orr_Status save(FilterId id, uint64_t bufferSize, std::vector<uint8_t> *blob) override;
   orr_Status restore(FilterId id, std::span<const uint8_t> blob) override;
   orr_Status saveAsHypervisor(FilterId id, std::vector<uint8_t> *blob, uint32_t maxPolls) override;
   void scriptRetrieve(SlowPathStateOutcome outcome) override;
   void scriptRestore(SlowPathStateOutcome outcome) override;
   std::vector<SlowPathStateRequest> requests() const override;
   size_t pendingReplies() const override;
   size_t deliverReplies(size_t count) override;

private:
   struct PendingReply {
      size_t request = 0;                            // index into requests_
      orr_SifraRetrieveSlowPathStateReply retrieveReply = nullptr;
      orr_SifraRestoreSlowPathStateReply restoreReply = nullptr;
      orr_Status status = ORR_OK;
      std::vector<uint8_t> state;                    // retrieve replies
      std::shared_ptr<GuardedBuffer> blob;           // restore: the blob kept alive until the reply
   };

   SifraRegistry::ModuleFilter requireFilter(FilterId id, const char *op) const;
   // Checks the request's context and takes the next scripted outcome;
   // nothing when the request is refused (its status in `refusal`).
   std::optional<FilterId> beginRequest(const char *op, orr_SifraFilterHandle handle);
   void checkGuards(const GuardedBuffer &buffer, const std::string &what);

   Violations &violations_;
   FaultTable &faults_;
   LockRegistry &locks_;
   SifraRegistry &sifra_;

   mutable std::mutex mutex_;
   std::deque<SlowPathStateOutcome> retrieveScript_;
   std::deque<SlowPathStateOutcome> restoreScript_;
   std::vector<SlowPathStateRequest> requests_;
   std::deque<PendingReply> pending_;
   // The blob of the restore call in progress, handed on to its reply.
   std::shared_ptr<GuardedBuffer> restoring_;
};

}  // namespace swsec::host
