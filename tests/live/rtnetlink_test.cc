// Link messages as the kernel's routing socket sends them, whole, cut and
// malformed; and which joins and leaves the --watch rule acts on.
#include "live/rtnetlink.h"

#include <gtest/gtest.h>
#include <linux/if_link.h>
#include <linux/rtnetlink.h>
#include <sys/socket.h>

#include <cstring>
#include <tuple>

namespace swsec::live {
namespace {

void attr(std::vector<uint8_t> &out, uint16_t type, const void *data, size_t length)
{
   const rtattr header{static_cast<unsigned short>(RTA_LENGTH(length)), type};
   const size_t at = out.size();
   out.resize(at + RTA_SPACE(length));
   std::memcpy(&out[at], &header, sizeof header);
   std::memcpy(&out[at + RTA_LENGTH(0)], data, length);
}

// One RTM_NEWLINK/DELLINK: `name` (with its NUL), master, MTU, MAC, kind.
std::vector<uint8_t> linkMessage(uint16_t type, int index, const char *name, uint32_t master,
                                 uint8_t family = AF_UNSPEC)
{
   std::vector<uint8_t> body(sizeof(ifinfomsg));
   const ifinfomsg info{.ifi_family = family, .ifi_index = index};
   std::memcpy(body.data(), &info, sizeof info);
   attr(body, IFLA_IFNAME, name, std::strlen(name) + 1);
   if (master != 0) {
      attr(body, IFLA_MASTER, &master, sizeof master);
   }
   const uint32_t mtu = 9000;
   attr(body, IFLA_MTU, &mtu, sizeof mtu);
   const uint8_t mac[] = {0xfe, 0x54, 0, 1, 2, 3};
   attr(body, IFLA_ADDRESS, mac, sizeof mac);
   std::vector<uint8_t> kind;
   attr(kind, IFLA_INFO_KIND, "tun", 4);
   attr(body, IFLA_LINKINFO, kind.data(), kind.size());
   const nlmsghdr header{.nlmsg_len = static_cast<uint32_t>(NLMSG_HDRLEN + body.size()), .nlmsg_type = type};
   std::vector<uint8_t> out(NLMSG_HDRLEN + body.size());
   std::memcpy(out.data(), &header, sizeof header);
   std::memcpy(out.data() + NLMSG_HDRLEN, body.data(), body.size());
   return out;
}

TEST(LinkMessages, whole_cut_and_malformed)
{
   const auto join = linkMessage(RTM_NEWLINK, 7, "vnet3", 4);
   std::vector<uint8_t> two = join;
   const auto gone = linkMessage(RTM_DELLINK, 8, "vnet4", 0);
   two.insert(two.end(), gone.begin(), gone.end());
   auto cutAttr = join;                        // the name's length runs past the message
   cutAttr[NLMSG_HDRLEN + sizeof(ifinfomsg)] = 0xff;
   auto shortMaster = linkMessage(RTM_NEWLINK, 7, "vnet3", 0);
   attr(shortMaster, IFLA_MASTER, "x", 1);     // a master of one byte
   reinterpret_cast<nlmsghdr *>(shortMaster.data())->nlmsg_len = static_cast<uint32_t>(shortMaster.size());
   auto noNul = linkMessage(RTM_NEWLINK, 7, "vnet345", 4);   // 8 bytes with the NUL, which goes
   noNul[NLMSG_HDRLEN + sizeof(ifinfomsg) + RTA_LENGTH(0) + 7] = 'x';
   struct Case {
      const char *what;
      std::vector<uint8_t> bytes;
      size_t events;
      size_t malformed;
      const char *firstName;
   };
   const Case cases[] = {
      {"one join", join, 1, 0, "vnet3"},
      {"two in one datagram", two, 2, 0, "vnet3"},
      {"cut inside the header", {join.begin(), join.begin() + 10}, 0, 0, nullptr},
      {"cut inside the body", {join.begin(), join.end() - 4}, 0, 1, nullptr},
      {"attribute past the message", cutAttr, 0, 1, nullptr},
      {"master shorter than 4 bytes", shortMaster, 0, 1, nullptr},
      {"name without NUL", noNul, 1, 0, "vnet345x"},
      {"bridge family skipped", linkMessage(RTM_DELLINK, 7, "vnet3", 4, AF_BRIDGE), 0, 0, nullptr},
   };
   for (const Case &c : cases) {
      size_t malformed = 0;
      const auto events = parseLinkMessages(c.bytes, &malformed);
      EXPECT_EQ(events.size(), c.events) << c.what;
      EXPECT_EQ(malformed, c.malformed) << c.what;
      if (c.firstName != nullptr && !events.empty()) {
         EXPECT_EQ(events[0].name, c.firstName) << c.what;
      }
   }
   const auto events = parseLinkMessages(two);
   ASSERT_EQ(events.size(), 2u);
   const auto fields = [](const LinkEvent &e) { return std::tuple(e.removed, e.ifindex, e.master, e.hasMaster, e.mtu, e.mac, e.kind); };
   EXPECT_EQ(fields(events[0]), std::tuple(false, 7, 4, true, 9000u, "fe:54:00:01:02:03", "tun"));
   EXPECT_EQ(fields(events[1]), std::tuple(true, 8, 0, false, 9000u, "fe:54:00:01:02:03", "tun"));
}

TEST(WatchRule, joins_and_leaves)
{
   auto event = [](const char *name, bool removed, int master, const char *kind = "tun") {
      LinkEvent e;
      e.name = name;
      e.removed = removed;
      e.master = master;
      e.hasMaster = master >= 0;
      e.kind = kind;
      return e;
   };
   constexpr int bridge = 4;
   struct Case {
      LinkEvent event;
      bool guarded;
      WatchAction action;
   };
   const Case cases[] = {
      {event("vnet3", false, bridge), false, WatchAction::guard},
      {event("eth0", false, bridge), false, WatchAction::none},        // the pattern does not match
      {event("vnet3", false, 9), false, WatchAction::none},            // another bridge
      {event("vnet3", false, -1), false, WatchAction::none},           // in no bridge
      {event("vnet3", true, bridge), false, WatchAction::none},
      {event("vnet9", false, bridge, "bridge"), false, WatchAction::none},
      {event("swsec12b", false, bridge), false, WatchAction::none},    // swsec's own pair end
      {event("vnet3", true, -1), true, WatchAction::release},
      {event("vnet3", false, 9), true, WatchAction::release},          // moved to another bridge
      {event("vnet3", false, -1), true, WatchAction::none},            // taken out by swsec itself
      {event("vnet3", false, bridge), true, WatchAction::none},
   };
   for (const Case &c : cases) {
      EXPECT_EQ(watchAction(c.event, bridge, "[sv]*", c.guarded), c.action) << c.event.name << " " << c.guarded;
   }
   EXPECT_TRUE(isOwnPairEnd("swsec7g"));
   EXPECT_FALSE(isOwnPairEnd("swsecXb"));
   EXPECT_FALSE(isOwnPairEnd("swsecb"));
}

}  // namespace
}  // namespace swsec::live
