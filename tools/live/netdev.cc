// iproute2 commands and link queries for the guarded ports.
#include "live/netdev.h"

#include <nlohmann/json.hpp>

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>

extern char **environ;

namespace swsec::live {

namespace {

struct Output {
   int status = -1;
   std::string out;
   std::string err;
};

std::string readAll(int fd)
{
   std::string text;
   char buffer[4096];
   for (;;) {
      const ssize_t got = read(fd, buffer, sizeof buffer);
      if (got > 0) {
         text.append(buffer, static_cast<size_t>(got));
      } else if (got == 0 || errno != EINTR) {
         return text;
      }
   }
}

// ip's output is small (one link, one line of error), so reading stdout to
// the end before stderr cannot fill the other pipe.
Output spawnIp(const std::vector<std::string> &args)
{
   int outPipe[2];
   int errPipe[2];
   if (pipe2(outPipe, O_CLOEXEC) != 0) {
      throw NetdevError(std::string("pipe: ") + std::strerror(errno));
   }
   if (pipe2(errPipe, O_CLOEXEC) != 0) {
      close(outPipe[0]);
      close(outPipe[1]);
      throw NetdevError(std::string("pipe: ") + std::strerror(errno));
   }
   posix_spawn_file_actions_t actions;
   posix_spawn_file_actions_init(&actions);
   posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
   posix_spawn_file_actions_adddup2(&actions, outPipe[1], STDOUT_FILENO);
   posix_spawn_file_actions_adddup2(&actions, errPipe[1], STDERR_FILENO);
   std::vector<std::string> argv{"ip"};
   argv.insert(argv.end(), args.begin(), args.end());
   std::vector<char *> pointers;
   for (auto &arg : argv) {
      pointers.push_back(arg.data());
   }
   pointers.push_back(nullptr);
   pid_t pid = 0;
   const int spawned = posix_spawnp(&pid, "ip", &actions, nullptr, pointers.data(), environ);
   posix_spawn_file_actions_destroy(&actions);
   close(outPipe[1]);
   close(errPipe[1]);
   Output output;
   if (spawned != 0) {
      close(outPipe[0]);
      close(errPipe[0]);
      throw NetdevError(std::string("cannot run ip (iproute2): ") + std::strerror(spawned));
   }
   output.out = readAll(outPipe[0]);
   output.err = readAll(errPipe[0]);
   close(outPipe[0]);
   close(errPipe[0]);
   int status = 0;
   while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
   }
   output.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128;
   while (!output.err.empty() && output.err.back() == '\n') {
      output.err.pop_back();
   }
   return output;
}

std::string commandText(const std::vector<std::string> &args)
{
   std::string text = "ip";
   for (const auto &arg : args) {
      text += " " + arg;
   }
   return text;
}

LinkInfo linkInfo(const nlohmann::json &link, const std::string &name)
{
   LinkInfo info;
   info.ifindex = link.value("ifindex", 0);
   info.name = link.value("ifname", name);
   info.master = link.value("master", "");
   info.mtu = link.value("mtu", 0u);
   info.mac = link.value("address", "");
   const auto flags = link.value("flags", std::vector<std::string>{});
   info.up = std::find(flags.begin(), flags.end(), "UP") != flags.end();
   if (link.contains("linkinfo") && link["linkinfo"].is_object()) {
      info.kind = link["linkinfo"].value("info_kind", "");
   }
   return info;
}

}  // namespace

void runIp(const std::vector<std::string> &args)
{
   const Output output = spawnIp(args);
   if (output.status != 0) {
      throw NetdevError(commandText(args) + ": " + (output.err.empty() ? "failed" : output.err));
   }
}

std::optional<LinkInfo> findLink(const std::string &name)
{
   const Output output = spawnIp({"-j", "-d", "link", "show", "dev", name});
   if (output.status != 0) {
      return std::nullopt;
   }
   const auto document = nlohmann::json::parse(output.out, nullptr, false);
   if (!document.is_array() || document.empty() || !document[0].is_object()) {
      throw NetdevError("ip -j link show dev " + name + ": unexpected output");
   }
   return linkInfo(document[0], name);
}

std::vector<LinkInfo> bridgePorts(const std::string &bridge)
{
   const Output output = spawnIp({"-j", "-d", "link", "show", "master", bridge});
   const auto document = nlohmann::json::parse(output.out, nullptr, false);
   std::vector<LinkInfo> ports;
   if (output.status != 0 || !document.is_array()) {
      return ports;
   }
   for (const auto &link : document) {
      if (link.is_object()) {
         ports.push_back(linkInfo(link, ""));
      }
   }
   return ports;
}

std::optional<bool> ipv6Disabled(const std::string &name)
{
   std::ifstream file("/proc/sys/net/ipv6/conf/" + name + "/disable_ipv6");
   int value = 0;
   if (!(file >> value)) {
      return std::nullopt;
   }
   return value != 0;
}

void setIpv6Disabled(const std::string &name, bool disabled)
{
   std::ofstream file("/proc/sys/net/ipv6/conf/" + name + "/disable_ipv6");
   file << (disabled ? "1\n" : "0\n");
   file.flush();
   if (!file) {
      throw NetdevError("cannot set disable_ipv6 of " + name);
   }
}

}  // namespace swsec::live
