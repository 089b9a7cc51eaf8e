/* The host kernel's log and its modules' logs, through spdlog: level, time, thread name; colour
 * only on a terminal; standard error by default.
 */
#pragma once

#include <cstdarg>
#include <functional>
#include <string>
#include <vector>

#include "platform/zel.h"

namespace host {

/* The host's own lines. fmt-free on purpose: printf-style like the platform's. */
void logInfo(const char *format, ...) __attribute__((format(printf, 1, 2)));
void logWarning(const char *format, ...) __attribute__((format(printf, 1, 2)));

/* What standard error shows. A sink gets every line. */
enum class LogThreshold { Info, Warning, Off };
void setLogThreshold(LogThreshold threshold);

struct LogLine {
  uint32_t urgency;
  std::string text;     /* without its final newline */
  std::string log = {}; /* name of the module's log; empty for the host's own lines */
};

/* Sends every line to `sink` as well as, or with `only` instead of, standard error; an empty
 * function undoes it, and no call of the old sink runs any more when this returns. Calls come from
 * any thread, one at a time; the sink neither logs nor sets a sink. For embedding and tests. */
void setLogSink(std::function<void(const LogLine &)> sink, bool only);

/* Behind the platform's log functions. logVWrite writes whatever the log's level is; `log` is null
 * for a line that belongs to none. */
zel_Status logOpen(const char *name, zel_ModuleID moduleID, uint32_t level, zel_Log **log);
void logClose(zel_Log **log);
void logVWrite(uint32_t urgency, zel_Log *log, const char *format, va_list arguments);
const char *logName(zel_Log *log);
int32_t logLevel(zel_Log *log);
std::vector<std::string> logsOpen(); /* names of the logs that are open */

}  // namespace host
