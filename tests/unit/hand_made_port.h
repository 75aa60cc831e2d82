// A switch-security port made by hand, for unit tests of the module's
// pieces: the module heap, log and lock domain as start-up makes them, the
// port filter map, a filter of the built-in agent named "port-7", and a
// context with IP discovery on a host portset, its database not yet
// configured. Frames are built by the host and wrapped in a parse record
// as the frame loop fills it. A block left on the heap fails the test.
#pragma once

#include "support/frames.h"
#include "support/host_fixture.h"
#include "support/scene.h"
#include "support/security_config.h"

#include "contract/config_record.h"
#include "framework/sifra_generic.h"
#include "framework/sifra_generic_agent.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_lock.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_dhcp_req_index.h"
#include "swsec/swsec_ip_discovery.h"
#include "swsec/swsec_notify.h"
#include "swsec/swsec_pkt_info.h"
#include "swsec/swsec_port_db.h"
#include "swsec/swsec_port_db_export.h"
#include "swsec/swsec_port_db_links.h"
#include "swsec/swsec_port_filter_map.h"

#include <algorithm>
#include <array>
#include <chrono>
#include <cstring>
#include <memory>
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

// One host frame and the parse record of it.
struct WrappedFrame {
   std::unique_ptr<host::FrameList> list;
   orr_Pkt *pkt = nullptr;
   std::array<orr_PktHeaderEntry, 3> headers{};   // Ethernet, IPv4, UDP
   SwSecPktInfo info{};

   // Gives back the copy a parser made, as the frame loop does after each frame.
   void releaseCopy()
   {
      if (info.pktCopy != nullptr) {
         SifraGenericFree(info.pktCopy);
         info.pktCopy = nullptr;
      }
   }
   ~WrappedFrame() { releaseCopy(); }
};

// What IP discovery made of one frame.
struct Outcome {
   orr_Status status = ORR_OK;   // of the last pass
   uint32_t verdict = 0;
   bool askedForWriteLock = false;
};

class HandMadePortTest : public HostTest {
protected:
   static constexpr uint32_t kPortId = 7;

   void SetUp() override
   {
      HostTest::SetUp();
      orr_NameInitialize(&heapProps_.name, "unit");
      heapProps_.initialSize = 4096;
      heapProps_.maximumSize = 1u << 20;
      ASSERT_EQ(orr_HeapCreate(&heapProps_, &sifraGenericHeapID), ORR_OK);
      orr_LogProps logProps{.name = heapProps_.name, .heap = sifraGenericHeapID};
      ASSERT_EQ(orr_LogRegister(&logProps, &sifraGenericLogHandle), ORR_OK);
      ASSERT_EQ(orr_LockDomainCreate(orr_ModuleCurrentID, sifraGenericHeapID, &heapProps_.name,
                                     &sifraGenericLockDomain),
                ORR_OK);
      ASSERT_EQ(SifraGenericCreateSpinlock("sifg.sec.config", ORR_SPINLOCK_RW, SifraGenericLockRank::PortConfig,
                                           &ctx_.configLock),
                ORR_OK);
      ASSERT_EQ(SwSecInitPortFilterMap(), ORR_OK);
      std::strcpy(agent_.name, SIFRAGENERIC_BUILTIN_AGENT_NAME);
      std::strcpy(filter_.name, "port-7");
      filter_.magic = SIFRAGENERIC_FILTER_MAGIC;
      filter_.agent = &agent_;
      ctx_.filter = &filter_;
      ctx_.config.featuresEnabled = kOn;
      ctx_.config.trusted = 1;
      ctx_.config.portDbSize = 32;
      SifraGenericListInit(&ctx_.portDbList);
      SifraGenericListInit(&ctx_.dhcpReqList);
      ctx_.portset = host().portsets().addPortset("vswitch0");
      host().portsets().addPort("vswitch0", kPortId);
      ctx_.portId = kPortId;
   }

   // Disables the database as the filter's destruction does, then
   // releases what start-up made, in reverse order.
   void TearDown() override
   {
      host().faults().clear();
      if (ctx_.portDbTimer != 0) {
         orr_TimerRemoveSync(ctx_.portDbTimer);
      }
      SwSecConfig off{};
      EXPECT_EQ(SwSecConfigPortDb(&ctx_, &off), ORR_OK);
      SwSecPortDbDestroy(&ctx_);
      EXPECT_EQ(portFilterMapDb.numPfm, 0u);
      SwSecCleanupPortFilterMap();
      orr_SpinlockDestroy(ctx_.configLock);
      orr_LockDomainDestroy(sifraGenericLockDomain);
      sifraGenericLockDomain = ORR_INVALID_LOCK_DOMAIN;
      orr_LogUnregister(sifraGenericLogHandle);
      sifraGenericLogHandle = nullptr;
      orr_HeapDestroy(sifraGenericHeapID);
      sifraGenericHeapID = nullptr;
      HostTest::TearDown();
   }

   // ---- the database

   // Every VMI and every pending request, oldest first.
   std::vector<SwSecVmi *> vmis()
   {
      std::vector<SwSecVmi *> out;
      for (orr_ListLinks *l = ctx_.portDbList.next; l != &ctx_.portDbList; l = l->next) {
         out.push_back(SwSecVmiFromListLinks(l));
      }
      return out;
   }
   std::vector<SwSecDhcpReq *> requests()
   {
      std::vector<SwSecDhcpReq *> out;
      for (orr_ListLinks *l = ctx_.dhcpReqList.next; l != &ctx_.dhcpReqList; l = l->next) {
         out.push_back(SwSecDhcpReqFromLinks(l));
      }
      return out;
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
      const int result = SwSecAddVmi(&ctx_, vmi);
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
      for (const SwSecVmi *vmi : vmis()) {
         out.emplace_back(keyOf(vmi), vmi->discoveryMethod);
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
      PortConfig config{.features = features, .trusted = trusted != 0, .portDbSize = portDbSize};
      for (const Key &key : statics) {
         config.statics.push_back({key.vlan, key.macBytes(), {10, 0, 0, key.ip}});
      }
      return configRecord(config);
   }

   // Configures the database; the caller copies the rest of the header once it is accepted.
   orr_Status configure(const std::vector<uint8_t> &bytes)
   {
      const auto *header = reinterpret_cast<const SwSecConfig *>(bytes.data());
      const orr_Status status = SwSecConfigPortDb(&ctx_, header);
      if (status == ORR_OK) {
         ctx_.config.featuresEnabled = header->featuresEnabled;
      }
      return status;
   }

   // ---- frames

   // Wraps `bytes` as one host frame, its headers located (untagged
   // Ethernet, IPv4 without options, then UDP) as the host reports them.
   std::unique_ptr<WrappedFrame> wrap(const Bytes &bytes, uint16_t vlanId = 0, std::vector<uint32_t> split = {},
                                      std::optional<uint32_t> mappedLen = std::nullopt)
   {
      auto frame = std::make_unique<WrappedFrame>();
      frame->list = host().frames().makeList({{.bytes = bytes,
                                               .vlanId = vlanId,
                                               .split = std::move(split),
                                               .mappedLen = mappedLen.value_or(static_cast<uint32_t>(bytes.size()))}});
      frame->pkt = frame->list->frame(0);
      SwSecPktInfo &info = frame->info;
      info.frame = orr_PktFrameMappedPointerGet(frame->pkt);
      info.frameLen = orr_PktFrameLenGet(frame->pkt);
      info.mappedLen = std::min(info.frameLen, orr_PktFrameMappedLenGet(frame->pkt));
      info.vlanId = orr_PktVlanIDGet(frame->pkt);
      auto &[eth, ip, l4] = frame->headers;
      eth = {0, 14, 0, 14};
      std::memcpy(&eth.nextProto, &bytes[12], 2);   // network order, as the host keeps it
      info.ethEntry = &eth;
      info.ethHdr = info.frame;
      info.flags = SWSEC_PKT_ETH;
      if ((bytes[12] << 8 | bytes[13]) == kEtherIpv4) {
         ip = {14, 20, bytes[14 + 9], 34};
         info.ipEntry = &ip;
         info.ipHdr = info.frame + 14;
         info.flags |= SWSEC_PKT_IPV4;
         if (bytes[14 + 9] == 17) {
            l4 = {34, 8, 0, 42};
            info.l4Entry = &l4;
            info.udpHdr = info.frame + 34;
            info.flags |= SWSEC_PKT_UDP;
         }
      }
      return frame;
   }

   // Judges one frame as the frame loop does: shared first, exclusive on ORR_BUSY.
   Outcome judge(const Bytes &bytes, uint32_t direction, uint16_t vlanId = 0)
   {
      auto frame = wrap(bytes, vlanId);
      Outcome out;
      frame->info.readLocked = 1;
      out.status = SwSecIpDiscovery(&ctx_, frame->pkt, &frame->info, direction, &out.verdict);
      if (out.status == ORR_BUSY) {
         out.askedForWriteLock = true;
         frame->releaseCopy();
         frame->info.readLocked = 0;
         out.status = SwSecIpDiscovery(&ctx_, frame->pkt, &frame->info, direction, &out.verdict);
      }
      return out;
   }

   void advanceSeconds(int64_t seconds) { host().clock().advance(std::chrono::seconds(seconds)); }

   int64_t uptime()
   {
      orr_TimeVal now{};
      orr_GetUptime(&now);
      return now.sec;
   }

   SifraGenericFastPathAgent agent_{};
   SifraGenericFilter filter_{};
   SwSecContext ctx_{};

private:
   orr_HeapProps heapProps_{};
};

}  // namespace swsec::testing
