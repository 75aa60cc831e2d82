/*
 * What every agent does with the port a filter sits on: find it when the
 * filter is made, run its periodic timer, and post its change messages on
 * its portset. Each agent keeps the port ID, the portset and the timer in
 * its own context; these calls work on them.
 */
#pragma once

#include "framework/sifra_generic_filter.h"
#include "platform/orr_portset.h"
#include "platform/orr_time.h"

/*
 * The port of a new filter: its ID, and its portset, held only while it is
 * read. Logs and returns the host's status when either is refused.
 */
orr_Status SifraGenericFindPort(const SifraGenericFilter *filter, uint32_t *portId, orr_Portset **portset);

/*
 * The port's periodic timer: `callback(data)` every 10 s, with the host's
 * options for a port timer. On a failure, logged, `*timer` is 0.
 */
orr_Status SifraGenericAddPortTimer(const SifraGenericFilter *filter, orr_TimerCallback callback, void *data,
                                    orr_Timer *timer);

/*
 * Removes a timer added above, if any, and waits for a tick that is running:
 * no lock the tick takes may be held. `*timer` is 0 after.
 */
void SifraGenericRemovePortTimer(orr_Timer *timer);

/*
 * A block of a port's entries handed to another module holds the module
 * (its use count) until it is given back. ORR_OK, or ORR_FAILURE with the
 * block freed and the refusal logged with `name` and `portId`.
 */
orr_Status SifraGenericHandOutBlock(const char *name, uint32_t portId, void *block);

/* A block handed out, given back: freed, and the module let go. ORR_BAD_PARAM for null. */
orr_Status SifraGenericGiveBackBlock(void *block);

/*
 * Posts a message of class `msgClass` for `portId` on `portset`: `header`
 * begins a record whose `payloadLength` bytes follow it; its name is set
 * to `msgName` here. The portset is locked shared for the post unless this
 * CPU already holds it (a frame list's hold lets the post through), and let
 * go in the mode it is held in then. A failure is logged, not returned: a
 * change message lost does not undo the change.
 */
void SifraGenericPostPortMessage(const SifraGenericFilter *filter, orr_Portset *portset, uint32_t portId,
                                 uint64_t msgClass, const char *msgName, orr_PortsetMessageHeader *header,
                                 uint64_t payloadLength);
