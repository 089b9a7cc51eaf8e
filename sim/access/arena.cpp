/* The arena: where the next block goes, and what lies where. One OS thread, no lock. */
#include "sim/access/arena.h"

#include <cstring>

#include "host/kernel/panic.h"
#include "sim/access/reserve.h"

namespace sim::access {

namespace {

constexpr int junk = 0xdb; /* fills new blocks: zeroes may be there by luck only */

}  // namespace

Arena::Arena(Listener &listener)
    : listener_(listener),
      base_(reinterpret_cast<uintptr_t>(reserve(size))),
      owners_(static_cast<uint32_t *>(reserve(size / unit * sizeof(uint32_t)))) {}

Arena::~Arena() {
  unreserve(owners_, size / unit * sizeof(uint32_t));
  unreserve(reinterpret_cast<void *>(base_), size);
}

/* Moves next_ to a place with `length` free bytes: onwards past live blocks, once around. */
bool Arena::findRoom(size_t length) {
  size_t passed = 0;
  for (auto it = extents_.lower_bound(next_); passed <= size;) {
    while (it != extents_.end() && !blocks_[it->second.number].live) ++it;
    const size_t end = it == extents_.end() ? size : it->first;
    if (end - next_ >= length) return true;
    const size_t after = it == extents_.end() ? unit : it->first + it->second.length;
    passed += after > next_ ? after - next_ : size - next_;
    next_ = after;
    it = extents_.lower_bound(next_);
  }
  return false;
}

void Arena::forgetFreed(size_t offset, size_t length) {
  auto it = extents_.lower_bound(offset);
  if (it != extents_.begin() && std::prev(it)->first + std::prev(it)->second.length > offset) --it;
  while (it != extents_.end() && it->first < offset + length) {
    const size_t first = it->first / unit;
    std::fill_n(owners_ + first, it->second.length / unit, 0u);
    freeNumbers_.push_back(it->second.number);
    it = extents_.erase(it);
  }
}

uint32_t Arena::newNumber() {
  if (freeNumbers_.empty()) {
    blocks_.emplace_back();
    return static_cast<uint32_t>(blocks_.size() - 1);
  }
  const uint32_t number = freeNumbers_.back();
  freeNumbers_.pop_back();
  blocks_[number] = {};
  return number;
}

void *Arena::get(size_t front, size_t bytes) {
  const size_t length =
      (front + bytes + unit) / unit * unit; /* one byte at least belongs to none */
  if (!findRoom(length)) return nullptr;
  const size_t offset = next_;
  next_ += length;
  forgetFreed(offset, length);
  const uint32_t number = newNumber();
  extents_[offset] = {length, number};
  std::fill_n(owners_ + offset / unit, length / unit, number);
  Block &block = blocks_[number];
  block.base = base_ + offset + front;
  block.size = bytes;
  block.live = true;
  std::memset(reinterpret_cast<void *>(base_ + offset), junk, front + bytes);
  listener_.given(block);
  return reinterpret_cast<void *>(base_ + offset);
}

void Arena::put(void *memory) {
  Block *block = find(reinterpret_cast<uintptr_t>(memory));
  if (!block || !block->live) host::panic("%p goes back to the arena but is not alive", memory);
  listener_.taken(*block);
  block->live = false;
}

}  // namespace sim::access
