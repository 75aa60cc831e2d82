#include "module_checks.h"

#include <cstdio>
#include <regex>

namespace swsec::testing {

std::string statusText(orr_Status status)
{
   char number[16];
   std::snprintf(number, sizeof(number), "%#x", static_cast<unsigned>(status));
   return std::string("(") + number + "): " + orr_StatusToString(status);
}

static std::string allTexts(host::Host &host)
{
   std::string all;
   for (const auto &record : host.log().records()) {
      all += "  [" + std::to_string(record.severity) + (record.viaNoLevel ? " nolevel] " : "] ") +
             record.text;
   }
   return all;
}

::testing::AssertionResult loggedWithPrefix(host::Host &host, std::string_view message,
                                            uint32_t severity, std::string_view function)
{
   // "swsec: <function>:<line>: " starts the text; function names are plain identifiers.
   const std::string name = function.empty() ? std::string("\\w+") : std::string(function);
   const std::regex prefix("swsec: " + name + ":\\d+: ");
   const std::string tail = std::string(message) + "\n";
   for (const auto &record : host.log().records()) {
      std::smatch match;
      if (record.hasComponent && !record.viaNoLevel && record.severity == severity &&
          std::regex_search(record.text, match, prefix, std::regex_constants::match_continuous) &&
          match.suffix().str() == tail) {
         return ::testing::AssertionSuccess();
      }
   }
   return ::testing::AssertionFailure() << "no severity-" << severity << " record \"" << message
                                        << "\" with the log prefix in:\n"
                                        << allTexts(host);
}

::testing::AssertionResult loggedWithoutLog(host::Host &host, std::string_view message)
{
   for (const auto &record : host.log().records()) {
      if (record.viaNoLevel && !record.hasComponent && record.severity == ORR_LOG_ERROR &&
          record.text == std::string(message) + "\n") {
         return ::testing::AssertionSuccess();
      }
   }
   return ::testing::AssertionFailure() << "no record \"" << message
                                        << "\" written without a log in:\n"
                                        << allTexts(host);
}

void expectNothingLeft(host::Host &host)
{
   EXPECT_FALSE(host.loaded());
   EXPECT_TRUE(host.sifra().fastPaths().empty());
   EXPECT_TRUE(host.sifra().properties().empty());
   EXPECT_TRUE(host.plex().clientPorts().empty());
   EXPECT_TRUE(host.locks().live().empty());
   EXPECT_TRUE(host.locks().domains().empty());
   EXPECT_TRUE(host.portsets().listeners().empty());
   EXPECT_EQ(host.heap().liveBlocks(), 0u);
   EXPECT_EQ(host.clock().pendingTimers(), 0u);
}

}  // namespace swsec::testing
