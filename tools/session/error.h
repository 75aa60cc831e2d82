// The one error a replay reports for bad input: a line naming the file and
// the problem.
#pragma once

#include <stdexcept>
#include <string>

namespace swsec::session {

class InputError : public std::runtime_error {
public:
   using std::runtime_error::runtime_error;
};

}  // namespace swsec::session
