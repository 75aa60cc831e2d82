// The pending-request index against a model of the list it stands beside:
// random exchanges of many clients (shared VLANs, hardware addresses and
// xids, with and without identifiers, repeats that change the xid, ageing)
// must leave the same requests in the same order, and the same answer
// verdicts, as first-match walks of the arrival-ordered list give.
#include "unit/hand_made_port.h"

#include "swsec/swsec_dhcp_req_index.h"

#include <optional>
#include <random>
#include <string>
#include <vector>

namespace swsec::testing {
namespace {


struct ModelRequest {
   uint16_t vlan;
   uint32_t xid;
   Mac chaddr;
   std::optional<Bytes> clientId;
   int64_t expiry;

   bool sameClient(uint16_t v, const Mac &mac, const std::optional<Bytes> &id) const
   {
      return vlan == v && clientId == id && (id.has_value() || chaddr == mac);
   }
   bool answeredBy(uint16_t v, uint32_t x, const Mac &mac) const
   {
      return vlan == v && xid == x && chaddr == mac;
   }
};

class DhcpReqIndexTest : public HandMadePortTest {
protected:
   Outcome fromVm(uint16_t vlan, uint8_t type, uint32_t xid, const Mac &mac,
                  const std::optional<Bytes> &clientId)
   {
      // Unicast with ciaddr set: a renewal, which leaves the client's binding alone.
      Dhcp dhcp{.op = 1, .xid = xid, .ciaddr = Ip4::parse("10.0.0.9"), .chaddr = mac, .type = type,
                .clientId = clientId};
      return judge(dhcpFrame({.src = mac, .ipDst = kServerIp, .dhcp = dhcp}), SwSecDirectionTx, vlan);
   }

   Outcome fromServer(uint16_t vlan, uint8_t type, uint32_t xid, const Mac &mac, uint8_t host)
   {
      Dhcp dhcp{.op = 2, .xid = xid, .yiaddr = Ip4{{10, 0, 1, host}}, .siaddr = kServerIp,
                .chaddr = mac, .type = type, .leaseTime = 600};
      return judge(dhcpFrame({.src = kServerMac, .dst = mac, .ipSrc = kServerIp, .ipDst = dhcp.yiaddr,
                              .fromServer = true, .dhcp = dhcp}),
                   SwSecDirectionRx, vlan);
   }

   // The port's requests as the model writes them, oldest first.
   std::vector<std::string> portRequests()
   {
      std::vector<std::string> out;
      for (SwSecDhcpReq *req : requests()) {
         std::optional<Bytes> id;
         if (req->clientIdLen != 0) {
            id = Bytes(req->clientIdStr, req->clientIdStr + req->clientIdLen);
         }
         Mac mac;
         std::memcpy(mac.bytes.data(), req->chaddr, 6);
         // The port keeps the xid as the message carries it (network order).
         out.push_back(describe({req->vlanId, __builtin_bswap32(req->xid), mac, id, req->expiryTime}));
      }
      return out;
   }

   static std::string describe(const ModelRequest &r)
   {
      std::string text = std::to_string(r.vlan) + "/" + std::to_string(r.xid) + "/" +
                         std::to_string(r.chaddr.bytes[5]) + "/" + std::to_string(r.expiry) + "/";
      if (r.clientId) {
         for (uint8_t b : *r.clientId) {
            text += std::to_string(b) + ".";
         }
      }
      return text;
   }

   static std::vector<std::string> describe(const std::vector<ModelRequest> &model)
   {
      std::vector<std::string> out;
      for (const ModelRequest &r : model) {
         out.push_back(describe(r));
      }
      return out;
   }
};

class DhcpReqIndexModelTest : public DhcpReqIndexTest, public ::testing::WithParamInterface<uint32_t> {};

// A few hundred clients at most: the requests stay within the 1 MiB test heap.
TEST_P(DhcpReqIndexModelTest, random_exchanges_match_first_match_walks_of_the_list)
{
   const uint32_t seed = GetParam();
   SCOPED_TRACE("seed " + std::to_string(seed));
   std::mt19937 random(seed);
   auto pick = [&random](uint32_t n) { return static_cast<uint32_t>(random() % n); };
   const std::vector<uint16_t> vlans{0, 5};
   std::vector<Mac> macs;
   for (uint8_t i = 1; i <= 3; i++) {
      macs.push_back(Mac{{0x02, 0, 0, 0, 0, i}});
   }
   std::vector<ModelRequest> model;
   bool indexSeen = false;

   for (int step = 0; step < 3000; step++) {
      SCOPED_TRACE("step " + std::to_string(step));
      const uint16_t vlan = vlans[pick(2)];
      const Mac &mac = macs[pick(3)];
      // Few xids, so that clients sharing a hardware address answer alike.
      const uint32_t xid = 1 + pick(3);
      std::optional<Bytes> clientId;
      if (pick(4) != 0) {
         // Identifiers of 1 to 20 bytes: the hash's whole words and tails.
         const uint32_t n = pick(60);
         clientId = Bytes(1 + n % 20, static_cast<uint8_t>(n));
      }
      const uint32_t action = pick(20);
      if (action < 11) {
         ASSERT_EQ(fromVm(vlan, kDhcpRequest, xid, mac, clientId).status, ORR_OK);
         auto it = std::find_if(model.begin(), model.end(),
                                [&](const ModelRequest &r) { return r.sameClient(vlan, mac, clientId); });
         if (it != model.end()) {
            it->xid = xid;
         } else {
            model.push_back({vlan, xid, mac, clientId, uptime() + 60});
         }
      } else if (action < 13) {
         const uint8_t type = action == 11 ? kDhcpDiscover : kDhcpRelease;
         ASSERT_EQ(fromVm(vlan, type, xid, mac, clientId).status, ORR_OK);
         auto it = std::find_if(model.begin(), model.end(),
                                [&](const ModelRequest &r) { return r.sameClient(vlan, mac, clientId); });
         if (it != model.end()) {
            model.erase(it);
         }
      } else if (action < 19) {
         const uint8_t type = action < 17 ? kDhcpAck : kDhcpNak;
         const Outcome out = fromServer(vlan, type, xid, mac, static_cast<uint8_t>(step));
         ASSERT_EQ(out.status, ORR_OK);
         auto it = std::find_if(model.begin(), model.end(),
                                [&](const ModelRequest &r) { return r.answeredBy(vlan, xid, mac); });
         const bool answers = it != model.end();
         EXPECT_EQ(out.verdict, answers || type == kDhcpNak ? SwSecVerdictPass : SwSecVerdictDrop);
         if (answers) {
            model.erase(it);
         }
      } else {
         advanceSeconds(7);
         SwSecPortDbTimerCb(&ctx_);
         std::erase_if(model, [this](const ModelRequest &r) { return r.expiry < uptime(); });
      }
      ASSERT_EQ(portRequests(), describe(model));
      ASSERT_EQ(ctx_.numDhcpReqs, model.size());
      indexSeen = indexSeen || SwSecDhcpReqIndexBuilt(&ctx_);
   }
   EXPECT_TRUE(indexSeen) << "the walk never had enough requests to build the index";
}

INSTANTIATE_TEST_SUITE_P(Seeds, DhcpReqIndexModelTest, ::testing::Values(1u, 2u, 3u));

TEST_F(DhcpReqIndexTest, index_comes_and_goes_with_the_requests_and_survives_a_failed_allocation)
{
   auto request = [this](uint8_t client) {
      return fromVm(0, kDhcpRequest, client, Mac{{2, 0, 0, 0, 0, 1}}, Bytes{client}).status;
   };
   for (uint8_t client = 1; client <= 8; client++) {
      ASSERT_EQ(request(client), ORR_OK);
   }
   EXPECT_FALSE(SwSecDhcpReqIndexBuilt(&ctx_)) << "eight requests are walked";

   // The ninth would build it: without memory the port walks the list and stays right.
   host().faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY, 3);
   ASSERT_EQ(request(9), ORR_OK);
   EXPECT_FALSE(SwSecDhcpReqIndexBuilt(&ctx_));
   EXPECT_EQ(ctx_.numDhcpReqs, 9u);
   EXPECT_EQ(fromServer(0, kDhcpAck, 9, Mac{{2, 0, 0, 0, 0, 1}}, 9).verdict, SwSecVerdictPass);

   ASSERT_EQ(request(9), ORR_OK);
   EXPECT_TRUE(SwSecDhcpReqIndexBuilt(&ctx_)) << "the next request tries again";

   // Answers consume the requests; the last one takes the index with it.
   for (uint8_t client = 1; client <= 9; client++) {
      EXPECT_EQ(fromServer(0, kDhcpAck, client, Mac{{2, 0, 0, 0, 0, 1}}, client).verdict,
                SwSecVerdictPass);
   }
   EXPECT_EQ(ctx_.numDhcpReqs, 0u);
   EXPECT_FALSE(SwSecDhcpReqIndexBuilt(&ctx_));
}

}  // namespace
}  // namespace swsec::testing
