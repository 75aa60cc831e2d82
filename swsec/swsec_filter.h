/*
 * The switch-security agent's per-filter callbacks: the port context's
 * creation and destruction, the frame loop and the filter ioctls. Each is
 * called by the framework with the filter record and no framework lock held.
 */
#pragma once

#include "framework/sifra_generic_filter.h"
#include "platform/orr_pkt.h"

/*
 * Builds the port context in `agentData` with the default configuration
 * (IP discovery on a trusted port). On a failure everything built is
 * undone and the status returned.
 */
orr_Status SwSecCreateFilter(SifraGenericFilter *filter);

/*
 * Switches the port's features off and frees the context. ORR_BUSY from
 * the port filter map is retried 19 times, 10 ms apart; a failure leaves
 * the context attached and usable. ORR_OK also without a context.
 */
orr_Status SwSecDestroyFilter(SifraGenericFilter *filter);

/* Judges every frame of the list; dropped frames are removed and released. Always ORR_OK. */
orr_Status SwSecProcessPackets(SifraGenericFilter *filter, orr_PktList *pktList,
                               uint32_t direction);

/*
 * A request of the slow path: echo, set features, get or clear VMIs.
 * Failures are logged, not returned (ORR_OK always).
 */
orr_Status SwSecFilterIoctlRequest(SifraGenericFilter *filter, uint32_t requestId, void *payload,
                                   uint64_t payloadSize);

/* Filter ioctl message types: the u32 at the start of every payload. */
enum SwSecIoctlType : uint32_t {
   SWSEC_IOCTL_ECHO = 1,
   SWSEC_IOCTL_SET_FEATURES = 7,
   SWSEC_IOCTL_SET_FEATURES_REPLY = 8,
   SWSEC_IOCTL_GET_VMI = 9,
   SWSEC_IOCTL_GET_VMI_REPLY = 10,
   SWSEC_IOCTL_CLEAR_VMI = 11,
};

/* Payload layouts (offsets from the payload's start). */
constexpr uint32_t SWSEC_IOCTL_TYPE_LEN = 4;
constexpr uint32_t SWSEC_IOCTL_ECHO_TEXT_MAX = 64;
constexpr uint32_t SWSEC_IOCTL_REPLY_RESULT_OFFSET = 4;
constexpr uint32_t SWSEC_IOCTL_SET_FEATURES_REPLY_LEN = 8;
constexpr uint32_t SWSEC_IOCTL_GET_VMI_COUNT_OFFSET = 4;
constexpr uint32_t SWSEC_IOCTL_GET_VMI_ENTRIES_OFFSET = 8;
constexpr uint32_t SWSEC_IOCTL_CLEAR_ALL_OFFSET = 4;
constexpr uint32_t SWSEC_IOCTL_CLEAR_COUNT_OFFSET = 5;
constexpr uint32_t SWSEC_IOCTL_CLEAR_ENTRIES_OFFSET = 9;
