#include "host/violations.h"

#include <cstdio>
#include <cstdlib>
#include <utility>

namespace swsec::host {

void Violations::report(std::string violation)
{
   ViolationHandler handler;
   {
      std::lock_guard guard(mutex_);
      list_.push_back(violation);
      handler = handler_;
   }
   if (handler) {
      handler(violation);
      return;
   }
   fatal(violation);
}

void Violations::reportAll(std::vector<std::string> violations)
{
   for (auto &violation : violations) {
      report(std::move(violation));
   }
}

std::vector<std::string> Violations::list() const
{
   std::lock_guard guard(mutex_);
   return list_;
}

void Violations::setHandler(ViolationHandler handler)
{
   std::lock_guard guard(mutex_);
   handler_ = std::move(handler);
}

std::string pointerText(const void *pointer)
{
   char text[32];
   std::snprintf(text, sizeof text, "%p", pointer);
   return text;
}

void fatal(const std::string &message)
{
   std::fprintf(stderr, "swsec host: %s\n", message.c_str());
   std::fflush(stderr);
   std::abort();
}

}  // namespace swsec::host
