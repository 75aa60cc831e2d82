/*
 * The module's branch of the Nexo tree: node IDs 5000 to 5007, and the
 * handlers the host calls for them. Every handler returns a host status;
 * none keeps state between calls.
 */
#pragma once

#include "platform/orr_nexo.h"

#include <cstddef>

struct SwSecContext;

enum class SwSecNexoNodeId : uint32_t {
   Root = 5000,
   CreateAgent = 5001,
   Security = 5002,
   FeatureSummary = 5003,
   ClearVmi = 5004,
   Vmi = 5005,
   StartTest = 5006,
   StopTest = 5007,
   Ipv6 = 5008,
   Ipv6Summary = 5009,
   Ipv6Bindings = 5010,
   Ipv6Clear = 5011,
};

/* The branch, published in the module information. */
extern const Nexo_Tree swsecNexoTree;

/* "createAgent": creates and registers a fast path agent named by input 0. */
orr_Status SwSecNexoCreateAgent(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs,
                                const Nexo_ParamList *input);
/* "security": the port IDs of the port filter map, in its list order. */
orr_Status SwSecNexoListPortIds(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs,
                                Nexo_ParamList *list);
/* "featureSummary" of port instanceArgs[0] into a SwSec_FeatureSummary. */
orr_Status SwSecNexoFeatureSummaryGet(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs,
                                      void *output);
/* "clearVmi" of port instanceArgs[0]: 1 argument clears all, 4 clear one VLAN/MAC/IP. */
orr_Status SwSecNexoClearVmi(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs,
                             const Nexo_ParamList *input);
/* "vmi" of port instanceArgs[0]: the indexes 0 .. numVmiEntries - 1. */
orr_Status SwSecNexoListVmi(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs,
                            Nexo_ParamList *list);
/* "vmi" instance instanceArgs[1] of port instanceArgs[0] into a SwSec_VmiSummary. */
orr_Status SwSecNexoVmiSummaryGet(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs,
                                  void *output);
/* "startTest" / "stopTest": the port database test hooks on and off. */
orr_Status SwSecNexoStartTest(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs,
                              const Nexo_ParamList *input);
orr_Status SwSecNexoStopTest(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs,
                             const Nexo_ParamList *input);

/*
 * The names of the enabled features in bit order, comma-separated, into a
 * text of `size` bytes; "None" for 0; empty when only unnamed bits are set.
 */
void SwSecNexoFormatFeatures(char *text, size_t size, uint32_t features);

/* How a per-port handler holds the port's configLock. */
enum class SwSecNexoLockMode : uint32_t {
   Write = 0,
   Read = 1,
};

/*
 * Finds the port named by instance argument 0 through the port filter map,
 * takes a reference on its context and locks its configLock as `mode` says.
 * `*ctx` is null on every failure: the argument read (logged) or the map's
 * status (ORR_NOT_FOUND for a port without IP discovery).
 */
orr_Status SwSecNexoGetFilter(const Nexo_ParamList *instanceArgs, uint32_t *portId, SwSecContext **ctx,
                              SwSecNexoLockMode mode);
/* Undoes SwSecNexoGetFilter: unlocks as locked and drops the reference; nothing for a null context. */
void SwSecNexoPutFilter(uint32_t portId, SwSecContext *ctx, SwSecNexoLockMode mode);
