/*
 * Log components. A message is written with a severity: 1 information,
 * 2 failures, refusals and anything unexpected.
 */
#pragma once

#include "platform/orr_base.h"

typedef struct orr_LogOpaque *orr_LogHandle;

enum orr_LogSeverity : uint32_t {
   ORR_LOG_INFO = 1,
   ORR_LOG_ERROR = 2,
};

typedef struct orr_LogProps {
   orr_Name name;
   orr_ModuleID module;
   orr_HeapID heap;
   int32_t level;            /* the component's initial level */
   const void *extra;        /* null */
} orr_LogProps;

ORR_API orr_Status orr_LogRegister(const orr_LogProps *props, orr_LogHandle *log);
ORR_API void orr_LogUnregister(orr_LogHandle log);
ORR_API int32_t orr_LogGetCurrentLogLevel(orr_LogHandle log);
ORR_API const char *orr_LogGetName(orr_LogHandle log);

/*
 * Writes a message of a log component when `level` is at most the
 * component's current level. A null handle has no component: the host keeps
 * no such message.
 */
ORR_API void orr_LogLevel(uint32_t severity, orr_LogHandle log, int32_t level,
                          const char *format, ...) ORR_PRINTF(4, 5);
/* Writes a message that belongs to no component. */
ORR_API void orr_LogNoLevel(uint32_t severity, const char *format, ...) ORR_PRINTF(2, 3);
