/* Memory for the heaps of modules. Blocks are given out in ascending order of address and what was
 * freed is used again only when the whole range has been used up, so that a use after free meets
 * memory that still says when it was freed, and by whom. One OS thread, no lock.
 */
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <vector>

#include "host/kernel/heap.h"
#include "sim/access/strand.h"

namespace sim::access {

struct Region;

/* What a module was given, without the heap's own record in front of it. */
struct Block {
  uintptr_t base = 0;
  size_t size = 0; /* as asked */
  bool live = false;
  Moment allocated{};
  Moment freed{};
  Region *region = nullptr; /* what was declared about it */
};

class Arena final : public host::HeapMemory {
 public:
  /* Told of every block that begins, and of every one that is about to end. */
  struct Listener {
    virtual ~Listener() = default;
    virtual void given(Block &block) = 0;
    virtual void taken(Block &block) = 0;
  };

  static constexpr size_t size = size_t{64} << 20; /* bytes; those that are never used cost none */

  explicit Arena(Listener &listener);
  ~Arena() override;

  void *get(size_t front, size_t bytes) override;
  void put(void *memory) override;

  uintptr_t base() const { return base_; }
  bool contains(uintptr_t address) const { return address - base_ < size; }

  /* The block, live or freed, whose memory or front the address lies in; else null. */
  Block *find(uintptr_t address) {
    const uint32_t number = owners_[(address - base_) / unit];
    return number ? &blocks_[number] : nullptr;
  }

 private:
  static constexpr size_t unit = 16; /* bytes; no two blocks share one */

  struct Extent {
    size_t length;
    uint32_t number; /* of the block */
  };

  bool findRoom(size_t length);
  void forgetFreed(size_t offset, size_t length);
  uint32_t newNumber();

  Listener &listener_;
  uintptr_t base_;
  uint32_t *owners_;   /* a block's number by unit; 0: never given, or forgotten */
  size_t next_ = unit; /* offset behind the last block given; nothing lies at the base itself */
  std::map<size_t, Extent> extents_; /* blocks with their fronts, live and freed, by offset */
  std::vector<Block> blocks_{1};
  std::vector<uint32_t> freeNumbers_;
};

}  // namespace sim::access
