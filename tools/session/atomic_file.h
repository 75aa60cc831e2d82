// A file written whole or not at all: the bytes go to a temporary file beside
// the target, which commit() syncs and renames over it; destroyed without a
// commit, it removes the temporary file and leaves the target as it was.
//
// Symbolic links: the file at `path` is replaced, never written through, so a
// link there is replaced by the file and what it named is left alone. A caller
// that means to write where a link points (the pcap outputs, as tcpdump does)
// resolves the path first and gives the file the link names.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <span>
#include <string>

namespace swsec::session {

class AtomicFile {
public:
   // Makes the temporary file with exactly `mode` (the caller applies the
   // umask where it should). Failures here and below throw InputError naming
   // `named` (the path as the user gave it; `path` when empty).
   AtomicFile(std::string path, mode_t mode, std::string named = {});
   ~AtomicFile();
   AtomicFile(const AtomicFile &) = delete;
   AtomicFile &operator=(const AtomicFile &) = delete;

   // The temporary file's descriptor, still owned by this writer.
   int fd() const { return fd_; }
   const std::string &named() const { return named_; }
   void write(std::span<const uint8_t> bytes);
   void commit();

private:
   void discard();
   [[noreturn]] void fail(const char *what);

   std::string path_;
   std::string named_;
   std::string tempPath_;
   int fd_ = -1;
};

// The process's umask, read without changing it for longer than the call.
mode_t currentUmask();

}  // namespace swsec::session
