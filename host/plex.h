// Plex client-port properties: handlers registered by name, and writes to
// them as the management plane would make them.
#pragma once

#include "host/faults.h"
#include "host/host.h"
#include "host/violations.h"

#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace swsec::host {

class PlexRegistry final : public Plex {
public:
   PlexRegistry(Violations &violations, FaultTable &faults);
   ~PlexRegistry() override;

   // Platform operations.
   orr_Status registerClientPort(orr_PlexClientPortHandle *handle, uint32_t flags, const char *name,
                                 const orr_PlexClientPortOps *ops);
   orr_Status unregisterClientPort(orr_PlexClientPortHandle handle);

   // Reports and removes registrations still present.
   std::vector<std::string> purge(std::string_view when);

   // Plex
   std::vector<std::string> clientPorts() const override;
   orr_Status write(std::string_view clientPort, std::string_view bytes) override;

   struct Registration;

private:
   Violations &violations_;
   FaultTable &faults_;

   mutable std::mutex mutex_;
   std::condition_variable idle_;
   uint64_t nextSeq_ = 1;
   std::map<const orr_PlexClientPortOpaque *, std::shared_ptr<Registration>> registrations_;
};

}  // namespace swsec::host
