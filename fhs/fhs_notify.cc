/* Binding change messages. */
#include "fhs/fhs_notify.h"

#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_log.h"
#include "platform/orr_text.h"
#include "platform/orr_time.h"

void FhsPostBindingMsg(FhsContext *ctx, FhsBindingOp op, const FhsBinding *binding)
{
   FhsBindingMsg msg;
   orr_Memset(&msg, 0, sizeof(msg));
   const char *msgName = op == FhsBindingOpAdded ? FHS_MSG_ADDED : FHS_MSG_REMOVED;
   orr_Name name;
   orr_NameInitialize(&name, msgName);
   orr_Memcpy(msg.header.name, name.name, sizeof(msg.header.name));
   msg.header.payloadLength = sizeof(msg.payload);
   msg.payload.op = op;
   msg.payload.method = binding->method;
   msg.payload.key = binding->key;
   if (op == FhsBindingOpAdded && binding->expiry != 0) {
      orr_TimeVal now = {};
      orr_GetUptime(&now);
      const int64_t left = binding->expiry - now.sec;
      msg.payload.lifetime = left <= 0 ? 1u : left > 0xffffffff ? 0xffffffffu : static_cast<uint32_t>(left);
   }

   /* A frame list's hold on the portset (the host's, per CPU) already lets the post through. */
   orr_Portset *portset = ctx->portset;
   const bool locked = orr_PortsetHoldState(portset) == ORR_PORTSET_HOLD_NONE;
   if (locked) {
      orr_PortsetLockShared(portset);
   }
   const orr_Status status = orr_PortsetPostMessage(portset, ctx->portId, FHS_PORTSET_MSG_BINDING, &msg.header);
   if (locked) {
      orr_PortsetUnlockShared(portset);
   }
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not post message:%u:%s:%s", ctx->filter->name, ctx->portId, msgName,
             orr_StatusToString(status));
   }
}
