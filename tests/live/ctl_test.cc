// The control socket and the metrics as a client and a scraper meet them:
// the socket is the owner's alone, a second daemon is refused, junk and a
// stalled client harm no one, streams follow events; the Prometheus text
// has every series with escaped labels.
#include "cli/ctl_format.h"
#include "live/ctl_server.h"
#include "live/events.h"

#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/wait.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <string>

namespace swsec::live {
namespace {

class EchoHandler : public CtlHandler {
public:
   nlohmann::json handle(const nlohmann::json &request) override
   {
      if (request["command"] == "boom") {
         throw CtlError("no such thing");
      }
      if (request["command"] == "latin1") {
         throw CtlError("caf\xe9 \xe2\x80");   // a message quoting bytes that are not UTF-8
      }
      return {{"echo", request["command"]}};
   }
};

class Client {
public:
   explicit Client(const std::string &path)
   {
      fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
      sockaddr_un address{};
      address.sun_family = AF_UNIX;
      std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
      connected_ = connect(fd_, reinterpret_cast<const sockaddr *>(&address), sizeof address) == 0;
      timeval timeout{5, 0};
      setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
   }
   ~Client() { close(fd_); }
   bool connected() const { return connected_; }
   // The last line() found the connection closed (not a timeout).
   bool closedByServer() const { return closedByServer_; }
   void shutdownWrite() { ::shutdown(fd_, SHUT_WR); }
   void send(const std::string &text) { ASSERT_EQ(::send(fd_, text.data(), text.size(), MSG_NOSIGNAL), ssize_t(text.size())); }
   // One line, or "" on a timeout or a closed connection.
   std::string line()
   {
      for (;;) {
         const size_t newline = buffer_.find('\n');
         if (newline != std::string::npos) {
            std::string out = buffer_.substr(0, newline);
            buffer_.erase(0, newline + 1);
            return out;
         }
         char chunk[4096];
         const ssize_t got = recv(fd_, chunk, sizeof chunk, 0);
         closedByServer_ = got == 0;
         if (got <= 0) {
            return "";
         }
         buffer_.append(chunk, size_t(got));
      }
   }

private:
   int fd_ = -1;
   bool connected_ = false;
   bool closedByServer_ = false;
   std::string buffer_;
};

class CtlServerTest : public ::testing::Test {
protected:
   void SetUp() override
   {
      dir_ = std::filesystem::temp_directory_path() / ("swsec-ctl-test-" + std::to_string(getpid()));
      std::filesystem::create_directories(dir_);
      path_ = (dir_ / "ctl.sock").string();
   }
   void TearDown() override { std::filesystem::remove_all(dir_); }

   std::filesystem::path dir_;
   std::string path_;
   EventHub events_;
   EchoHandler handler_;
};

TEST_F(CtlServerTest, the_socket_replaces_a_stale_one_is_the_owners_alone_and_goes_with_the_server)
{
   {
      const int fd = socket(AF_UNIX, SOCK_STREAM, 0);
      sockaddr_un address{};
      address.sun_family = AF_UNIX;
      std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path_.c_str());
      ASSERT_EQ(bind(fd, reinterpret_cast<const sockaddr *>(&address), sizeof address), 0);
      close(fd);   // bound, never listening: what a killed daemon leaves
   }
   {
      CtlServer server(path_, events_, handler_);
      struct stat info{};
      ASSERT_EQ(stat(path_.c_str(), &info), 0);
      EXPECT_EQ(info.st_mode & 0777, 0600u);
      // A second daemon on the same socket is refused; the first goes on.
      EXPECT_THROW(CtlServer(path_, events_, handler_), std::runtime_error);
      Client client(path_);
      client.send("{\"command\": \"ports\"}\n");
      client.shutdownWrite();   // a client that closes its side after the request still gets the reply
      EXPECT_EQ(nlohmann::json::parse(client.line())["result"]["echo"], "ports");
   }
   EXPECT_FALSE(std::filesystem::exists(path_));
   // Any other file is left alone.
   const std::string plain = (dir_ / "plain").string();
   std::fclose(std::fopen(plain.c_str(), "w"));
   EXPECT_THROW(CtlServer(plain, events_, handler_), std::runtime_error);
   EXPECT_TRUE(std::filesystem::exists(plain));
}

TEST_F(CtlServerTest, junk_errors_and_a_stalled_client_hold_up_no_one)
{
   CtlServer server(path_, events_, handler_);
   Client junk(path_);
   junk.send("this is not json\n");
   EXPECT_FALSE(nlohmann::json::parse(junk.line())["ok"]);
   EXPECT_EQ(junk.line(), "");   // and it is disconnected

   Client stalled(path_);
   stalled.send("{\"command\": \"po");
   Client good(path_);
   good.send("{\"command\": \"boom\"}\n{\"command\": \"counters\"}\n");
   const auto refused = nlohmann::json::parse(good.line());
   EXPECT_FALSE(refused["ok"]);
   EXPECT_EQ(refused["error"], "no such thing");
   EXPECT_EQ(nlohmann::json::parse(good.line())["result"]["echo"], "counters");
}

TEST_F(CtlServerTest, log_follow_and_watch_stream_what_comes_after_the_recent_lines)
{
   for (int i = 0; i <= 200; ++i) {
      events_.log("info", "inline", "before " + std::to_string(i));
   }
   CtlServer server(path_, events_, handler_);
   // Plain or followed, a log starts with the 200 most recent lines.
   Client plain(path_);
   plain.send("{\"command\": \"log\"}\n");
   const auto recent = nlohmann::json::parse(plain.line())["result"];
   ASSERT_EQ(recent.size(), 200u);
   EXPECT_EQ(recent[0]["text"], "before 1");
   Client log(path_);
   log.send("{\"command\": \"log\", \"follow\": true}\n");
   const auto first = nlohmann::json::parse(log.line());
   ASSERT_TRUE(first["streaming"]);
   EXPECT_EQ(first["result"], recent);
   Client watch(path_);
   watch.send("{\"command\": \"watch\"}\n");
   EXPECT_TRUE(nlohmann::json::parse(watch.line())["result"].empty());

   events_.notification({{"port", "vm1"}, {"name", "portdb.entry.added"}, {"ip", "192.0.2.5"}});
   events_.log("error", "module", "after");
   EXPECT_EQ(nlohmann::json::parse(watch.line())["ip"], "192.0.2.5");
   EXPECT_EQ(nlohmann::json::parse(log.line())["text"], "after");
}

TEST_F(CtlServerTest, hostile_requests_get_an_error_reply_and_never_a_crash)
{
   struct Case {
      std::string line;
      const char *error;   // part of the reply's error
      bool closes;
   };
   const Case cases[] = {
      {R"({"command": "log", "follow": "yes"})", "\"follow\" must be true or false", false},
      {R"({"command": "log", "follow": null})", "\"follow\" must be true or false", false},
      {R"({"command": "latin1"})", "caf", false},
      {std::string(100'000, '[') + std::string(100'000, ']'), "not a request", true},
      {R"({"cmd": "ports"})", "not a request", true},
   };
   for (const Case &c : cases) {
      const CtlAnswer answer = answerRequest(c.line, events_, handler_);
      const auto reply = nlohmann::json::parse(answer.reply);
      EXPECT_FALSE(reply["ok"]) << c.error;
      EXPECT_NE(reply["error"].get<std::string>().find(c.error), std::string::npos) << reply;
      EXPECT_EQ(answer.close, c.closes) << c.error;
      EXPECT_FALSE(answer.follow) << c.error;
   }
}

TEST_F(CtlServerTest, idle_connections_are_closed_and_make_room_for_a_newcomer)
{
   CtlLimits limits;
   limits.idleTimeoutMs = 400;
   limits.maxClients = 3;
   CtlServer server(path_, events_, handler_, limits);
   // Each asks once, so that the server has taken it (a loaded machine may
   // leave connections in the backlog, all equally idle when accepted).
   const auto asked = [](Client &client) {
      client.send("{\"command\": \"ports\"}\n");
      return !client.line().empty();
   };
   Client first(path_);
   ASSERT_TRUE(asked(first));
   usleep(100'000);
   Client second(path_), third(path_);
   ASSERT_TRUE(asked(second) && asked(third));
   usleep(100'000);
   // Every place taken by a connection that asks nothing more: the newcomer is served.
   Client newcomer(path_);
   newcomer.send("{\"command\": \"ports\"}\n");
   EXPECT_EQ(nlohmann::json::parse(newcomer.line())["result"]["echo"], "ports");
   // The oldest made room, and the rest time out.
   for (Client *client : {&first, &third}) {
      EXPECT_EQ(client->line(), "");
      EXPECT_TRUE(client->closedByServer());
   }
}

TEST_F(CtlServerTest, another_user_is_refused_even_where_the_socket_lets_it_connect)
{
   if (geteuid() != 0) {
      GTEST_SKIP() << "needs root to connect as another user";
   }
   CtlServer server(path_, events_, handler_);
   ASSERT_EQ(chmod(path_.c_str(), 0666), 0);
   ASSERT_EQ(chmod(dir_.c_str(), 0755), 0);
   const pid_t child = fork();
   ASSERT_GE(child, 0);
   if (child == 0) {
      if (setresgid(65534, 65534, 65534) != 0 || setresuid(65534, 65534, 65534) != 0) {
         _exit(3);
      }
      Client other(path_);   // refused as it is accepted: nothing to send
      _exit(!other.connected() ? 4 : other.line().find("not allowed") != std::string::npos ? 0 : 5);
   }
   int status = 0;
   ASSERT_EQ(waitpid(child, &status, 0), child);
   EXPECT_TRUE(WIFEXITED(status));
   EXPECT_EQ(WEXITSTATUS(status), 0) << "3: no other user, 4: could not connect, 5: served";
}

TEST(CtlMetrics, every_series_of_every_port_with_escaped_labels)
{
   const auto counters = nlohmann::json::parse(R"([
      {"port": "vm1", "running": true, "truncated": 0, "sendErrors": 2, "overruns": 4,
       "frames": {"to-vm": {"passed": 5, "dropped": 1}, "from-vm": {"passed": 7, "dropped": 3}},
       "drops": {"daiDropCnt": 2, "ipSrcGuardDropCnt": 1},
       "bindings": {"DHCP Snooping": 1, "Static": 0}, "ipv6Bindings": {"DHCPv6": 2}},
      {"port": "we\"ird", "running": false, "truncated": 0, "sendErrors": 0,
       "frames": {"to-vm": {"passed": 0, "dropped": 0}, "from-vm": {"passed": 0, "dropped": 0}}}])");
   const std::string text = ctl::metricsText(counters);
   for (const char *line : {
           "swsec_port_up{port=\"vm1\"} 1\n",
           "swsec_port_up{port=\"we\\\"ird\"} 0\n",
           "swsec_frames_total{port=\"vm1\",direction=\"from-vm\",verdict=\"dropped\"} 3\n",
           "swsec_frames_total{port=\"vm1\",direction=\"to-vm\",verdict=\"passed\"} 5\n",
           "swsec_module_drops_total{port=\"vm1\",counter=\"daiDropCnt\"} 2\n",
           "swsec_bindings{port=\"vm1\",method=\"DHCP Snooping\"} 1\n",
           "swsec_ipv6_bindings{port=\"vm1\",method=\"DHCPv6\"} 2\n",
           "swsec_frames_lost_total{port=\"vm1\",reason=\"send-error\"} 2\n",
           "swsec_frames_lost_total{port=\"vm1\",reason=\"overrun\"} 4\n",
           "# TYPE swsec_frames_total counter\n",
           "# TYPE swsec_bindings gauge\n",
        }) {
      EXPECT_NE(text.find(line), std::string::npos) << line << "\nin:\n" << text;
   }
   EXPECT_EQ(text.find("swsec_bindings{port=\"we"), std::string::npos);
}

}  // namespace
}  // namespace swsec::live
