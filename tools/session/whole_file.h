// Reading a whole file of outside bytes, bounded before it is read.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace swsec::session {

// Reads the file open on `fd` into `bytes` and closes `fd`. Anything but a
// regular file (a FIFO, a device, a directory) and a file over `maxBytes`
// are refused before a byte is read; a file that shrinks while it is read
// gives what is there. A refusal or failure is returned as one line naming
// `path` ("PATH: 2000000 bytes is too large for KIND"), for the caller to
// raise as its own error; nothing when the file was read.
std::optional<std::string> readWholeFile(int fd, const std::string &path, uint64_t maxBytes, const char *kind,
                                         std::vector<uint8_t> &bytes);

}  // namespace swsec::session
