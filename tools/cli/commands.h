// The subcommands of the swsec tool.
#pragma once

#include "platform/orr_module.h"

#include <cstdint>
#include <map>
#include <string>
#include <utility>
#include <vector>

namespace CLI {
class App;
}

namespace swsec::tools {

inline constexpr const char *kToolVersion = "0.1.0";

// Exit statuses shared by every subcommand.
inline constexpr int kExitOk = 0;
inline constexpr int kExitFailure = 1;   // refused or failed while running
inline constexpr int kExitUsage = 2;     // bad command line or bad input

// "NAME=VALUE" as every option that takes one reads it: NAME of letters,
// digits, '.', '_' or '-' (at most 31), VALUE not empty. Throws
// session::InputError naming the option.
std::pair<std::string, std::string> nameValue(const std::string &text, const char *option);

struct InfoOptions {
   bool json = false;
   bool verbose = false;
   std::vector<std::string> parameters;  // NAME=VALUE
   std::string modulePath;               // "" the module linked into swsec
};

// The module linked into swsec: what runs unless --module names an image.
const orr_ModuleInfo *linkedModule();

void addInfoOptions(CLI::App &command, InfoOptions &options);
int runInfo(const InfoOptions &options);

struct ReplayCommandOptions {
   std::string capture;
   std::string vmMac;
   std::vector<std::string> ports;         // NAME=MAC[,MAC...]
   std::vector<std::string> portConfigs;   // NAME=FILE
   std::vector<std::string> networkMacs;
   int vlan = -1;                          // -1: every VLAN
   std::string config;
   std::string until;   // seconds, checked by the command
   uint32_t batch = 32;
   bool json = false;
   bool jsonLines = false;
   bool verbose = false;
   std::string writePassed;
   std::string writeDropped;
   std::string modulePath;               // "" the module linked into swsec
   std::string saveState;
   std::string restoreState;
};

void addReplayOptions(CLI::App &command, ReplayCommandOptions &options);
int runReplay(const ReplayCommandOptions &options);

// Where `swsec inline` listens and `swsec ctl` connects by default.
inline constexpr const char *kDefaultCtlSocket = "/run/swsec.sock";

struct InlineCommandOptions {
   std::string bridge;
   std::vector<std::string> ports;         // NAME=IFACE
   std::string watch;                      // a pattern of interfaces guarded as they join the bridge
   std::string config;                     // every port's, unless --port-config names one
   std::vector<std::string> portConfigs;   // NAME=FILE
   std::string failMode = "closed";
   std::string ctl = kDefaultCtlSocket;
   std::string stateDir;
   std::string modulePath;
   uint32_t batch = 64;
   std::string datapath;                   // "kernel", "user", "" the kernel's where it loads
};

void addInlineOptions(CLI::App &command, InlineCommandOptions &options);
int runInline(const InlineCommandOptions &options);

struct CtlCommandOptions {
   std::string ctl = kDefaultCtlSocket;
   std::vector<std::string> words;         // COMMAND ARGS...
   std::string config;                     // add-port: the new port's configuration file
   bool json = false;
   bool follow = false;
};

void addCtlOptions(CLI::App &command, CtlCommandOptions &options);
int runCtl(const CtlCommandOptions &options);

struct StateShowOptions {
   std::string file;
   bool json = false;
};

// `swsec state show FILE`: the subcommand `state` with its one verb.
void addStateOptions(CLI::App &command, StateShowOptions &options);
int runStateShow(const StateShowOptions &options);

}  // namespace swsec::tools
