/* Status texts, names and printf-style text; behind zel_StatusToString, zel_NameInitialize and
 * zel_Snprintf. No state, no lock.
 */
#pragma once

#include <cstdarg>
#include <string>

#include "platform/zel.h"

namespace host {

/* "ZEL_NO_MEMORY" and the like; "unknown status" for a value that nobody knows. */
const char *statusText(zel_Status status);

/* Fills `name` with `text`, cut to 31 characters, and zeroes the rest. */
void fillName(zel_Name *name, const char *text);

/* The text of a name, which a module may have left without its NUL. */
std::string toString(const zel_Name &name);

std::string formatText(const char *format, ...) __attribute__((format(printf, 1, 2)));
std::string vformatText(const char *format, va_list arguments)
    __attribute__((format(printf, 1, 0)));

}  // namespace host
