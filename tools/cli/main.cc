// swsec: puts the switch-security module to work in the user-space host.
#include "cli/commands.h"

#include <CLI/CLI.hpp>

#include <cstdio>
#include <exception>
#include <string>
#include <vector>

namespace {

// What every subcommand's help ends with: its exit statuses (0, 1 and 2
// mean the same everywhere) and examples.
struct HelpEnd {
   const char *done;
   const char *failed;
   const char *bad;
   std::vector<const char *> examples;
};

std::string footer(const HelpEnd &help)
{
   std::string text = "\nEXIT STATUS\n  0  " + std::string(help.done) + "\n  1  " + help.failed + "\n  2  " +
                      help.bad + "\n\nEXAMPLES\n";
   for (const char *example : help.examples) {
      text += std::string("  ") + example + "\n";
   }
   return text;
}

const HelpEnd kInfoHelp{
   "the module loaded and unloaded cleanly",
   "the module failed to load or left something behind",
   "bad usage (an unknown option or parameter, a value that is not an integer)",
   {"swsec info", "swsec info --json --param SIFRAGENERIC_HEAP_MAX_SIZE=0x400000"}};
const HelpEnd kReplayHelp{
   "every frame was replayed",
   "a port refused its configuration (in the module's words), or the host found a fault (a leak, a port that "
   "would not go)",
   "bad usage or bad input: a missing or corrupt capture, a bad configuration file, MAC or --until, an "
   "unwritable or refused output, a module image that cannot be opened, a bad saved state",
   {"swsec replay --vm-mac 02:00:5e:c0:00:01 --config examples/enforcing.json -v examples/example-dhcp-then-spoof.pcap",
    "swsec replay --json --port vm1=02:00:5e:c0:00:11 --port vm2=02:00:5e:c0:00:12 bridge.pcap | jq '.ports[].portDb'",
    "tcpdump -i br0 -w - | swsec replay --json-lines --vm-mac 02:00:5e:c0:00:01 -"}};
const HelpEnd kInlineHelp{
   "stopped cleanly (SIGTERM or SIGINT)",
   "the start failed (the network, a port the module refused, another swsec on the socket), or the host "
   "found a fault at the stop",
   "bad usage or bad input: options, a configuration file, a module image that cannot be opened",
   {"swsec inline --bridge br0 --port vm1=vnet0 --config examples/enforcing.json",
    "swsec inline --bridge br0 --port vm1=vnet0 --port vm2=vnet1 --port-config vm2=vm2.json --fail open "
    "--state-dir /var/lib/swsec"}};
const HelpEnd kCtlHelp{"done", "the daemon refused the request or is not there",
                       "bad usage: an unknown command, wrong arguments, a file that cannot be read",
                       {"swsec ctl bindings", "swsec ctl --json bindings vm1", "swsec ctl clear vm1 0 02:00:5e:c0:00:01 192.0.2.101",
                        "swsec ctl log -f"}};
const HelpEnd kStateHelp{"the saved state was shown", "(not used)",
                         "bad usage, or a file that is missing or not a well-formed saved state",
                         {"swsec state show /var/lib/swsec/vm1.state", "swsec state show --json vm1.state"}};

}  // namespace

int main(int argc, char **argv)
{
   CLI::App app{"swsec: the switch-security fast path, run in a user-space host"};
   app.require_subcommand(1);
   app.set_version_flag("--version", std::string("swsec ") + swsec::tools::kToolVersion + "\nmodule: " +
                                        swsec::tools::linkedModule()->version);
   app.footer("\nEXIT STATUS\n  0 done, 1 refused or failed while running, 2 bad usage or bad input, in every "
              "subcommand.\n\nSee `swsec COMMAND --help` for each subcommand.\n");

   swsec::tools::InfoOptions info;
   CLI::App *infoCommand =
      app.add_subcommand("info", "load the module, show what it registered, unload it");
   swsec::tools::addInfoOptions(*infoCommand, info);
   infoCommand->footer(footer(kInfoHelp));

   swsec::tools::ReplayCommandOptions replay;
   CLI::App *replayCommand =
      app.add_subcommand("replay", "run every frame of a capture through one switch-security port");
   swsec::tools::addReplayOptions(*replayCommand, replay);
   replayCommand->footer(footer(kReplayHelp));

   swsec::tools::InlineCommandOptions inlineOptions;
   CLI::App *inlineCommand =
      app.add_subcommand("inline", "guard live Linux bridge ports with the module until stopped");
   swsec::tools::addInlineOptions(*inlineCommand, inlineOptions);
   inlineCommand->footer(footer(kInlineHelp));

   swsec::tools::CtlCommandOptions ctl;
   CLI::App *ctlCommand = app.add_subcommand("ctl", "ask a running swsec inline");
   swsec::tools::addCtlOptions(*ctlCommand, ctl);
   ctlCommand->footer(footer(kCtlHelp));

   swsec::tools::StateShowOptions stateShow;
   CLI::App *stateCommand = app.add_subcommand("state", "saved port states");
   swsec::tools::addStateOptions(*stateCommand, stateShow);
   stateCommand->footer(footer(kStateHelp));

   // An unknown word where the subcommand goes is named as such, before
   // the parser calls it a missing subcommand.
   const auto known = app.get_subcommands([&](const CLI::App *sub) { return argc > 1 && sub->check_name(argv[1]); });
   if (argc > 1 && argv[1][0] != '-' && known.empty()) {
      std::fprintf(stderr, "swsec: unknown subcommand \"%s\" (known: info, replay, inline, ctl, state)\n", argv[1]);
      return swsec::tools::kExitUsage;
   }

   try {
      app.parse(argc, argv);
   } catch (const CLI::ParseError &e) {
      return app.exit(e) == 0 ? 0 : swsec::tools::kExitUsage;
   }

   try {
      if (infoCommand->parsed()) {
         return swsec::tools::runInfo(info);
      }
      if (replayCommand->parsed()) {
         return swsec::tools::runReplay(replay);
      }
      if (inlineCommand->parsed()) {
         return swsec::tools::runInline(inlineOptions);
      }
      if (ctlCommand->parsed()) {
         return swsec::tools::runCtl(ctl);
      }
      if (stateCommand->parsed()) {
         return swsec::tools::runStateShow(stateShow);
      }
   } catch (const std::exception &e) {
      std::fprintf(stderr, "swsec: %s\n", e.what());
      return swsec::tools::kExitFailure;
   }
   return swsec::tools::kExitUsage;
}
