// Link events from the kernel's routing socket (rtnetlink): interfaces
// that appear, change (bridge, MTU) or go. The parsing is separate from the
// socket so that it can be fed any bytes.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace swsec::live {

struct LinkEvent {
   bool removed = false;   // RTM_DELLINK (else RTM_NEWLINK)
   int ifindex = 0;
   std::string name;
   int master = 0;         // the bridge's index, 0 none (or not said)
   bool hasMaster = false; // the message carried IFLA_MASTER
   unsigned mtu = 0;       // 0 not said
   std::string mac;        // "aa:bb:cc:dd:ee:ff", "" not said
   std::string kind;       // "bridge", "veth", "tun", ... ("" not said)
};

// The link messages in one datagram read from the socket. Reads no byte
// past `bytes`; a message that is cut short or malformed ends the walk (the
// datagram's later messages cannot be found) and counts in `*malformed`.
// Messages of other types are skipped.
std::vector<LinkEvent> parseLinkMessages(std::span<const uint8_t> bytes, size_t *malformed = nullptr);

// The names swsec gives its own veth ends ("swsec<N>b", "swsec<N>g").
bool isOwnPairEnd(std::string_view name);

// What the --watch rule makes of one event for `bridge` (its index) and a
// shell pattern: guard the interface, let it go, or nothing.
enum class WatchAction : uint8_t { none, guard, release };
WatchAction watchAction(const LinkEvent &event, int bridge, const std::string &pattern, bool guarded);

// A routing socket that hears every link change of the process's network
// namespace. Non-blocking: `drain` returns what is queued and never waits.
class LinkMonitor {
public:
   LinkMonitor();   // throws std::system_error
   ~LinkMonitor();
   LinkMonitor(const LinkMonitor &) = delete;
   LinkMonitor &operator=(const LinkMonitor &) = delete;

   int fd() const { return fd_; }
   // Every queued event. Sets `*lost` when the kernel dropped some (the
   // socket's buffer overflowed): the caller must then look again itself.
   std::vector<LinkEvent> drain(bool *lost);

private:
   int fd_ = -1;
};

}  // namespace swsec::live
