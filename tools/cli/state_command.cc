// swsec state show: a saved-state file decoded for a person (or, with
// --json, a program) without loading a port.
#include "cli/commands.h"

#include "session/ipv6_saved_state.h"
#include "session/saved_state_format.h"
#include "session/json_text.h"
#include "session/state_file.h"

#include <CLI/CLI.hpp>

#include <cstdio>
#include <ctime>
#include <iostream>

namespace swsec::tools {

void addStateOptions(CLI::App &command, StateShowOptions &options)
{
   command.require_subcommand(1);
   CLI::App *show = command.add_subcommand("show", "decode a saved state: header, configuration, counters, bindings");
   show->add_option("FILE", options.file, "saved-state file (swsec replay --save-state)")->required();
   show->add_flag("--json", options.json, "print one JSON document");
}

int runStateShow(const StateShowOptions &options)
{
   try {
      const session::StoredState stored = session::readStoredState(options.file);
      // An IPv6 agent's state (swsec inline keeps it in NAME.state6) or a switch-security one.
      const bool ipv6 = session::isIpv6SavedState(stored.blob);
      const session::SavedIpv6State ipv6State =
         ipv6 ? session::decodeIpv6SavedState(stored.blob) : session::SavedIpv6State{};
      const session::SavedPortState state = ipv6 ? ipv6State.header : session::decodeSavedState(stored.blob);
      if (options.json) {
         nlohmann::json doc = ipv6 ? session::ipv6SavedStateJson(ipv6State) : session::savedStateJson(state);
         // Seconds since 1970 of the save, null for a bare blob.
         doc["savedAt"] = stored.savedAtUs ? nlohmann::json(static_cast<double>(*stored.savedAtUs) / 1e6) : nullptr;
         std::cout << session::jsonText(doc, 1) << "\n";
      } else {
         if (stored.savedAtUs) {
            const std::time_t seconds = static_cast<std::time_t>(*stored.savedAtUs / 1'000'000);
            char text[64];
            std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S UTC", std::gmtime(&seconds));
            std::cout << "Saved at " << text << "\n";
         }
         if (ipv6) {
            session::printIpv6SavedState(std::cout, ipv6State);
         } else {
            session::printSavedState(std::cout, state);
         }
      }
      return kExitOk;
   } catch (const session::StateFileError &e) {
      std::fprintf(stderr, "swsec state: %s\n", e.what());
      return kExitUsage;
   } catch (const session::BadSavedState &e) {
      std::fprintf(stderr, "swsec state: %s: %s\n", options.file.c_str(), e.what());
      return kExitUsage;
   }
}

}  // namespace swsec::tools
