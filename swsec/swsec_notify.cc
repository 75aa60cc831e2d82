/*
 * Port database change messages: one 80-byte portset message per entry
 * added or removed, posted under the portset's lock.
 */
#include "swsec/swsec_notify.h"

#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_log.h"
#include "platform/orr_text.h"
#include "swsec/swsec_port_db_export.h"

#include <cstddef>

#define SWSEC_PORTDB_MSG_ADDED "portdb.entry.added"
#define SWSEC_PORTDB_MSG_REMOVED "portdb.entry.removed"

/* The payload: an operation and a count, then one exported entry record. */
struct __attribute__((packed)) SwSecPortDbMsgPayload {
   uint32_t op;              /* SwSecPortDbOp */
   uint32_t numEntries;      /* always 1 */
   SwSecPortDbEntry entry;
};
static_assert(sizeof(SwSecPortDbMsgPayload) == 40);
static_assert(offsetof(SwSecPortDbMsgPayload, op) == 0);
static_assert(offsetof(SwSecPortDbMsgPayload, numEntries) == 4);
static_assert(offsetof(SwSecPortDbMsgPayload, entry) == 8);
static_assert(offsetof(SwSecPortDbMsgPayload, entry) + offsetof(SwSecPortDbEntry, vlanId) == 8);
static_assert(offsetof(SwSecPortDbMsgPayload, entry) + offsetof(SwSecPortDbEntry, macAddr) == 10);
static_assert(offsetof(SwSecPortDbMsgPayload, entry) + offsetof(SwSecPortDbEntry, ipAddrType) == 16);
static_assert(offsetof(SwSecPortDbMsgPayload, entry) + offsetof(SwSecPortDbEntry, ipAddr) == 20);
static_assert(offsetof(SwSecPortDbMsgPayload, entry) + offsetof(SwSecPortDbEntry, authoritative) ==
              36);

struct SwSecPortDbMsg {
   orr_PortsetMessageHeader header;
   SwSecPortDbMsgPayload payload;
};
static_assert(sizeof(SwSecPortDbMsg) == 80);
static_assert(offsetof(SwSecPortDbMsg, header) == 0);
static_assert(offsetof(SwSecPortDbMsg, header.name) == 0);
static_assert(offsetof(SwSecPortDbMsg, header.payloadLength) == 32);
static_assert(offsetof(SwSecPortDbMsg, payload) == 40);

/* Lets go of a hold taken for a post, in the mode the CPU holds it now. */
static void SwSecPortsetUnlock(orr_Portset *portset)
{
   if (orr_PortsetHoldState(portset) == ORR_PORTSET_HOLD_EXCL) {
      orr_PortsetUnlockExcl(portset);
   } else {
      orr_PortsetUnlockShared(portset);
   }
}

void SwSecPostPortDbMsg(SwSecContext *ctx, SwSecPortDbOp op, const SwSecVmi *vmi)
{
   SwSecPortDbMsg msg;
   orr_Memset(&msg, 0, sizeof(msg));
   const char *msgName = op == SwSecPortDbOpAdded ? SWSEC_PORTDB_MSG_ADDED : SWSEC_PORTDB_MSG_REMOVED;
   orr_Name name;
   orr_NameInitialize(&name, msgName);
   orr_Memcpy(msg.header.name, name.name, sizeof(msg.header.name));
   msg.header.payloadLength = sizeof(msg.payload);
   msg.payload.op = op;
   msg.payload.numEntries = 1;
   SwSecPortDbEntryFill(&msg.payload.entry, vmi);

   orr_Portset *portset = ctx->portset;
   bool locked = false;
   if (orr_PortsetHoldState(portset) == ORR_PORTSET_HOLD_NONE) {
      /*
       * The hold is per CPU: a second look catches a hold that appeared
       * since, which taking the lock again would deadlock on.
       */
      if (orr_PortsetHoldState(portset) != ORR_PORTSET_HOLD_NONE) {
         SG_LOG(ORR_LOG_ERROR, "%s: Could not lock portset:%u:%s:%s", ctx->filter->name,
                ctx->portId, msgName, orr_StatusToString(ORR_FAILURE));
         return;
      }
      orr_PortsetLockShared(portset);
      locked = true;
   }

   orr_Status status = orr_PortsetPostMessage(portset, ctx->portId, SWSEC_PORTSET_MSG_PORTDB, &msg.header);

   if (locked) {
      SwSecPortsetUnlock(portset);
   }
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not post message:%u:%s:%s", ctx->filter->name, ctx->portId,
             msgName, orr_StatusToString(status));
   }
}
