// The control socket's server thread.
#include "live/ctl_server.h"

#include "session/json_text.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
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
   ucred owner{};
   socklen_t length = sizeof owner;
   const bool known = live && getsockopt(probe, SOL_SOCKET, SO_PEERCRED, &owner, &length) == 0 && owner.pid > 0;
   close(probe);
   if (live) {
      throw std::runtime_error(path + ": another swsec inline is listening there" +
                               (known ? " (PID " + std::to_string(owner.pid) + ")" : std::string()));
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
   Clock::time_point lastActive{};
};

CtlAnswer answerRequest(std::string_view line, EventHub &events, CtlHandler &handler)
{
   CtlAnswer answer;
   auto fail = [&answer](const std::string &message) {
      answer.reply = session::jsonText({{"ok", false}, {"error", message}}) + "\n";
   };
   nlohmann::json request;
   if (session::jsonDepth(line) <= session::kMaxJsonDepth) {
      request = nlohmann::json::parse(line, nullptr, false);
   } else {
      request = nlohmann::json::value_t::discarded;
   }
   if (request.is_discarded() || !request.is_object() || !request.contains("command") ||
       !request["command"].is_string()) {
      fail("not a request: one JSON object with a \"command\" a line");
      answer.close = true;
      return answer;
   }
   const std::string command = request["command"];
   const auto follow = request.find("follow");
   if (follow != request.end() && !follow->is_boolean()) {
      fail("\"follow\" must be true or false");
      return answer;
   }
   if (command == "watch" || command == "log") {
      // A followed log starts with the recent lines; a watch with what comes next.
      nlohmann::json result = nlohmann::json::array();
      if (command == "log") {
         const auto recent = events.since(EventKind::log, 0);
         const size_t skip = recent.size() > kDefaultLogLines ? recent.size() - kDefaultLogLines : 0;
         for (size_t i = skip; i < recent.size(); ++i) {
            result.push_back(recent[i].body);
         }
      }
      answer.follow = command == "watch" || (follow != request.end() && follow->get<bool>());
      answer.followKind = command == "watch" ? EventKind::notification : EventKind::log;
      nlohmann::json reply = {{"ok", true}, {"result", std::move(result)}};
      if (answer.follow) {
         reply["streaming"] = true;
      }
      answer.reply = session::jsonText(reply) + "\n";
      return answer;
   }
   try {
      answer.reply = session::jsonText({{"ok", true}, {"result", handler.handle(request)}}) + "\n";
   } catch (const CtlError &e) {
      fail(e.what());
   } catch (const std::exception &e) {
      fail(std::string("failed: ") + e.what());
   }
   return answer;
}

CtlServer::CtlServer(std::string path, EventHub &events, CtlHandler &handler, CtlLimits limits)
   : path_(std::move(path)), events_(events), handler_(handler), limits_(limits)
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
   auto handleLine = [&](Client &client, const std::string &line) {
      const CtlAnswer answer = answerRequest(line, events_, handler_);
      client.out += answer.reply;
      client.closeAfterWrite = answer.close;
      if (answer.follow) {
         const size_t followers = static_cast<size_t>(
            std::count_if(clients.begin(), clients.end(), [](const Client &c) { return c.following; }));
         if (followers >= limits_.maxFollowers) {
            client.out = session::jsonText({{"ok", false},
                                           {"error", "too many streams (" + std::to_string(followers) + ")"}}) +
                         "\n";
            client.closeAfterWrite = true;
            return;
         }
         client.following = true;
         client.followKind = answer.followKind;
         client.lastSeq = events_.lastSeq();
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
            client.out += session::jsonText(event.body) + "\n";
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
               client.lastActive = Clock::now();
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
                  client.out += session::jsonText({{"ok", false},
                                                  {"error", "request longer than " +
                                                               std::to_string(kMaxRequestBytes) + " bytes"}}) +
                                "\n";
                  client.in.clear();
                  client.closeAfterWrite = true;
               }
            }
         }
         if ((revents & POLLOUT) != 0 && !client.out.empty()) {
            const ssize_t sent = send(client.fd, client.out.data(), client.out.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
            if (sent > 0) {
               client.out.erase(0, static_cast<size_t>(sent));
               client.lastActive = Clock::now();
            } else if (sent < 0 && errno != EAGAIN && errno != EINTR) {
               client.out.clear();
               client.closeAfterWrite = true;
            }
         }
      }
      // Cut off: done, stalled mid-request, idle, or too far behind a stream.
      const auto now = Clock::now();
      const auto idle = [&now](const Client &client) {
         return client.following || !client.in.empty() || !client.out.empty() ? Clock::duration::zero()
                                                                             : now - client.lastActive;
      };
      for (auto it = clients.begin(); it != clients.end();) {
         const bool stalled =
            !it->in.empty() && now - it->requestStarted > std::chrono::milliseconds(limits_.requestTimeoutMs);
         const bool lagging = it->out.size() > kMaxQueuedBytes;
         const bool idled = idle(*it) > std::chrono::milliseconds(limits_.idleTimeoutMs);
         if ((it->closeAfterWrite && it->out.empty()) || stalled || lagging || idled) {
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
            if (allowed && clients.size() >= limits_.maxClients) {
               // Full: the connection idle the longest makes room.
               auto oldest = std::max_element(clients.begin(), clients.end(), [&idle](const Client &a, const Client &b) {
                  return idle(a) < idle(b);
               });
               if (oldest != clients.end() && idle(*oldest) > Clock::duration::zero()) {
                  close(oldest->fd);
                  clients.erase(oldest);
               }
            }
            if (!allowed || clients.size() >= limits_.maxClients) {
               const std::string message =
                  session::jsonText({{"ok", false}, {"error", allowed ? "too many clients" : "not allowed"}}) + "\n";
               (void)!send(fd, message.data(), message.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
               close(fd);
               continue;
            }
            Client &client = clients.emplace_back();
            client.fd = fd;
            client.lastActive = Clock::now();
         }
      }
   }
   for (Client &client : clients) {
      close(client.fd);
   }
}

}  // namespace swsec::live
