// A boot storm on one port: a hundred thousand DHCP clients behind the VM,
// each with its own client identifier, all asking before the server
// answers any. Every ACK must find its request. (With the requests found by
// walking their list, this took minutes; indexed, about a second.)
#include "port_fixture.h"

#include <string>
#include <vector>

namespace swsec::testing {
namespace {

const Mac kVmMac = Mac::parse("02:00:5e:c0:00:01");
const Mac kServerMac = Mac::parse("02:00:5e:c0:00:99");
const Ip4 kServerIp = Ip4::parse("192.0.2.1");
constexpr uint32_t kClients = 100000;
constexpr uint32_t kListFrames = 64;

Bytes clientIdOf(uint32_t client)
{
   return Bytes{0, static_cast<uint8_t>(client >> 24), static_cast<uint8_t>(client >> 16),
                static_cast<uint8_t>(client >> 8), static_cast<uint8_t>(client), 's'};
}

Ip4 addressOf(uint32_t client)
{
   return Ip4{{10, static_cast<uint8_t>(64 + (client >> 16)), static_cast<uint8_t>(client >> 8),
               static_cast<uint8_t>(client)}};
}

using DhcpBootStorm = PortTest;

TEST_F(DhcpBootStorm, every_ack_of_a_hundred_thousand_clients_finds_its_request)
{
   const host::FilterId id = create();
   auto storm = [&](uint32_t direction, auto frameOf) {
      size_t kept = 0;
      std::vector<Bytes> list;
      for (uint32_t client = 0; client < kClients; client++) {
         list.push_back(frameOf(client));
         if (list.size() == kListFrames || client + 1 == kClients) {
            kept += send(id, direction, list).kept.size();
            list.clear();
         }
      }
      return kept;
   };

   const size_t requests = storm(kTx, [](uint32_t client) {
      return dhcpFrame({.src = kVmMac,
                        .dhcp = {.xid = client + 1, .chaddr = kVmMac, .type = kDhcpRequest,
                                 .clientId = clientIdOf(client)}});
   });
   EXPECT_EQ(requests, kClients);

   const size_t acks = storm(kRx, [](uint32_t client) {
      Dhcp ack{.op = 2, .xid = client + 1, .yiaddr = addressOf(client), .siaddr = kServerIp,
               .chaddr = kVmMac, .type = kDhcpAck, .leaseTime = 3600};
      return dhcpFrame({.src = kServerMac, .dst = kVmMac, .ipSrc = kServerIp, .ipDst = ack.yiaddr,
                        .fromServer = true, .dhcp = ack});
   });
   EXPECT_EQ(acks, kClients) << "an ACK that finds no request is dropped";

   // The same ACKs again answer nothing: every request was consumed.
   EXPECT_FALSE(passes(id, kRx, dhcpFrame({.src = kServerMac, .dst = kVmMac, .ipSrc = kServerIp,
                                            .fromServer = true,
                                            .dhcp = {.op = 2, .xid = 1, .chaddr = kVmMac, .type = kDhcpAck,
                                                     .leaseTime = 3600}})));
}

}  // namespace
}  // namespace swsec::testing
