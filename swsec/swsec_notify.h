/* Port database change messages posted on the port's portset. */
#pragma once

#include "swsec/swsec_context.h"

/* The class every port database message is posted with. */
constexpr uint64_t SWSEC_PORTSET_MSG_PORTDB = 0x0008000000000000ull;

enum SwSecPortDbOp : uint32_t {
   SwSecPortDbOpAdded = 0,
   SwSecPortDbOpRemoved = 1,
};

/* Announces one entry's addition or removal; configLock exclusive. */
void SwSecPostPortDbMsg(SwSecContext *ctx, SwSecPortDbOp op, const SwSecVmi *vmi);
