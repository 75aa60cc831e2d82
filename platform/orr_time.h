/* Time, timer queues and timers. */
#pragma once

#include "platform/orr_base.h"

typedef struct orr_TimeVal {
   int64_t sec;              /* host uptime in whole seconds */
   int64_t usec;
} orr_TimeVal;

ORR_API void orr_GetUptime(orr_TimeVal *uptime);
ORR_API uint64_t orr_GetTimerCycles(void);
ORR_API uint64_t orr_TimerCyclesPerSecond(void);
/* Sleeps the calling world; no spinlock may be held. */
ORR_API void orr_WorldSleep(uint64_t microseconds);

typedef struct orr_TimerQueueOpaque *orr_TimerQueue;

typedef struct orr_TimerQueueProps {
   orr_Name name;
   orr_ModuleID module;
   orr_HeapID heap;
   uint32_t flags;           /* 0 */
} orr_TimerQueueProps;

ORR_API orr_Status orr_TimerQueueCreate(const orr_TimerQueueProps *props, orr_TimerQueue *queue);
/* The queue must hold no pending timer. */
ORR_API void orr_TimerQueueDestroy(orr_TimerQueue queue);

/* A timer handle; 0 is never a timer. */
typedef uint64_t orr_Timer;
typedef void (*orr_TimerCallback)(void *data);

#define ORR_TIMER_ONE_SHOT (-1)

/*
 * Schedules `callback(data)` on a queue after `timeoutUs`, then every
 * `periodUs` (ORR_TIMER_ONE_SHOT: once). The callback runs outside the
 * caller's context, as if it held a lock of `lockRank` in `domain`: it may
 * take only locks of a higher rank there.
 */
ORR_API orr_Status orr_TimerSchedule(orr_TimerQueue queue, orr_TimerCallback callback, void *data,
                                     int64_t timeoutUs, int64_t periodUs, uint32_t flags,
                                     orr_LockDomainID domain, uint32_t lockRank, orr_Timer *timer);
/*
 * Adds a timer on the host's system queue: `callback(data)` after `timeoutUs`
 * and, when `periodic`, every `timeoutUs` after that. `options` is passed
 * through to the host.
 */
ORR_API orr_Status orr_TimerAdd(orr_TimerCallback callback, void *data, int64_t timeoutUs,
                                bool periodic, uint32_t options, orr_Timer *timer);
/*
 * Cancels a timer and waits until a running call of its callback has
 * returned. True when the timer was still pending or running.
 */
ORR_API bool orr_TimerRemoveSync(orr_Timer timer);
