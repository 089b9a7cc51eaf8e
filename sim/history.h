/* What happened: the last platform calls, and what was noted between them, each with its fiber, its
 * key argument and its result, in a ring of fixed size. One OS thread, no lock.
 */
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "sim/calls.h"
#include "sim/fiber.h"

namespace sim {

class Sketch;

/* What a call was about: a number, a UUID with its entry type, or a name. Never an address, which
 * would differ between two equal runs. */
class Argument {
 public:
  Argument() = default;
  static Argument number(uint64_t value);
  static Argument entry(uint8_t type, const zel_UUID &uuid);
  static Argument text(const char *text); /* the first 31 characters */
  static Argument name(const zel_Name &name);

  uint64_t hash() const {
    constexpr size_t wordsUsed[] = {0, 1, 2, 4}; /* by kind */
    uint64_t hash = static_cast<uint64_t>(kind_) << 8 | type_;
    for (size_t i = 0; i < wordsUsed[static_cast<size_t>(kind_)]; ++i)
      hash = (hash ^ words_[i]) * 0x9e3779b97f4a7c15u + (hash >> 31);
    return hash;
  }
  std::string toString() const;
  bool operator==(const Argument &) const = default;

 private:
  enum class Kind : uint8_t { None, Number, Entry, Text };
  Kind kind_ = Kind::None;
  uint8_t type_ = 0;
  uint64_t words_[4] = {};
};

struct HistoryEntry {
  uint64_t step = 0; /* of the scheduler */
  uint64_t time = 0; /* virtual nanoseconds */
  uint32_t fiber = 0;
  Call call{};
  const char *note = nullptr; /* instead of a call: what begins here; a text that stays */
  bool returned = false;      /* else it goes on, or its fiber was abandoned in it */
  bool injected = false;      /* the result was made to be a failure */
  uint64_t result = 0;        /* a status, a Boolean, a count; 0 for calls without a result */
  Argument argument;
  const std::string *fiberName = nullptr;
  bool operator==(const HistoryEntry &other) const; /* all but the addresses */
};

class History {
 public:
  explicit History(size_t length); /* in calls; 0: keeps nothing */

  /* With nothing kept, nobody need make entries. */
  bool keeps() const { return !ring_.empty(); }

  /* A call begins; the number names it to end(). */
  uint64_t begin(const HistoryEntry &entry) {
    note(entry);
    return made_ - 1;
  }
  void end(uint64_t number, uint64_t result, bool injected) {
    if (made_ - number > ring_.size()) return;
    HistoryEntry &entry = ring_[number & mask_];
    entry.result = result;
    entry.injected = injected;
    entry.returned = true;
  }
  void note(const HistoryEntry &entry) { ring_[made_++ & mask_] = entry; }
  void clear();

  /* The last calls, oldest first. */
  std::vector<HistoryEntry> entries() const;

  /* The last `lines` of them as a table for people: a fiber's name where it takes over, and the
   * spinlocks that it holds after the call, as far as they were taken within the entries. */
  std::string timeline(size_t lines) const;

  /* Every history of the process tells `sketch` of calls that follow directly on a call of another
   * fiber: which call of whom on which call of whom. Null: none. Whatever else is kept. */
  static void setSuccessions(Sketch *sketch) { successions_ = sketch; }
  void follows(const Fiber &fiber, Call call) {
    if (successions_) noteSuccession(fiber, call);
  }

  /* How many lines the report of a panic shows. */
  static void setReportLines(size_t lines) { reportLines_ = lines; }
  static size_t reportLines() { return reportLines_; }

 private:
  void noteSuccession(const Fiber &fiber, Call call);

  inline static Sketch *successions_ = nullptr;
  inline static size_t reportLines_ = 60;
  std::vector<HistoryEntry> ring_; /* a power of two */
  uint64_t mask_ = 0;
  uint64_t made_ = 0;
  uint64_t cleared_ = 0; /* calls before this one are forgotten */
  uint32_t lastFiber_ = 0;
  uint64_t lastCall_ = 0; /* whose call of what, hashed */
};

}  // namespace sim
