#include "host/sifra_registry.h"

#include "host/sifra_records.h"

#include "host/state.h"

#include <algorithm>
#include <memory>
#include <stdexcept>
#include <string>

namespace swsec::host {

struct SifraRegistry::Property : orr_SifraPropertyOpaque {
   uint64_t seq = 0;
   std::string name;
   const orr_SifraPropertyOps *ops = nullptr;
};

namespace {

template <typename Record>
std::vector<const Record *> inOrder(const auto &records)
{
   std::vector<const Record *> ordered;
   for (const auto &[key, record] : records) {
      ordered.push_back(record.get());
   }
   std::sort(ordered.begin(), ordered.end(), [](const Record *a, const Record *b) { return a->seq < b->seq; });
   return ordered;
}

}  // namespace

SifraRegistry::SifraRegistry(Violations &violations, FaultTable &faults, LockRegistry &locks,
                             PortsetService &portsets, FrameStore &frames, TimerService &timers)
   : violations_(violations), faults_(faults), portsets_(portsets), frames_(frames), timers_(timers),
     slowPaths_(*this, violations, faults, locks)
{
}

SifraRegistry::~SifraRegistry() = default;

orr_Status SifraRegistry::registerFastPath(const char *name, uint32_t revision, uint32_t compatRevision,
                                           orr_ModuleID module, const orr_SifraFastPathOps *ops,
                                           orr_SifraAgentHandle agent, orr_SifraFastPath *fastPath)
{
   if (auto status = faults_.hit(faultPoint("orr_SifraRegisterFastPath"))) {
      return *status;
   }
   if (name == nullptr || name[0] == '\0' || ops == nullptr || fastPath == nullptr) {
      return ORR_BAD_PARAM;
   }
   // The host speaks its own revision; a fast path that needs a newer one
   // (its compatible revision is above ours) cannot be served.
   if (compatRevision > ORR_SIFRA_FASTPATH_REVISION || revision < compatRevision) {
      return ORR_NOT_SUPPORTED;
   }
   auto record = std::make_unique<FastPath>();
   record->info = FastPathInfo{name, revision, compatRevision, module, ops, agent};
   std::lock_guard guard(mutex_);
   for (const auto &[key, other] : fastPaths_) {
      if (other->info.name == record->info.name) {
         return ORR_EXISTS;
      }
   }
   record->seq = nextSeq_++;
   *fastPath = record.get();
   fastPaths_.emplace(static_cast<const orr_SifraFastPathOpaque *>(record.get()), std::move(record));
   return ORR_OK;
}

void SifraRegistry::unregisterFastPath(orr_SifraFastPath fastPath)
{
   const FastPath *known = nullptr;
   {
      std::lock_guard guard(mutex_);
      auto found = fastPaths_.find(fastPath);
      if (found != fastPaths_.end()) {
         known = found->second.get();
      }
   }
   if (known != nullptr) {
      // The module relies on its filters and slow paths being gone when
      // this returns.
      destroyFiltersOf(known);
      slowPaths_.withdrawAllOf(known);
      std::lock_guard guard(mutex_);
      fastPaths_.erase(fastPath);
      return;
   }
   violations_.report("orr_SifraUnregisterFastPath: unknown fast path " + pointerText(fastPath));
}

orr_Status SifraRegistry::registerProperty(orr_SifraPropertyHandle *handle, const char *name,
                                           const orr_SifraPropertyOps *ops)
{
   if (auto status = faults_.hit(faultPoint("orr_SifraPropertyRegister"))) {
      return *status;
   }
   if (handle == nullptr || name == nullptr || name[0] == '\0' || ops == nullptr) {
      return ORR_BAD_PARAM;
   }
   auto record = std::make_unique<Property>();
   record->name = name;
   record->ops = ops;
   std::lock_guard guard(mutex_);
   for (const auto &[key, other] : properties_) {
      if (other->name == record->name) {
         return ORR_EXISTS;
      }
   }
   record->seq = nextSeq_++;
   *handle = record.get();
   properties_.emplace(static_cast<const orr_SifraPropertyOpaque *>(record.get()), std::move(record));
   return ORR_OK;
}

void SifraRegistry::unregisterProperty(orr_SifraPropertyHandle handle)
{
   {
      std::lock_guard guard(mutex_);
      if (properties_.erase(handle) != 0) {
         return;
      }
   }
   violations_.report("orr_SifraPropertyUnregister: unknown property " + pointerText(handle));
}

std::vector<std::string> SifraRegistry::purge(std::string_view when)
{
   std::vector<std::string> problems = slowPaths_.purge(when);
   std::lock_guard guard(mutex_);
   for (const FastPath *fastPath : inOrder<FastPath>(fastPaths_)) {
      problems.push_back(std::string(when) + ": Sifra fast path '" + fastPath->info.name + "' is still registered");
   }
   for (const Property *property : inOrder<Property>(properties_)) {
      problems.push_back(std::string(when) + ": Sifra property '" + property->name + "' is still registered");
   }
   fastPaths_.clear();
   properties_.clear();
   return problems;
}

std::vector<FastPathInfo> SifraRegistry::fastPaths() const
{
   std::lock_guard guard(mutex_);
   std::vector<FastPathInfo> result;
   for (const FastPath *fastPath : inOrder<FastPath>(fastPaths_)) {
      result.push_back(fastPath->info);
   }
   return result;
}

std::optional<FastPathInfo> SifraRegistry::fastPath(std::string_view name) const
{
   std::lock_guard guard(mutex_);
   for (const auto &[key, fastPath] : fastPaths_) {
      if (fastPath->info.name == name) {
         return fastPath->info;
      }
   }
   return std::nullopt;
}

std::optional<SifraRegistry::FastPathRef> SifraRegistry::fastPathRef(std::string_view name) const
{
   std::lock_guard guard(mutex_);
   for (const auto &[key, fastPath] : fastPaths_) {
      if (fastPath->info.name == name) {
         return FastPathRef{fastPath.get(), fastPath->info};
      }
   }
   return std::nullopt;
}

std::vector<std::string> SifraRegistry::properties() const
{
   std::lock_guard guard(mutex_);
   std::vector<std::string> result;
   for (const Property *property : inOrder<Property>(properties_)) {
      result.push_back(property->name);
   }
   return result;
}

}  // namespace swsec::host

using swsec::host::detail::requireState;

ORR_API orr_Status orr_SifraRegisterFastPath(const char *name, uint32_t revision, uint32_t compatRevision,
                                             orr_ModuleID module, const orr_SifraFastPathOps *ops,
                                             orr_SifraAgentHandle agent, orr_SifraFastPath *fastPath)
{
   return requireState("orr_SifraRegisterFastPath")
      .sifra.registerFastPath(name, revision, compatRevision, module, ops, agent, fastPath);
}

ORR_API void orr_SifraUnregisterFastPath(orr_SifraFastPath fastPath)
{
   requireState("orr_SifraUnregisterFastPath").sifra.unregisterFastPath(fastPath);
}

ORR_API orr_Status orr_SifraPropertyRegister(orr_SifraPropertyHandle *handle, const char *name,
                                             const orr_SifraPropertyOps *ops)
{
   return requireState("orr_SifraPropertyRegister").sifra.registerProperty(handle, name, ops);
}

ORR_API void orr_SifraPropertyUnregister(orr_SifraPropertyHandle handle)
{
   requireState("orr_SifraPropertyUnregister").sifra.unregisterProperty(handle);
}

namespace swsec::host {

std::optional<SifraRegistry::PropertyCall> SifraRegistry::propertyCallOf(std::string_view property,
                                                                       std::optional<FilterId> filter) const
{
   PropertyCall call;
   {
      std::lock_guard guard(mutex_);
      for (const auto &[key, record] : properties_) {
         if (record->name == property) {
            call.ops = record->ops;
         }
      }
   }
   if (call.ops == nullptr) {
      return std::nullopt;
   }
   if (filter) {
      auto filterCall = callOf(*filter);
      if (!filterCall) {
         throw std::invalid_argument("property '" + std::string(property) + "': no filter " +
                                     std::to_string(*filter));
      }
      call.record = filterCall->record;
   }
   return call;
}

orr_Status SifraRegistry::writeProperty(std::string_view property, std::optional<FilterId> filter,
                                        const std::vector<uint8_t> &bytes)
{
   auto call = propertyCallOf(property, filter);
   if (!call || call->ops->write == nullptr) {
      return ORR_NOT_FOUND;
   }
   // An exact-size copy, so that a read past the written bytes is caught.
   auto buffer = std::make_unique<uint8_t[]>(bytes.size());
   std::copy(bytes.begin(), bytes.end(), buffer.get());
   const orr_Status status = call->ops->write(call->record, nullptr, bytes.empty() ? nullptr : buffer.get(),
                                              static_cast<uint32_t>(bytes.size()));
   afterModuleCall();
   return status;
}

orr_Status SifraRegistry::readProperty(std::string_view property, std::optional<FilterId> filter,
                                       std::vector<uint8_t> &buffer)
{
   auto call = propertyCallOf(property, filter);
   if (!call || call->ops->read == nullptr) {
      return ORR_NOT_FOUND;
   }
   auto exact = std::make_unique<uint8_t[]>(buffer.size());
   const orr_Status status =
      call->ops->read(call->record, nullptr, exact.get(), static_cast<uint32_t>(buffer.size()));
   std::copy(exact.get(), exact.get() + buffer.size(), buffer.begin());
   afterModuleCall();
   return status;
}

std::optional<uint32_t> SifraRegistry::pollProperty(std::string_view property, std::optional<FilterId> filter)
{
   auto call = propertyCallOf(property, filter);
   if (!call || call->ops->poll == nullptr) {
      return std::nullopt;
   }
   uint32_t length = 0;
   const bool hasValue = call->ops->poll(call->record, nullptr, &length);
   afterModuleCall();
   if (!hasValue) {
      return std::nullopt;
   }
   return length;
}

}  // namespace swsec::host
