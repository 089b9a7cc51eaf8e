/* The module's log lines. No lock; may be used under any. */
#ifndef KARST_RESOLVER_LOG_H
#define KARST_RESOLVER_LOG_H

#include "platform/zel.h"

extern "C" {
extern zel_Log *karstResolverLogHandle; /* null while no log is open */
}

/* Through the open log: prefixed, and at the log's own level so that it is never filtered out. */
#define KARST_RESOLVER_LOG_OPEN(urgency, function, text, ...)                                      \
  zel_LogLevel(urgency, karstResolverLogHandle, zel_LogGetCurrentLogLevel(karstResolverLogHandle), \
               "%s: %s:%d: " text, zel_LogGetName(karstResolverLogHandle), function,               \
               __LINE__ __VA_OPT__(, ) __VA_ARGS__)

/* A failure, reported in the name of `function`; unprefixed where no log is open. */
#define KARST_RESOLVER_REPORT_AS(function, text, ...)                                              \
  do {                                                                                             \
    if (karstResolverLogHandle != nullptr) {                                                       \
      KARST_RESOLVER_LOG_OPEN(ZEL_LOG_URGENCY_WARNING, function, text __VA_OPT__(, ) __VA_ARGS__); \
    } else {                                                                                       \
      zel_LogNoLevel(ZEL_LOG_URGENCY_WARNING, text __VA_OPT__(, ) __VA_ARGS__);                    \
    }                                                                                              \
  } while (0)

#define KARST_RESOLVER_REPORT(text, ...) \
  KARST_RESOLVER_REPORT_AS(__func__, text __VA_OPT__(, ) __VA_ARGS__)

/* Something to know, from code that runs only while the module is loaded and its log is open. */
#define KARST_RESOLVER_NOTE_AS(function, text, ...) \
  KARST_RESOLVER_LOG_OPEN(ZEL_LOG_URGENCY_INFO, function, text __VA_OPT__(, ) __VA_ARGS__)

#define KARST_RESOLVER_NOTE(text, ...) \
  KARST_RESOLVER_NOTE_AS(__func__, text __VA_OPT__(, ) __VA_ARGS__)

#endif
