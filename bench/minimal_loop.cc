#include "minimal_loop.h"

#include "swsec/swsec_vmi_hash.h"

#include <algorithm>
#include <cstring>

namespace swsec::bench {

namespace {

constexpr uint16_t kEtherIpv4 = 0x0800;
constexpr uint32_t kEthHeaderLen = 14;
constexpr uint32_t kIpv4SrcInHeader = 12;
constexpr uint32_t kIpv4ProtocolOffset = kEthHeaderLen + 9;
constexpr uint8_t kIpProtoUdp = 17;
constexpr uint16_t kDhcpServerPort = 67;

}  // namespace

MinimalLoop::MinimalLoop(const std::vector<Binding> &bindings)
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

bool MinimalLoop::isBound(orr_Pkt *pkt, const uint8_t *ethHdr, const uint8_t *ipHdr) const
{
   Key key{};
   key.vlanId = orr_PktVlanIDGet(pkt);
   std::memcpy(key.macAddr, ethHdr + 6, 6);
   std::memcpy(&key.ipAddr, ipHdr + kIpv4SrcInHeader, 4);
   return find(key) != nullptr;
}

uint32_t MinimalLoop::run(orr_PktList *list) const
{
   alignas(void *) unsigned char iterSpace[ORR_PKT_LIST_ITER_MAX_SIZE];
   auto *iter = reinterpret_cast<orr_PktListIter *>(iterSpace);
   uint32_t drops = 0;
   for (orr_PktListIterStart(list, iter); !orr_PktListIterIsAtEnd(iter); orr_PktListIterMove(iter)) {
      orr_Pkt *pkt = orr_PktListIterGetPkt(iter);
      const uint8_t *frame = static_cast<const uint8_t *>(orr_PktFrameMappedPointerGet(pkt));
      // Bounded as the module bounds its reads: by the mapped part and the frame.
      const uint32_t mapped = std::min(orr_PktFrameMappedLenGet(pkt), orr_PktFrameLenGet(pkt));
      if (mapped < kEthHeaderLen + 20 + 4) {
         continue;
      }
      const auto etherType = static_cast<uint16_t>(frame[12] << 8 | frame[13]);
      if (etherType != kEtherIpv4) {
         continue;
      }
      const uint32_t ipHeaderLen = (frame[kEthHeaderLen] & 0x0fu) * 4u;
      if (frame[kIpv4ProtocolOffset] == kIpProtoUdp && mapped >= kEthHeaderLen + ipHeaderLen + 4) {
         const uint8_t *udp = frame + kEthHeaderLen + ipHeaderLen;
         if ((udp[2] << 8 | udp[3]) == kDhcpServerPort) {
            continue;
         }
      }
      if (!isBound(pkt, frame, frame + kEthHeaderLen)) {
         ++drops;
      }
   }
   return drops;
}

uint32_t MinimalLoop::runViaHeaders(orr_PktList *list) const
{
   alignas(void *) unsigned char iterSpace[ORR_PKT_LIST_ITER_MAX_SIZE];
   auto *iter = reinterpret_cast<orr_PktListIter *>(iterSpace);
   uint32_t drops = 0;
   for (orr_PktListIterStart(list, iter); !orr_PktListIterIsAtEnd(iter); orr_PktListIterMove(iter)) {
      orr_Pkt *pkt = orr_PktListIterGetPkt(iter);
      orr_PktHeaderEntry *eth = nullptr;
      orr_PktHeaderEntry *ip = nullptr;
      orr_PktHeaderEntry *l4 = nullptr;
      uint8_t *ethHdr = nullptr;
      uint8_t *ipHdr = nullptr;
      uint8_t *udpHdr = nullptr;
      if (orr_PktHeaderFind(pkt, ORR_PKT_LAYER_2, ORR_PKT_HEADER_CLASS_L2, 1, &eth, 0) != ORR_OK ||
          orr_PktHeaderDataGet(pkt, eth, &ethHdr) != ORR_OK) {
         continue;
      }
      if (eth->nextProto == __builtin_bswap16(kEtherIpv4) &&
          orr_PktHeaderFind(pkt, ORR_PKT_LAYER_3, ORR_PKT_HEADER_CLASS_L3, 1, &ip, 0) == ORR_OK &&
          orr_PktHeaderDataGet(pkt, ip, &ipHdr) == ORR_OK) {
         bool toServer = false;
         if (ip->nextProto == kIpProtoUdp &&
             orr_PktHeaderFind(pkt, ORR_PKT_LAYER_4, ORR_PKT_HEADER_CLASS_L4, 1, &l4, 0) == ORR_OK &&
             orr_PktHeaderDataGet(pkt, l4, &udpHdr) == ORR_OK) {
            toServer = (udpHdr[2] << 8 | udpHdr[3]) == kDhcpServerPort;
            orr_PktHeaderDataRelease(pkt, l4, udpHdr, 0);
         }
         if (!toServer && !isBound(pkt, ethHdr, ipHdr)) {
            ++drops;
         }
         orr_PktHeaderDataRelease(pkt, ip, ipHdr, 0);
      }
      orr_PktHeaderDataRelease(pkt, eth, ethHdr, 0);
   }
   return drops;
}

}  // namespace swsec::bench
