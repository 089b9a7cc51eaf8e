/* UUIDs as text. No state. */
#include "host/kernel/uuid.h"

namespace host {
namespace {

constexpr size_t kTextLength = 36;
constexpr size_t kPlainLength = 32;

bool isDashPlace(size_t position) {
  return position == 8 || position == 13 || position == 18 || position == 23;
}

std::optional<uint8_t> digitValue(char digit) {
  if (digit >= '0' && digit <= '9') return static_cast<uint8_t>(digit - '0');
  if (digit >= 'a' && digit <= 'f') return static_cast<uint8_t>(digit - 'a' + 10);
  if (digit >= 'A' && digit <= 'F') return static_cast<uint8_t>(digit - 'A' + 10);
  return std::nullopt;
}

}  // namespace

std::string toString(const zel_UUID &uuid) {
  static const char digits[] = "0123456789abcdef";
  std::string text(kTextLength, '-');
  size_t place = 0;
  for (uint8_t byte : uuid.bytes) {
    place += isDashPlace(place);
    text[place++] = digits[byte >> 4];
    text[place++] = digits[byte & 0xf];
  }
  return text;
}

std::optional<zel_UUID> parseUUID(std::string_view text) {
  const bool dashed = text.size() == kTextLength;
  if (!dashed && text.size() != kPlainLength) return std::nullopt;
  zel_UUID uuid{};
  size_t digitsSeen = 0;
  for (size_t position = 0; position < text.size(); position++) {
    if (dashed && isDashPlace(position)) {
      if (text[position] != '-') return std::nullopt;
      continue;
    }
    const auto value = digitValue(text[position]);
    if (!value) return std::nullopt;
    uint8_t &byte = uuid.bytes[digitsSeen++ / 2];
    byte = static_cast<uint8_t>(byte << 4 | *value);
  }
  return uuid;
}

}  // namespace host
