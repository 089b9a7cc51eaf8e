/* The end of the world: message, backtrace, abort. */
#pragma once

#include <functional>
#include <string>

namespace host {

/* Prints the message and a backtrace, with symbols of loaded modules, and aborts. printf-style. */
[[noreturn]] void panic(const char *format, ...) __attribute__((format(printf, 1, 2)));

/* Something to print between the message and the backtrace (the simulator prints its history). */
void setPanicReport(std::function<std::string()> report);

}  // namespace host
