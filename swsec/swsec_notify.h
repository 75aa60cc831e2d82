/* Port database change messages posted on the port's portset (layout: contract/notification.h). */
#pragma once

#include "contract/notification.h"
#include "swsec/swsec_context.h"

/* Announces one entry's addition or removal; configLock exclusive. */
void SwSecPostPortDbMsg(SwSecContext *ctx, SwSecPortDbOp op, const SwSecVmi *vmi);
