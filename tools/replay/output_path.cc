// Output targets: links followed with a bound on their number, the file
// type checked, and the mode a new file gets from the umask.
#include "replay/output_path.h"

#include "session/error.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <vector>

namespace swsec::replay {

namespace {

// As the kernel bounds a path walk (MAXSYMLINKS).
constexpr int kMaxLinks = 40;

mode_t currentUmask()
{
   const mode_t mask = ::umask(0);
   ::umask(mask);
   return mask;
}

}  // namespace

OutputTarget resolveOutput(const std::string &path)
{
   OutputTarget target;
   target.named = path;
   std::filesystem::path current = path;
   for (int hops = 0;; ++hops) {
      struct stat st {};
      if (::lstat(current.c_str(), &st) != 0) {
         if (errno != ENOENT) {
            throw session::InputError(path + ": cannot write: " + std::strerror(errno));
         }
         // A new file, readable as the umask allows, as any tool makes one.
         target.mode = 0666 & ~currentUmask();
         break;
      }
      if (S_ISLNK(st.st_mode)) {
         if (hops == kMaxLinks) {
            throw session::InputError(path + ": cannot write: too many levels of symbolic links");
         }
         std::vector<char> link(static_cast<size_t>(st.st_size > 0 ? st.st_size : 4096) + 1);
         const ssize_t length = ::readlink(current.c_str(), link.data(), link.size() - 1);
         if (length < 0) {
            throw session::InputError(path + ": cannot write: " + std::strerror(errno));
         }
         const std::filesystem::path next(std::string(link.data(), static_cast<size_t>(length)));
         current = next.is_absolute() ? next : current.parent_path() / next;
         continue;
      }
      if (!S_ISREG(st.st_mode)) {
         throw session::InputError(path + ": cannot write: not a regular file");
      }
      // Replaced in place: the file keeps its permissions.
      target.identity = FileIdentity{st.st_dev, st.st_ino};
      target.mode = st.st_mode & 0777;
      break;
   }
   target.path = current.string();
   return target;
}

bool sameFile(const OutputTarget &a, const OutputTarget &b)
{
   if (a.identity && b.identity) {
      return *a.identity == *b.identity;
   }
   if (a.identity || b.identity) {
      return false;
   }
   std::error_code ec;
   const auto left = std::filesystem::weakly_canonical(a.path, ec);
   const auto right = std::filesystem::weakly_canonical(b.path, ec);
   return left == right;
}

}  // namespace swsec::replay
