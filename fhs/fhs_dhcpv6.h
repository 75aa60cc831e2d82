/*
 * DHCPv6 messages as first-hop security reads them: the message type, the
 * transaction ID, the client's DUID and the addresses of its identity
 * associations (IA_NA and IA_TA) with their valid lifetimes.
 */
#pragma once

#include <cstdint>

constexpr uint16_t FHS_DHCPV6_CLIENT_PORT = 546;
constexpr uint16_t FHS_DHCPV6_SERVER_PORT = 547;

enum FhsDhcpv6Type : uint8_t {
   FhsDhcpv6Solicit = 1,
   FhsDhcpv6Advertise = 2,
   FhsDhcpv6Request = 3,
   FhsDhcpv6Confirm = 4,
   FhsDhcpv6Renew = 5,
   FhsDhcpv6Rebind = 6,
   FhsDhcpv6Reply = 7,
   FhsDhcpv6Release = 8,
   FhsDhcpv6Decline = 9,
   FhsDhcpv6Reconfigure = 10,
   FhsDhcpv6InformationRequest = 11,
   FhsDhcpv6RelayForw = 12,
   FhsDhcpv6RelayReply = 13,
};

/* A DUID is at most 128 bytes after its 2-byte type. */
constexpr uint32_t FHS_DHCPV6_DUID_MAX = 130;
/* IA addresses kept from one message; further ones are counted, not kept. */
constexpr uint32_t FHS_DHCPV6_MAX_ADDRS = 8;

struct FhsDhcpv6Addr {
   uint8_t addr[16];
   uint32_t validLifetime;       /* seconds; 0xffffffff: for ever */
};

struct FhsDhcpv6Msg {
   uint8_t msgType;
   uint32_t xid;                 /* 24 bits */
   const uint8_t *clientId;      /* the DUID inside the message; null when absent */
   uint32_t clientIdLen;
   uint32_t numAddrs;            /* kept in addrs */
   uint32_t numAddrsSkipped;     /* past FHS_DHCPV6_MAX_ADDRS */
   FhsDhcpv6Addr addrs[FHS_DHCPV6_MAX_ADDRS];
};

/*
 * Reads the message of `length` bytes at `bytes` (a UDP payload); reads no
 * byte past them. 0, or -1 for a message that is not a well-formed client
 * or server message (relay messages are refused: only their type is
 * wanted, which the caller reads itself). A client ID longer than a DUID
 * can be counts as malformed.
 */
int FhsDhcpv6Parse(const uint8_t *bytes, uint32_t length, FhsDhcpv6Msg *msg);
