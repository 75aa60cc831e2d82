/*
 * Port database change messages: one 80-byte portset message per entry
 * added or removed (SifraGenericPostPortMessage).
 */
#include "swsec/swsec_notify.h"

#include "framework/sifra_generic_port.h"
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

void SwSecPostPortDbMsg(SwSecContext *ctx, SwSecPortDbOp op, const SwSecVmi *vmi)
{
   SwSecPortDbMsg msg;
   orr_Memset(&msg, 0, sizeof(msg));
   msg.payload.op = op;
   msg.payload.numEntries = 1;
   SwSecPortDbEntryFill(&msg.payload.entry, vmi);
   SifraGenericPostPortMessage(ctx->filter, ctx->portset, ctx->portId, SWSEC_PORTSET_MSG_PORTDB,
                               op == SwSecPortDbOpAdded ? SWSEC_PORTDB_MSG_ADDED : SWSEC_PORTDB_MSG_REMOVED,
                               &msg.header, sizeof(msg.payload));
}
