// swsec info: loads the module into the host, shows what it registered
// (module information, parameters, agents, properties, client ports) and
// unloads it, reporting leaks.
#include "cli/commands.h"

#include "host/host.h"
#include "session/error.h"

#include <CLI/CLI.hpp>
#include <nlohmann/json.hpp>

#include <charconv>
#include <cstdio>
#include <iostream>
#include <stdexcept>

namespace swsec::tools {

void addInfoOptions(CLI::App &command, InfoOptions &options)
{
   command.add_flag("--json", options.json, "print one JSON document");
   command.add_flag("-v,--verbose", options.verbose, "also print the module's log lines");
   command.add_option("--param", options.parameters, "module parameter NAME=VALUE (repeatable)");
   command.add_option("--module", options.modulePath, "open this module image instead of the module linked into swsec");
}

namespace {

std::map<std::string, int, std::less<>> parseParameters(const std::vector<std::string> &texts)
{
   std::map<std::string, int, std::less<>> parameters;
   for (const auto &text : texts) {
      const auto [name, number] = nameValue(text, "--param");
      int value = 0;
      const char *first = number.data();
      const char *last = number.data() + number.size();
      int base = 10;
      if (last - first > 2 && first[0] == '0' && (first[1] == 'x' || first[1] == 'X')) {
         first += 2;
         base = 16;
      }
      auto [end, error] = std::from_chars(first, last, value, base);
      if (error != std::errc{} || end != last || first == last) {
         throw std::invalid_argument("--param '" + text + "': value is not an integer");
      }
      parameters[name] = value;
   }
   return parameters;
}

struct Snapshot {
   int loadResult = 1;
   host::ModuleDescription module;
   std::vector<std::string> fastPaths;
   std::vector<std::string> properties;
   std::vector<std::string> clientPorts;
   std::vector<host::LockInfo> locks;
   uint64_t heapLiveBytes = 0;
   uint64_t heapLiveBlocks = 0;
   orr_Status unloadStatus = ORR_OK;
   std::vector<host::LogRecord> log;
   std::vector<std::string> violations;
};

Snapshot takeSnapshot(const InfoOptions &options)
{
   host::Host host;
   Snapshot snap;
   host.setViolationHandler([&snap](const std::string &v) { snap.violations.push_back(v); });
   host::LoadOptions load;
   load.modulePath = options.modulePath;
   if (options.modulePath.empty()) {
      load.linkedModule = linkedModule();
   }
   load.parameters = parseParameters(options.parameters);
   snap.loadResult = host.load(load);
   if (snap.loadResult == 0) {
      snap.module = host.module();
      for (const auto &fp : host.sifra().fastPaths()) {
         snap.fastPaths.push_back(fp.name);
      }
      snap.properties = host.sifra().properties();
      snap.clientPorts = host.plex().clientPorts();
      snap.locks = host.locks().live();
      snap.heapLiveBytes = host.heap().liveBytes();
      snap.heapLiveBlocks = host.heap().liveBlocks();
      snap.unloadStatus = host.unload();
   }
   snap.log = host.log().records();
   return snap;
}

const char *severityName(uint32_t severity)
{
   return severity >= 2 ? "error" : "info";
}

nlohmann::json toJson(const Snapshot &snap)
{
   nlohmann::json doc;
   doc["loaded"] = snap.loadResult == 0;
   if (snap.loadResult == 0) {
      const auto &m = snap.module;
      doc["module"] = {{"name", m.name},
                       {"version", m.version},
                       {"requiredNamespaces", m.requiredNamespaces},
                       {"providedNamespace", m.providedNamespace}};
      auto &params = doc["module"]["parameters"] = nlohmann::json::array();
      for (const auto &p : m.parameters) {
         params.push_back({{"name", p.name}, {"value", p.value}, {"description", p.description}});
      }
      auto &exports = doc["module"]["exports"] = nlohmann::json::array();
      for (const auto &e : m.exports) {
         exports.push_back({{"namespace", e.nameSpace}, {"name", e.name}});
      }
      doc["agents"] = snap.fastPaths;
      doc["properties"] = snap.properties;
      doc["clientPorts"] = snap.clientPorts;
      auto &locks = doc["locks"] = nlohmann::json::array();
      for (const auto &l : snap.locks) {
         locks.push_back({{"name", l.name}, {"type", l.type}, {"rank", l.rank}});
      }
      doc["heap"] = {{"liveBytes", snap.heapLiveBytes}, {"liveBlocks", snap.heapLiveBlocks}};
      doc["unload"] = {{"status", static_cast<uint32_t>(snap.unloadStatus)},
                       {"text", orr_StatusToString(snap.unloadStatus)}};
   }
   doc["violations"] = snap.violations;
   auto &log = doc["log"] = nlohmann::json::array();
   for (const auto &r : snap.log) {
      log.push_back({{"severity", r.severity}, {"text", r.text}});
   }
   return doc;
}

void printText(const Snapshot &snap, bool verbose)
{
   if (snap.loadResult != 0) {
      std::cout << "module failed to load (init_module returned " << snap.loadResult << ")\n";
   } else {
      const auto &m = snap.module;
      std::cout << "module      " << m.name << "  " << m.version << "\n";
      std::cout << "requires    ";
      for (size_t i = 0; i < m.requiredNamespaces.size(); ++i) {
         std::cout << (i ? ", " : "") << m.requiredNamespaces[i];
      }
      std::cout << "\nprovides    " << m.providedNamespace << "\n";
      std::cout << "exports    ";
      for (const auto &e : m.exports) {
         std::cout << " " << e.name;
      }
      std::cout << "\nparameters\n";
      for (const auto &p : m.parameters) {
         std::printf("  %-30s %-12d %s\n", p.name.c_str(), p.value, p.description.c_str());
      }
      std::cout << "agents (fast paths registered, in order)\n";
      for (const auto &name : snap.fastPaths) {
         std::cout << "  " << name << "\n";
      }
      std::cout << "filter properties\n";
      for (const auto &name : snap.properties) {
         std::cout << "  " << name << "\n";
      }
      std::cout << "client-port properties\n";
      for (const auto &name : snap.clientPorts) {
         std::cout << "  " << name << "\n";
      }
      std::cout << "locks\n";
      for (const auto &l : snap.locks) {
         std::printf("  %-28s rank %u%s\n", l.name.c_str(), l.rank,
                     l.type == ORR_SPINLOCK_RW ? "  (reader-writer)" : "");
      }
      std::printf("module heap %llu bytes in %llu blocks while loaded\n",
                  static_cast<unsigned long long>(snap.heapLiveBytes),
                  static_cast<unsigned long long>(snap.heapLiveBlocks));
      std::printf("unloaded    %s\n", snap.unloadStatus == ORR_OK && snap.violations.empty()
                                         ? "cleanly, nothing left behind"
                                         : orr_StatusToString(snap.unloadStatus));
   }
   for (const auto &v : snap.violations) {
      std::cout << "VIOLATION   " << v << "\n";
   }
   if (verbose || snap.loadResult != 0) {
      std::cout << "log\n";
      for (const auto &r : snap.log) {
         std::cout << "  [" << severityName(r.severity) << "] " << r.text;
         if (r.text.empty() || r.text.back() != '\n') {
            std::cout << "\n";
         }
      }
   }
}

}  // namespace

int runInfo(const InfoOptions &options)
{
   Snapshot snap;
   try {
      snap = takeSnapshot(options);
   } catch (const std::invalid_argument &e) {
      std::fprintf(stderr, "swsec info: %s\n", e.what());
      return kExitUsage;
   } catch (const session::InputError &e) {
      std::fprintf(stderr, "swsec info: %s\n", e.what());
      return kExitUsage;
   } catch (const std::runtime_error &e) {
      // The only one thrown: a module image that cannot be opened.
      std::fprintf(stderr, "swsec info: %s\n", e.what());
      return options.modulePath.empty() ? kExitFailure : kExitUsage;
   }
   if (options.json) {
      std::cout << toJson(snap).dump(2) << "\n";
   } else {
      printText(snap, options.verbose);
   }
   bool clean = snap.loadResult == 0 && snap.unloadStatus == ORR_OK && snap.violations.empty();
   return clean ? kExitOk : kExitFailure;
}

}  // namespace swsec::tools
