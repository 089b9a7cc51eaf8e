/* UUIDs that are told apart at a glance: nodes, interfaces, objects. */
#pragma once

#include "platform/zel.h"

constexpr zel_UUID uuidOf(uint8_t kind, uint32_t number) {
  return {{kind, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, static_cast<uint8_t>(number >> 24),
           static_cast<uint8_t>(number >> 16), static_cast<uint8_t>(number >> 8),
           static_cast<uint8_t>(number)}};
}
constexpr zel_UUID nodeUUID(uint32_t number) {
  return uuidOf(0xa0, number);
}
constexpr zel_UUID netIfUUID(uint32_t number) {
  return uuidOf(0xb0, number);
}
constexpr zel_UUID objectUUID(uint32_t number) {
  return uuidOf(0xc0, number);
}
constexpr zel_UUID noUUID{};
constexpr uint8_t objectType = 20;
