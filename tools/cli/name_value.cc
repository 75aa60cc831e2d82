// The one reading of NAME=VALUE arguments.
#include "cli/commands.h"

#include "session/error.h"

#include <algorithm>

namespace swsec::tools {

std::pair<std::string, std::string> nameValue(const std::string &text, const char *option)
{
   const size_t equals = text.find('=');
   const std::string name = text.substr(0, std::min(equals, text.size()));
   const bool nameOk = !name.empty() && name.size() <= 31 &&
                       name.find_first_not_of("abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789._-") ==
                          std::string::npos;
   if (equals == std::string::npos || !nameOk || equals + 1 == text.size()) {
      throw session::InputError(std::string(option) + " \"" + text.substr(0, 60) +
                                "\": expected NAME=VALUE, NAME of letters, digits, '.', '_' or '-' (at most 31)");
   }
   return {name, text.substr(equals + 1)};
}

}  // namespace swsec::tools
