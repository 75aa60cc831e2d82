/*
 * Doubly linked lists with a head that links to itself when empty. A linked
 * record's links are cleared when it is taken off, so "not linked" reads as
 * both links null.
 */
#pragma once

#include "platform/orr_hash.h"

static inline void SifraGenericListInit(orr_ListLinks *head)
{
   head->prev = head;
   head->next = head;
}

static inline bool SifraGenericListIsEmpty(const orr_ListLinks *head)
{
   return head->next == head;
}

/* Links `links` at the tail of `head`. */
static inline void SifraGenericListAppend(orr_ListLinks *head, orr_ListLinks *links)
{
   links->prev = head->prev;
   links->next = head;
   head->prev->next = links;
   head->prev = links;
}

/* Takes `links` off its list and clears it. */
static inline void SifraGenericListUnlink(orr_ListLinks *links)
{
   links->prev->next = links->next;
   links->next->prev = links->prev;
   links->prev = nullptr;
   links->next = nullptr;
}

static inline bool SifraGenericListIsLinked(const orr_ListLinks *links)
{
   return links->next != nullptr;
}
