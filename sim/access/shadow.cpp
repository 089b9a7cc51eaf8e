/* The lists of entries: recorded, compared, replaced. One OS thread, no lock. */
#include "sim/access/shadow.h"

#include <algorithm>

#include "sim/access/reserve.h"

namespace sim::access {

namespace {

constexpr uint8_t bit(Kind kind) {
  return static_cast<uint8_t>(1u << static_cast<unsigned>(kind));
}

/* Kinds that a kind conflicts with: one of the two writes, and not both are atomic. */
constexpr uint8_t conflicts[] = {
    bit(Kind::Write) | bit(Kind::AtomicWrite),
    bit(Kind::Read) | bit(Kind::Write) | bit(Kind::AtomicRead) | bit(Kind::AtomicWrite),
    bit(Kind::Write),
    bit(Kind::Read) | bit(Kind::Write),
};

constexpr bool conflict(Kind a, Kind b) {
  return conflicts[static_cast<size_t>(a)] & bit(b);
}

/* Does whatever conflicts with `old` conflict with `young` as well? */
constexpr bool standsFor(Kind young, Kind old) {
  return (conflicts[static_cast<size_t>(old)] & ~conflicts[static_cast<size_t>(young)]) == 0;
}
static_assert(standsFor(Kind::Write, Kind::Read) && standsFor(Kind::Read, Kind::AtomicRead));
static_assert(!standsFor(Kind::Read, Kind::AtomicWrite) &&
              !standsFor(Kind::AtomicWrite, Kind::Read));

}  // namespace

Shadow::Shadow(uintptr_t base, size_t size)
    : base_(base),
      size_(size),
      heads_(static_cast<uint32_t *>(reserve(size / granule * sizeof(uint32_t)))) {}

Shadow::~Shadow() {
  unreserve(heads_, size_ / granule * sizeof(uint32_t));
}

Shadow::Page &Shadow::pageOf(uintptr_t address) {
  const uintptr_t number = address / pageSize;
  if (number != lastPage_ || !lastPageHeads_) {
    auto &page = pages_[number];
    if (!page) page = std::make_unique<Page>();
    lastPage_ = number;
    lastPageHeads_ = page.get();
  }
  return *lastPageHeads_;
}

uint32_t &Shadow::headOf(uintptr_t address) {
  if (address - base_ < size_) return heads_[(address - base_) / granule];
  return pageOf(address).heads[address % pageSize / granule];
}

/* Calls `visit(head, mask)` for each granule of a range, with the bytes of it that are in it, until
 * it returns true. */
template <typename HeadOf, typename Visit>
static void forGranules(uintptr_t address, size_t size, const HeadOf &headOf, const Visit &visit) {
  while (size > 0) {
    const size_t first = address % 8;
    const size_t count = std::min(size, 8 - first);
    const auto mask = static_cast<uint8_t>(((1u << count) - 1) << first);
    if (visit(headOf(address), mask)) return;
    address += count;
    size -= count;
  }
}

void Shadow::drop(uint32_t *link) {
  const uint32_t number = *link;
  *link = entries_[number].next;
  entries_[number].next = freeEntries_;
  freeEntries_ = number;
}

const Shadow::Entry *Shadow::recordInGranule(uint32_t &head, uint8_t mask, const Access &access,
                                             const Strand &strand) {
  for (uint32_t *link = &head; *link != 0;) {
    Entry &entry = entries_[*link];
    if (entry.mask & mask) {
      const bool own = entry.slot == strand.slot;
      /* The same fiber has published nothing since, so that nobody knows the one but not the other. */
      if (own && entry.time == strand.time() && !(mask & ~entry.mask) &&
          standsFor(entry.kind, access.kind)) {
        return nullptr;
      }
      if (own || entry.time <= strand.clock.at(entry.slot)) {
        if (standsFor(access.kind, entry.kind)) entry.mask &= static_cast<uint8_t>(~mask);
        if (entry.mask == 0) {
          drop(link);
          continue;
        }
      } else if (conflict(access.kind, entry.kind)) {
        return &entry;
      }
    }
    link = &entry.next;
  }
  const Entry made{access.at, access.size, strand.time(), head, strand.slot, mask, access.kind};
  if (freeEntries_ == 0) {
    entries_.push_back(made);
    head = static_cast<uint32_t>(entries_.size() - 1);
  } else {
    head = freeEntries_;
    freeEntries_ = entries_[head].next;
    entries_[head] = made;
  }
  return nullptr;
}

Shadow::Race Shadow::record(const Access &access, const Strand &strand) {
  Race race;
  const auto headOfGranule = [this](uintptr_t address) -> uint32_t & { return headOf(address); };
  uintptr_t place = access.address;
  forGranules(access.address, access.size, headOfGranule, [&](uint32_t &head, uint8_t mask) {
    if (const Entry *entry = recordInGranule(head, mask, access, strand)) {
      race = {true, {place, entry->size, entry->kind, entry->at}};
    }
    place = (place / granule + 1) * granule;
    return race.found;
  });
  return race;
}

void Shadow::clearGranule(uint32_t &head, uint8_t mask) {
  for (uint32_t *link = &head; *link != 0;) {
    Entry &entry = entries_[*link];
    entry.mask &= static_cast<uint8_t>(~mask);
    if (entry.mask == 0) {
      drop(link);
    } else {
      link = &entry.next;
    }
  }
}

void Shadow::clear(uintptr_t address, size_t size) {
  while (size > 0) {
    const size_t count = std::min(size, pageSize - address % pageSize);
    const bool known = address - base_ < size_ || pages_.contains(address / pageSize);
    const auto headOfGranule = [this](uintptr_t at) -> uint32_t & { return headOf(at); };
    if (known) {
      forGranules(address, count, headOfGranule, [this](uint32_t &head, uint8_t mask) {
        clearGranule(head, mask);
        return false;
      });
    }
    address += count;
    size -= count;
  }
}

}  // namespace sim::access
