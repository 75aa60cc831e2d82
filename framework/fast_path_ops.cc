/* The fast path operations table given to the host with every agent. */
#include "framework/sifra_generic_ops.h"

constinit const orr_SifraFastPathOps sifraGenericOps = {
   .registerSlowPath = SifraGenericRegisterSlowPath,
   .unregisterSlowPath = SifraGenericUnregisterSlowPath,
   .createFilter = SifraGenericCreateFilter,
   .destroyFilter = SifraGenericDestroyFilter,
   .prefetchSavedState = SifraGenericPrefetchSavedState,
   .getSavedStateLen = SifraGenericGetSavedStateLen,
   .saveState = SifraGenericSaveState,
   .restoreState = SifraGenericRestoreState,
   .processPackets = SifraGenericProcessPackets,
   .processSlowPathPackets = SifraGenericProcessSlowPathPackets,
   .processFilterIoctl = SifraGenericProcessFilterIoctl,
   .processSlowPathIoctl = SifraGenericProcessSlowPathIoctl,
   .configurationChanged = SifraGenericConfigurationChanged,
};
