/* The ring of the last calls and its text. No lock. */
#include "sim/history.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <map>

#include "host/kernel/text.h"
#include "host/kernel/uuid.h"
#include "sim/sketch.h"

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

/* ---- The ring -------------------------------------------------------------------------------- */

bool HistoryEntry::operator==(const HistoryEntry &other) const {
  return step == other.step && time == other.time && fiber == other.fiber && call == other.call &&
         note == other.note && returned == other.returned && injected == other.injected &&
         result == other.result && argument == other.argument && *fiberName == *other.fiberName;
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

void History::noteSuccession(const Fiber &fiber, Call made) {
  const uint64_t call = fiber.nameHash() * callCount + static_cast<uint64_t>(made);
  if (fiber.id() != lastFiber_) successions_->add(lastCall_ * 0x9e3779b97f4a7c15u ^ call);
  lastFiber_ = fiber.id();
  lastCall_ = call;
}

/* ---- For people ------------------------------------------------------------------------------ */

namespace {

/* Statuses by name; nothing for a call whose zero says nothing. */
std::string resultText(const HistoryEntry &entry) {
  if (!entry.returned) return entry.note ? "" : "  ...";
  const auto status = static_cast<zel_Status>(entry.result);
  const bool isStatus = entry.note || traits(entry.call).fault != ZEL_OK || status >= ZEL_FAILURE;
  std::string text;
  if (isStatus)
    text = std::string("  -> ") + host::statusText(status);
  else if (entry.result != 0)
    text = "  -> " + std::to_string(entry.result);
  return entry.injected ? text + "  injected" : text;
}

/* Who holds which spinlocks, followed through the entries. */
class Holding {
 public:
  void follow(const HistoryEntry &entry) {
    if (entry.note || !entry.returned) return;
    std::vector<std::string> &held = held_[entry.fiber];
    const std::string lock = entry.argument.toString();
    if (entry.call == Call::zel_SpinlockLock) held.push_back(lock);
    if (entry.call != Call::zel_SpinlockUnlock) return;
    const auto found = std::find(held.rbegin(), held.rend(), lock);
    if (found != held.rend()) held.erase(found.base() - 1);
  }
  std::string of(uint32_t fiber) const {
    const auto found = held_.find(fiber);
    if (found == held_.end()) return "";
    std::string text;
    for (const std::string &lock : found->second) text += (text.empty() ? "  [" : ", ") + lock;
    return text.empty() ? text : text + "]";
  }

 private:
  std::map<uint32_t, std::vector<std::string>> held_;
};

std::string what(const HistoryEntry &entry) {
  const std::string argument = entry.argument.toString();
  if (entry.note) return std::string("* ") + entry.note + (argument.empty() ? "" : " ") + argument;
  return std::string(traits(entry.call).name) + "(" + argument + ")";
}

/* The same again, one step or more later. */
bool repeats(const HistoryEntry &entry, const HistoryEntry &before) {
  HistoryEntry moved = entry;
  moved.step = before.step;
  return moved == before;
}

std::string lineOf(const HistoryEntry &entry, bool takesOver, const std::string &held) {
  return host::formatText(
      "%8llu %6llu us  %-22s %s%s%s", static_cast<unsigned long long>(entry.step),
      static_cast<unsigned long long>(entry.time / 1000), takesOver ? entry.fiberName->c_str() : "",
      what(entry).c_str(), resultText(entry).c_str(), held.c_str());
}

}  // namespace

std::string History::timeline(size_t lines) const {
  const std::vector<HistoryEntry> all = entries();
  std::vector<std::string> table;
  Holding holding;
  for (size_t i = 0, next; i < all.size(); i = next) {
    next = i + 1;
    while (next < all.size() && repeats(all[next], all[i])) ++next;
    for (size_t same = i; same < next; ++same) holding.follow(all[same]);
    const bool takesOver = i == 0 || all[i - 1].fiber != all[i].fiber;
    table.push_back(lineOf(all[i], takesOver, holding.of(all[i].fiber)));
    if (next > i + 1) table.back() += "  " + std::to_string(next - i) + " times";
  }
  std::string text;
  for (size_t i = table.size() > lines ? table.size() - lines : 0; i < table.size(); ++i)
    text += table[i] + "\n";
  return text;
}

}  // namespace sim
