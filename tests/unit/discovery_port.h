// A switch-security port made by hand for the DHCP parser and IP discovery
// tests: a filter record with a name, a context with an enabled port
// database on a host portset, and frames built by the host and wrapped in a
// parse record as the frame loop fills it.
#pragma once

#include "support/frames.h"
#include "support/host_fixture.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_pkt_info.h"
#include "swsec/swsec_port_db.h"

#include <algorithm>
#include <chrono>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

namespace swsec::testing {

// The frame's headers, located from its bytes (untagged Ethernet, IPv4
// without options, then UDP) as the host's header lookup reports them.
struct FrameHeaders {
   orr_PktHeaderEntry eth{};
   orr_PktHeaderEntry ip{};
   orr_PktHeaderEntry l4{};
};

// One host frame and the parse record of it.
struct WrappedFrame {
   std::unique_ptr<host::FrameList> list;
   orr_Pkt *pkt = nullptr;
   std::unique_ptr<FrameHeaders> headers = std::make_unique<FrameHeaders>();
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

class DiscoveryTest : public HostTest {
protected:
   static constexpr uint32_t kPortId = 7;

   void SetUp() override
   {
      HostTest::SetUp();
      // The module heap and log, as start-up makes them.
      orr_HeapProps props{};
      orr_NameInitialize(&props.name, "discovery");
      props.initialSize = 4096;
      props.maximumSize = 1u << 20;
      ASSERT_EQ(orr_HeapCreate(&props, &sifraGenericHeapID), ORR_OK);
      orr_LogProps logProps{};
      logProps.name = props.name;
      logProps.heap = sifraGenericHeapID;
      ASSERT_EQ(orr_LogRegister(&logProps, &sifraGenericLogHandle), ORR_OK);

      std::strcpy(filter_.name, "port-7");
      filter_.magic = SIFRAGENERIC_FILTER_MAGIC;
      ctx_.filter = &filter_;
      ctx_.config.featuresEnabled = SwSecFeatureIpDiscovery;
      ctx_.config.trusted = 1;
      ctx_.config.portDbSize = 32;
      SifraGenericListInit(&ctx_.portDbList);
      SifraGenericListInit(&ctx_.dhcpReqList);
      ctx_.portset = host().portsets().addPortset("vswitch0");
      host().portsets().addPort("vswitch0", kPortId);
      ctx_.portId = kPortId;
   }

   void TearDown() override
   {
      // Empty the database and the requests, as a disable does.
      while (!SifraGenericListIsEmpty(&ctx_.portDbList)) {
         SwSecDelVmi(&ctx_, vmiAt(ctx_.portDbList.next));
      }
      while (!SifraGenericListIsEmpty(&ctx_.dhcpReqList)) {
         SwSecDelDhcpReq(&ctx_, reqAt(ctx_.dhcpReqList.next));
      }
      if (ctx_.sparePortDbHash != nullptr) {
         Hash_Free(ctx_.sparePortDbHash);
      }
      if (sifraGenericLogHandle != nullptr) {
         orr_LogUnregister(sifraGenericLogHandle);
         sifraGenericLogHandle = nullptr;
      }
      if (sifraGenericHeapID != nullptr) {
         orr_HeapDestroy(sifraGenericHeapID);   // a block left behind is reported as a leak
         sifraGenericHeapID = nullptr;
      }
      HostTest::TearDown();
   }

   static SwSecVmi *vmiAt(orr_ListLinks *links)
   {
      return reinterpret_cast<SwSecVmi *>(reinterpret_cast<uint8_t *>(links) -
                                          offsetof(SwSecVmi, listLinks));
   }
   static SwSecDhcpReq *reqAt(orr_ListLinks *links)
   {
      return reinterpret_cast<SwSecDhcpReq *>(reinterpret_cast<uint8_t *>(links) -
                                              offsetof(SwSecDhcpReq, links));
   }

   // Every VMI, oldest first.
   std::vector<SwSecVmi *> vmis()
   {
      std::vector<SwSecVmi *> out;
      for (orr_ListLinks *l = ctx_.portDbList.next; l != &ctx_.portDbList; l = l->next) {
         out.push_back(vmiAt(l));
      }
      return out;
   }
   std::vector<SwSecDhcpReq *> requests()
   {
      std::vector<SwSecDhcpReq *> out;
      for (orr_ListLinks *l = ctx_.dhcpReqList.next; l != &ctx_.dhcpReqList; l = l->next) {
         out.push_back(reqAt(l));
      }
      return out;
   }

   // Wraps `bytes` as one host frame with its parse record filled as the
   // frame loop fills it: headers located, readLocked as given.
   std::unique_ptr<WrappedFrame> wrap(const Bytes &bytes, uint16_t vlanId = 0,
                                      std::vector<uint32_t> split = {},
                                      std::optional<uint32_t> mappedLen = std::nullopt)
   {
      auto frame = std::make_unique<WrappedFrame>();
      host::FrameSpec frameSpec;
      frameSpec.bytes = bytes;
      frameSpec.vlanId = vlanId;
      frameSpec.split = std::move(split);
      frameSpec.mappedLen = mappedLen.value_or(static_cast<uint32_t>(bytes.size()));
      frame->list = host().frames().makeList({frameSpec});
      frame->pkt = frame->list->frame(0);

      SwSecPktInfo &info = frame->info;
      info.frame = orr_PktFrameMappedPointerGet(frame->pkt);
      info.frameLen = orr_PktFrameLenGet(frame->pkt);
      info.mappedLen = std::min(info.frameLen, orr_PktFrameMappedLenGet(frame->pkt));
      info.vlanId = orr_PktVlanIDGet(frame->pkt);
      info.readLocked = 0;

      FrameHeaders &h = *frame->headers;
      h.eth = {0, 14, 0, 14};
      std::memcpy(&h.eth.nextProto, &bytes[12], 2);   // network order, as the host keeps it
      info.ethEntry = &h.eth;
      info.ethHdr = info.frame;
      info.flags = SWSEC_PKT_ETH;
      const uint16_t etherType = static_cast<uint16_t>(bytes[12] << 8 | bytes[13]);
      if (etherType == kEtherIpv4) {
         h.ip = {14, 20, bytes[14 + 9], 34};
         info.ipEntry = &h.ip;
         info.ipHdr = info.frame + 14;
         info.flags |= SWSEC_PKT_IPV4;
         if (bytes[14 + 9] == 17) {
            h.l4 = {34, 8, 0, 42};
            info.l4Entry = &h.l4;
            info.udpHdr = info.frame + 34;
            info.flags |= SWSEC_PKT_UDP;
         }
      }
      return frame;
   }

   void advanceSeconds(int64_t seconds) { host().clock().advance(std::chrono::seconds(seconds)); }

   int64_t uptime()
   {
      orr_TimeVal now{};
      orr_GetUptime(&now);
      return now.sec;
   }

   SifraGenericFilter filter_{};
   SwSecContext ctx_{};

};

}  // namespace swsec::testing
