/*
 * The per-filter security property "<agent name>.security" of the built-in
 * agent: the management plane writes and reads a port's security
 * configuration record (SwSecConfig and its static entries) through it.
 */
#pragma once

#include "framework/sifra_generic_agent.h"
#include "platform/orr_sifra.h"

extern const orr_SifraPropertyOps securityPropOps;

/*
 * Registers the property for the built-in agent and records it in
 * `propHandle`; other agents get none (null). A failure is logged and
 * costs only the property.
 */
orr_Status SifraGenericFWInitProperty(SifraGenericFastPathAgent *agent);
/* Withdraws the agent's property, if it has one. */
void SifraGenericFWCleanupProperty(SifraGenericFastPathAgent *agent);

/* The property's operations; `filter` is the framework's SifraGenericFilter or null. */
orr_Status SWSecPropWrite(orr_SifraFilter filter, void *extra, const void *data, uint32_t length);
orr_Status SWSecPropRead(orr_SifraFilter filter, void *extra, void *buffer, uint32_t length);
bool SWSecPropPoll(orr_SifraFilter filter, void *extra, uint32_t *length);
void SWSecPropCleanup(void);
