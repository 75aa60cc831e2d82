// The bounded reader of configuration and saved-state files.
#include "session/whole_file.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace swsec::session {

std::optional<std::string> readWholeFile(int fd, const std::string &path, uint64_t maxBytes, const char *kind,
                                         std::vector<uint8_t> &bytes)
{
   const struct Closer {
      int fd;
      ~Closer() { ::close(fd); }
   } closer{fd};
   struct stat info {};
   if (::fstat(fd, &info) != 0) {
      return path + ": cannot read: " + std::strerror(errno);
   }
   if (!S_ISREG(info.st_mode)) {
      return path + ": not a regular file";
   }
   if (static_cast<uint64_t>(info.st_size) > maxBytes) {
      return path + ": " + std::to_string(info.st_size) + " bytes is too large for " + kind;
   }
   bytes.assign(static_cast<size_t>(info.st_size), 0);
   size_t done = 0;
   while (done < bytes.size()) {
      const ssize_t got = ::read(fd, bytes.data() + done, bytes.size() - done);
      if (got < 0 && errno == EINTR) {
         continue;
      }
      if (got < 0) {
         return path + ": cannot read: " + std::strerror(errno);
      }
      if (got == 0) {
         bytes.resize(done);   // it shrank while read: what is there is the file
         break;
      }
      done += static_cast<size_t>(got);
   }
   return std::nullopt;
}

}  // namespace swsec::session
