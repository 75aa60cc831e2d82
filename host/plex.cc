#include "host/plex.h"

#include "host/state.h"

#include <algorithm>
#include <cstring>
#include <limits>

// The record behind an orr_PlexClientPortHandle.
struct orr_PlexClientPortOpaque {};

namespace swsec::host {

struct PlexRegistry::Registration : orr_PlexClientPortOpaque {
   uint64_t seq = 0;
   std::string name;
   const orr_PlexClientPortOps *ops = nullptr;
   uint32_t writesRunning = 0;
   std::vector<std::thread::id> writers;
};

PlexRegistry::PlexRegistry(Violations &violations, FaultTable &faults) : violations_(violations), faults_(faults) {}

PlexRegistry::~PlexRegistry() = default;

orr_Status PlexRegistry::registerClientPort(orr_PlexClientPortHandle *handle, uint32_t flags, const char *name,
                                            const orr_PlexClientPortOps *ops)
{
   if (auto status = faults_.hit(faultPoint("orr_PlexClientPortRegister"))) {
      return *status;
   }
   // No flag is defined: anything else is a caller that expects a behaviour
   // this host does not have.
   if (handle == nullptr || name == nullptr || name[0] == '\0' || ops == nullptr || ops->write == nullptr ||
       flags != 0) {
      return ORR_BAD_PARAM;
   }
   auto registration = std::make_shared<Registration>();
   registration->name = name;
   registration->ops = ops;
   std::lock_guard guard(mutex_);
   for (const auto &[key, other] : registrations_) {
      if (other->name == registration->name) {
         return ORR_EXISTS;
      }
   }
   registration->seq = nextSeq_++;
   *handle = registration.get();
   registrations_.emplace(static_cast<const orr_PlexClientPortOpaque *>(registration.get()), std::move(registration));
   return ORR_OK;
}

orr_Status PlexRegistry::unregisterClientPort(orr_PlexClientPortHandle handle)
{
   if (auto status = faults_.hit(faultPoint("orr_PlexClientPortUnregister"))) {
      return *status;
   }
   if (handle == nullptr) {
      return ORR_INVALID_HANDLE;
   }
   std::unique_lock guard(mutex_);
   auto found = registrations_.find(handle);
   if (found == registrations_.end()) {
      // A stale handle: a real kernel would follow it into freed memory.
      guard.unlock();
      violations_.report("orr_PlexClientPortUnregister: unknown registration " + pointerText(handle));
      return ORR_INVALID_HANDLE;
   }
   auto registration = found->second;
   registrations_.erase(found);
   // The handler's code may go away once this returns: wait for writes in
   // progress, except one made by this very thread (a handler withdrawing
   // itself would otherwise wait for ever).
   idle_.wait(guard, [&] {
      return registration->writesRunning == 0 ||
             std::find(registration->writers.begin(), registration->writers.end(), std::this_thread::get_id()) !=
                registration->writers.end();
   });
   return ORR_OK;
}

std::vector<std::string> PlexRegistry::purge(std::string_view when)
{
   std::lock_guard guard(mutex_);
   std::vector<const Registration *> live;
   for (const auto &[key, registration] : registrations_) {
      live.push_back(registration.get());
   }
   std::sort(live.begin(), live.end(), [](const Registration *a, const Registration *b) { return a->seq < b->seq; });
   std::vector<std::string> problems;
   for (const Registration *registration : live) {
      problems.push_back(std::string(when) + ": Plex client port '" + registration->name + "' is still registered");
   }
   registrations_.clear();
   return problems;
}

std::vector<std::string> PlexRegistry::clientPorts() const
{
   std::lock_guard guard(mutex_);
   std::vector<std::pair<uint64_t, std::string>> ordered;
   for (const auto &[key, registration] : registrations_) {
      ordered.emplace_back(registration->seq, registration->name);
   }
   std::sort(ordered.begin(), ordered.end());
   std::vector<std::string> names;
   for (auto &[seq, name] : ordered) {
      names.push_back(std::move(name));
   }
   return names;
}

orr_Status PlexRegistry::write(std::string_view clientPort, std::string_view bytes)
{
   if (bytes.size() > static_cast<size_t>(std::numeric_limits<int32_t>::max())) {
      return ORR_BAD_PARAM;
   }
   std::shared_ptr<Registration> registration;
   {
      std::lock_guard guard(mutex_);
      auto found = std::find_if(registrations_.begin(), registrations_.end(),
                                [&](const auto &entry) { return entry.second->name == clientPort; });
      if (found == registrations_.end()) {
         return ORR_NOT_FOUND;
      }
      registration = found->second;
      ++registration->writesRunning;
      registration->writers.push_back(std::this_thread::get_id());
   }
   // The handler gets a buffer of exactly the written length, with no
   // terminating zero after it, so that a read past the count is caught by
   // the address sanitizer instead of finding a convenient zero.
   const auto count = static_cast<int32_t>(bytes.size());
   auto copy = std::make_unique<char[]>(bytes.size());
   std::memcpy(copy.get(), bytes.data(), bytes.size());
   orr_Status status = registration->ops->write(nullptr, nullptr, nullptr, copy.get(), count);
   {
      std::lock_guard guard(mutex_);
      --registration->writesRunning;
      auto writer = std::find(registration->writers.begin(), registration->writers.end(), std::this_thread::get_id());
      registration->writers.erase(writer);
   }
   idle_.notify_all();
   return status;
}

}  // namespace swsec::host

using swsec::host::detail::requireState;

ORR_API orr_Status orr_PlexClientPortRegister(orr_PlexClientPortHandle *handle, uint32_t flags, const char *name,
                                              const orr_PlexClientPortOps *ops)
{
   return requireState("orr_PlexClientPortRegister").plex.registerClientPort(handle, flags, name, ops);
}

ORR_API orr_Status orr_PlexClientPortUnregister(orr_PlexClientPortHandle handle)
{
   return requireState("orr_PlexClientPortUnregister").plex.unregisterClientPort(handle);
}
