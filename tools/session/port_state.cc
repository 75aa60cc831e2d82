// Saving and restoring a port's state through the host's migration calls,
// with the module's log lines as the message of a refusal.
#include "session/port_state.h"

#include "session/ipv6_saved_state.h"
#include "session/saved_state_format.h"

#include <regex>
#include <string>

namespace swsec::session {

namespace {

// The module's message without the log prefix ("<log>: <function>:<line>: ")
// and the final newline.
std::string messageText(const std::string &text)
{
   static const std::regex kPrefix(R"(^[^:]*: [A-Za-z_][A-Za-z0-9_]*:[0-9]+: )");
   std::string message = std::regex_replace(text, kPrefix, "", std::regex_constants::format_first_only);
   while (!message.empty() && message.back() == '\n') {
      message.pop_back();
   }
   return message;
}

// What the module said since `from`: its error lines, or its other lines
// when it gave none, joined on one line; the status's text when silent.
std::string moduleMessage(host::Host &host, size_t from, orr_Status status)
{
   const auto records = host.log().records();
   std::string errors;
   std::string others;
   for (size_t i = from; i < records.size(); ++i) {
      std::string &into = records[i].severity >= 2 ? errors : others;
      into += (into.empty() ? "" : "; ") + messageText(records[i].text);
   }
   if (!errors.empty()) {
      return errors;
   }
   return !others.empty() ? others : std::string(orr_StatusToString(status));
}

}  // namespace

std::vector<uint8_t> savePortState(host::Host &host, host::FilterId port)
{
   const size_t from = host.log().records().size();
   std::vector<uint8_t> blob;
   const orr_Status status = host.migration().saveAsHypervisor(port, &blob);
   if (status != ORR_OK) {
      throw StateRefused("the port's state could not be saved: " + moduleMessage(host, from, status));
   }
   return blob;
}

void restorePortState(host::Host &host, host::FilterId port, std::span<const uint8_t> blob)
{
   // One judgement for `state show` and a restore: what the decoder
   // refuses never reaches the module.
   try {
      if (isIpv6SavedState(blob)) {
         (void)decodeIpv6SavedState(blob);
      } else {
         (void)decodeSavedState(blob);
      }
   } catch (const BadSavedState &e) {
      throw StateRefused(e.what());
   }
   const size_t from = host.log().records().size();
   const orr_Status status = host.migration().restore(port, blob);
   if (status != ORR_OK) {
      throw StateRefused(moduleMessage(host, from, status));
   }
}

}  // namespace swsec::session
