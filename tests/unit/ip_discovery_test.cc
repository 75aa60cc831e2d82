// IP discovery as a port sees it: DHCP exchanges between a VM and a server
// and ARP from the VM, judged first under the shared lock and again under
// the exclusive one when discovery asks for it, as the frame loop does.
#include "unit/hand_made_port.h"

#include "swsec/swsec_ip_discovery.h"

#include <optional>
#include <string>

namespace swsec::testing {
namespace {

const Ip4 kLeased = Ip4::parse("10.0.0.10");
const Ip4 kRenumbered = Ip4::parse("10.0.0.20");
const Ip4 kBroadcastIp{{255, 255, 255, 255}};
constexpr uint32_t kInfiniteLease = 0xffffffffu;

class IpDiscoveryTest : public HandMadePortTest {
protected:
   Outcome fromVm(const Dhcp &dhcp, const Mac &src = kVmMac, Ip4 ipDst = kBroadcastIp, uint16_t vlanId = 0)
   {
      return judge(dhcpFrame({.src = src, .ipDst = ipDst, .dhcp = dhcp}), SwSecDirectionTx, vlanId);
   }

   Outcome fromServer(const Dhcp &dhcp, uint16_t vlanId = 0)
   {
      return judge(dhcpFrame({.src = kServerMac, .dst = kVmMac, .ipSrc = kServerIp,
                              .ipDst = dhcp.yiaddr, .fromServer = true, .dhcp = dhcp}),
                   SwSecDirectionRx, vlanId);
   }

   static Dhcp clientMsg(uint8_t type, uint32_t xid, std::optional<Bytes> clientId = std::nullopt)
   {
      return Dhcp{.op = 1, .xid = xid, .chaddr = kVmMac, .type = type, .clientId = clientId};
   }

   static Dhcp serverMsg(uint8_t type, uint32_t xid, Ip4 yiaddr, uint32_t lease = 3600)
   {
      return Dhcp{.op = 2, .xid = xid, .yiaddr = yiaddr, .siaddr = kServerIp, .chaddr = kVmMac,
                  .type = type, .leaseTime = lease};
   }

   // Request and ACK: a bound client.
   void bind(Ip4 address, uint32_t xid = 0x100, uint32_t lease = 3600,
             std::optional<Bytes> clientId = std::nullopt)
   {
      ASSERT_EQ(fromVm(clientMsg(kDhcpRequest, xid, clientId)).status, ORR_OK);
      const Outcome ack = fromServer(serverMsg(kDhcpAck, xid, address, lease));
      ASSERT_EQ(ack.status, ORR_OK);
      ASSERT_EQ(ack.verdict, SwSecVerdictPass);
   }

   // A bound client's renewing request: unicast to the server, ciaddr set.
   Outcome renew(uint32_t xid, Ip4 current = kLeased)
   {
      Dhcp dhcp = clientMsg(kDhcpRequest, xid);
      dhcp.ciaddr = current;
      return fromVm(dhcp, kVmMac, kServerIp);
   }

   SwSecVmi *find(Ip4 address, const Mac &mac = kVmMac, uint16_t vlan = 0)
   {
      return SwSecFindVmi(&ctx_, vlan, mac.bytes.data(), address.raw());
   }

   // The names of the posted messages, in order.
   std::vector<std::string> posts()
   {
      std::vector<std::string> out;
      for (const auto &message : host().portsets().posted()) {
         out.push_back(message.name);
      }
      return out;
   }

   Bytes arp(uint16_t op, Ip4 sender, Ip4 target, const Mac &src = kVmMac)
   {
      return arpFrame(src, kBroadcastMac,
                      {.op = op, .senderMac = src, .senderIp = sender, .targetIp = target});
   }
};

// ---------------------------------------------------------------- DHCP snooping

struct RenewalCase {
   const char *name;
   std::optional<uint8_t> atNewAddress;   // the method of an entry the new address already has
   Ip4 address;                           // the renewal's ACK
   Entries after;                         // beside the ARP entry of 10.0.0.99
   std::vector<std::string> posts;
   const char *message;
};

class RenewalTest : public IpDiscoveryTest, public ::testing::WithParamInterface<RenewalCase> {};

TEST_P(RenewalTest, the_ack_of_a_renewal_refiles_or_retires_the_binding)
{
   const RenewalCase &c = GetParam();
   ASSERT_EQ(add({0, 1, 99}, kArp, uptime() + 180), 0);   // so that the hash table is in use
   bind(kLeased, 0x100, 600);
   if (c.atNewAddress) {
      ASSERT_EQ(add({0, 1, 20}, *c.atNewAddress, *c.atNewAddress == kStatic ? 0 : uptime() + 180), 0);
   }
   host().portsets().clearPosted();
   advanceSeconds(300);
   ASSERT_EQ(renew(0x200).status, ORR_OK);
   ASSERT_EQ(vmis().size(), c.atNewAddress ? 3u : 2u) << "a renewing request keeps the binding";
   ASSERT_EQ(fromServer(serverMsg(kDhcpAck, 0x200, c.address, kInfiniteLease)).verdict, SwSecVerdictPass);

   Entries expected{{{0, 1, 99}, kArp}};
   expected.insert(expected.end(), c.after.begin(), c.after.end());
   EXPECT_EQ(entries(), expected);
   EXPECT_EQ(posts(), c.posts);
   EXPECT_EQ(ctx_.numDhcpReqs, 0u);
   expectCountersAgree();
   const SwSecVmi *vmi = find(c.address);
   ASSERT_NE(vmi, nullptr) << "found under its new address: refiled in the hash table";
   if (vmi->discoveryMethod == kDhcp) {
      EXPECT_EQ(vmi->leaseTime, kInfiniteLease);
      EXPECT_EQ(vmi->expiryTime, uptime() + int64_t{kInfiniteLease});
   }
   if (c.message != nullptr) {
      EXPECT_TRUE(logged(c.message));
   }
}

const std::string kAdded = "portdb.entry.added";
const std::string kRemoved = "portdb.entry.removed";

INSTANTIATE_TEST_SUITE_P(
   Renewals, RenewalTest,
   ::testing::Values(
      RenewalCase{"keeping_the_address_only_extends_the_lease", std::nullopt, kLeased, {{{0, 1, 10}, kDhcp}}, {},
                  nullptr},
      RenewalCase{"a_new_address_refiles_the_entry", std::nullopt, kRenumbered, {{{0, 1, 20}, kDhcp}},
                  {kRemoved, kAdded},
                  "port-7: IP address change on renewal: 0 02:00:00:00:00:01 10.0.0.10->10.0.0.20"},
      RenewalCase{"onto_an_arp_learned_address_replaces_that_entry", kArp, kRenumbered, {{{0, 1, 20}, kDhcp}},
                  {kRemoved, kRemoved, kAdded}, nullptr},
      RenewalCase{"onto_a_static_address_retires_the_dhcp_entry", kStatic, kRenumbered, {{{0, 1, 20}, kStatic}},
                  {kRemoved}, nullptr}),
   [](const auto &test) { return std::string(test.param.name); });

TEST_F(IpDiscoveryTest, dhcp_under_the_shared_lock_asks_for_the_write_lock_before_parsing)
{
   auto frame = wrap(dhcpFrame({.src = kVmMac, .dhcp = clientMsg(kDhcpRequest, 0xa00)}));
   uint8_t sentinel = 0;
   frame->info.dhcpHdr = &sentinel;
   frame->info.readLocked = 1;
   uint32_t verdict = 0;
   EXPECT_EQ(SwSecIpDiscovery(&ctx_, frame->pkt, &frame->info, SwSecDirectionTx, &verdict),
             ORR_BUSY);
   EXPECT_EQ(verdict, SwSecVerdictPass);
   EXPECT_EQ(frame->info.dhcpHdr, &sentinel) << "parsed under the shared lock";
   EXPECT_EQ(ctx_.numDhcpReqs, 0u);

   // Even a malformed message: the parse comes after the upgrade.
   Bytes broken = dhcpFrame({.src = kServerMac, .fromServer = true, .dhcp = serverMsg(kDhcpAck, 1, kLeased)});
   broken[42 + 1] = 6;
   EXPECT_TRUE(judge(broken, SwSecDirectionRx).askedForWriteLock);
   EXPECT_TRUE(logged("port-7: Invalid htype/hlen: [6 6]"));
}

struct QuietCase {
   const char *name;
   Bytes frame;
   uint32_t direction;
};

class QuietFrameTest : public IpDiscoveryTest, public ::testing::WithParamInterface<QuietCase> {};

TEST_P(QuietFrameTest, frames_that_are_no_dhcp_or_arp_to_learn_from_pass_and_ask_for_nothing)
{
   const Outcome out = judge(GetParam().frame, GetParam().direction);
   EXPECT_FALSE(out.askedForWriteLock);
   EXPECT_EQ(out.verdict, SwSecVerdictPass);
   EXPECT_TRUE(vmis().empty());
   EXPECT_EQ(ctx_.numDhcpReqs, 0u);
   EXPECT_FALSE(logged("DHCP"));
}

Bytes fragmentOf(Bytes bytes, uint8_t flags, uint8_t offset)
{
   bytes[14 + 6] = flags;
   bytes[14 + 7] = offset;
   return bytes;
}

const Bytes kRequestFrame = dhcpFrame({.src = kVmMac, .dhcp = {.xid = 1, .chaddr = kVmMac, .type = kDhcpRequest}});
const Bytes kArpRequest =
   arpFrame(kVmMac, kBroadcastMac, {.op = 1, .senderMac = kVmMac, .senderIp = kVmIp, .targetIp = kPeerIp});

INSTANTIATE_TEST_SUITE_P(
   Frames, QuietFrameTest,
   ::testing::Values(
      QuietCase{"first_fragment", fragmentOf(kRequestFrame, 0x20, 0), SwSecDirectionTx},
      QuietCase{"later_fragment", fragmentOf(kRequestFrame, 0, 0x10), SwSecDirectionTx},
      QuietCase{"client_message_to_the_vm", kRequestFrame, SwSecDirectionRx},
      QuietCase{"arp_cut_short", Bytes(kArpRequest.begin(), kArpRequest.begin() + 14 + 27), SwSecDirectionTx}),
   [](const auto &test) { return std::string(test.param.name); });

TEST_F(IpDiscoveryTest, failed_allocations_leave_nothing_half_made)
{
   // The pending request: nothing recorded, the frame still passes.
   host().faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY);
   Outcome out = fromVm(clientMsg(kDhcpRequest, 0xc00, Bytes{7, 7}));
   EXPECT_EQ(out.status, ORR_NO_MEMORY);
   EXPECT_EQ(out.verdict, SwSecVerdictPass);
   EXPECT_EQ(ctx_.numDhcpReqs, 0u);
   host().faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY, 2);   // its identifier
   EXPECT_EQ(fromVm(clientMsg(kDhcpRequest, 0xc00, Bytes{7, 7})).status, ORR_NO_MEMORY);
   EXPECT_EQ(ctx_.numDhcpReqs, 0u);
   EXPECT_TRUE(logged("port-7: Alloc of dhcpReq failed"));
   EXPECT_TRUE(logged("port-7: Alloc of dhcpReq clientIdStr failed"));

   // The binding: the request is consumed all the same.
   for (const uint64_t nth : {uint64_t{1}, uint64_t{2}}) {
      ASSERT_EQ(fromVm(clientMsg(kDhcpRequest, 0xc01, Bytes{7, 7})).status, ORR_OK);
      host().faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY, nth);
      out = fromServer(serverMsg(kDhcpAck, 0xc01, kLeased));
      EXPECT_EQ(out.status, ORR_NO_MEMORY);
      EXPECT_EQ(out.verdict, SwSecVerdictPass);
      EXPECT_TRUE(vmis().empty());
      EXPECT_EQ(ctx_.numDhcpReqs, 0u);
   }
   EXPECT_TRUE(logged("port-7: Vmi alloc failed"));
   EXPECT_TRUE(logged("port-7: Vmi clientIdStr alloc failed"));

   // An ARP binding.
   host().faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY);
   EXPECT_EQ(judge(arp(1, kLeased, kPeerIp), SwSecDirectionTx).status, ORR_NO_MEMORY);
   EXPECT_TRUE(vmis().empty());
}

// ---------------------------------------------------------------- ARP snooping

TEST_F(IpDiscoveryTest, traffic_refreshes_non_authoritative_entries_under_the_shared_lock_on_a_trusted_port_only)
{
   ASSERT_TRUE(judge(arp(1, kVmIp, kPeerIp), SwSecDirectionTx).askedForWriteLock);
   advanceSeconds(100);
   EXPECT_FALSE(judge(arp(1, kVmIp, kPeerIp), SwSecDirectionTx).askedForWriteLock);
   EXPECT_EQ(vmis().at(0)->expiryTime, uptime() + 180);
   advanceSeconds(100);
   const Bytes ip = udpFrame({.src = kVmMac, .dst = kServerMac, .ipSrc = kVmIp, .ipDst = kServerIp});
   EXPECT_FALSE(judge(ip, SwSecDirectionTx).askedForWriteLock);
   EXPECT_EQ(vmis().at(0)->expiryTime, uptime() + 180);

   // An untrusted port neither refreshes nor learns.
   ctx_.config.trusted = 0;
   advanceSeconds(100);
   EXPECT_FALSE(judge(ip, SwSecDirectionTx).askedForWriteLock);
   EXPECT_FALSE(judge(arp(1, kPeerIp, kVmIp), SwSecDirectionTx).askedForWriteLock);
   ASSERT_EQ(vmis().size(), 1u);
   EXPECT_EQ(vmis()[0]->expiryTime, uptime() + 80);
}

}  // namespace
}  // namespace swsec::testing
