// The DHCP parser on arbitrary bytes as a UDP/IPv4 frame, laid out in
// scatter-gather elements chosen by the input, with the parse record filled
// as the frame loop fills it.
//
// Input: [split count] [mapped length, 2 bytes] [split lengths...] [frame]
#include "fuzz_input.h"

#include "host/host.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_dhcp_parse.h"
#include "swsec/swsec_pkt_info.h"

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>

namespace {

using swsec::fuzz::FuzzInput;

// Ethernet 14 + IPv4 20 + UDP 8: the headers the frame loop has located
// before it hands a frame to the parser.
constexpr size_t kUdpPayloadOffset = 42;
constexpr uint32_t kPortId = 7;

// The host and a hand-made port: the module heap and log as start-up makes
// them and a context with an enabled port database, kept for the process.
struct Port {
   swsec::host::Host host;
   SifraGenericFilter filter{};
   SwSecContext ctx{};

   Port()
   {
      orr_HeapProps props{};
      orr_NameInitialize(&props.name, "dhcpfuzz");
      props.initialSize = 4096;
      props.maximumSize = 1u << 20;
      if (orr_HeapCreate(&props, &sifraGenericHeapID) != ORR_OK) {
         std::abort();
      }
      orr_LogProps logProps{};
      logProps.name = props.name;
      logProps.heap = sifraGenericHeapID;
      if (orr_LogRegister(&logProps, &sifraGenericLogHandle) != ORR_OK) {
         std::abort();
      }
      std::strcpy(filter.name, "port-7");
      filter.magic = SIFRAGENERIC_FILTER_MAGIC;
      ctx.filter = &filter;
      ctx.config.featuresEnabled = SwSecFeatureIpDiscovery;
      ctx.config.trusted = 1;
      ctx.config.portDbSize = 32;
      SifraGenericListInit(&ctx.portDbList);
      SifraGenericListInit(&ctx.dhcpReqList);
      ctx.portset = host.portsets().addPortset("vswitch0");
      host.portsets().addPort("vswitch0", kPortId);
      ctx.portId = kPortId;
   }
};

Port &port()
{
   static Port *instance = new Port();   // lives until exit; the host aborts on a leak at teardown otherwise
   return *instance;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int *, char ***)
{
   (void)port();
   return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
   Port &p = port();
   FuzzInput in(data, size);
   const uint8_t splitCount = in.byte() % 4;
   const uint16_t mappedWanted = in.u16();
   const std::vector<uint8_t> rawSplits = in.bytes(splitCount);

   std::vector<uint8_t> bytes = in.rest();
   if (bytes.size() < kUdpPayloadOffset) {
      bytes.resize(kUdpPayloadOffset, 0);
   }
   // A UDP/IPv4 frame without IP options, as the frame loop has classified it.
   bytes[12] = 0x08;
   bytes[13] = 0x00;
   bytes[14] = 0x45;
   bytes[23] = 17;

   swsec::host::FrameSpec frameSpec;
   frameSpec.bytes = bytes;
   frameSpec.split = swsec::fuzz::clampSplits(rawSplits, bytes.size());
   // The loop maps at least the located headers; beyond that the input decides.
   frameSpec.mappedLen = static_cast<uint32_t>(
      std::clamp<size_t>(mappedWanted, kUdpPayloadOffset, bytes.size()));
   auto list = p.host.frames().makeList({frameSpec});
   orr_Pkt *pkt = list->frame(0);

   orr_PktHeaderEntry eth{0, 14, 0, 14};
   std::memcpy(&eth.nextProto, &bytes[12], 2);
   orr_PktHeaderEntry ip{14, 20, 17, 34};
   orr_PktHeaderEntry l4{34, 8, 0, 42};

   SwSecPktInfo info{};
   info.frame = orr_PktFrameMappedPointerGet(pkt);
   info.frameLen = orr_PktFrameLenGet(pkt);
   info.mappedLen = std::min(info.frameLen, orr_PktFrameMappedLenGet(pkt));
   info.vlanId = orr_PktVlanIDGet(pkt);
   info.ethEntry = &eth;
   info.ethHdr = info.frame;
   info.ipEntry = &ip;
   info.ipHdr = info.frame + 14;
   info.l4Entry = &l4;
   info.udpHdr = info.frame + 34;
   info.flags = SWSEC_PKT_ETH | SWSEC_PKT_IPV4 | SWSEC_PKT_UDP;

   (void)SwSecDhcpParse(&p.ctx, pkt, &info);
   if (info.pktCopy != nullptr) {
      SifraGenericFree(info.pktCopy);
   }
   p.host.log().clear();
   return 0;
}
