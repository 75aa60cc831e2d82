// The Sifra registry: fast paths and per-filter properties registered by
// name, and the filters the host creates of them on ports (their
// configuration, minimum mapped length and ioctl replies).
#pragma once

#include "host/faults.h"
#include "host/frames.h"
#include "host/host.h"
#include "host/portsets.h"
#include "host/sifra_slow_paths.h"
#include "host/timers.h"
#include "host/violations.h"

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

namespace swsec::host {

class SifraRegistry final : public Sifra {
public:
   SifraRegistry(Violations &violations, FaultTable &faults, LockRegistry &locks, PortsetService &portsets,
                 FrameStore &frames, TimerService &timers);
   ~SifraRegistry() override;

   // Platform operations.
   orr_Status registerFastPath(const char *name, uint32_t revision, uint32_t compatRevision, orr_ModuleID module,
                               const orr_SifraFastPathOps *ops, orr_SifraAgentHandle agent,
                               orr_SifraFastPath *fastPath);
   void unregisterFastPath(orr_SifraFastPath fastPath);
   orr_Status registerProperty(orr_SifraPropertyHandle *handle, const char *name, const orr_SifraPropertyOps *ops);
   void unregisterProperty(orr_SifraPropertyHandle handle);

   orr_Status getName(orr_SifraFilterHandle handle, char *buffer, uint32_t size);
   orr_Status getFailurePolicy(orr_SifraFilterHandle handle, uint32_t *policy);
   orr_Status getEndPointType(orr_SifraFilterHandle handle, uint32_t *type);
   orr_Status getVMUUID(orr_SifraFilterHandle handle, char *buffer, uint32_t size);
   orr_Status getVnicIndex(orr_SifraFilterHandle handle, int32_t *index);
   orr_Status getPortID(orr_SifraFilterHandle handle, uint32_t *portID);
   orr_Status setMinPktMappedLen(orr_SifraFilterHandle handle, uint32_t length, uint32_t directions);
   orr_Status sendFilterIoctlReply(orr_SifraFilterHandle handle, uint32_t requestId, const void *data,
                                   uint64_t length);

   // For the migration calls: the live filter's operations and module
   // record; the filter a host handle names; the host regaining control
   // after a module call (messages posted during it go out).
   struct ModuleFilter {
      const orr_SifraFastPathOps *ops = nullptr;
      orr_SifraFilter record = nullptr;
   };
   std::optional<ModuleFilter> moduleFilter(FilterId id) const;
   std::optional<FilterId> filterOfHandle(orr_SifraFilterHandle handle) const;
   void moduleCallReturned() { afterModuleCall(); }

   // Reports and removes registrations still present.
   std::vector<std::string> purge(std::string_view when);

   // For the slow path driver.
   SlowPathDriver &slowPathDriver() { return slowPaths_; }
   // The filter of a host handle, created or still in its creation.
   std::optional<FilterId> filterIdOf(orr_SifraFilterHandle handle) const;
   // The module's record of a created filter; null otherwise.
   orr_SifraFilter createdRecordOf(FilterId id) const;
   void setHostSlowPath(FilterId id, std::optional<uint32_t> slowPathID);
   struct FastPathRef {
      const void *key = nullptr;   // identifies the registration
      FastPathInfo info;
   };
   std::optional<FastPathRef> fastPathRef(std::string_view name) const;
   // Moves virtual time on by 1 ms between the calls of a retry loop.
   void stepTime();
   // The host regains control after a call into the module.
   void afterModuleCall();

   // Sifra
   std::vector<FastPathInfo> fastPaths() const override;
   std::optional<FastPathInfo> fastPath(std::string_view name) const override;
   std::vector<std::string> properties() const override;
   orr_Status createFilter(std::string_view agent, uint32_t portID, const FilterConfig &config,
                           FilterId *id) override;
   orr_Status destroyFilter(FilterId id) override;
   DestroyResult destroyFilterAsHypervisor(FilterId id, uint32_t maxAttempts) override;
   orr_Status changeConfiguration(FilterId id, const FilterConfig &config) override;
   std::optional<FilterInfo> filter(FilterId id) const override;
   std::vector<FilterInfo> filters() const override;
   orr_Status sendIoctl(FilterId id, uint32_t requestId, const std::vector<uint8_t> &payload) override;
   std::vector<IoctlReply> ioctlReplies() const override;
   void clearIoctlReplies() override;
   PacketsResult processPackets(FilterId id, uint32_t direction, const std::vector<FrameSpec> &frames) override;
   PacketsResult processPackets(FilterId id, uint32_t direction, std::span<const FrameView> frames) override;
   orr_Status writeProperty(std::string_view property, std::optional<FilterId> filter,
                            const std::vector<uint8_t> &bytes) override;
   orr_Status readProperty(std::string_view property, std::optional<FilterId> filter,
                           std::vector<uint8_t> &buffer) override;
   std::optional<uint32_t> pollProperty(std::string_view property, std::optional<FilterId> filter) override;
   PacketsResult processPort(uint32_t portID, uint32_t direction, const std::vector<FrameSpec> &frames) override;
   SlowPaths &slowPaths() override { return slowPaths_; }

   struct FastPath;
   struct Property;
   struct Filter;

private:
   // The live filter of `id`, its ops and record copied under the lock.
   struct Call {
      const orr_SifraFastPathOps *ops = nullptr;
      orr_SifraFilter record = nullptr;
      uint32_t minMappedLen = 0;
   };
   std::optional<Call> callOf(FilterId id, uint32_t direction = 0) const;
   // The operations of a registered property and the record of `filter`
   // (null without one); nothing when either is unknown.
   struct PropertyCall {
      const orr_SifraPropertyOps *ops = nullptr;
      orr_SifraFilter record = nullptr;
   };
   std::optional<PropertyCall> propertyCallOf(std::string_view property, std::optional<FilterId> filter) const;
   // The filter of a handle with `guard` holding the registry's lock, or
   // null (reported, lock released).
   Filter *lockedFilter(std::unique_lock<std::mutex> &guard, orr_SifraFilterHandle handle, const char *op);
   // Destroys every filter of a fast path being withdrawn.
   void destroyFiltersOf(const FastPath *fastPath);
   // Builds the list, hands it to the filter and collects what stayed.
   template <typename FrameInputs>
   PacketsResult judgeList(FilterId id, uint32_t direction, const FrameInputs &frames);

   Violations &violations_;
   FaultTable &faults_;
   PortsetService &portsets_;
   FrameStore &frames_;
   TimerService &timers_;

   mutable std::mutex mutex_;
   uint64_t nextSeq_ = 1;
   std::map<const orr_SifraFastPathOpaque *, std::unique_ptr<FastPath>> fastPaths_;
   std::map<const orr_SifraPropertyOpaque *, std::unique_ptr<Property>> properties_;
   FilterId nextFilter_ = 1;
   std::map<FilterId, std::unique_ptr<Filter>> filters_;
   std::vector<IoctlReply> replies_;
   // Calls back into the registry: made last, destroyed first.
   SlowPathDriver slowPaths_;
};

}  // namespace swsec::host
