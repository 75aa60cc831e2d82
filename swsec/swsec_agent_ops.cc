/* The switch-security agent's callback table. */
#include "swsec/swsec_agent.h"

/*
 * The switch-security callbacks come with the per-port context; until then
 * every slot is empty and the framework treats each event as unhandled.
 */
constinit const SifraGenericAgentOps sifraGenericFwFastPathOps = {
   .createFilter = nullptr,
   .destroyFilter = nullptr,
   .getSavedStateLen = nullptr,
   .saveState = nullptr,
   .restoreState = nullptr,
   .processPackets = nullptr,
   .processSlowPathPackets = nullptr,
   .filterIoctlRequest = nullptr,
   .slowPathIoctlRequest = nullptr,
   .configurationChanged = nullptr,
   .attachStateChanged = nullptr,
};
