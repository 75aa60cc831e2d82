/*
 * Binding change messages: one 80-byte portset message per binding added
 * or removed, posted on the port's portset.
 */
#pragma once

#include "contract/fhs_binding.h"
#include "fhs/fhs_context.h"

#include "platform/orr_portset.h"

#include <cstddef>

struct FhsBindingMsg {
   orr_PortsetMessageHeader header;
   FhsBindingMsgPayload payload;
};
static_assert(sizeof(FhsBindingMsg) == 80);
static_assert(offsetof(FhsBindingMsg, payload) == 40);

/* Announces one binding's addition or removal; configLock exclusive. */
void FhsPostBindingMsg(FhsContext *ctx, FhsBindingOp op, const FhsBinding *binding);
