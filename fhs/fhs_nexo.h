/*
 * The first-hop security agent's management nodes, under "ipv6" (one
 * instance per port of the agent): "summary", "bindings" and "clear".
 * Every handler returns a host status; none keeps state between calls.
 */
#pragma once

#include "fhs/fhs_context.h"
#include "platform/orr_nexo.h"

#include <cstddef>

struct FhsNexo_Summary {
   char featuresEnabled[200];
   char portMode[12];
   char bindingLimit[12];
   char numBindings[12];
   char numDhcpv6[12];
   char numStatic[12];
   char numFcfs[12];
   char ndRateLimit[40];
   char ndRateLimitErr[8];
#define FHS_NEXO_DROP_FIELD(name, text) char name[24];
   FHS_DROP_LIST(FHS_NEXO_DROP_FIELD)
#undef FHS_NEXO_DROP_FIELD
   char ndRateLimitErrEntryCnt[24];
   char bindingsEvictedCnt[24];
};
static_assert(offsetof(FhsNexo_Summary, headerChainDropCnt) == 320);
static_assert(offsetof(FhsNexo_Summary, ndRateLimitErrEntryCnt) == 512);
static_assert(sizeof(FhsNexo_Summary) == 560);

struct FhsNexo_Binding {
   char vlanId[8];
   char mac[20];
   char addr[40];
   uint32_t method;              /* FhsBindMethod */
   char timeRemaining[24];       /* seconds; "never" for a static binding */
};
static_assert(sizeof(FhsNexo_Binding::method) == 4);

extern const Nexo_RecordDef fhsNexoSummaryRecord;
extern const Nexo_RecordDef fhsNexoBindingRecord;

/* "ipv6": the port IDs of the agent's ports, in creation order. */
orr_Status FhsNexoListPorts(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs, Nexo_ParamList *list);
/* "summary" of port instanceArgs[0]. */
orr_Status FhsNexoSummaryGet(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs, void *output);
/* "bindings" of port instanceArgs[0]: indexes in the port's binding order; one binding's record. */
orr_Status FhsNexoListBindings(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs, Nexo_ParamList *list);
orr_Status FhsNexoBindingGet(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs, void *output);
/* "clear" of port instanceArgs[0]: no argument clears every dynamic binding, one (an IPv6 address) those of it. */
orr_Status FhsNexoClear(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs, const Nexo_ParamList *input);

/*
 * An IPv6 address in text (eight groups, or fewer around one "::"; no
 * embedded IPv4) into 16 bytes; reads no further than the terminating
 * zero. False for anything else.
 */
bool FhsParseIpv6(const char *text, uint8_t *addr);
