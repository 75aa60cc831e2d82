// A switch-security port made by hand for the port database tests: the
// module heap, log and lock domain as start-up makes them, the port filter
// map, a filter of the built-in agent, and a context with an enabled, empty
// database on a host portset, its configLock created.
#pragma once

#include "support/frames.h"
#include "support/host_fixture.h"
#include "support/security_config.h"
#include "unit/hand_made_port.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_agent.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_lock.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_dhcp_req_index.h"
#include "swsec/swsec_notify.h"
#include "swsec/swsec_port_db.h"
#include "swsec/swsec_port_db_export.h"
#include "swsec/swsec_port_filter_map.h"

#include <array>
#include <chrono>
#include <cstring>
#include <string>
#include <vector>

namespace swsec::testing {

constexpr uint32_t kOn = SwSecFeatureIpDiscovery;
constexpr uint8_t kDhcp = SwSecDiscDhcpSnooping;
constexpr uint8_t kStatic = SwSecDiscStatic;
constexpr uint8_t kTofu = SwSecDiscTofu;
constexpr uint8_t kArp = SwSecDiscApSnooping;

// A VMI key in test terms: VLAN, last MAC byte, last address byte.
struct Key {
   uint16_t vlan = 1;
   uint8_t mac = 1;
   uint8_t ip = 1;

   std::array<uint8_t, 6> macBytes() const { return {0x02, 0, 0, 0, 0, mac}; }
   uint32_t ipAddr() const { return Ip4{{10, 0, 0, ip}}.raw(); }
   SwSecVmiKey raw() const { return {.vlanId = vlan, .macAddr = {0x02, 0, 0, 0, 0, mac}, .ipAddr = ipAddr()}; }
   bool operator==(const Key &) const = default;
};

// Every VMI as (key, method), oldest first.
using Entries = std::vector<std::pair<Key, uint8_t>>;

// What a listener learns from one message.
struct Notice {
   std::string name;
   uint32_t op = 0;
   Key key;
   uint8_t authoritative = 0;
   bool operator==(const Notice &) const = default;
};

// A message's 40-byte payload, decoded; reserved bytes must be zero.
inline Notice decodeNotice(const std::string &name, const uint8_t *p)
{
   Notice n{.name = name};
   std::memcpy(&n.op, p, 4);
   uint32_t count = 0;
   std::memcpy(&count, p + 4, 4);
   EXPECT_EQ(count, 1u);
   std::memcpy(&n.key.vlan, p + 8, 2);
   n.key.mac = p[15];
   EXPECT_EQ(p[16], 1u);   // IPv4
   n.key.ip = p[23];
   n.authoritative = p[36];
   for (size_t i : {17u, 18u, 19u, 24u, 25u, 26u, 27u, 28u, 29u, 30u, 31u, 32u, 33u, 34u, 35u, 37u, 38u, 39u}) {
      EXPECT_EQ(p[i], 0u) << "payload byte " << i;
   }
   return n;
}

class PortDbTest : public HandMadePortTest {
protected:
   void SetUp() override
   {
      HostTest::SetUp();
      makePort("portdb");
      makeConfigLock();
      ASSERT_EQ(SwSecInitPortFilterMap(), ORR_OK);
      std::strcpy(agent_.name, SIFRAGENERIC_BUILTIN_AGENT_NAME);
      filter_.agent = &agent_;
   }

   void TearDown() override
   {
      host().faults().clear();
      if (ctx_.portDbTimer != 0) {
         orr_TimerRemoveSync(ctx_.portDbTimer);
      }
      // Disable, as the filter's destruction does: empties the database and the map entry.
      SwSecConfig off{};
      EXPECT_EQ(SwSecConfigPortDb(&ctx_, &off), ORR_OK);
      ctx_.config.featuresEnabled = 0;
      while (!SifraGenericListIsEmpty(&ctx_.dhcpReqList)) {
         SwSecDelDhcpReq(&ctx_, reqAt(ctx_.dhcpReqList.next));
      }
      SwSecPortDbDestroy(&ctx_);
      EXPECT_EQ(portFilterMapDb.numPfm, 0u);
      SwSecCleanupPortFilterMap();
      releasePort();
      HostTest::TearDown();
   }

   // A filled heap record, as a learner makes it.
   static SwSecVmi *newVmi(Key key, uint8_t method, int64_t expiry = 0, uint8_t clientIdLen = 0)
   {
      auto *vmi = static_cast<SwSecVmi *>(SifraGenericAlloc(sizeof(SwSecVmi)));
      EXPECT_NE(vmi, nullptr);
      vmi->vlanId = key.vlan;
      std::memcpy(vmi->macAddr, key.macBytes().data(), 6);
      vmi->ipAddr = key.ipAddr();
      vmi->discoveryMethod = method;
      vmi->expiryTime = expiry;
      if (clientIdLen != 0) {
         vmi->clientIdLen = clientIdLen;
         vmi->clientIdStr = static_cast<uint8_t *>(SifraGenericAlloc(clientIdLen));
      }
      return vmi;
   }

   // Adds a record; frees it when refused, as a learner does.
   int add(Key key, uint8_t method, int64_t expiry = 0, uint8_t clientIdLen = 0)
   {
      SwSecVmi *vmi = newVmi(key, method, expiry, clientIdLen);
      int result = SwSecAddVmi(&ctx_, vmi);
      if (result != 0) {
         if (vmi->clientIdStr != nullptr) {
            SifraGenericFree(vmi->clientIdStr);
         }
         SifraGenericFree(vmi);
      }
      return result;
   }

   void addRequest(int64_t expiry, uint8_t clientIdLen = 0)
   {
      auto *req = static_cast<SwSecDhcpReq *>(SifraGenericAlloc(sizeof(SwSecDhcpReq)));
      ASSERT_NE(req, nullptr);
      req->expiryTime = expiry;
      if (clientIdLen != 0) {
         req->clientIdLen = clientIdLen;
         req->clientIdStr = static_cast<uint8_t *>(SifraGenericAlloc(clientIdLen));
      }
      SwSecLinkDhcpReq(&ctx_, req);
   }

   SwSecVmi *find(Key key) { return SwSecFindVmi(&ctx_, key.vlan, key.macBytes().data(), key.ipAddr()); }

   static Key keyOf(const SwSecVmi *vmi) { return {vmi->vlanId, vmi->macAddr[5], static_cast<uint8_t>(vmi->ipAddr >> 24)}; }

   Entries entries()
   {
      Entries out;
      for (orr_ListLinks *l = ctx_.portDbList.next; l != &ctx_.portDbList; l = l->next) {
         out.emplace_back(keyOf(vmiAt(l)), vmiAt(l)->discoveryMethod);
      }
      return out;
   }

   // The counters agree with the list (an invariant of every operation).
   void expectCountersAgree()
   {
      uint32_t all = 0, auth = 0, nonAuth = 0, statics = 0;
      for (auto &[key, method] : entries()) {
         all++;
         auth += (method & SwSecDiscAuthoritativeMask) != 0;
         nonAuth += (method & SwSecDiscNonAuthoritativeMask) != 0;
         statics += method == SwSecDiscStatic;
      }
      EXPECT_EQ(ctx_.numVmiEntries, all);
      EXPECT_EQ(ctx_.numAuthVmiEntries, auth);
      EXPECT_EQ(ctx_.numNonAuthVmiEntries, nonAuth);
      EXPECT_EQ(+ctx_.config.numStatic, statics);
      EXPECT_EQ(ctx_.portDbHash != nullptr, all >= 2);
   }

   // The messages posted since the last call.
   std::vector<Notice> notices()
   {
      std::vector<Notice> out;
      for (const auto &msg : host().portsets().posted()) {
         EXPECT_EQ(msg.msgClass, SWSEC_PORTSET_MSG_PORTDB);
         EXPECT_EQ(msg.portID, kPortId);
         EXPECT_EQ(msg.payload.size(), 40u);
         if (msg.payload.size() == 40) {
            out.push_back(decodeNotice(msg.name, msg.payload.data()));
         }
      }
      host().portsets().clearPosted();
      return out;
   }

   static Notice added(Key key, uint8_t auth) { return {"portdb.entry.added", 0, key, auth}; }
   static Notice removed(Key key, uint8_t auth) { return {"portdb.entry.removed", 1, key, auth}; }

   // A configuration record with its static keys behind the header.
   static std::vector<uint8_t> config(uint32_t features, uint8_t trusted, uint32_t portDbSize,
                                      const std::vector<Key> &statics = {})
   {
      PortConfig config{.features = features, .trusted = trusted, .portDbSize = portDbSize};
      for (const Key &key : statics) {
         config.statics.push_back({key.vlan, key.macBytes(), {10, 0, 0, key.ip}});
      }
      return configBytes(config);
   }

   orr_Status configure(const std::vector<uint8_t> &bytes)
   {
      // The caller copies the rest of the header once the database accepted it.
      const auto *header = reinterpret_cast<const SwSecConfig *>(bytes.data());
      orr_Status status = SwSecConfigPortDb(&ctx_, header);
      if (status == ORR_OK) {
         ctx_.config.featuresEnabled = header->featuresEnabled;
      }
      return status;
   }

   SifraGenericFastPathAgent agent_{};
};

}  // namespace swsec::testing
