#include "module_checks.h"

#include <cctype>
#include <cstdio>

namespace swsec::testing {

std::string statusText(orr_Status status)
{
   char number[16];
   std::snprintf(number, sizeof(number), "%#x", static_cast<unsigned>(status));
   return std::string("(") + number + "): " + orr_StatusToString(status);
}

size_t countRecords(host::Host &host, std::string_view needle)
{
   return host.log().count(needle);
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

// Length of "swsec: <function>:<line>: " at the start of `text`, or 0.
static size_t prefixLength(const std::string &text, std::string_view function)
{
   auto isName = [](char c) { return std::isalnum(static_cast<unsigned char>(c)) || c == '_'; };
   const std::string head = "swsec: ";
   if (text.rfind(head, 0) != 0) {
      return 0;
   }
   size_t at = head.size();
   if (!function.empty()) {
      at = text.compare(at, function.size(), function) == 0 ? at + function.size() : 0;
   } else {
      while (at < text.size() && isName(text[at])) {
         at++;
      }
   }
   const size_t line = at + 1;
   if (at <= head.size() || text.size() <= line || text[at] != ':') {
      return 0;
   }
   at = line;
   while (at < text.size() && std::isdigit(static_cast<unsigned char>(text[at]))) {
      at++;
   }
   return at > line && text.compare(at, 2, ": ") == 0 ? at + 2 : 0;
}

::testing::AssertionResult loggedWithPrefix(host::Host &host, std::string_view message,
                                            uint32_t severity, std::string_view function)
{
   const std::string tail = std::string(message) + "\n";
   for (const auto &record : host.log().records()) {
      const size_t prefix = prefixLength(record.text, function);
      if (record.hasComponent && !record.viaNoLevel && record.severity == severity && prefix != 0 &&
          record.text.substr(prefix) == tail) {
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
