// rtnetlink link messages: the socket and a bounded walk of its bytes.
#include "live/rtnetlink.h"

#include <fnmatch.h>
#include <linux/if_link.h>
#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <system_error>

namespace swsec::live {

namespace {

constexpr size_t kAlign = 4;
constexpr size_t kMessageHeader = sizeof(nlmsghdr);
constexpr size_t kAttrHeader = sizeof(rtattr);
constexpr size_t kMacBytes = 6;

size_t aligned(size_t length)
{
   return (length + kAlign - 1) & ~(kAlign - 1);
}

template <typename T>
T readAt(std::span<const uint8_t> bytes, size_t offset)
{
   T value;
   std::memcpy(&value, bytes.data() + offset, sizeof value);
   return value;
}

// Calls `take(type, payload)` for each attribute; false when one runs past
// the bytes or is shorter than its own header.
template <typename Take>
bool walkAttributes(std::span<const uint8_t> bytes, Take take)
{
   size_t offset = 0;
   while (bytes.size() - offset >= kAttrHeader) {
      const auto attr = readAt<rtattr>(bytes, offset);
      if (attr.rta_len < kAttrHeader || attr.rta_len > bytes.size() - offset) {
         return false;
      }
      take(static_cast<uint16_t>(attr.rta_type & NLA_TYPE_MASK),
           bytes.subspan(offset + kAttrHeader, attr.rta_len - kAttrHeader));
      offset += std::min(aligned(attr.rta_len), bytes.size() - offset);
   }
   return true;
}

// A NUL-terminated string attribute, without running past its payload.
std::string text(std::span<const uint8_t> payload)
{
   const auto *begin = reinterpret_cast<const char *>(payload.data());
   return std::string(begin, strnlen(begin, payload.size()));
}

bool parseLink(std::span<const uint8_t> body, bool removed, LinkEvent &event)
{
   if (body.size() < sizeof(ifinfomsg)) {
      return false;
   }
   const auto info = readAt<ifinfomsg>(body, 0);
   event.removed = removed;
   event.ifindex = info.ifi_index;
   bool wellFormed = true;
   static_assert(sizeof(ifinfomsg) % kAlign == 0, "attributes follow the link header at once");
   const bool attributes = walkAttributes(body.subspan(sizeof(ifinfomsg)), [&](uint16_t type,
                                                                              std::span<const uint8_t> payload) {
      switch (type) {
      case IFLA_IFNAME:
         event.name = text(payload);
         break;
      case IFLA_MASTER:
      case IFLA_MTU:
         if (payload.size() < sizeof(uint32_t)) {
            wellFormed = false;
         } else if (type == IFLA_MASTER) {
            event.master = static_cast<int>(readAt<uint32_t>(payload, 0));
            event.hasMaster = true;
         } else {
            event.mtu = readAt<uint32_t>(payload, 0);
         }
         break;
      case IFLA_ADDRESS:
         if (payload.size() == kMacBytes) {
            char mac[18];
            std::snprintf(mac, sizeof mac, "%02x:%02x:%02x:%02x:%02x:%02x", payload[0], payload[1], payload[2],
                          payload[3], payload[4], payload[5]);
            event.mac = mac;
         }
         break;
      case IFLA_LINKINFO:
         wellFormed = walkAttributes(payload, [&](uint16_t inner, std::span<const uint8_t> kind) {
            if (inner == IFLA_INFO_KIND) {
               event.kind = text(kind);
            }
         }) && wellFormed;
         break;
      default:
         break;
      }
   });
   return attributes && wellFormed && event.ifindex > 0;
}

}  // namespace

// Messages of the bridge family are the bridge's view of its ports (a
// RTM_DELLINK as one leaves the bridge), not the interfaces' own: skipped.
std::vector<LinkEvent> parseLinkMessages(std::span<const uint8_t> bytes, size_t *malformed)
{
   std::vector<LinkEvent> events;
   size_t offset = 0;
   while (bytes.size() - offset >= kMessageHeader) {
      const auto header = readAt<nlmsghdr>(bytes, offset);
      if (header.nlmsg_len < kMessageHeader || header.nlmsg_len > bytes.size() - offset) {
         if (malformed != nullptr) {
            ++*malformed;
         }
         break;
      }
      const auto body = bytes.subspan(offset + kMessageHeader, header.nlmsg_len - kMessageHeader);
      if ((header.nlmsg_type == RTM_NEWLINK || header.nlmsg_type == RTM_DELLINK) &&
          (body.size() < sizeof(ifinfomsg) || readAt<ifinfomsg>(body, 0).ifi_family != AF_BRIDGE)) {
         LinkEvent event;
         if (parseLink(body, header.nlmsg_type == RTM_DELLINK, event)) {
            events.push_back(std::move(event));
         } else if (malformed != nullptr) {
            ++*malformed;
         }
      }
      offset += std::min(aligned(header.nlmsg_len), bytes.size() - offset);
   }
   return events;
}

bool isOwnPairEnd(std::string_view name)
{
   constexpr std::string_view prefix = "swsec";
   if (name.size() < prefix.size() + 2 || name.substr(0, prefix.size()) != prefix ||
       (name.back() != 'b' && name.back() != 'g')) {
      return false;
   }
   const std::string_view digits = name.substr(prefix.size(), name.size() - prefix.size() - 1);
   return digits.find_first_not_of("0123456789") == std::string_view::npos;
}

WatchAction watchAction(const LinkEvent &event, int bridge, const std::string &pattern, bool guarded)
{
   if (guarded) {
      // Gone, or moved to another bridge. Out of every bridge is what
      // guarding it does itself.
      const bool elsewhere = event.hasMaster && event.master != 0 && event.master != bridge;
      return event.removed || elsewhere ? WatchAction::release : WatchAction::none;
   }
   if (event.removed || !event.hasMaster || event.master != bridge || event.kind == "bridge" ||
       isOwnPairEnd(event.name) || fnmatch(pattern.c_str(), event.name.c_str(), 0) != 0) {
      return WatchAction::none;
   }
   return WatchAction::guard;
}

LinkMonitor::LinkMonitor()
{
   fd_ = socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC | SOCK_NONBLOCK, NETLINK_ROUTE);
   if (fd_ < 0) {
      throw std::system_error(errno, std::generic_category(), "rtnetlink socket");
   }
   sockaddr_nl address{};
   address.nl_family = AF_NETLINK;
   address.nl_groups = RTMGRP_LINK;
   if (bind(fd_, reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0) {
      const int error = errno;
      close(fd_);
      throw std::system_error(error, std::generic_category(), "rtnetlink bind");
   }
}

LinkMonitor::~LinkMonitor()
{
   close(fd_);
}

std::vector<LinkEvent> LinkMonitor::drain(bool *lost)
{
   std::vector<LinkEvent> events;
   std::vector<uint8_t> buffer(64 * 1024);
   for (;;) {
      const ssize_t got = recv(fd_, buffer.data(), buffer.size(), MSG_TRUNC);
      if (got < 0) {
         if (errno == ENOBUFS) {
            *lost = true;
            continue;
         }
         // EAGAIN: nothing more queued.
         return events;
      }
      if (static_cast<size_t>(got) > buffer.size()) {
         *lost = true;   // a datagram larger than the buffer: its tail is gone
         continue;
      }
      auto more = parseLinkMessages(std::span<const uint8_t>(buffer.data(), static_cast<size_t>(got)));
      for (auto &event : more) {
         events.push_back(std::move(event));
      }
   }
}

}  // namespace swsec::live
