// swsec: puts the switch-security module to work in the user-space host.
#include "cli/commands.h"

#include <CLI/CLI.hpp>

#include <cstdio>
#include <exception>

int main(int argc, char **argv)
{
   CLI::App app{"swsec: the switch-security fast path, run in a user-space host"};
   app.require_subcommand(1);

   swsec::tools::InfoOptions info;
   CLI::App *infoCommand =
      app.add_subcommand("info", "load the module, show what it registered, unload it");
   swsec::tools::addInfoOptions(*infoCommand, info);

   swsec::tools::ReplayCommandOptions replay;
   CLI::App *replayCommand =
      app.add_subcommand("replay", "run every frame of a capture through one switch-security port");
   swsec::tools::addReplayOptions(*replayCommand, replay);

   swsec::tools::InlineCommandOptions inlineOptions;
   CLI::App *inlineCommand =
      app.add_subcommand("inline", "guard live Linux bridge ports with the module until stopped");
   swsec::tools::addInlineOptions(*inlineCommand, inlineOptions);

   swsec::tools::CtlCommandOptions ctl;
   CLI::App *ctlCommand = app.add_subcommand("ctl", "ask a running swsec inline");
   swsec::tools::addCtlOptions(*ctlCommand, ctl);

   swsec::tools::StateShowOptions stateShow;
   CLI::App *stateCommand = app.add_subcommand("state", "saved port states");
   swsec::tools::addStateOptions(*stateCommand, stateShow);

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
