#include "host/loader.h"

#include "host/state.h"

#include <dlfcn.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <stdexcept>
#include <utility>

namespace swsec::host {

namespace {

std::string modulePath(const LoadOptions &options)
{
   if (!options.modulePath.empty()) {
      return options.modulePath;
   }
   if (const char *fromEnvironment = std::getenv("SWSEC_MODULE_PATH"); fromEnvironment != nullptr && *fromEnvironment) {
      return fromEnvironment;
   }
#ifdef SWSEC_MODULE_PATH
   return SWSEC_MODULE_PATH;
#else
   throw std::runtime_error("no module image: give LoadOptions::modulePath or set SWSEC_MODULE_PATH");
#endif
}

std::string textOf(const char *text)
{
   return text != nullptr ? std::string(text) : std::string();
}

// Closes an image on the way out of a load that throws.
struct ImageGuard {
   void *image;
   ~ImageGuard()
   {
      if (image != nullptr) {
         dlclose(image);
      }
   }
};

}  // namespace

Loader::Loader(Host::State &state) : state_(state) {}

int Loader::load(const LoadOptions &options)
{
   {
      std::lock_guard guard(mutex_);
      if (phase_ != Phase::Unloaded) {
         throw std::logic_error("Host::load: a module is already loaded");
      }
   }
   const bool linked = options.linkedModule != nullptr;
   const std::string path = linked ? std::string("(linked into the program)") : modulePath(options);
   ImageGuard image{linked ? nullptr : dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL)};
   if (!linked && image.image == nullptr) {
      const char *error = dlerror();
      throw std::runtime_error("cannot open module image '" + path + "': " + textOf(error));
   }
   const auto *info = linked ? options.linkedModule
                             : static_cast<const orr_ModuleInfo *>(dlsym(image.image, ORR_MODULE_INFO_SYMBOL));
   if (info == nullptr) {
      throw std::runtime_error("module image '" + path + "' has no " ORR_MODULE_INFO_SYMBOL);
   }
   if (info->infoVersion != ORR_MODULE_INFO_VERSION) {
      throw std::runtime_error("module image '" + path + "' has module information version " +
                               std::to_string(info->infoVersion) + ", this host reads version " +
                               std::to_string(ORR_MODULE_INFO_VERSION));
   }
   if (info->initModule == nullptr || info->cleanupModule == nullptr || info->currentID == nullptr ||
       (info->numParameters != 0 && info->parameters == nullptr) ||
       (info->numExports != 0 && info->exports == nullptr) ||
       (info->numRequiredNamespaces != 0 && info->requiredNamespaces == nullptr)) {
      throw std::runtime_error("module image '" + path + "' has incomplete module information");
   }
   if (info->nexoTree != nullptr) {
      NexoRegistry::validate(*info->nexoTree);
   }

   // Every requested parameter must exist before any is set.
   for (const auto &[name, value] : options.parameters) {
      const orr_ModuleParam *param = nullptr;
      for (uint32_t i = 0; i < info->numParameters; ++i) {
         if (info->parameters[i].name != nullptr && name == info->parameters[i].name) {
            param = &info->parameters[i];
         }
      }
      if (param == nullptr) {
         throw std::invalid_argument("module '" + options.moduleName + "' has no parameter '" + name + "'");
      }
      if (param->type != ORR_MODULE_PARAM_INT || param->value == nullptr) {
         throw std::runtime_error("module parameter '" + name + "' is not an int parameter");
      }
   }
   for (uint32_t i = 0; i < info->numParameters; ++i) {
      const orr_ModuleParam &param = info->parameters[i];
      auto requested = param.name != nullptr ? options.parameters.find(std::string_view(param.name))
                                             : options.parameters.end();
      if (requested != options.parameters.end()) {
         *param.value = requested->second;
      }
   }

   ModuleDescription description;
   description.name = options.moduleName;
   description.version = textOf(info->version);
   for (uint32_t i = 0; i < info->numRequiredNamespaces; ++i) {
      description.requiredNamespaces.push_back(textOf(info->requiredNamespaces[i]));
   }
   description.providedNamespace = textOf(info->providedNamespace);
   for (uint32_t i = 0; i < info->numParameters; ++i) {
      const orr_ModuleParam &param = info->parameters[i];
      description.parameters.push_back(
         ModuleParamInfo{textOf(param.name), textOf(param.description), param.value != nullptr ? *param.value : 0});
   }
   for (uint32_t i = 0; i < info->numExports; ++i) {
      description.exports.push_back(ModuleExportInfo{description.providedNamespace, textOf(info->exports[i].name)});
   }

   orr_ModuleID id = ORR_INVALID_MODULE_ID;
   {
      std::lock_guard guard(mutex_);
      id = nextID_++;
      phase_ = Phase::Initializing;
      image_ = std::exchange(image.image, nullptr);
      info_ = info;
      path_ = path;
      description_ = std::move(description);
      moduleID_ = id;
      registered_ = false;
      useCount_ = 0;
   }
   *info->currentID = id;
   state_.heaps.forgetModuleHeap();

   const int result = info->initModule();
   if (result == 0) {
      {
         std::lock_guard guard(mutex_);
         phase_ = Phase::Ready;
      }
      // The module's branch is data declared with it: visible while it is loaded.
      state_.nexo.install(info->nexoTree);
      return 0;
   }
   if (result != 1) {
      state_.violations.report("init_module returned " + std::to_string(result) + " (0 or 1 expected)");
   }
   {
      std::lock_guard guard(mutex_);
      phase_ = Phase::Unloading;
   }
   purgeLeftovers("after a failed load");
   closeImage();
   return 1;
}

orr_Status Loader::unload()
{
   const orr_ModuleInfo *info = nullptr;
   {
      std::lock_guard guard(mutex_);
      if (phase_ != Phase::Ready) {
         return ORR_NOT_FOUND;
      }
      if (useCount_ > 0) {
         return ORR_BUSY;
      }
      phase_ = Phase::Unloading;
      info = info_;
   }
   // No handler may run into a module that is going.
   state_.nexo.remove();
   const orr_Status status = info->cleanupModule();
   purgeLeftovers("at unload");
   closeImage();
   return status;
}

void Loader::purgeLeftovers(std::string_view when)
{
   std::vector<std::string> problems;
   {
      std::lock_guard guard(mutex_);
      if (registered_) {
         problems.push_back(std::string(when) + ": module '" + description_.name + "' is still registered");
         registered_ = false;
      }
   }
   // Timers first: nothing may fire into an image about to close.
   auto add = [&](std::vector<std::string> more) { problems.insert(problems.end(), more.begin(), more.end()); };
   add(state_.timers.purge(when));
   add(state_.migration.purge(when));
   add(state_.sifra.purge(when));
   add(state_.plex.purge(when));
   add(state_.portsets.purge(when));
   add(state_.locks.purge(when));
   add(state_.logs.purge(when));
   state_.hashTables.purge();
   add(state_.heaps.purge(when));
   state_.violations.reportAll(std::move(problems));
}

void Loader::closeImage()
{
   void *image = nullptr;
   std::string path;
   {
      std::lock_guard guard(mutex_);
      image = std::exchange(image_, nullptr);
      path = path_;
      info_ = nullptr;
      phase_ = Phase::Unloaded;
      registered_ = false;
      useCount_ = 0;
   }
   if (image == nullptr) {
      // A linked module: there is no image to close.
      state_.symbolizer.forget();
      return;
   }
   if (dlclose(image) != 0) {
      const char *error = dlerror();
      state_.violations.report("closing module image '" + path + "' failed: " + textOf(error));
   }
   state_.symbolizer.forget();
   // A reload must start from fresh globals. An image that stays mapped
   // (marked not-deletable, for instance by unique symbols that g++ emits
   // for some inline statics) would hand the next load the old values.
   if (void *still = dlopen(path.c_str(), RTLD_NOW | RTLD_NOLOAD); still != nullptr) {
      dlclose(still);
      state_.violations.report("module image '" + path +
                               "' stayed mapped after it was closed: its globals would survive into the next load");
   }
}

bool Loader::loaded() const
{
   std::lock_guard guard(mutex_);
   return phase_ == Phase::Ready;
}

const ModuleDescription &Loader::description() const
{
   std::lock_guard guard(mutex_);
   return description_;
}

uint32_t Loader::useCount() const
{
   std::lock_guard guard(mutex_);
   return useCount_;
}

void Loader::dropUsers()
{
   std::lock_guard guard(mutex_);
   useCount_ = 0;
}

orr_ExportedFn Loader::resolveExport(std::string_view nameSpace, std::string_view name) const
{
   std::lock_guard guard(mutex_);
   if (phase_ != Phase::Ready || info_->providedNamespace == nullptr || nameSpace != info_->providedNamespace) {
      return nullptr;
   }
   for (uint32_t i = 0; i < info_->numExports; ++i) {
      if (info_->exports[i].name != nullptr && name == info_->exports[i].name) {
         return info_->exports[i].function;
      }
   }
   return nullptr;
}

orr_Status Loader::registerModule(orr_ModuleID *moduleID, uint32_t revision)
{
   if (auto status = state_.faults.hit(faultPoint("orr_ModuleRegister"))) {
      return *status;
   }
   if (moduleID == nullptr) {
      return ORR_BAD_PARAM;
   }
   {
      std::lock_guard guard(mutex_);
      if (phase_ == Phase::Initializing) {
         if (revision != ORR_MODULE_INTERFACE_REVISION) {
            return ORR_NOT_SUPPORTED;
         }
         if (registered_) {
            return ORR_EXISTS;
         }
         registered_ = true;
         *moduleID = moduleID_;
         return ORR_OK;
      }
   }
   state_.violations.report("orr_ModuleRegister called outside the init_module of a module being loaded");
   return ORR_FAILURE;
}

orr_Status Loader::unregisterModule(orr_ModuleID moduleID)
{
   if (auto status = state_.faults.hit(faultPoint("orr_ModuleUnregister"))) {
      return *status;
   }
   std::lock_guard guard(mutex_);
   if (!registered_ || moduleID != moduleID_) {
      return ORR_NOT_FOUND;
   }
   registered_ = false;
   return ORR_OK;
}

orr_Status Loader::moduleName(orr_ModuleID moduleID, char *buffer, uint32_t size)
{
   if (auto status = state_.faults.hit(faultPoint("orr_ModuleGetName"))) {
      return *status;
   }
   if (buffer == nullptr || size == 0) {
      return ORR_BAD_PARAM;
   }
   std::lock_guard guard(mutex_);
   if (phase_ == Phase::Unloaded || moduleID != moduleID_) {
      return ORR_NOT_FOUND;
   }
   // Cut to the buffer and always terminated, like the kernel's own copy.
   const size_t length = std::min<size_t>(description_.name.size(), size - 1);
   std::memcpy(buffer, description_.name.data(), length);
   buffer[length] = '\0';
   return ORR_OK;
}

orr_Status Loader::setHeap(orr_ModuleID moduleID, orr_HeapID heap)
{
   if (auto status = state_.faults.hit(faultPoint("orr_ModuleSetHeapID"))) {
      return *status;
   }
   {
      std::lock_guard guard(mutex_);
      if (!registered_ || moduleID != moduleID_) {
         return ORR_NOT_FOUND;
      }
   }
   if (!state_.heaps.isLive(heap)) {
      return ORR_INVALID_HANDLE;
   }
   state_.heaps.setModuleHeap(heap);
   return ORR_OK;
}

orr_Status Loader::incUseCount(orr_ModuleID moduleID)
{
   if (auto status = state_.faults.hit(faultPoint("orr_ModuleIncUseCount"))) {
      return *status;
   }
   std::lock_guard guard(mutex_);
   if (phase_ == Phase::Unloaded || moduleID != moduleID_) {
      return ORR_NOT_FOUND;
   }
   // A module on its way out takes no new users.
   if (phase_ == Phase::Unloading) {
      return ORR_FAILURE;
   }
   ++useCount_;
   return ORR_OK;
}

void Loader::decUseCount(orr_ModuleID moduleID)
{
   std::string problem;
   {
      std::lock_guard guard(mutex_);
      if (phase_ == Phase::Unloaded || moduleID != moduleID_) {
         problem = "orr_ModuleDecUseCount: unknown module " + std::to_string(moduleID);
      } else if (useCount_ == 0) {
         problem = "orr_ModuleDecUseCount: use count of '" + description_.name + "' is already 0";
      } else {
         --useCount_;
         return;
      }
   }
   state_.violations.report(std::move(problem));
}

}  // namespace swsec::host

using swsec::host::detail::requireState;

ORR_API orr_Status orr_ModuleRegister(orr_ModuleID *moduleID, uint32_t revision)
{
   return requireState("orr_ModuleRegister").loader.registerModule(moduleID, revision);
}

ORR_API orr_Status orr_ModuleUnregister(orr_ModuleID moduleID)
{
   return requireState("orr_ModuleUnregister").loader.unregisterModule(moduleID);
}

ORR_API orr_Status orr_ModuleGetName(orr_ModuleID moduleID, char *buffer, uint32_t size)
{
   return requireState("orr_ModuleGetName").loader.moduleName(moduleID, buffer, size);
}

ORR_API orr_Status orr_ModuleSetHeapID(orr_ModuleID moduleID, orr_HeapID heap)
{
   return requireState("orr_ModuleSetHeapID").loader.setHeap(moduleID, heap);
}

ORR_API orr_Status orr_ModuleIncUseCount(orr_ModuleID moduleID)
{
   return requireState("orr_ModuleIncUseCount").loader.incUseCount(moduleID);
}

ORR_API void orr_ModuleDecUseCount(orr_ModuleID moduleID)
{
   requireState("orr_ModuleDecUseCount").loader.decUseCount(moduleID);
}
