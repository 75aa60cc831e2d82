/* The first-hop security agent's callback table. */
#include "fhs/fhs_agent.h"
#include "fhs/fhs_saved_state.h"

/* Slow path frames and ioctls, configuration and attach state changes are not the agent's business. */
constinit const SifraGenericAgentOps fhsAgentOps = {
   .createFilter = FhsCreateFilter,
   .destroyFilter = FhsDestroyFilter,
   .getSavedStateLen = FhsGetSavedStateLen,
   .saveState = FhsSaveState,
   .restoreState = FhsRestoreState,
   .processPackets = FhsProcessPackets,
   .processSlowPathPackets = nullptr,
   .filterIoctlRequest = nullptr,
   .slowPathIoctlRequest = nullptr,
   .configurationChanged = nullptr,
   .attachStateChanged = nullptr,
};
