/*
 * The fast path operations every agent registers with the host, in the
 * host's slot order. The host calls them with the agent handle, a filter
 * record from createFilter or a slow path record from registerSlowPath;
 * each checks the record's magic first.
 */
#pragma once

#include "platform/orr_sifra.h"

extern const orr_SifraFastPathOps sifraGenericOps;

/* Slow path registration. */
orr_Status SifraGenericRegisterSlowPath(orr_SifraAgentHandle agent, uint32_t slowPathID,
                                        orr_SifraSlowPath *slowPath);
orr_Status SifraGenericUnregisterSlowPath(orr_SifraSlowPath slowPath);

/* Filters and dispatch to the agent. */
orr_Status SifraGenericCreateFilter(orr_SifraAgentHandle agent, orr_SifraFilterHandle handle,
                                    orr_SifraFilter *filter, uint8_t flags);
orr_Status SifraGenericDestroyFilter(orr_SifraFilter filter);
orr_Status SifraGenericProcessPackets(orr_SifraFilter filter, orr_PktList *pktList,
                                      uint32_t direction);
orr_Status SifraGenericProcessSlowPathPackets(orr_SifraFilter filter, orr_PktList *pktList,
                                              uint32_t direction);
orr_Status SifraGenericProcessFilterIoctl(orr_SifraFilter filter, uint32_t requestId,
                                          void *payload, uint64_t payloadSize);
orr_Status SifraGenericProcessSlowPathIoctl(orr_SifraSlowPath slowPath, uint32_t requestId,
                                            void *payload, uint64_t payloadSize);
orr_Status SifraGenericConfigurationChanged(orr_SifraFilter filter);

/* Saved state. */
void SifraGenericPrefetchSavedState(orr_SifraFilter filter);
orr_Status SifraGenericGetSavedStateLen(orr_SifraFilter filter, uint64_t *length);
orr_Status SifraGenericSaveState(orr_SifraFilter filter, void *buffer, uint64_t *length);
orr_Status SifraGenericRestoreState(orr_SifraFilter filter, const void *buffer, uint64_t length);
