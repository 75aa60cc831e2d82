// The control socket of a running `swsec inline`: a Unix stream socket,
// mode 0600, one JSON request a line and one JSON reply a line; "watch"
// and "log" with "follow" then stream one JSON event a line. One thread
// serves every client with non-blocking I/O: a client that sends junk gets
// an error, one that stalls mid-request or stops reading a stream is cut
// off, and neither holds up the frames or the other clients.
#pragma once

#include "live/events.h"

#include <nlohmann/json.hpp>

#include <atomic>
#include <cstdint>
#include <stdexcept>
#include <string>
#include <string_view>
#include <thread>

namespace swsec::live {

// A request that cannot be answered: the message goes back to the client.
class CtlError : public std::runtime_error {
public:
   using std::runtime_error::runtime_error;
};

class CtlHandler {
public:
   virtual ~CtlHandler() = default;
   // The reply's "result" for one request ({"command": ..., ...}); throws
   // CtlError for a bad one. Runs on the control thread.
   virtual nlohmann::json handle(const nlohmann::json &request) = 0;
};

// What the server does with one request line: the reply line, then either
// the client's next request, a stream it follows, or the end (`close`).
struct CtlAnswer {
   std::string reply;
   bool close = false;
   bool follow = false;
   EventKind followKind = EventKind::log;
};

// Parses and answers one request line (without its newline). Never throws
// for anything the line holds: every fault is an error reply.
CtlAnswer answerRequest(std::string_view line, EventHub &events, CtlHandler &handler);

struct CtlLimits {
   int requestTimeoutMs = 10'000;   // to finish a request once begun
   int idleTimeoutMs = 30'000;      // a connection that asks nothing is closed
   size_t maxClients = 64;          // the longest idle one makes room for a newcomer
   size_t maxFollowers = 32;        // streams may not take every place
};

class CtlServer {
public:
   static constexpr size_t kMaxRequestBytes = 1 << 20;
   static constexpr size_t kMaxQueuedBytes = 4 << 20;   // a stream that lags further is cut off

   // Binds `path` (replacing a stale socket, refusing a live one or any
   // other file) and starts serving; throws std::runtime_error naming it.
   CtlServer(std::string path, EventHub &events, CtlHandler &handler, CtlLimits limits = {});
   // Stops serving, disconnects every client and removes the socket.
   ~CtlServer();
   CtlServer(const CtlServer &) = delete;
   CtlServer &operator=(const CtlServer &) = delete;

   const std::string &path() const { return path_; }

   struct Client;

private:
   void serve();

   std::string path_;
   EventHub &events_;
   CtlHandler &handler_;
   CtlLimits limits_;
   int listen_ = -1;
   int stop_ = -1;
   std::thread thread_;
};

}  // namespace swsec::live
