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

struct SwSecPortDbMsg {
   orr_PortsetMessageHeader header;
   SwSecPortDbMsgPayload payload;
};
static_assert(sizeof(SwSecPortDbMsg) == SWSEC_PORTDB_MSG_LEN);
static_assert(offsetof(SwSecPortDbMsg, header) == 0);
static_assert(offsetof(SwSecPortDbMsg, header.name) == 0);
static_assert(sizeof(orr_PortsetMessageHeader::name) == SWSEC_PORTDB_MSG_NAME_LEN);
static_assert(offsetof(SwSecPortDbMsg, header.payloadLength) == SWSEC_PORTDB_MSG_LENGTH_OFFSET);
static_assert(offsetof(SwSecPortDbMsg, payload) == SWSEC_PORTDB_MSG_PAYLOAD_OFFSET);

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
