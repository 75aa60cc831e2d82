/*
 * The IPv6 header chain: the fixed header, the extension headers and where
 * the upper-layer header starts, walked within fixed limits.
 *
 * Limits: at most FHS_CHAIN_MAX_HEADERS extension headers and at most
 * FHS_CHAIN_MAX_BYTES bytes of them between the fixed header and the
 * upper-layer header. A chain over either limit is refused, as is one that
 * is malformed (a header or the upper-layer header running past the
 * packet, a hop-by-hop header not first, two fragment headers) or, in a
 * first fragment, one that the fragment does not hold whole together with
 * the upper-layer header.
 */
#pragma once

#include <cstdint>

constexpr uint32_t FHS_CHAIN_MAX_HEADERS = 8;
constexpr uint32_t FHS_CHAIN_MAX_BYTES = 256;
constexpr uint32_t FHS_IPV6_HEADER_LEN = 40;
/* The longest upper-layer header the walk makes sure of (TCP's fixed part). */
constexpr uint32_t FHS_CHAIN_UPPER_MAX = 20;
/* A view of this many bytes (or the whole packet) is always enough for a walk. */
constexpr uint32_t FHS_CHAIN_VIEW_LEN = FHS_IPV6_HEADER_LEN + FHS_CHAIN_MAX_BYTES + FHS_CHAIN_UPPER_MAX;

constexpr uint8_t FHS_PROTO_HOP_BY_HOP = 0;
constexpr uint8_t FHS_PROTO_TCP = 6;
constexpr uint8_t FHS_PROTO_UDP = 17;
constexpr uint8_t FHS_PROTO_ROUTING = 43;
constexpr uint8_t FHS_PROTO_FRAGMENT = 44;
constexpr uint8_t FHS_PROTO_AH = 51;
constexpr uint8_t FHS_PROTO_ICMPV6 = 58;
constexpr uint8_t FHS_PROTO_DEST_OPTS = 60;

enum FhsChainVerdict : uint32_t {
   FhsChainOk = 0,
   FhsChainMalformed = 1,
   FhsChainOverLimit = 2,
   FhsChainNotInFirstFragment = 3,
   /* The view ended before the walk did, inside the packet: walk again with more bytes. */
   FhsChainNeedView = 4,
};

struct FhsIpv6Chain {
   uint32_t packetLen;      /* 40 + payload length */
   uint32_t upperOffset;    /* from the fixed header; valid unless laterFragment */
   uint8_t upperProto;      /* the next-header value that ends the chain */
   uint8_t fragmented;      /* a fragment header was met */
   uint8_t laterFragment;   /* not the first fragment: no upper-layer header here */
   uint8_t numHeaders;      /* extension headers walked */
};

/*
 * Walks the chain of the IPv6 packet at `ip6`. `viewLen` bytes are
 * readable there; `l3Len` is the frame's length from the fixed header on
 * (at least viewLen). Reads no byte past viewLen.
 */
FhsChainVerdict FhsWalkIpv6Chain(const uint8_t *ip6, uint32_t viewLen, uint32_t l3Len, FhsIpv6Chain *chain);
