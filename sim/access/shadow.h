/* For every byte of memory, the accesses that a later one could still race with.
 *
 * Each access has its fiber's time; an access happens before another one when the other one's fiber
 * knows of that time through a chain of promises of the platform (vector clocks). Two accesses of
 * which neither happens before the other, and that conflict, are a race, whatever came of it in this
 * run. As in FastTrack (Flanagan and Freund, PLDI 2009) an entry is one number of one fiber in place
 * of a clock, and goes when a later access takes its place: when that one happens after it, covers
 * its bytes and conflicts with all that it conflicts with. No entry goes for want of room, so that no
 * race with it is missed; nor is one invented, as by lock sets alone (Eraser, Savage et al., SOSP
 * 1997).
 *
 * One OS thread, no lock.
 */
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <unordered_map>
#include <vector>

#include "sim/access/strand.h"

namespace sim::access {

enum class Kind : uint8_t { Read, Write, AtomicRead, AtomicWrite };

constexpr bool writes(Kind kind) {
  return kind == Kind::Write || kind == Kind::AtomicWrite;
}
constexpr bool isAtomic(Kind kind) {
  return kind == Kind::AtomicRead || kind == Kind::AtomicWrite;
}

struct Access {
  uintptr_t address = 0;
  size_t size = 0; /* bytes */
  Kind kind{};
  Moment at{};
  bool frees = false; /* gives a whole block back, which counts as a write */
};

class Shadow {
 public:
  /* What an access raced with. */
  struct Race {
    bool found = false;
    Access earlier{};
  };

  /* Addresses from `base` on, `size` of them, have their entries in one array. */
  Shadow(uintptr_t base, size_t size);
  ~Shadow();
  Shadow(const Shadow &) = delete;
  Shadow &operator=(const Shadow &) = delete;

  /* Records the access, unless it races with one that is recorded. */
  Race record(const Access &access, const Strand &strand);

  /* Forgets all accesses to a range. */
  void clear(uintptr_t address, size_t size);

 private:
  static constexpr size_t granule = 8; /* bytes that share a list of entries */
  static constexpr size_t pageSize = 4096;

  struct Entry {
    Moment at;
    size_t size;
    uint32_t time;
    uint32_t next; /* 0: the last one */
    uint16_t slot;
    uint8_t mask; /* of the granule's bytes */
    Kind kind;
  };
  struct Page {
    uint32_t heads[pageSize / granule] = {};
  };

  uint32_t &headOf(uintptr_t address);
  Page &pageOf(uintptr_t address);
  const Entry *recordInGranule(uint32_t &head, uint8_t mask, const Access &access,
                               const Strand &strand);
  void clearGranule(uint32_t &head, uint8_t mask);
  void drop(uint32_t *link);

  const uintptr_t base_;
  const size_t size_;
  uint32_t *heads_; /* of the granules from base_ on */
  std::unordered_map<uintptr_t, std::unique_ptr<Page>> pages_;
  uintptr_t lastPage_ = 0;
  Page *lastPageHeads_ = nullptr;
  std::vector<Entry> entries_{1};
  uint32_t freeEntries_ = 0;
};

}  // namespace sim::access
