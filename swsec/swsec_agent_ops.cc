/* The switch-security agent's callback table. */
#include "swsec/swsec_agent.h"

#include "swsec/swsec_filter.h"

/*
 * Slow path frames, slow path ioctls, configuration changes and attach
 * state changes are not the agent's business: those slots stay empty. The
 * saved-state slots stay empty until the port database can be saved.
 */
constinit const SifraGenericAgentOps sifraGenericFwFastPathOps = {
   .createFilter = SwSecCreateFilter,
   .destroyFilter = SwSecDestroyFilter,
   .getSavedStateLen = nullptr,
   .saveState = nullptr,
   .restoreState = nullptr,
   .processPackets = SwSecProcessPackets,
   .processSlowPathPackets = nullptr,
   .filterIoctlRequest = SwSecFilterIoctlRequest,
   .slowPathIoctlRequest = nullptr,
   .configurationChanged = nullptr,
   .attachStateChanged = nullptr,
};
