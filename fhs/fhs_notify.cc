/* Binding change messages. */
#include "fhs/fhs_notify.h"

#include "framework/sifra_generic_port.h"
#include "platform/orr_text.h"
#include "platform/orr_time.h"

void FhsPostBindingMsg(FhsContext *ctx, FhsBindingOp op, const FhsBinding *binding)
{
   FhsBindingMsg msg;
   orr_Memset(&msg, 0, sizeof(msg));
   msg.payload.op = op;
   msg.payload.method = binding->method;
   msg.payload.key = binding->key;
   if (op == FhsBindingOpAdded && binding->expiry != 0) {
      orr_TimeVal now = {};
      orr_GetUptime(&now);
      const int64_t left = binding->expiry - now.sec;
      msg.payload.lifetime = left <= 0 ? 1u : left > 0xffffffff ? 0xffffffffu : static_cast<uint32_t>(left);
   }

   SifraGenericPostPortMessage(ctx->filter, ctx->portset, ctx->portId, FHS_PORTSET_MSG_BINDING,
                               op == FhsBindingOpAdded ? FHS_MSG_ADDED : FHS_MSG_REMOVED, &msg.header,
                               sizeof(msg.payload));
}
