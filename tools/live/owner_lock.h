// One owner per VM interface, whichever swsec inline runs: an flock on a
// file under a run directory named after the interface's network namespace
// and index, holding the owner's PID. The kernel lets go of it when the
// owner dies, so a killed run's interface is free at once for the next,
// while a running one is never disturbed by a second.
#pragma once

#include <string>

namespace swsec::live {

inline constexpr const char *kDefaultRunDir = "/run/swsec";

class InterfaceLock {
public:
   // Takes the lock before anything changes; throws NetdevError naming the
   // owner's PID when another process holds it.
   InterfaceLock(const std::string &runDir, int ifindex, const std::string &ifname);
   ~InterfaceLock();
   InterfaceLock(const InterfaceLock &) = delete;
   InterfaceLock &operator=(const InterfaceLock &) = delete;

   const std::string &path() const { return path_; }

private:
   std::string path_;
   int fd_ = -1;
};

}  // namespace swsec::live
