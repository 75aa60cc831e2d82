// The control socket's server thread.
#include "live/ctl_server.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <list>
#include <system_error>

namespace swsec::live {

namespace {

using Clock = std::chrono::steady_clock;

// How many of the recent log lines a plain "log" shows.
constexpr size_t kDefaultLogLines = 200;

sockaddr_un socketAddress(const std::string &path)
{
   sockaddr_un address{};
   address.sun_family = AF_UNIX;
   if (path.empty() || path.size() >= sizeof address.sun_path) {
      throw std::runtime_error(path + ": not a usable socket path (1 to " +
                               std::to_string(sizeof address.sun_path - 1) + " bytes)");
   }
   std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
   return address;
}

std::runtime_error systemError(const std::string &what)
{
   return std::runtime_error(what + ": " + std::strerror(errno));
}

// A socket file left by a run that died is replaced; a live one or a
// file of another kind is not ours to remove.
void clearStaleSocket(const std::string &path, const sockaddr_un &address)
{
   struct stat info{};
   if (lstat(path.c_str(), &info) != 0) {
      return;
   }
   if (!S_ISSOCK(info.st_mode)) {
      throw std::runtime_error(path + ": exists and is not a socket");
   }
   const int probe = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
   if (probe < 0) {
      throw systemError("socket");
   }
   const bool live = connect(probe, reinterpret_cast<const sockaddr *>(&address), sizeof address) == 0;
   close(probe);
   if (live) {
      throw std::runtime_error(path + ": another swsec inline is listening there");
   }
   if (unlink(path.c_str()) != 0) {
      throw systemError(path);
   }
}

}  // namespace

struct CtlServer::Client {
   int fd = -1;
   std::string in;
   std::string out;
   bool closeAfterWrite = false;
   bool following = false;
   EventKind followKind = EventKind::log;
   uint64_t lastSeq = 0;
   Clock::time_point requestStarted{};
};

CtlServer::CtlServer(std::string path, EventHub &events, CtlHandler &handler)
   : path_(std::move(path)), events_(events), handler_(handler)
{
   const sockaddr_un address = socketAddress(path_);
   clearStaleSocket(path_, address);
   listen_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
   if (listen_ < 0) {
      throw systemError("socket");
   }
   // Owner only from the start: the mode is set by the umask at bind, then
   // made sure of.
   const mode_t oldMask = umask(0177);
   const int bound = bind(listen_, reinterpret_cast<const sockaddr *>(&address), sizeof address);
   umask(oldMask);
   if (bound != 0 || chmod(path_.c_str(), 0600) != 0 || listen(listen_, 16) != 0) {
      const auto error = systemError(path_);
      close(listen_);
      if (bound == 0) {
         unlink(path_.c_str());
      }
      throw error;
   }
   stop_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
   if (stop_ < 0) {
      const auto error = systemError("eventfd");
      close(listen_);
      unlink(path_.c_str());
      throw error;
   }
   thread_ = std::thread([this] { serve(); });
}

CtlServer::~CtlServer()
{
   const uint64_t one = 1;
   (void)!write(stop_, &one, sizeof one);
   thread_.join();
   close(stop_);
   close(listen_);
   unlink(path_.c_str());
}

void CtlServer::serve()
{
   std::list<Client> clients;
   std::vector<pollfd> fds;
   std::vector<Client *> order;
   auto reply = [](Client &client, const nlohmann::json &message) { client.out += message.dump() + "\n"; };
   auto fail = [&](Client &client, const std::string &message) {
      reply(client, {{"ok", false}, {"error", message}});
   };

   auto recentLog = [&] {
      nlohmann::json lines = nlohmann::json::array();
      const auto recent = events_.since(EventKind::log, 0);
      const size_t skip = recent.size() > kDefaultLogLines ? recent.size() - kDefaultLogLines : 0;
      for (size_t i = skip; i < recent.size(); ++i) {
         lines.push_back(recent[i].body);
      }
      return lines;
   };

   auto handleLine = [&](Client &client, const std::string &line) {
      const auto request = nlohmann::json::parse(line, nullptr, false);
      if (request.is_discarded() || !request.is_object() || !request.contains("command") ||
          !request["command"].is_string()) {
         fail(client, "not a request: one JSON object with a \"command\" a line");
         client.closeAfterWrite = true;
         return;
      }
      const std::string command = request["command"];
      if (command == "watch" || (command == "log" && request.value("follow", false))) {
         client.following = true;
         client.followKind = command == "watch" ? EventKind::notification : EventKind::log;
         // A followed log starts with the recent lines; a watch with what comes next.
         client.lastSeq = events_.lastSeq();
         reply(client, {{"ok", true},
                        {"result", command == "log" ? recentLog() : nlohmann::json::array()},
                        {"streaming", true}});
         return;
      }
      if (command == "log") {
         reply(client, {{"ok", true}, {"result", recentLog()}});
         return;
      }
      try {
         reply(client, {{"ok", true}, {"result", handler_.handle(request)}});
      } catch (const CtlError &e) {
         fail(client, e.what());
      } catch (const std::exception &e) {
         fail(client, std::string("failed: ") + e.what());
      }
   };

   for (;;) {
      fds.clear();
      order.clear();
      fds.push_back({stop_, POLLIN, 0});
      fds.push_back({listen_, POLLIN, 0});
      fds.push_back({events_.wakeFd(), POLLIN, 0});
      for (Client &client : clients) {
         short events = client.closeAfterWrite ? 0 : POLLIN;
         if (!client.out.empty()) {
            events |= POLLOUT;
         }
         fds.push_back({client.fd, events, 0});
         order.push_back(&client);
      }
      if (poll(fds.data(), fds.size(), 1000) < 0 && errno != EINTR) {
         return;
      }
      if ((fds[0].revents & POLLIN) != 0) {
         break;
      }
      if ((fds[2].revents & POLLIN) != 0) {
         events_.drainWake();
      }
      // New events to every follower.
      for (Client &client : clients) {
         if (!client.following) {
            continue;
         }
         for (const auto &event : events_.since(client.followKind, client.lastSeq)) {
            client.out += event.body.dump() + "\n";
            client.lastSeq = event.seq;
         }
         client.lastSeq = std::max(client.lastSeq, events_.lastSeq());
      }
      for (size_t i = 0; i < order.size(); ++i) {
         Client &client = *order[i];
         const short revents = fds[i + 3].revents;
         if ((revents & (POLLIN | POLLHUP | POLLERR)) != 0 && !client.closeAfterWrite) {
            char buffer[16384];
            const ssize_t got = recv(client.fd, buffer, sizeof buffer, MSG_DONTWAIT);
            if (got == 0) {
               // The client is done sending: its replies still go out.
               client.closeAfterWrite = true;
               client.following = false;
            } else if (got < 0 && errno != EAGAIN && errno != EINTR) {
               client.closeAfterWrite = true;
               client.out.clear();
            } else if (got > 0 && !client.following) {
               if (client.in.empty()) {
                  client.requestStarted = Clock::now();
               }
               client.in.append(buffer, static_cast<size_t>(got));
               size_t newline;
               while (!client.closeAfterWrite && !client.following &&
                      (newline = client.in.find('\n')) != std::string::npos) {
                  const std::string line = client.in.substr(0, newline);
                  client.in.erase(0, newline + 1);
                  client.requestStarted = Clock::now();
                  handleLine(client, line);
               }
               if (client.in.size() > kMaxRequestBytes) {
                  fail(client, "request longer than " + std::to_string(kMaxRequestBytes) + " bytes");
                  client.in.clear();
                  client.closeAfterWrite = true;
               }
            }
         }
         if ((revents & POLLOUT) != 0 && !client.out.empty()) {
            const ssize_t sent = send(client.fd, client.out.data(), client.out.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
            if (sent > 0) {
               client.out.erase(0, static_cast<size_t>(sent));
            } else if (sent < 0 && errno != EAGAIN && errno != EINTR) {
               client.out.clear();
               client.closeAfterWrite = true;
            }
         }
      }
      // Cut off: done, stalled mid-request, or too far behind a stream.
      const auto now = Clock::now();
      for (auto it = clients.begin(); it != clients.end();) {
         const bool stalled = !it->in.empty() && now - it->requestStarted > std::chrono::milliseconds(kRequestTimeoutMs);
         const bool lagging = it->out.size() > kMaxQueuedBytes;
         if ((it->closeAfterWrite && it->out.empty()) || stalled || lagging) {
            close(it->fd);
            it = clients.erase(it);
         } else {
            ++it;
         }
      }
      if ((fds[1].revents & POLLIN) != 0) {
         for (;;) {
            const int fd = accept4(listen_, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
            if (fd < 0) {
               break;
            }
            ucred peer{};
            socklen_t length = sizeof peer;
            const bool allowed = getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &length) == 0 &&
                                 (peer.uid == 0 || peer.uid == geteuid());
            if (!allowed || clients.size() >= kMaxClients) {
               const std::string message =
                  nlohmann::json{{"ok", false}, {"error", allowed ? "too many clients" : "not allowed"}}.dump() + "\n";
               (void)!send(fd, message.data(), message.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
               close(fd);
               continue;
            }
            Client &client = clients.emplace_back();
            client.fd = fd;
         }
      }
   }
   for (Client &client : clients) {
      close(client.fd);
   }
}

}  // namespace swsec::live
