// Why the port dropped a frame, found from outside the module: the drop
// counters the port shows, read before and after the frame, name the check
// wherever the check has a counter. The checks that count nothing (the
// BPDU filter, the DHCP server block, a DHCPACK that answers no request)
// are told apart by what the dropped frame is: each applies to one kind of
// frame only, so no verdict is worked out again here.
#pragma once

#include <cstdint>
#include <map>
#include <span>
#include <string>

namespace swsec::replay {

enum class DropReason : uint8_t {
   none,                  // not dropped, or not asked
   unexplained,           // no counter moved and the frame is of no counterless check's kind
   dai,                   // daiDropCnt
   arpRateLimit,          // rxRateLimitDropCnt, or txRateLimitDropCnt as the error state is entered
   arpRateLimitErrorState,// txRateLimitDropCnt while in the error-rate-limit state
   ipSourceGuard,         // ipSrcGuardDropCnt
   dhcpChaddrMismatch,    // dhcpSnoopingDropCnt
   taggedFrame,           // taggedDropCnt
   etherType,             // etherTypeDropCnt
   bpduFilter,
   dhcpServerBlock,
   dhcpv6ServerBlock,      // the same rule on UDP from port 547, before the IPv6 agent sees it
   dhcpUnansweredAck,
   // The IPv6 agent's checks, each by its counter.
   ipv6HeaderChain,       // headerChainDropCnt
   fragmentedNd,          // fragmentedNdDropCnt
   raGuard,               // raGuardDropCnt
   dhcpv6Guard,           // dhcpv6GuardDropCnt
   ipv6SourceGuard,       // sourceGuardDropCnt
   ndInspection,          // ndInspectionDropCnt
   claimRefused,          // claimRefusedDropCnt
   ndRateLimit,           // ndRateLimitDropCnt with ndRateLimitErrEntryCnt
   ndRateLimitErrorState, // ndRateLimitDropCnt alone: in the error state
};

// The names the port's feature summary uses for the checks.
const char *dropReasonName(DropReason reason);

// The drop counters as the "featureSummary" node shows them, by field name.
using DropCounters = std::map<std::string, uint64_t, std::less<>>;

// The check that dropped `frame` (handed over alone in `direction`), from
// the counters before and after it.
DropReason explainDrop(const DropCounters &before, const DropCounters &after, std::span<const uint8_t> frame,
                       uint8_t direction);

}  // namespace swsec::replay
