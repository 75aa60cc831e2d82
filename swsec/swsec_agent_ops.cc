/* The switch-security agent's callback table. */
#include "swsec/swsec_agent.h"

#include "swsec/swsec_filter.h"
#include "swsec/swsec_saved_state.h"

/*
 * Slow path frames, slow path ioctls, configuration changes and attach
 * state changes are not the agent's business: those slots stay empty.
 */
constinit const SifraGenericAgentOps sifraGenericFwFastPathOps = {
   .createFilter = SwSecCreateFilter,
   .destroyFilter = SwSecDestroyFilter,
   .getSavedStateLen = SwSecGetSavedStateLen,
   .saveState = SwSecSaveState,
   .restoreState = SwSecRestoreState,
   .processPackets = SwSecProcessPackets,
   .processSlowPathPackets = nullptr,
   .filterIoctlRequest = SwSecFilterIoctlRequest,
   .slowPathIoctlRequest = nullptr,
   .configurationChanged = nullptr,
   .attachStateChanged = nullptr,
};
