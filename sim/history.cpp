/* The ring of the last calls and its text. No lock. */
#include "sim/history.h"

#include <algorithm>
#include <bit>
#include <cstring>

#include "host/kernel/text.h"
#include "host/kernel/uuid.h"

namespace sim {

/* ---- Arguments ------------------------------------------------------------------------------- */

Argument Argument::number(uint64_t value) {
  Argument argument;
  argument.kind_ = Kind::Number;
  argument.words_[0] = value;
  return argument;
}

Argument Argument::entry(uint8_t type, const zel_UUID &uuid) {
  Argument argument;
  argument.kind_ = Kind::Entry;
  argument.type_ = type;
  std::memcpy(argument.words_, uuid.bytes, sizeof uuid.bytes);
  return argument;
}

Argument Argument::text(const char *text) {
  Argument argument;
  argument.kind_ = Kind::Text;
  std::memcpy(argument.words_, text, strnlen(text, sizeof argument.words_ - 1));
  return argument;
}

Argument Argument::name(const zel_Name &name) {
  Argument argument;
  argument.kind_ = Kind::Text;
  static_assert(sizeof argument.words_ == sizeof name.text, "a name fits as it is");
  std::memcpy(argument.words_, name.text, sizeof name.text);
  return argument;
}

uint64_t Argument::hash() const {
  uint64_t hash = static_cast<uint64_t>(kind_) << 8 | type_;
  for (const uint64_t word : words_) hash = (hash ^ word) * 0x9e3779b97f4a7c15u + (hash >> 31);
  return hash;
}

std::string Argument::toString() const {
  switch (kind_) {
    case Kind::None:
      return "";
    case Kind::Number:
      return std::to_string(words_[0]);
    case Kind::Entry: {
      zel_UUID uuid;
      std::memcpy(uuid.bytes, words_, sizeof uuid.bytes);
      return "type " + std::to_string(type_) + " " +
             (host::isZero(uuid) ? std::string("all") : host::toString(uuid));
    }
    case Kind::Text: {
      const char *text = reinterpret_cast<const char *>(words_);
      return std::string(text, strnlen(text, sizeof words_));
    }
  }
  return "";
}

namespace {

/* Statuses by name; nothing for a call whose zero says nothing. */
std::string resultText(const HistoryEntry &entry) {
  const auto status = static_cast<zel_Status>(entry.result);
  if (traits(entry.call).fault != ZEL_OK || status >= ZEL_FAILURE)
    return std::string("  -> ") + host::statusText(status);
  return entry.result != 0 ? "  -> " + std::to_string(entry.result) : "";
}

}  // namespace

/* ---- The ring -------------------------------------------------------------------------------- */

bool HistoryEntry::operator==(const HistoryEntry &other) const {
  return step == other.step && time == other.time && fiber == other.fiber && call == other.call &&
         returned == other.returned && injected == other.injected && result == other.result &&
         argument == other.argument && *fiberName == *other.fiberName;
}

History::History(size_t length) {
  if (length == 0) return;
  ring_.resize(std::bit_ceil(length));
  mask_ = ring_.size() - 1;
}

void History::clear() {
  cleared_ = made_;
}

std::vector<HistoryEntry> History::entries() const {
  const uint64_t kept = std::min<uint64_t>(made_ - cleared_, ring_.size());
  std::vector<HistoryEntry> entries;
  entries.reserve(kept);
  for (uint64_t number = made_ - kept; number < made_; ++number)
    entries.push_back(ring_[number & mask_]);
  return entries;
}

std::string History::timeline(size_t lines) const {
  std::vector<HistoryEntry> all = entries();
  const size_t first = all.size() > lines ? all.size() - lines : 0;
  std::string text;
  for (size_t i = first; i < all.size(); ++i) {
    const HistoryEntry &entry = all[i];
    const char *end = !entry.returned ? "  ..." : entry.injected ? "  injected" : "";
    const std::string result = entry.returned ? resultText(entry) : "";
    text += host::formatText(
        "%8llu %6llu us  %-22s %s(%s)%s%s\n", static_cast<unsigned long long>(entry.step),
        static_cast<unsigned long long>(entry.time / 1000), entry.fiberName->c_str(),
        traits(entry.call).name, entry.argument.toString().c_str(), result.c_str(), end);
  }
  return text;
}

}  // namespace sim
