/*
 * The module's one logging convention.
 *
 * With the module's log component, a message goes to orr_LogLevel at the
 * component's current level (so it is always written) and carries the
 * prefix "<log name>: <function>:<line>: ". Before the component exists and
 * after the teardown released it, an error goes to orr_LogNoLevel without
 * the prefix; an information message is still handed to orr_LogLevel with
 * no component, which keeps no trace of it.
 *
 * Every text ends with a newline, added here. A host status is shown as
 * "(%#x): %s" with its value and orr_StatusToString.
 */
#pragma once

#include "framework/sifra_generic.h"
#include "platform/orr_log.h"

#define SG_LOG(severity, fmt, ...)                                                         \
   do {                                                                                    \
      orr_LogHandle sgLogHandle_ = sifraGenericLogHandle;                                  \
      if (sgLogHandle_ != nullptr) {                                                       \
         orr_LogLevel((severity), sgLogHandle_, orr_LogGetCurrentLogLevel(sgLogHandle_),   \
                      "%s: %s:%d: " fmt "\n", orr_LogGetName(sgLogHandle_), __func__,      \
                      __LINE__ __VA_OPT__(, ) __VA_ARGS__);                                \
      } else if ((severity) == ORR_LOG_ERROR) {                                            \
         orr_LogNoLevel(ORR_LOG_ERROR, fmt "\n" __VA_OPT__(, ) __VA_ARGS__);               \
      } else {                                                                             \
         orr_LogLevel((severity), nullptr, 0, fmt "\n" __VA_OPT__(, ) __VA_ARGS__);        \
      }                                                                                    \
   } while (0)

/* The number of a status for "%#x". */
static inline unsigned SifraGenericStatusValue(orr_Status status)
{
   return static_cast<unsigned>(status);
}
