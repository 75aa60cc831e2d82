// Counters first, in the order the port runs its checks; then the kind of
// frame, for the three checks without a counter.
#include "replay/drop_reason.h"

#include "replay/capture.h"
#include "replay/describe.h"

#include <utility>

namespace swsec::replay {

const char *dropReasonName(DropReason reason)
{
   switch (reason) {
   case DropReason::none: return "";
   case DropReason::unexplained: return "unexplained (no drop counter moved)";
   case DropReason::dai: return "DAI";
   case DropReason::arpRateLimit: return "ARP rate limit";
   case DropReason::arpRateLimitErrorState: return "ARP rate limit: error state";
   case DropReason::ipSourceGuard: return "IP source guard";
   case DropReason::dhcpChaddrMismatch: return "DHCP snooping: chaddr mismatch";
   case DropReason::taggedFrame: return "Tagged frame";
   case DropReason::etherType: return "Ethertype not allowed";
   case DropReason::bpduFilter: return "BPDU filter";
   case DropReason::dhcpServerBlock: return "DHCP server block";
   case DropReason::dhcpv6ServerBlock: return "DHCP server block: DHCPv6 server message";
   case DropReason::dhcpUnansweredAck: return "DHCP snooping: unanswered ACK";
   case DropReason::ipv6HeaderChain: return "IPv6 header chain";
   case DropReason::fragmentedNd: return "Fragmented ND or RA";
   case DropReason::raGuard: return "RA guard";
   case DropReason::dhcpv6Guard: return "DHCPv6 guard";
   case DropReason::ipv6SourceGuard: return "IPv6 source guard";
   case DropReason::ndInspection: return "ND inspection";
   case DropReason::claimRefused: return "Address claimed by another port";
   case DropReason::ndRateLimit: return "ND rate limit";
   case DropReason::ndRateLimitErrorState: return "ND rate limit: error state";
   }
   return "";
}

namespace {

bool moved(const DropCounters &before, const DropCounters &after, std::string_view name)
{
   const auto was = before.find(name);
   const auto is = after.find(name);
   return is != after.end() && is->second != (was != before.end() ? was->second : 0);
}

}  // namespace

DropReason explainDrop(const DropCounters &before, const DropCounters &after, std::span<const uint8_t> frame,
                       uint8_t direction)
{
   // The frame guard judges before every feature.
   if (moved(before, after, "taggedDropCnt")) {
      return DropReason::taggedFrame;
   }
   if (moved(before, after, "etherTypeDropCnt")) {
      return DropReason::etherType;
   }
   if (moved(before, after, "txRateLimitDropCnt")) {
      return moved(before, after, "txRateLimitErrEntryCnt") ? DropReason::arpRateLimit
                                                             : DropReason::arpRateLimitErrorState;
   }
   if (moved(before, after, "rxRateLimitDropCnt")) {
      return DropReason::arpRateLimit;
   }
   if (moved(before, after, "daiDropCnt")) {
      return DropReason::dai;
   }
   if (moved(before, after, "dhcpSnoopingDropCnt")) {
      return DropReason::dhcpChaddrMismatch;
   }
   if (moved(before, after, "ipSrcGuardDropCnt")) {
      return DropReason::ipSourceGuard;
   }
   // The IPv6 agent judges what the IPv4 agent passed.
   if (moved(before, after, "ndRateLimitDropCnt")) {
      return moved(before, after, "ndRateLimitErrEntryCnt") ? DropReason::ndRateLimit
                                                            : DropReason::ndRateLimitErrorState;
   }
   static constexpr std::pair<std::string_view, DropReason> kIpv6Counters[] = {
      {"headerChainDropCnt", DropReason::ipv6HeaderChain}, {"fragmentedNdDropCnt", DropReason::fragmentedNd},
      {"raGuardDropCnt", DropReason::raGuard},             {"dhcpv6GuardDropCnt", DropReason::dhcpv6Guard},
      {"sourceGuardDropCnt", DropReason::ipv6SourceGuard}, {"ndInspectionDropCnt", DropReason::ndInspection},
      {"claimRefusedDropCnt", DropReason::claimRefused},
   };
   for (const auto &[counter, reason] : kIpv6Counters) {
      if (moved(before, after, counter)) {
         return reason;
      }
   }
   const FrameFacts facts = frameFacts(frame);
   if (facts.bpduDestination) {
      return DropReason::bpduFilter;
   }
   if (direction == kDirFromVm && (facts.udpSourcePort == 67 || facts.udpSourcePort == 547)) {
      return facts.udpSourcePort == 67 ? DropReason::dhcpServerBlock : DropReason::dhcpv6ServerBlock;
   }
   if (direction == kDirToVm && facts.dhcpMessageType == kDhcpAck) {
      return DropReason::dhcpUnansweredAck;
   }
   return DropReason::unexplained;
}

}  // namespace swsec::replay
