// Checks shared by the module's integration tests.
#pragma once

#include "host/host.h"

#include <gtest/gtest.h>

#include <string>
#include <string_view>

namespace swsec::testing {

// "(0xbad0007): Bad parameter", as the module prints a status.
std::string statusText(orr_Status status);

// A record written through the module's log component "swsec" at
// `severity`: "swsec: <function>:<line>: <message>\n". An empty `function`
// stands for any function name.
::testing::AssertionResult loggedWithPrefix(host::Host &host, std::string_view message,
                                            uint32_t severity, std::string_view function = {});

// A severity-2 record written without a component: "<message>\n".
::testing::AssertionResult loggedWithoutLog(host::Host &host, std::string_view message);

// Nothing of the module is left in the host.
void expectNothingLeft(host::Host &host);

}  // namespace swsec::testing
