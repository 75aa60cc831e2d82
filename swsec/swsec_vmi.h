/*
 * The records of a port database: a database entry (a VMI with how it was
 * learned; its key is contract/vmi_key.h) and a pending DHCP request.
 */
#pragma once

#include "contract/vmi_key.h"
#include "platform/orr_hash.h"

#include <cstddef>
#include <cstdint>

/*
 * A port database entry, a zeroed heap record.
 *
 * Made by its learner (configuration, IP discovery, restore), owned by the
 * database from a successful SwSecAddVmi to SwSecDelVmi, which frees it with
 * its clientIdStr. Guarded by the port's configLock.
 */
struct SwSecVmi {
   orr_ListLinks hashLinks;  /* in a portDbHash bucket; unlinked with a single entry */
   orr_ListLinks listLinks;  /* in portDbList */
   uint16_t vlanId;
   uint8_t macAddr[6];
   uint32_t ipAddr;          /* network order */
   uint8_t discoveryMethod;  /* SwSecDiscMethod */
   int64_t expiryTime;       /* uptime in seconds; 0 and unused for static entries */
   /* DHCP entries only; the client identity group shared with SwSecDhcpReq. */
   uint8_t chaddr[6];
   uint8_t clientIdLen;
   uint8_t *clientIdStr;     /* clientIdLen bytes, owned; null when clientIdLen is 0 */
   uint32_t serverIp;        /* network order */
   uint32_t leaseTime;       /* seconds, host order */
};

/*
 * A DHCP request seen from the VM and not yet answered, a zeroed heap
 * record in dhcpReqList (and in the index beside it, when there is one);
 * aged with the database. Made by IP discovery, owned by the port from
 * SwSecLinkDhcpReq to SwSecDelDhcpReq.
 */
struct SwSecDhcpReq {
   orr_ListLinks links;
   uint16_t vlanId;
   uint32_t xid;             /* byte order of the message */
   uint8_t chaddr[6];
   uint8_t clientIdLen;
   uint8_t *clientIdStr;
   int64_t expiryTime;
   /* The index (swsec_dhcp_req_index.h); unlinked while there is none. */
   orr_ListLinks clientLinks;  /* in a by-client bucket */
   orr_ListLinks answerLinks;  /* in a by-answer bucket, arrival order */
   uint64_t arrival;           /* the port's count of requests when this one came */
};

/*
 * The index of a port's pending requests: one heap block of 2 x numBuckets
 * list heads (by client, then by answer); no block while few are pending.
 */
struct SwSecDhcpReqIndex {
   orr_ListLinks *byClient;    /* numBuckets heads, or null: no index */
   orr_ListLinks *byAnswer;    /* the block's second half */
   uint32_t bucketMask;        /* numBuckets - 1 */
   uint64_t seed;              /* keys the hashes; set when the block is made */
   uint64_t nextArrival;       /* stamps SwSecDhcpReq::arrival */
};

/* The client identity group has one shape in both records. */
static_assert(offsetof(SwSecVmi, clientIdLen) - offsetof(SwSecVmi, chaddr) ==
              offsetof(SwSecDhcpReq, clientIdLen) - offsetof(SwSecDhcpReq, chaddr));
static_assert(offsetof(SwSecVmi, clientIdStr) - offsetof(SwSecVmi, chaddr) ==
              offsetof(SwSecDhcpReq, clientIdStr) - offsetof(SwSecDhcpReq, chaddr));

constexpr uint32_t SWSEC_PORT_DB_HASH_BUCKETS = 16;
