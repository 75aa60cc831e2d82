#include "host/host.h"

#include "host/state.h"

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <stdexcept>

namespace swsec::host {

namespace {

std::atomic<Host *> currentHost{nullptr};

}  // namespace

std::atomic<Host::State *> detail::currentState{nullptr};

void detail::noHost(const char *operation)
{
   std::fprintf(stderr, "swsec host: %s called with no Host alive\n", operation);
   std::fflush(stderr);
   std::abort();
}

Host::Host() : state_(std::make_unique<State>())
{
   Host *expected = nullptr;
   if (!currentHost.compare_exchange_strong(expected, this, std::memory_order_acq_rel)) {
      throw std::logic_error("only one Host may exist at a time");
   }
   detail::currentState.store(state_.get(), std::memory_order_release);
}

Host::~Host()
{
   if (loaded()) {
      if (unload() == ORR_BUSY) {
         state_->violations.report("host destroyed while the module is in use");
         state_->loader.dropUsers();
         (void)unload();
      }
   }
   // The timer thread may still be about to call into the host.
   state_->timers.stop();
   detail::currentState.store(nullptr, std::memory_order_release);
   currentHost.store(nullptr, std::memory_order_release);
}

Host &Host::current()
{
   Host *host = currentHost.load(std::memory_order_acquire);
   if (host == nullptr) {
      throw std::logic_error("no Host is alive");
   }
   return *host;
}

int Host::load(const LoadOptions &options)
{
   return state_->loader.load(options);
}

orr_Status Host::unload()
{
   return state_->loader.unload();
}

bool Host::loaded() const
{
   return state_->loader.loaded();
}

const ModuleDescription &Host::module() const
{
   return state_->loader.description();
}

uint32_t Host::useCount() const
{
   return state_->loader.useCount();
}

orr_ExportedFn Host::resolveExport(std::string_view nameSpace, std::string_view name) const
{
   return state_->loader.resolveExport(nameSpace, name);
}

void Host::setViolationHandler(ViolationHandler handler)
{
   state_->violations.setHandler(std::move(handler));
}

std::vector<std::string> Host::violations() const
{
   return state_->violations.list();
}

Log &Host::log()
{
   return state_->logs;
}

Faults &Host::faults()
{
   return state_->faults;
}

Heap &Host::heap()
{
   return state_->heaps;
}

Clock &Host::clock()
{
   return state_->timers;
}

Locks &Host::locks()
{
   return state_->locks;
}

Plex &Host::plex()
{
   return state_->plex;
}

Sifra &Host::sifra()
{
   return state_->sifra;
}

Portsets &Host::portsets()
{
   return state_->portsets;
}

Frames &Host::frames()
{
   return state_->frames;
}

Nexo &Host::nexo()
{
   return state_->nexo;
}

Migration &Host::migration()
{
   return state_->migration;
}

Host::State &Host::state()
{
   return *state_;
}

}  // namespace swsec::host
