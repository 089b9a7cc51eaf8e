/* UUIDs as text, order and equality. */
#pragma once

#include <compare>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>

#include "platform/zel.h"

inline bool operator==(const zel_UUID &a, const zel_UUID &b) {
  return std::memcmp(a.bytes, b.bytes, sizeof a.bytes) == 0;
}
inline std::strong_ordering operator<=>(const zel_UUID &a, const zel_UUID &b) {
  return std::memcmp(a.bytes, b.bytes, sizeof a.bytes) <=> 0;
}

namespace host {

/* "8-4-4-4-12" lower-case hexadecimal digits. */
std::string toString(const zel_UUID &uuid);

/* Accepts 8-4-4-4-12 or 32 hexadecimal digits of either case; nothing else. */
std::optional<zel_UUID> parseUUID(std::string_view text);

inline bool isZero(const zel_UUID &uuid) {
  return uuid == zel_UUID{};
}

}  // namespace host
