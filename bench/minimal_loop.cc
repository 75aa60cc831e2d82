#include "minimal_loop.h"

#include "contract/config_record.h"
#include "contract/vmi_key.h"

#include <algorithm>
#include <cstring>

namespace swsec::bench {

namespace {

constexpr uint16_t kEtherIpv4 = 0x0800;
constexpr uint32_t kEthHeaderLen = 14;
constexpr uint32_t kIpv4SrcInHeader = 12;
constexpr uint32_t kIpv4FragmentInHeader = 6;
constexpr uint32_t kIpv4ProtocolOffset = kEthHeaderLen + 9;
constexpr uint8_t kIpProtoUdp = 17;
constexpr uint16_t kDhcpServerPort = 67;
constexpr uint16_t kFragmentMask = 0x3fff;   // more fragments and the offset
constexpr uint8_t kStpMac[6] = {0x01, 0x80, 0xc2, 0x00, 0x00, 0x00};
constexpr uint8_t kPvstMac[6] = {0x01, 0x00, 0x0c, 0xcc, 0xcc, 0xcd};

uint16_t load16(const uint8_t *bytes)
{
   return static_cast<uint16_t>(bytes[0] << 8 | bytes[1]);
}

}  // namespace

MinimalLoop::MinimalLoop(const std::vector<Binding> &bindings)
   : features_(SwSecFeatureBpduFilter | SwSecFeatureBlockDhcpServer | SwSecFeatureIpDiscovery |
               SwSecFeatureDai | SwSecFeatureIpSrcGuard)
{
   entries_.resize(bindings.size());
   for (size_t i = 0; i < bindings.size(); ++i) {
      Entry &entry = entries_[i];
      entry.key = Key{};
      entry.key.vlanId = 0;
      std::memcpy(entry.key.macAddr, bindings[i].mac.bytes.data(), 6);
      std::memcpy(&entry.key.ipAddr, bindings[i].ip.bytes.data(), 4);
      const uint32_t bucket = SwSecVmiKeyHash(&entry.key) & (kBuckets - 1);
      entry.next = buckets_[bucket];
      buckets_[bucket] = &entry;
   }
}

const MinimalLoop::Entry *MinimalLoop::find(const Key &key) const
{
   const uint32_t bucket = SwSecVmiKeyHash(&key) & (kBuckets - 1);
   for (const Entry *entry = buckets_[bucket]; entry != nullptr; entry = entry->next) {
      if (std::memcmp(&entry->key, &key, sizeof key) == 0) {
         return entry;
      }
   }
   return nullptr;
}

bool MinimalLoop::isBound(uint16_t vlanId, const uint8_t *ethHdr, const uint8_t *ipHdr) const
{
   Key key{};
   key.vlanId = vlanId;
   std::memcpy(key.macAddr, ethHdr + 6, 6);
   std::memcpy(&key.ipAddr, ipHdr + kIpv4SrcInHeader, 4);
   return find(key) != nullptr;
}

bool MinimalLoop::drops(const uint8_t *frame, uint32_t mapped, uint16_t vlanId) const
{
   const uint32_t features = features_;
   if (mapped < kEthHeaderLen) {
      return false;
   }
   if ((features & SwSecFeatureBpduFilter) != 0 &&
       (std::memcmp(frame, kStpMac, 6) == 0 || std::memcmp(frame, kPvstMac, 6) == 0)) {
      return true;
   }
   if (load16(frame + 12) != kEtherIpv4 || mapped < kEthHeaderLen + 20) {
      return false;
   }
   const uint8_t *ip = frame + kEthHeaderLen;
   const bool fragment = (load16(ip + kIpv4FragmentInHeader) & kFragmentMask) != 0;
   const uint32_t ipHeaderLen = (ip[0] & 0x0fu) * 4u;
   if (!fragment && frame[kIpv4ProtocolOffset] == kIpProtoUdp && mapped >= kEthHeaderLen + ipHeaderLen + 4) {
      const uint8_t *udp = ip + ipHeaderLen;
      if ((features & SwSecFeatureBlockDhcpServer) != 0 && load16(udp) == kDhcpServerPort) {
         return true;
      }
      if ((features & SwSecFeatureIpDiscovery) != 0 && load16(udp + 2) == kDhcpServerPort) {
         return false;
      }
   }
   return (features & SwSecFeatureIpSrcGuard) != 0 && !isBound(vlanId, frame, ip);
}

uint32_t MinimalLoop::run(orr_PktList *list) const
{
   alignas(void *) unsigned char iterSpace[ORR_PKT_LIST_ITER_MAX_SIZE];
   auto *iter = reinterpret_cast<orr_PktListIter *>(iterSpace);
   uint32_t dropped = 0;
   for (orr_PktListIterStart(list, iter); !orr_PktListIterIsAtEnd(iter); orr_PktListIterMove(iter)) {
      orr_Pkt *pkt = orr_PktListIterGetPkt(iter);
      const uint8_t *frame = static_cast<const uint8_t *>(orr_PktFrameMappedPointerGet(pkt));
      // Bounded as the module bounds its reads: by the mapped part and the frame.
      const uint32_t mapped = std::min(orr_PktFrameMappedLenGet(pkt), orr_PktFrameLenGet(pkt));
      dropped += drops(frame, mapped, orr_PktVlanIDGet(pkt)) ? 1 : 0;
   }
   return dropped;
}

uint32_t MinimalLoop::runBytes(const std::vector<testing::Bytes> &frames) const
{
   uint32_t dropped = 0;
   for (const testing::Bytes &frame : frames) {
      dropped += drops(frame.data(), static_cast<uint32_t>(frame.size()), 0) ? 1 : 0;
   }
   return dropped;
}

uint32_t MinimalLoop::runViaHeaders(orr_PktList *list) const
{
   alignas(void *) unsigned char iterSpace[ORR_PKT_LIST_ITER_MAX_SIZE];
   auto *iter = reinterpret_cast<orr_PktListIter *>(iterSpace);
   uint32_t dropped = 0;
   for (orr_PktListIterStart(list, iter); !orr_PktListIterIsAtEnd(iter); orr_PktListIterMove(iter)) {
      orr_Pkt *pkt = orr_PktListIterGetPkt(iter);
      orr_PktHeaderEntry *eth = nullptr;
      orr_PktHeaderEntry *ip = nullptr;
      orr_PktHeaderEntry *l4 = nullptr;
      uint8_t *ethHdr = nullptr;
      uint8_t *ipHdr = nullptr;
      uint8_t *udpHdr = nullptr;
      const uint32_t features = features_;
      if (orr_PktHeaderFind(pkt, ORR_PKT_LAYER_2, ORR_PKT_HEADER_CLASS_L2, 1, &eth, 0) != ORR_OK ||
          orr_PktHeaderDataGet(pkt, eth, &ethHdr) != ORR_OK) {
         continue;
      }
      bool drop = (features & SwSecFeatureBpduFilter) != 0 &&
                  (std::memcmp(ethHdr, kStpMac, 6) == 0 || std::memcmp(ethHdr, kPvstMac, 6) == 0);
      if (!drop && eth->nextProto == __builtin_bswap16(kEtherIpv4) &&
          orr_PktHeaderFind(pkt, ORR_PKT_LAYER_3, ORR_PKT_HEADER_CLASS_L3, 1, &ip, 0) == ORR_OK &&
          orr_PktHeaderDataGet(pkt, ip, &ipHdr) == ORR_OK) {
         const bool fragment = (load16(ipHdr + kIpv4FragmentInHeader) & kFragmentMask) != 0;
         bool toServer = false;
         if (!fragment && ip->nextProto == kIpProtoUdp &&
             orr_PktHeaderFind(pkt, ORR_PKT_LAYER_4, ORR_PKT_HEADER_CLASS_L4, 1, &l4, 0) == ORR_OK &&
             orr_PktHeaderDataGet(pkt, l4, &udpHdr) == ORR_OK) {
            drop = (features & SwSecFeatureBlockDhcpServer) != 0 && load16(udpHdr) == kDhcpServerPort;
            toServer = (features & SwSecFeatureIpDiscovery) != 0 && load16(udpHdr + 2) == kDhcpServerPort;
            orr_PktHeaderDataRelease(pkt, l4, udpHdr, 0);
         }
         if (!drop && !toServer && (features & SwSecFeatureIpSrcGuard) != 0) {
            drop = !isBound(orr_PktVlanIDGet(pkt), ethHdr, ipHdr);
         }
         orr_PktHeaderDataRelease(pkt, ip, ipHdr, 0);
      }
      orr_PktHeaderDataRelease(pkt, eth, ethHdr, 0);
      dropped += drop ? 1 : 0;
   }
   return dropped;
}

}  // namespace swsec::bench
