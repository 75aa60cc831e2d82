// A switch-security port made by hand for the DHCP parser and IP discovery
// tests: a filter record with a name, a context with an enabled port
// database on a host portset, and frames built by the host and wrapped in a
// parse record as the frame loop fills it.
#pragma once

#include "support/frames.h"
#include "support/host_fixture.h"
#include "unit/hand_made_port.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_ip_discovery.h"
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

// What IP discovery made of one frame.
struct Outcome {
   orr_Status status = ORR_OK;   // of the last pass
   uint32_t verdict = 0;
   bool askedForWriteLock = false;
};

class DiscoveryTest : public HandMadePortTest {
protected:
   void SetUp() override
   {
      HostTest::SetUp();
      makePort("discovery");
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
      releasePort();
      HostTest::TearDown();
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
};

}  // namespace swsec::testing
