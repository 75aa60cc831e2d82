/*
 * Binding change messages: one 80-byte portset message per binding added
 * or removed, posted on the port's portset.
 */
#pragma once

#include "fhs/fhs_context.h"

#include "platform/orr_portset.h"

#include <cstddef>

/* The class every binding message is posted with. */
constexpr uint64_t FHS_PORTSET_MSG_BINDING = 0x0010000000000000ull;
#define FHS_MSG_ADDED "fhs.binding.added"
#define FHS_MSG_REMOVED "fhs.binding.removed"

enum FhsBindingOp : uint32_t {
   FhsBindingOpAdded = 0,
   FhsBindingOpRemoved = 1,
};

struct __attribute__((packed)) FhsBindingMsgPayload {
   uint32_t op;                  /* FhsBindingOp */
   uint8_t method;               /* FhsBindMethod */
   uint8_t reserved[3];
   FhsBindingKey key;
   uint32_t lifetime;            /* seconds left when added; 0: never expires (static), or removed */
   uint32_t reserved2;
};
static_assert(sizeof(FhsBindingMsgPayload) == 40);
static_assert(offsetof(FhsBindingMsgPayload, op) == 0);
static_assert(offsetof(FhsBindingMsgPayload, method) == 4);
static_assert(offsetof(FhsBindingMsgPayload, key) == 8);
static_assert(offsetof(FhsBindingMsgPayload, lifetime) == 32);

struct FhsBindingMsg {
   orr_PortsetMessageHeader header;
   FhsBindingMsgPayload payload;
};
static_assert(sizeof(FhsBindingMsg) == 80);
static_assert(offsetof(FhsBindingMsg, payload) == 40);

/* Announces one binding's addition or removal; configLock exclusive. */
void FhsPostBindingMsg(FhsContext *ctx, FhsBindingOp op, const FhsBinding *binding);
