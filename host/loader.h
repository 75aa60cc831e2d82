// The module loader: opens a module image, sets its parameters, runs
// init_module and cleanup_module, keeps the module registration and use
// count, and after a failed load or an unload checks that the module left
// nothing behind in the host.
#pragma once

#include "host/host.h"

#include <mutex>
#include <string>
#include <string_view>

namespace swsec::host {

class Loader {
public:
   explicit Loader(Host::State &state);

   int load(const LoadOptions &options);
   orr_Status unload();
   bool loaded() const;
   const ModuleDescription &description() const;
   uint32_t useCount() const;
   orr_ExportedFn resolveExport(std::string_view nameSpace, std::string_view name) const;
   // Drops the use count so that a host being destroyed can unload.
   void dropUsers();

   // Platform operations.
   orr_Status registerModule(orr_ModuleID *moduleID, uint32_t revision);
   orr_Status unregisterModule(orr_ModuleID moduleID);
   orr_Status moduleName(orr_ModuleID moduleID, char *buffer, uint32_t size);
   orr_Status setHeap(orr_ModuleID moduleID, orr_HeapID heap);
   orr_Status incUseCount(orr_ModuleID moduleID);
   void decUseCount(orr_ModuleID moduleID);

private:
   enum class Phase { Unloaded, Initializing, Ready, Unloading };

   // Reports every host object still present ("<when>: ...") and removes
   // it, so that nothing refers to the image once it is closed.
   void purgeLeftovers(std::string_view when);
   void closeImage();

   Host::State &state_;
   mutable std::mutex mutex_;
   Phase phase_ = Phase::Unloaded;
   void *image_ = nullptr;
   const orr_ModuleInfo *info_ = nullptr;
   std::string path_;
   ModuleDescription description_;
   // Module IDs are never reused within a host, so a stale ID from an
   // earlier load is recognised as such.
   orr_ModuleID nextID_ = 0x4d;
   orr_ModuleID moduleID_ = ORR_INVALID_MODULE_ID;
   bool registered_ = false;
   uint32_t useCount_ = 0;
};

}  // namespace swsec::host
