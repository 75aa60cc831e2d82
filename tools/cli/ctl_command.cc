// swsec ctl: one request to a running swsec inline, its reply shown for a
// person (default) or as JSON (--json, the reply's "result" as the daemon
// sent it). "metrics" shows the counters in the Prometheus text format.
#include "cli/commands.h"

#include "cli/ctl_format.h"
#include "live/ctl_commands.h"
#include "session/config_file.h"
#include "session/error.h"
#include "session/json_text.h"

#include <CLI/CLI.hpp>
#include <nlohmann/json.hpp>

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <iostream>

namespace swsec::tools {

void addCtlOptions(CLI::App &command, CtlCommandOptions &options)
{
   command.add_option("--ctl", options.ctl, "control socket path");
   command.add_flag("--json", options.json, "print the reply as JSON (streams: one object a line)");
   command.add_flag("-f,--follow", options.follow, "log: go on showing lines as they come");
   command.add_option("--config", options.config, "add-port: the new port's configuration file");
   std::string commands;
   for (const live::CtlCommand &ctl : live::kCtlCommands) {
      const std::string usage = ctl.name + std::string(*ctl.arguments != 0 ? " " : "") + ctl.arguments;
      commands += "\n  " + usage + std::string(usage.size() < 25 ? 27 - usage.size() : 2, ' ') + ctl.what;
   }
   command.add_option("COMMAND", options.words, "the command and its arguments:" + commands)->required();
}

namespace {

constexpr int kReplyTimeoutMs = 15'000;

class UsageError : public std::runtime_error {
public:
   using std::runtime_error::runtime_error;
};

// Read here, with the caller's own rights; the daemon gets the text.
std::string fileText(const std::string &path)
{
   try {
      return session::readConfigText(path);
   } catch (const session::InputError &e) {
      throw UsageError(e.what());
   }
}

nlohmann::json buildRequest(const CtlCommandOptions &options)
{
   const auto &words = options.words;
   const std::string &command = words[0];
   const live::CtlCommand *known = live::findCtlCommand(command);
   if (known == nullptr) {
      throw UsageError("unknown command '" + command + "' (" + live::ctlCommandNames(true) + ")");
   }
   const size_t given = words.size() - 1;
   // clear takes a port alone or a port and a whole key.
   if (given < known->leastArguments || given > known->mostArguments || (command == "clear" && (given == 2 || given == 3))) {
      throw UsageError(command + ": expected " + command + " " + known->arguments);
   }
   nlohmann::json request = {{"command", command}};
   if (command == "metrics") {
      request["command"] = "counters";
   } else if (command == "log") {
      request["follow"] = options.follow;
   } else if ((command == "bindings" || command == "summary" || command == "clear") && given >= 1) {
      request["port"] = words[1];
      if (given == 4) {
         request["key"] = {words[2], words[3], words[4]};
      }
   } else if (command == "config") {
      request["port"] = words[1];
      request["text"] = fileText(words[2]);
      request["origin"] = words[2];
   } else if (command == "add-port") {
      const auto [name, iface] = nameValue(words[1], "add-port");
      request["port"] = name;
      request["interface"] = iface;
      if (!options.config.empty()) {
         request["text"] = fileText(options.config);
         request["origin"] = options.config;
      }
   } else if (command == "remove-port") {
      request["port"] = words[1];
   }
   return request;
}

int connectTo(const std::string &path)
{
   sockaddr_un address{};
   address.sun_family = AF_UNIX;
   if (path.size() >= sizeof address.sun_path) {
      throw UsageError(path + ": socket path too long");
   }
   std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
   const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
   if (fd < 0 || connect(fd, reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0) {
      const std::string error = std::strerror(errno);
      if (fd >= 0) {
         close(fd);
      }
      throw std::runtime_error(path + ": " + error + " (is swsec inline running?)");
   }
   return fd;
}

// Lines from the socket; `timeoutMs` < 0 waits for ever (streams).
class LineReader {
public:
   explicit LineReader(int fd) : fd_(fd) {}
   bool next(std::string &line, int timeoutMs)
   {
      for (;;) {
         const size_t newline = buffer_.find('\n');
         if (newline != std::string::npos) {
            line = buffer_.substr(0, newline);
            buffer_.erase(0, newline + 1);
            return true;
         }
         pollfd fd{fd_, POLLIN, 0};
         const int ready = poll(&fd, 1, timeoutMs);
         if (ready == 0) {
            throw std::runtime_error("no reply from swsec inline");
         }
         if (ready < 0) {
            if (errno == EINTR) {
               continue;
            }
            throw std::runtime_error(std::string("poll: ") + std::strerror(errno));
         }
         char chunk[16384];
         const ssize_t got = recv(fd_, chunk, sizeof chunk, 0);
         if (got <= 0) {
            return false;
         }
         buffer_.append(chunk, static_cast<size_t>(got));
      }
   }

private:
   int fd_;
   std::string buffer_;
};

}  // namespace

int runCtl(const CtlCommandOptions &options)
{
   nlohmann::json request;
   try {
      request = buildRequest(options);
   } catch (const UsageError &e) {
      std::fprintf(stderr, "swsec ctl: %s\n", e.what());
      return kExitUsage;   } catch (const session::InputError &e) {
      std::fprintf(stderr, "swsec ctl: %s\n", e.what());
      return kExitUsage;
   }
   const std::string &command = options.words[0];
   int fd = -1;
   try {
      fd = connectTo(options.ctl);
   } catch (const std::exception &e) {
      std::fprintf(stderr, "swsec ctl: %s\n", e.what());
      return kExitFailure;
   }
   const std::string line = session::jsonText(request) + "\n";
   if (send(fd, line.data(), line.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(line.size())) {
      std::fprintf(stderr, "swsec ctl: %s: %s\n", options.ctl.c_str(), std::strerror(errno));
      close(fd);
      return kExitFailure;
   }
   LineReader reader(fd);
   std::string text;
   int status = kExitOk;
   try {
      if (!reader.next(text, kReplyTimeoutMs)) {
         throw std::runtime_error("swsec inline closed the connection");
      }
      const auto reply = nlohmann::json::parse(text, nullptr, false);
      if (reply.is_discarded() || !reply.is_object()) {
         throw std::runtime_error("unreadable reply from swsec inline");
      }
      if (!reply.value("ok", false)) {
         std::fprintf(stderr, "swsec ctl: %s: %s\n", command.c_str(), reply.value("error", "failed").c_str());
         close(fd);
         return kExitFailure;
      }
      const nlohmann::json &result = reply["result"];
      if (command == "metrics") {
         std::cout << ctl::metricsText(result);
      } else if (options.json) {
         std::cout << (reply.value("streaming", false) ? "" : session::jsonText(result, 1) + "\n");
         if (reply.value("streaming", false)) {
            for (const auto &entry : result) {
               std::cout << session::jsonText(entry) << "\n";
            }
         }
      } else {
         std::cout << ctl::humanText(command, result);
      }
      std::cout.flush();
      if (reply.value("streaming", false)) {
         while (reader.next(text, -1)) {
            const auto event = nlohmann::json::parse(text, nullptr, false);
            if (event.is_discarded()) {
               continue;
            }
            std::cout << (options.json ? session::jsonText(event) + "\n" : ctl::eventText(command, event)) << std::flush;
         }
         std::fprintf(stderr, "swsec ctl: swsec inline closed the connection\n");
         status = kExitFailure;
      }
   } catch (const std::exception &e) {
      std::fprintf(stderr, "swsec ctl: %s\n", e.what());
      status = kExitFailure;
   }
   close(fd);
   return status;
}

}  // namespace swsec::tools
