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

class CtlServer {
public:
   static constexpr size_t kMaxRequestBytes = 1 << 20;
   static constexpr size_t kMaxQueuedBytes = 4 << 20;   // a stream that lags further is cut off
   static constexpr int kRequestTimeoutMs = 10'000;     // to finish a request once begun
   static constexpr size_t kMaxClients = 64;

   // Binds `path` (replacing a stale socket, refusing a live one or any
   // other file) and starts serving; throws std::runtime_error naming it.
   CtlServer(std::string path, EventHub &events, CtlHandler &handler);
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
   int listen_ = -1;
   int stop_ = -1;
   std::thread thread_;
};

}  // namespace swsec::live
