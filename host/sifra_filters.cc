// Filters as the hypervisor drives them: creation on a port, the
// configuration the module reads back, destruction (retried while busy),
// configuration changes, ioctls with captured replies, and frame lists.
#include "host/sifra_records.h"
#include "host/state.h"

#include <algorithm>
#include <cstring>

namespace swsec::host {

namespace {

constexpr uint32_t kBothDirections = ORR_SIFRA_DIR_RX | ORR_SIFRA_DIR_TX;

FilterInfo infoOf(const SifraRegistry::Filter &filter)
{
   FilterInfo info;
   info.id = filter.id;
   info.agent = filter.fastPath->info.name;
   info.portID = filter.portID;
   info.config = filter.config;
   info.handle = const_cast<SifraRegistry::Filter *>(&filter);
   info.record = filter.record;
   // Both directions share a length when the module set them together.
   info.minMappedLen = std::max(filter.minMappedLen[0], filter.minMappedLen[1]);
   info.minMappedDirections = filter.minMappedDirections;
   info.slowPathID = filter.slowPathID;
   return info;
}

// Copies text into the module's buffer, cut to fit and always terminated,
// as the kernel's string copies do.
orr_Status copyText(const std::string &text, char *buffer, uint32_t size)
{
   if (buffer == nullptr || size == 0) {
      return ORR_BAD_PARAM;
   }
   const size_t length = std::min<size_t>(text.size(), size - 1);
   std::memcpy(buffer, text.data(), length);
   buffer[length] = '\0';
   return ORR_OK;
}

}  // namespace

std::optional<SifraRegistry::Call> SifraRegistry::callOf(FilterId id, uint32_t direction) const
{
   std::lock_guard guard(mutex_);
   auto found = filters_.find(id);
   if (found == filters_.end() || !found->second->created) {
      return std::nullopt;
   }
   const Filter &filter = *found->second;
   Call call{filter.fastPath->info.ops, filter.record, 0};
   if (direction == ORR_SIFRA_DIR_RX || direction == ORR_SIFRA_DIR_TX) {
      call.minMappedLen = filter.minMappedLen[direction - 1];
   }
   return call;
}

void SifraRegistry::afterModuleCall()
{
   // The host regains control: messages posted during the call go out now,
   // and owed replies too when the host completes requests on its own.
   portsets_.deliverIfQuiescent();
   slowPaths_.afterModuleCall();
}

void SifraRegistry::stepTime()
{
   if (timers_.isVirtual()) {
      timers_.advance(std::chrono::milliseconds(1));
   }
}

std::optional<FilterId> SifraRegistry::filterIdOf(orr_SifraFilterHandle handle) const
{
   std::lock_guard guard(mutex_);
   for (const auto &[id, filter] : filters_) {
      if (filter.get() == handle) {
         return id;
      }
   }
   return std::nullopt;
}

orr_SifraFilter SifraRegistry::createdRecordOf(FilterId id) const
{
   std::lock_guard guard(mutex_);
   auto found = filters_.find(id);
   return found != filters_.end() && found->second->created ? found->second->record : nullptr;
}

void SifraRegistry::setHostSlowPath(FilterId id, std::optional<uint32_t> slowPathID)
{
   std::lock_guard guard(mutex_);
   if (auto found = filters_.find(id); found != filters_.end()) {
      found->second->slowPathID = slowPathID;
   }
}

orr_Status SifraRegistry::createFilter(std::string_view agent, uint32_t portID, const FilterConfig &config,
                                       FilterId *id)
{
   if (id == nullptr) {
      throw std::invalid_argument("createFilter: null id");
   }
   if (portsets_.portsetOfPort(portID) == nullptr) {
      return ORR_NOT_FOUND;
   }
   Filter *filter = nullptr;
   {
      std::lock_guard guard(mutex_);
      const FastPath *fastPath = nullptr;
      for (const auto &[key, candidate] : fastPaths_) {
         if (candidate->info.name == agent) {
            fastPath = candidate.get();
         }
      }
      if (fastPath == nullptr) {
         return ORR_NOT_FOUND;
      }
      if (fastPath->info.ops->createFilter == nullptr) {
         return ORR_NOT_SUPPORTED;
      }
      auto record = std::make_unique<Filter>();
      record->id = nextFilter_++;
      record->fastPath = fastPath;
      record->portID = portID;
      record->config = config;
      filter = record.get();
      filters_.emplace(record->id, std::move(record));
   }
   const FastPathInfo &info = filter->fastPath->info;
   orr_SifraFilter moduleRecord = nullptr;
   const orr_Status status = info.ops->createFilter(info.agent, filter, &moduleRecord, 0);
   {
      std::lock_guard guard(mutex_);
      if (status != ORR_OK) {
         filters_.erase(filter->id);
      } else {
         filter->record = moduleRecord;
         filter->created = true;
         *id = filter->id;
      }
   }
   afterModuleCall();
   return status;
}

orr_Status SifraRegistry::destroyFilter(FilterId id)
{
   auto call = callOf(id);
   if (!call) {
      throw std::invalid_argument("destroyFilter: no filter " + std::to_string(id));
   }
   const orr_Status status = call->ops->destroyFilter != nullptr ? call->ops->destroyFilter(call->record) : ORR_OK;
   if (status == ORR_OK) {
      {
         std::lock_guard guard(mutex_);
         filters_.erase(id);
      }
      slowPaths_.filterGone(id);
   }
   afterModuleCall();
   return status;
}

DestroyResult SifraRegistry::destroyFilterAsHypervisor(FilterId id, uint32_t maxAttempts)
{
   DestroyResult result;
   while (result.attempts < maxAttempts) {
      if (result.attempts != 0) {
         timers_.advance(std::chrono::milliseconds(1));
         (void)slowPaths_.deliverReplies(id);
      }
      ++result.attempts;
      result.status = destroyFilter(id);
      if (result.status != ORR_BUSY) {
         break;
      }
   }
   return result;
}

void SifraRegistry::destroyFiltersOf(const FastPath *fastPath)
{
   // Enough for a module that retries its own teardown for a while.
   constexpr uint32_t kMaxAttempts = 1000;
   std::vector<FilterId> ids;
   {
      std::lock_guard guard(mutex_);
      for (const auto &[id, filter] : filters_) {
         if (filter->fastPath == fastPath && filter->created) {
            ids.push_back(id);
         }
      }
   }
   for (FilterId id : ids) {
      DestroyResult result;
      while (result.attempts < kMaxAttempts) {
         if (result.attempts != 0) {
            stepTime();
            (void)slowPaths_.deliverReplies(id);
         }
         ++result.attempts;
         auto call = callOf(id);
         result.status = call->ops->destroyFilter != nullptr ? call->ops->destroyFilter(call->record) : ORR_OK;
         if (result.status == ORR_OK) {
            break;
         }
      }
      std::string name;
      {
         std::lock_guard guard(mutex_);
         name = filters_.at(id)->config.name;
         filters_.erase(id);
      }
      slowPaths_.filterGone(id);
      if (result.status != ORR_OK) {
         violations_.report("orr_SifraUnregisterFastPath: filter '" + name + "' of fast path '" +
                            fastPath->info.name + "' could not be destroyed after " +
                            std::to_string(result.attempts) + " attempts (" + orr_StatusToString(result.status) +
                            ")");
      }
   }
}

orr_Status SifraRegistry::changeConfiguration(FilterId id, const FilterConfig &config)
{
   {
      std::lock_guard guard(mutex_);
      auto found = filters_.find(id);
      if (found == filters_.end() || !found->second->created) {
         throw std::invalid_argument("changeConfiguration: no filter " + std::to_string(id));
      }
      found->second->config = config;
   }
   auto call = callOf(id);
   const orr_Status status =
      call->ops->configurationChanged != nullptr ? call->ops->configurationChanged(call->record) : ORR_OK;
   afterModuleCall();
   return status;
}

std::optional<FilterInfo> SifraRegistry::filter(FilterId id) const
{
   std::lock_guard guard(mutex_);
   auto found = filters_.find(id);
   if (found == filters_.end() || !found->second->created) {
      return std::nullopt;
   }
   return infoOf(*found->second);
}

std::vector<FilterInfo> SifraRegistry::filters() const
{
   std::lock_guard guard(mutex_);
   std::vector<FilterInfo> result;
   for (const auto &[id, filter] : filters_) {
      if (filter->created) {
         result.push_back(infoOf(*filter));
      }
   }
   return result;
}

orr_Status SifraRegistry::sendIoctl(FilterId id, uint32_t requestId, const std::vector<uint8_t> &payload)
{
   auto call = callOf(id);
   if (!call) {
      throw std::invalid_argument("sendIoctl: no filter " + std::to_string(id));
   }
   if (call->ops->processFilterIoctl == nullptr) {
      return ORR_NOT_SUPPORTED;
   }
   // An exact-size buffer, so that a read past the payload is caught.
   auto buffer = std::make_unique<uint8_t[]>(payload.size());
   std::copy(payload.begin(), payload.end(), buffer.get());
   const orr_Status status = call->ops->processFilterIoctl(call->record, requestId, buffer.get(), payload.size());
   afterModuleCall();
   return status;
}

std::vector<IoctlReply> SifraRegistry::ioctlReplies() const
{
   std::lock_guard guard(mutex_);
   return replies_;
}

void SifraRegistry::clearIoctlReplies()
{
   std::lock_guard guard(mutex_);
   replies_.clear();
}

template <typename FrameInputs>
PacketsResult SifraRegistry::judgeList(FilterId id, uint32_t direction, const FrameInputs &frames)
{
   auto call = callOf(id, direction);
   if (!call) {
      throw std::invalid_argument("processPackets: no filter " + std::to_string(id));
   }
   auto list = frames_.makeList(frames, call->minMappedLen);
   PacketsResult result;
   result.status = call->ops->processPackets != nullptr ? call->ops->processPackets(call->record, list->list(), direction)
                                                        : ORR_OK;
   result.kept = list->kept();
   result.released = list->released();
   list.reset();
   afterModuleCall();
   return result;
}

PacketsResult SifraRegistry::processPackets(FilterId id, uint32_t direction, const std::vector<FrameSpec> &frames)
{
   return judgeList(id, direction, frames);
}

PacketsResult SifraRegistry::processPackets(FilterId id, uint32_t direction, std::span<const FrameView> frames)
{
   return judgeList(id, direction, frames);
}

PacketsResult SifraRegistry::processPort(uint32_t portID, uint32_t direction, const std::vector<FrameSpec> &frames)
{
   std::vector<Call> chain;
   {
      std::lock_guard guard(mutex_);
      for (const auto &[id, filter] : filters_) {
         if (filter->created && filter->portID == portID) {
            const uint32_t minMapped =
               direction == ORR_SIFRA_DIR_RX || direction == ORR_SIFRA_DIR_TX ? filter->minMappedLen[direction - 1] : 0;
            chain.push_back({filter->fastPath->info.ops, filter->record, minMapped});
         }
      }
   }
   uint32_t minMappedLen = 0;
   for (const Call &call : chain) {
      minMappedLen = std::max(minMappedLen, call.minMappedLen);
   }
   auto list = frames_.makeList(frames, minMappedLen);
   PacketsResult result;
   for (const Call &call : chain) {
      const orr_Status status =
         call.ops->processPackets != nullptr ? call.ops->processPackets(call.record, list->list(), direction) : ORR_OK;
      if (result.status == ORR_OK) {
         result.status = status;
      }
   }
   result.kept = list->kept();
   result.released = list->released();
   list.reset();
   afterModuleCall();
   return result;
}

// Platform operations on a filter handle. An unknown handle would be a
// crash in a real kernel; here it is a violation and ORR_INVALID_HANDLE.
SifraRegistry::Filter *SifraRegistry::lockedFilter(std::unique_lock<std::mutex> &guard,
                                                   orr_SifraFilterHandle handle, const char *op)
{
   guard = std::unique_lock(mutex_);
   for (const auto &[id, filter] : filters_) {
      if (filter.get() == handle) {
         return filter.get();
      }
   }
   guard.unlock();
   violations_.report(std::string(op) + ": unknown filter handle " + pointerText(handle));
   return nullptr;
}

orr_Status SifraRegistry::getName(orr_SifraFilterHandle handle, char *buffer, uint32_t size)
{
   if (auto status = faults_.hit(faultPoint("orr_SifraGetName"))) {
      return *status;
   }
   std::unique_lock<std::mutex> guard;
   Filter *filter = lockedFilter(guard, handle, "orr_SifraGetName");
   if (filter == nullptr) {
      return ORR_INVALID_HANDLE;
   }
   return copyText(filter->config.name, buffer, size);
}

orr_Status SifraRegistry::getFailurePolicy(orr_SifraFilterHandle handle, uint32_t *policy)
{
   if (auto status = faults_.hit(faultPoint("orr_SifraGetFailurePolicy"))) {
      return *status;
   }
   std::unique_lock<std::mutex> guard;
   Filter *filter = lockedFilter(guard, handle, "orr_SifraGetFailurePolicy");
   if (filter == nullptr) {
      return ORR_INVALID_HANDLE;
   }
   if (policy == nullptr) {
      return ORR_BAD_PARAM;
   }
   *policy = filter->config.failurePolicy;
   return ORR_OK;
}

orr_Status SifraRegistry::getEndPointType(orr_SifraFilterHandle handle, uint32_t *type)
{
   if (auto status = faults_.hit(faultPoint("orr_SifraGetEndPointType"))) {
      return *status;
   }
   std::unique_lock<std::mutex> guard;
   Filter *filter = lockedFilter(guard, handle, "orr_SifraGetEndPointType");
   if (filter == nullptr) {
      return ORR_INVALID_HANDLE;
   }
   if (type == nullptr) {
      return ORR_BAD_PARAM;
   }
   *type = filter->config.endPointType;
   return ORR_OK;
}

orr_Status SifraRegistry::getVMUUID(orr_SifraFilterHandle handle, char *buffer, uint32_t size)
{
   if (auto status = faults_.hit(faultPoint("orr_SifraGetVMUUID"))) {
      return *status;
   }
   std::unique_lock<std::mutex> guard;
   Filter *filter = lockedFilter(guard, handle, "orr_SifraGetVMUUID");
   if (filter == nullptr) {
      return ORR_INVALID_HANDLE;
   }
   if (!filter->config.vmUuid) {
      if (buffer != nullptr && size != 0) {
         buffer[0] = '\0';
      }
      return ORR_NO_VM_UUID;
   }
   return copyText(*filter->config.vmUuid, buffer, size);
}

orr_Status SifraRegistry::getVnicIndex(orr_SifraFilterHandle handle, int32_t *index)
{
   if (auto status = faults_.hit(faultPoint("orr_SifraGetVnicIndex"))) {
      return *status;
   }
   std::unique_lock<std::mutex> guard;
   Filter *filter = lockedFilter(guard, handle, "orr_SifraGetVnicIndex");
   if (filter == nullptr) {
      return ORR_INVALID_HANDLE;
   }
   if (index == nullptr) {
      return ORR_BAD_PARAM;
   }
   *index = filter->config.vnicIndex;
   return ORR_OK;
}

orr_Status SifraRegistry::getPortID(orr_SifraFilterHandle handle, uint32_t *portID)
{
   if (auto status = faults_.hit(faultPoint("orr_SifraGetPortID"))) {
      return *status;
   }
   std::unique_lock<std::mutex> guard;
   Filter *filter = lockedFilter(guard, handle, "orr_SifraGetPortID");
   if (filter == nullptr) {
      return ORR_INVALID_HANDLE;
   }
   if (portID == nullptr) {
      return ORR_BAD_PARAM;
   }
   *portID = filter->portID;
   return ORR_OK;
}

orr_Status SifraRegistry::setMinPktMappedLen(orr_SifraFilterHandle handle, uint32_t length, uint32_t directions)
{
   if (auto status = faults_.hit(faultPoint("orr_SifraSetMinPktMappedLen"))) {
      return *status;
   }
   std::unique_lock<std::mutex> guard;
   Filter *filter = lockedFilter(guard, handle, "orr_SifraSetMinPktMappedLen");
   if (filter == nullptr) {
      return ORR_INVALID_HANDLE;
   }
   if (directions == 0 || (directions & ~kBothDirections) != 0) {
      return ORR_BAD_PARAM;
   }
   for (uint32_t direction : {ORR_SIFRA_DIR_RX, ORR_SIFRA_DIR_TX}) {
      if ((directions & direction) != 0) {
         filter->minMappedLen[direction - 1] = length;
      }
   }
   filter->minMappedDirections |= directions;
   return ORR_OK;
}

orr_Status SifraRegistry::sendFilterIoctlReply(orr_SifraFilterHandle handle, uint32_t requestId, const void *data,
                                               uint64_t length)
{
   if (auto status = faults_.hit(faultPoint("orr_SifraSendFilterIoctlReply"))) {
      return *status;
   }
   std::unique_lock<std::mutex> guard;
   Filter *filter = lockedFilter(guard, handle, "orr_SifraSendFilterIoctlReply");
   if (filter == nullptr) {
      return ORR_INVALID_HANDLE;
   }
   if (data == nullptr && length != 0) {
      return ORR_BAD_PARAM;
   }
   const auto *bytes = static_cast<const uint8_t *>(data);
   replies_.push_back(IoctlReply{filter->id, requestId, std::vector<uint8_t>(bytes, bytes + length)});
   return ORR_OK;
}

}  // namespace swsec::host

using swsec::host::detail::requireState;

ORR_API orr_Status orr_SifraGetName(orr_SifraFilterHandle handle, char *buffer, uint32_t size)
{
   return requireState("orr_SifraGetName").sifra.getName(handle, buffer, size);
}

ORR_API orr_Status orr_SifraGetFailurePolicy(orr_SifraFilterHandle handle, uint32_t *policy)
{
   return requireState("orr_SifraGetFailurePolicy").sifra.getFailurePolicy(handle, policy);
}

ORR_API orr_Status orr_SifraGetEndPointType(orr_SifraFilterHandle handle, uint32_t *type)
{
   return requireState("orr_SifraGetEndPointType").sifra.getEndPointType(handle, type);
}

ORR_API orr_Status orr_SifraGetVMUUID(orr_SifraFilterHandle handle, char *buffer, uint32_t size)
{
   return requireState("orr_SifraGetVMUUID").sifra.getVMUUID(handle, buffer, size);
}

ORR_API orr_Status orr_SifraGetVnicIndex(orr_SifraFilterHandle handle, int32_t *index)
{
   return requireState("orr_SifraGetVnicIndex").sifra.getVnicIndex(handle, index);
}

ORR_API orr_Status orr_SifraGetPortID(orr_SifraFilterHandle handle, uint32_t *portID)
{
   return requireState("orr_SifraGetPortID").sifra.getPortID(handle, portID);
}

ORR_API orr_Status orr_SifraSetMinPktMappedLen(orr_SifraFilterHandle handle, uint32_t length, uint32_t directions)
{
   return requireState("orr_SifraSetMinPktMappedLen").sifra.setMinPktMappedLen(handle, length, directions);
}

ORR_API orr_Status orr_SifraSendFilterIoctlReply(orr_SifraFilterHandle handle, uint32_t requestId, const void *data,
                                                 uint64_t length)
{
   return requireState("orr_SifraSendFilterIoctlReply").sifra.sendFilterIoctlReply(handle, requestId, data, length);
}
