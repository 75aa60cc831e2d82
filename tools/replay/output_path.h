// Where an output capture is written. A symbolic link is followed to the
// file it names, as tcpdump does, so the link stays; anything that exists
// and is not a regular file (a directory, a device, a pipe) is refused.
#pragma once

#include "replay/capture.h"

#include <sys/types.h>

#include <optional>
#include <string>

namespace swsec::replay {

struct OutputTarget {
   std::string named;                      // as the user gave it, for messages
   std::string path;                       // the file written: links followed
   std::optional<FileIdentity> identity;   // when it exists
   mode_t mode = 0;                        // of the file written
};

// Throws session::InputError naming `path` when it cannot be a capture output.
OutputTarget resolveOutput(const std::string &path);

// Whether two targets are the same file (existing or to be made).
bool sameFile(const OutputTarget &a, const OutputTarget &b);

}  // namespace swsec::replay
