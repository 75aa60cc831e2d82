// Violations: problems the host finds at a boundary (a leak at unload, an
// unknown handle, objects left behind by a failed load). Each is recorded
// and handed to the handler, which by default prints it and aborts.
//
// Misuse that a real kernel could not survive (lock order, sleeping under a
// spinlock) does not come here: it aborts at once through fatal().
#pragma once

#include "host/host.h"

#include <mutex>
#include <string>
#include <vector>

namespace swsec::host {

class Violations {
public:
   // Records the violation and calls the handler outside any host lock the
   // caller does not hold itself; callers report after releasing their own.
   void report(std::string violation);
   void reportAll(std::vector<std::string> violations);
   std::vector<std::string> list() const;
   void setHandler(ViolationHandler handler);

private:
   mutable std::mutex mutex_;
   std::vector<std::string> list_;
   ViolationHandler handler_;
};

// "0x7f..." for reports.
std::string pointerText(const void *pointer);

// Prints "swsec host: <message>" to stderr and aborts.
[[noreturn]] void fatal(const std::string &message);

}  // namespace swsec::host
