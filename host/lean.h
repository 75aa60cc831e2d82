// The one switch between the checked host and the lean one.
//
// The checked host (every test, the gcc, clang, asan and tsan flavours)
// counts every call of a fault point, checks the magic number of every
// frame and iterator it is handed, and checks lock ranks and double
// acquisitions on every spinlock: faults only a test (or a broken module)
// can trip, each reported by name. The lean host, built only for the
// release flavour's programs (SWSEC_LEAN_HOST, set by the SWSEC_LEAN_HOST
// CMake option), leaves those checks out of the frame path and the lock
// operations, as a production kernel does; fault rules, once armed, still
// apply, and everything a program relies on (lists, locks that exclude,
// messages delivered once the poster holds no lock, leak reports at unload)
// stays. Code asks `kLeanHost` rather than testing the macro, so both
// variants are compiled (and warned about) in every flavour.
#pragma once

namespace swsec::host {

#if defined(SWSEC_LEAN_HOST) && SWSEC_LEAN_HOST
inline constexpr bool kLeanHost = true;
#else
inline constexpr bool kLeanHost = false;
#endif

}  // namespace swsec::host
