// The host's state: one instance per Host, reached by the platform's C
// functions as the current host's.
#pragma once

#include "host/faults.h"
#include "host/frames.h"
#include "host/hash.h"
#include "host/heap.h"
#include "host/host.h"
#include "host/loader.h"
#include "host/locks.h"
#include "host/log.h"
#include "host/migration.h"
#include "host/nexo.h"
#include "host/plex.h"
#include "host/portsets.h"
#include "host/sifra_registry.h"
#include "host/symbolizer.h"
#include "host/timers.h"
#include "host/violations.h"

#include <atomic>

namespace swsec::host {

// Members are destroyed in reverse order: the loader first, the heaps last,
// the timers (and their thread) before the locks their callbacks take; the
// filters before the frames and portsets they use.
struct Host::State {
   Violations violations;
   FaultTable faults;
   Symbolizer symbolizer;
   HeapRegistry heaps{violations, faults, symbolizer};
   LogBook logs{violations, faults, heaps};
   LockRegistry locks{violations, faults, heaps};
   TimerService timers{violations, faults, heaps, locks, symbolizer};
   PlexRegistry plex{violations, faults};
   PortsetService portsets{violations, faults, locks};
   FrameStore frames{violations, faults};
   SifraRegistry sifra{violations, faults, locks, portsets, frames, timers};
   MigrationService migration{violations, faults, locks, sifra};
   HashTables hashTables{violations, faults, heaps};
   NexoRegistry nexo{violations, faults};
   Loader loader{*this};
};

namespace detail {

// The current host's state, set while a Host is alive. A platform function
// called with no Host alive has nothing to act on: it prints which one it
// was and aborts.
extern std::atomic<Host::State *> currentState;
[[noreturn]] void noHost(const char *operation);

inline Host::State &requireState(const char *operation)
{
   Host::State *state = currentState.load(std::memory_order_acquire);
   if (state == nullptr) [[unlikely]] {
      noHost(operation);
   }
   return *state;
}

}  // namespace detail

}  // namespace swsec::host
