// The temporary-file-and-rename writer.
#include "session/atomic_file.h"

#include "session/error.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

namespace swsec::session {

mode_t currentUmask()
{
   const mode_t mask = ::umask(0);
   ::umask(mask);
   return mask;
}

AtomicFile::AtomicFile(std::string path, mode_t mode, std::string named)
   : path_(std::move(path)), named_(named.empty() ? path_ : std::move(named))
{
   static constexpr char kSuffix[] = ".partial-XXXXXX";
   std::vector<char> name(path_.begin(), path_.end());
   name.insert(name.end(), kSuffix, kSuffix + sizeof kSuffix);
   fd_ = mkstemp(name.data());
   if (fd_ < 0) {
      fail("cannot write");
   }
   tempPath_ = name.data();
   // mkstemp makes the file owner-only.
   if (::fchmod(fd_, mode) != 0) {
      fail("cannot write");
   }
}

AtomicFile::~AtomicFile()
{
   discard();
}

void AtomicFile::discard()
{
   if (fd_ >= 0) {
      ::close(fd_);
      fd_ = -1;
   }
   if (!tempPath_.empty()) {
      ::unlink(tempPath_.c_str());
      tempPath_.clear();
   }
}

// Every failure leaves no temporary file behind, also one in the constructor
// (where the destructor does not run).
void AtomicFile::fail(const char *what)
{
   const std::string message = named_ + ": " + what + ": " + std::strerror(errno);
   discard();
   throw InputError(message);
}

void AtomicFile::write(std::span<const uint8_t> bytes)
{
   size_t done = 0;
   while (done < bytes.size()) {
      const ssize_t wrote = ::write(fd_, bytes.data() + done, bytes.size() - done);
      if (wrote < 0 && errno == EINTR) {
         continue;
      }
      if (wrote < 0) {
         fail("write failed");
      }
      done += static_cast<size_t>(wrote);
   }
}

void AtomicFile::commit()
{
   const int fd = fd_;
   fd_ = -1;
   const bool synced = ::fsync(fd) == 0;
   const int error = errno;
   if (::close(fd) != 0 || !synced) {
      errno = synced ? errno : error;
      fail("write failed");
   }
   if (std::rename(tempPath_.c_str(), path_.c_str()) != 0) {
      fail("cannot write");
   }
   tempPath_.clear();
}

}  // namespace swsec::session
