/* The end of the world: message, backtrace, abort. */
#pragma once

#include <cstdarg>
#include <functional>
#include <string>

#include "platform/zel.h"

namespace host {

/* Prints the message and a backtrace, with symbols of loaded modules, and aborts. printf-style. */
[[noreturn]] void panic(const char *format, ...) __attribute__((format(printf, 1, 2)));

/* The same, attributed to a module: its name, or its ID where it is not loaded, comes first. */
[[noreturn]] void panicInModule(zel_ModuleID moduleID, const char *format, va_list arguments)
    __attribute__((format(printf, 2, 0)));

/* Something to print between the message and the backtrace (the simulator prints its history). */
void setPanicReport(std::function<std::string()> report);

}  // namespace host
