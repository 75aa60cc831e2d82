// Reading and writing saved-state files.
#include "session/state_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

namespace swsec::session {

namespace {

std::string systemError()
{
   return std::strerror(errno);
}

// Closes a descriptor and, unless released, removes the temporary file.
class TempFile {
public:
   TempFile(int fd, std::string path) : fd_(fd), path_(std::move(path)) {}
   ~TempFile()
   {
      if (fd_ >= 0) {
         ::close(fd_);
      }
      if (!path_.empty()) {
         ::unlink(path_.c_str());
      }
   }
   TempFile(const TempFile &) = delete;
   TempFile &operator=(const TempFile &) = delete;

   int fd() const { return fd_; }
   const std::string &path() const { return path_; }
   int close()
   {
      const int result = ::close(fd_);
      fd_ = -1;
      return result;
   }
   void release() { path_.clear(); }

private:
   int fd_;
   std::string path_;
};

}  // namespace

std::vector<uint8_t> readStateFile(const std::string &path)
{
   const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
   if (fd < 0) {
      throw StateFileError(path + ": cannot read: " + systemError());
   }
   TempFile file(fd, "");
   struct stat info {};
   if (::fstat(fd, &info) != 0) {
      throw StateFileError(path + ": cannot read: " + systemError());
   }
   if (!S_ISREG(info.st_mode)) {
      throw StateFileError(path + ": not a regular file");
   }
   if (static_cast<uint64_t>(info.st_size) > kMaxStateFileBytes) {
      throw StateFileError(path + ": " + std::to_string(info.st_size) + " bytes is too large for a saved state");
   }
   std::vector<uint8_t> bytes(static_cast<size_t>(info.st_size));
   size_t done = 0;
   while (done < bytes.size()) {
      const ssize_t got = ::read(fd, bytes.data() + done, bytes.size() - done);
      if (got < 0 && errno == EINTR) {
         continue;
      }
      if (got < 0) {
         throw StateFileError(path + ": cannot read: " + systemError());
      }
      if (got == 0) {
         // The file shrank while it was read: keep what is there.
         bytes.resize(done);
         break;
      }
      done += static_cast<size_t>(got);
   }
   return bytes;
}

void writeStateFile(const std::string &path, std::span<const uint8_t> bytes, mode_t mode)
{
   std::vector<char> name(path.begin(), path.end());
   static constexpr char kSuffix[] = ".partial-XXXXXX";
   name.insert(name.end(), kSuffix, kSuffix + sizeof kSuffix);
   const int fd = mkstemp(name.data());
   if (fd < 0) {
      throw StateFileError(path + ": cannot write: " + systemError());
   }
   TempFile file(fd, name.data());
   // mkstemp makes the file owner-only; a state file gets what the caller
   // asks for and the umask allows.
   const mode_t mask = ::umask(0);
   ::umask(mask);
   if (::fchmod(fd, mode & ~mask) != 0) {
      throw StateFileError(path + ": cannot write: " + systemError());
   }
   size_t done = 0;
   while (done < bytes.size()) {
      const ssize_t wrote = ::write(fd, bytes.data() + done, bytes.size() - done);
      if (wrote < 0 && errno == EINTR) {
         continue;
      }
      if (wrote < 0) {
         throw StateFileError(path + ": write failed: " + systemError());
      }
      done += static_cast<size_t>(wrote);
   }
   if (::fsync(fd) != 0 || file.close() != 0) {
      throw StateFileError(path + ": write failed: " + systemError());
   }
   if (std::rename(file.path().c_str(), path.c_str()) != 0) {
      throw StateFileError(path + ": cannot write: " + systemError());
   }
   file.release();
}

}  // namespace swsec::session
