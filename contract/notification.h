/*
 * The port database change message a port posts on its portset, and the
 * exported entry record it carries (the same record the exported queries
 * hand to other modules).
 *
 * An 80-byte message: a 32-byte NUL-terminated name ("portdb.entry.added"
 * or "portdb.entry.removed"), the payload's length as a 64-bit number (40),
 * then the payload. Host order except `ipAddr`; every byte not named is zero.
 *
 * Wire contract: freestanding, shared by the module and the tools.
 */
#pragma once

#include <cstddef>
#include <cstdint>

#define SWSEC_PORTDB_MSG_ADDED "portdb.entry.added"
#define SWSEC_PORTDB_MSG_REMOVED "portdb.entry.removed"

/* The class every port database message is posted with. */
constexpr uint64_t SWSEC_PORTSET_MSG_PORTDB = 0x0008000000000000ull;

/* The message around the payload. */
constexpr uint64_t SWSEC_PORTDB_MSG_NAME_LEN = 32;
constexpr uint64_t SWSEC_PORTDB_MSG_LENGTH_OFFSET = 32;
constexpr uint64_t SWSEC_PORTDB_MSG_PAYLOAD_OFFSET = 40;
constexpr uint64_t SWSEC_PORTDB_MSG_LEN = 80;

/*
 * One exported VMI, 32 bytes in host order except `ipAddr`; every byte not
 * named is zero.
 */
struct __attribute__((packed)) SwSecPortDbEntry {
   uint16_t vlanId;
   uint8_t macAddr[6];
   uint8_t ipAddrType;       /* SWSEC_PORT_DB_ENTRY_IPV4 */
   uint8_t reserved1[3];
   uint32_t ipAddr;          /* network order */
   uint8_t reserved2[12];
   uint8_t authoritative;    /* 1: DHCP snooping or static */
   uint8_t reserved3[3];
};
static_assert(sizeof(SwSecPortDbEntry) == 32);
static_assert(offsetof(SwSecPortDbEntry, vlanId) == 0);
static_assert(offsetof(SwSecPortDbEntry, macAddr) == 2);
static_assert(offsetof(SwSecPortDbEntry, ipAddrType) == 8);
static_assert(offsetof(SwSecPortDbEntry, ipAddr) == 12);
static_assert(offsetof(SwSecPortDbEntry, authoritative) == 28);

constexpr uint8_t SWSEC_PORT_DB_ENTRY_IPV4 = 1;

enum SwSecPortDbOp : uint32_t {
   SwSecPortDbOpAdded = 0,
   SwSecPortDbOpRemoved = 1,
};

/* The payload: an operation and a count, then one exported entry record. */
struct __attribute__((packed)) SwSecPortDbMsgPayload {
   uint32_t op;              /* SwSecPortDbOp */
   uint32_t numEntries;      /* always 1 */
   SwSecPortDbEntry entry;
};
static_assert(sizeof(SwSecPortDbMsgPayload) == 40);
static_assert(SWSEC_PORTDB_MSG_PAYLOAD_OFFSET + sizeof(SwSecPortDbMsgPayload) == SWSEC_PORTDB_MSG_LEN);
static_assert(offsetof(SwSecPortDbMsgPayload, op) == 0);
static_assert(offsetof(SwSecPortDbMsgPayload, numEntries) == 4);
static_assert(offsetof(SwSecPortDbMsgPayload, entry) == 8);
static_assert(offsetof(SwSecPortDbMsgPayload, entry) + offsetof(SwSecPortDbEntry, vlanId) == 8);
static_assert(offsetof(SwSecPortDbMsgPayload, entry) + offsetof(SwSecPortDbEntry, macAddr) == 10);
static_assert(offsetof(SwSecPortDbMsgPayload, entry) + offsetof(SwSecPortDbEntry, ipAddrType) == 16);
static_assert(offsetof(SwSecPortDbMsgPayload, entry) + offsetof(SwSecPortDbEntry, ipAddr) == 20);
static_assert(offsetof(SwSecPortDbMsgPayload, entry) + offsetof(SwSecPortDbEntry, authoritative) ==
              36);
