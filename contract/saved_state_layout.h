/*
 * The switch-security agent's part of a filter's saved state: the active
 * configuration header, the error-rate-limit state, the drop counters and
 * every VMI of the port database, with remaining lifetimes rather than
 * absolute times, so that a restore re-bases them on its own clock.
 *
 * Packed and little-endian: a 96-byte fixed part, then `numSavedVmis`
 * 48-byte entries back to back, each DHCP Snooping entry followed by its
 * `clientIdLen` bytes of client identifier, then the 40-byte frame guard
 * block. The part sits in the blob of contract/state_blob.h.
 *
 * Wire contract: freestanding, shared by the module and the tools.
 */
#pragma once

#include "contract/config_record.h"
#include "contract/state_blob.h"

#include <cstddef>
#include <cstdint>

/* A port's drop counters, one block, in the order the part carries them. */
struct SwSecDropCounters {
   uint64_t dhcpSnoopingDropCnt;
   uint64_t daiDropCnt;
   uint64_t txRateLimitDropCnt;
   uint64_t txRateLimitErrEntryCnt;
   uint64_t rxRateLimitDropCnt;
   uint64_t ipSrcGuardDropCnt;
};
static_assert(sizeof(SwSecDropCounters) == 48);

struct __attribute__((packed)) SwSecSavedState {
   SwSecConfig config;                /* the active header; numStatic is the live count */
   uint8_t reserved1[2];
   uint32_t numSavedVmis;             /* entries after the fixed part; 0 without IP discovery */
   uint8_t txRateLimitErr;            /* non-zero: in the error-rate-limit state */
   uint8_t reserved2[7];
   int64_t txRateLimitErrRemaining;   /* seconds that state had left; 0 when none or over */
   SwSecDropCounters counters;        /* the context's counter block, whole */
};

static_assert(sizeof(SwSecSavedState) == 96);
static_assert(offsetof(SwSecSavedState, config) == 0);
static_assert(offsetof(SwSecSavedState, reserved1) == 26);
static_assert(offsetof(SwSecSavedState, numSavedVmis) == 28);
static_assert(offsetof(SwSecSavedState, txRateLimitErr) == 32);
static_assert(offsetof(SwSecSavedState, reserved2) == 33);
static_assert(offsetof(SwSecSavedState, txRateLimitErrRemaining) == 40);
static_assert(offsetof(SwSecSavedState, counters) == 48);
static_assert(offsetof(SwSecSavedState, counters) + offsetof(SwSecDropCounters, dhcpSnoopingDropCnt) == 48);
static_assert(offsetof(SwSecSavedState, counters) + offsetof(SwSecDropCounters, daiDropCnt) == 56);
static_assert(offsetof(SwSecSavedState, counters) + offsetof(SwSecDropCounters, txRateLimitDropCnt) == 64);
static_assert(offsetof(SwSecSavedState, counters) + offsetof(SwSecDropCounters, txRateLimitErrEntryCnt) == 72);
static_assert(offsetof(SwSecSavedState, counters) + offsetof(SwSecDropCounters, rxRateLimitDropCnt) == 80);
static_assert(offsetof(SwSecSavedState, counters) + offsetof(SwSecDropCounters, ipSrcGuardDropCnt) == 88);

/* One VMI; a DHCP Snooping entry's client identifier follows it. */
struct __attribute__((packed)) SwSecSavedVmi {
   uint16_t vlanId;                   /* host order */
   uint8_t macAddr[6];
   uint32_t ipAddr;                   /* network order */
   uint8_t discoveryMethod;           /* SwSecDiscMethod */
   uint8_t reserved1[3];
   int64_t timeRemaining;             /* seconds left; 0 when expired, and for Static */
   /* DHCP Snooping only, else 0. */
   uint8_t chaddr[6];
   uint8_t clientIdLen;
   uint8_t reserved2;
   uint8_t reserved3[8];              /* where the record keeps its clientIdStr pointer */
   uint32_t serverIp;                 /* network order */
   uint32_t leaseTime;                /* seconds, host order */
};

static_assert(sizeof(SwSecSavedVmi) == 48);
static_assert(offsetof(SwSecSavedVmi, vlanId) == 0);
static_assert(offsetof(SwSecSavedVmi, macAddr) == 2);
static_assert(offsetof(SwSecSavedVmi, ipAddr) == 8);
static_assert(offsetof(SwSecSavedVmi, discoveryMethod) == 12);
static_assert(offsetof(SwSecSavedVmi, reserved1) == 13);
static_assert(offsetof(SwSecSavedVmi, timeRemaining) == 16);
static_assert(offsetof(SwSecSavedVmi, chaddr) == 24);
static_assert(offsetof(SwSecSavedVmi, clientIdLen) == 30);
static_assert(offsetof(SwSecSavedVmi, reserved2) == 31);
static_assert(offsetof(SwSecSavedVmi, reserved3) == 32);
static_assert(offsetof(SwSecSavedVmi, serverIp) == 40);
static_assert(offsetof(SwSecSavedVmi, leaseTime) == 44);

/*
 * After the entries: the frame guard and its drop counters. A part that
 * ends with the entries (saved before the block existed) restores the
 * defaults, unless its configuration is version 2, which needs the block.
 */
struct __attribute__((packed)) SwSecSavedFrameGuard {
   SwSecFrameGuard guard;
   uint8_t reserved[6];
   uint64_t taggedDropCnt;
   uint64_t etherTypeDropCnt;
};

static_assert(sizeof(SwSecSavedFrameGuard) == 40);
static_assert(offsetof(SwSecSavedFrameGuard, guard) == 0);
static_assert(offsetof(SwSecSavedFrameGuard, reserved) == 18);
static_assert(offsetof(SwSecSavedFrameGuard, taggedDropCnt) == 24);
static_assert(offsetof(SwSecSavedFrameGuard, etherTypeDropCnt) == 32);

/* The largest part: 32 entries, each with a 255-byte client identifier, and the frame guard. */
constexpr uint64_t SWSEC_SAVED_STATE_MAX_LEN =
   sizeof(SwSecSavedState) + 32u * (sizeof(SwSecSavedVmi) + 255u) + sizeof(SwSecSavedFrameGuard);
static_assert(SWSEC_SAVED_STATE_MAX_LEN == 9832);
