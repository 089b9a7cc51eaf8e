/* Status texts, names and printf-style text. No state, no lock. */
#include "host/kernel/text.h"

#include <cstdio>
#include <cstring>

#include "platform/expr_msh.h"

namespace host {

const char *statusText(zel_Status status) {
#define HOST_STATUS_TEXT(name) \
  case name:                   \
    return #name
  switch (status) {
    HOST_STATUS_TEXT(ZEL_OK);
    HOST_STATUS_TEXT(ZEL_FAILURE);
    HOST_STATUS_TEXT(ZEL_NOT_FOUND);
    HOST_STATUS_TEXT(ZEL_BAD_PARAM);
    HOST_STATUS_TEXT(ZEL_NO_MEMORY);
    HOST_STATUS_TEXT(ZEL_SUB_OVERFLOW);
    HOST_STATUS_TEXT(ZEL_SUB_CANCELLED);
    HOST_STATUS_TEXT(ZEL_NOT_INITIALIZED);
    HOST_STATUS_TEXT(ZEL_WORLD_STOPPING);
    HOST_STATUS_TEXT(ZEL_SUB_RESYNC);
    HOST_STATUS_TEXT(EXPR_MSH_TRUNCATED);
    HOST_STATUS_TEXT(EXPR_MSH_TRAILING);
    HOST_STATUS_TEXT(EXPR_MSH_BAD_TYPE);
    HOST_STATUS_TEXT(EXPR_MSH_OUT_OF_RANGE);
    HOST_STATUS_TEXT(EXPR_MSH_MALFORMED);
    default:
      return "unknown status";
  }
#undef HOST_STATUS_TEXT
}

void fillName(zel_Name *name, const char *text) {
  const size_t length = strnlen(text, sizeof name->text - 1);
  *name = {};
  std::memcpy(name->text, text, length);
}

std::string toString(const zel_Name &name) {
  return std::string(name.text, strnlen(name.text, sizeof name.text));
}

std::string formatText(const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  std::string text = vformatText(format, arguments);
  va_end(arguments);
  return text;
}

std::string vformatText(const char *format, va_list arguments) {
  char buffer[256]; /* most texts fit, and are made only once */
  va_list measured;
  va_copy(measured, arguments);
  const int length = std::vsnprintf(buffer, sizeof buffer, format, measured);
  va_end(measured);
  if (length < 0) return format;
  const auto size = static_cast<size_t>(length);
  if (size < sizeof buffer) return {buffer, size};
  std::string text(size, '\0');
  std::vsnprintf(text.data(), text.size() + 1, format, arguments);
  return text;
}

}  // namespace host
