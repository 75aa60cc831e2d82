// The interface lock of a guarded port.
#include "live/owner_lock.h"

#include "live/netdev.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace swsec::live {

namespace {

std::string systemText()
{
   return std::strerror(errno);
}

// Interface indexes are per network namespace: the namespace's inode
// tells two interfaces of one index apart.
std::string namespaceKey()
{
   struct stat info {};
   if (::stat("/proc/self/ns/net", &info) != 0) {
      return "0";
   }
   return std::to_string(info.st_ino);
}

}  // namespace

InterfaceLock::InterfaceLock(const std::string &runDir, int ifindex, const std::string &ifname)
   : path_(runDir + "/net" + namespaceKey() + "-if" + std::to_string(ifindex) + ".lock")
{
   if (::mkdir(runDir.c_str(), 0700) != 0 && errno != EEXIST) {
      throw NetdevError(runDir + ": " + systemText());
   }
   fd_ = ::open(path_.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, 0600);
   if (fd_ < 0) {
      throw NetdevError(path_ + ": " + systemText());
   }
   if (::flock(fd_, LOCK_EX | LOCK_NB) != 0) {
      const int error = errno;
      char text[32] = {};
      const ssize_t got = ::pread(fd_, text, sizeof text - 1, 0);
      ::close(fd_);
      fd_ = -1;
      if (error != EWOULDBLOCK) {
         throw NetdevError(path_ + ": " + std::strerror(error));
      }
      const long owner = got > 0 ? std::strtol(text, nullptr, 10) : 0;
      throw NetdevError(ifname + " is guarded by another swsec inline" +
                        (owner > 0 ? " (PID " + std::to_string(owner) + ")" : std::string()) + "; lock " + path_);
   }
   const std::string pid = std::to_string(::getpid()) + "\n";
   if (::ftruncate(fd_, 0) != 0 || ::pwrite(fd_, pid.data(), pid.size(), 0) != static_cast<ssize_t>(pid.size())) {
      const std::string error = systemText();
      ::close(fd_);
      throw NetdevError(path_ + ": " + error);
   }
}

InterfaceLock::~InterfaceLock()
{
   if (fd_ >= 0) {
      ::close(fd_);
   }
}

}  // namespace swsec::live
