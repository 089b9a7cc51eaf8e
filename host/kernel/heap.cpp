/* Bounded heaps. One lock, heapsLock, guards the table of heaps and every heap's accounts; nothing
 * sleeps, logs or panics under it.
 */
#include "host/kernel/heap.h"

#include <algorithm>
#include <cinttypes>
#include <cstdlib>
#include <limits>
#include <map>
#include <memory>
#include <mutex>
#include <new>

#include "host/kernel/log.h"
#include "host/kernel/module_loader.h"
#include "host/kernel/panic.h"
#include "host/kernel/text.h"

namespace host {
namespace {

constexpr uint32_t kAlignment = 16;

/* Stands before each block. A block is on the list of its heap, oldest first, and in the bucket of
 * its address: whether a pointer is alive is known without reading what it points at. */
struct alignas(kAlignment) BlockHeader {
  BlockHeader *older;
  BlockHeader *newer;
  BlockHeader *nextInBucket;
  void *returnAddress;
  uint32_t size;

  void *block() { return this + 1; }
};

class Malloc final : public HeapMemory {
 public:
  /* Exactly what was asked, not what is accounted: a sanitizer then sees the first byte beyond. */
  void *get(size_t front, size_t size) override { return std::malloc(front + size); }
  void put(void *memory) override { std::free(memory); }
};

class Heap {
 public:
  Heap(const zel_HeapProps &props, HeapMemory &memory)
      : memory_(memory),
        name_(toString(props.name)),
        maximum_(props.maximumSize),
        buckets_(kFirstBuckets) {}

  ~Heap() {
    while (oldest_ != nullptr) {
      BlockHeader *const next = oldest_->newer;
      memory_.put(oldest_);
      oldest_ = next;
    }
  }
  Heap(const Heap &) = delete;
  Heap &operator=(const Heap &) = delete;

  void *allocate(uint32_t size, void *returnAddress) {
    const uint32_t space = heapSpaceFor(size);
    if (space > maximum_ - used_) return nullptr;
    void *memory = memory_.get(sizeof(BlockHeader), size);
    if (memory == nullptr) return nullptr;

    auto *header = new (memory) BlockHeader{newest_, nullptr, nullptr, returnAddress, size};
    (newest_ == nullptr ? oldest_ : newest_->newer) = header;
    newest_ = header;
    BlockHeader *&bucket = bucketOf(header->block());
    header->nextInBucket = bucket;
    bucket = header;

    used_ += space;
    peak_ = std::max(peak_, used_);
    allocations_++;
    if (++blocks_ > buckets_.size()) spread();
    return header->block();
  }

  HeapMemory &memory() const { return memory_; }

  /* Forgets the block; what is left is to put its memory back. Null when it is not alive. */
  void *release(void *block) {
    BlockHeader **place = &bucketOf(block);
    while (*place != nullptr && (*place)->block() != block) place = &(*place)->nextInBucket;
    BlockHeader *const header = *place;
    if (header == nullptr) return nullptr;

    *place = header->nextInBucket;
    (header->older == nullptr ? oldest_ : header->older->newer) = header->newer;
    (header->newer == nullptr ? newest_ : header->newer->older) = header->older;
    used_ -= heapSpaceFor(header->size);
    blocks_--;
    return header;
  }

  HeapState state() const {
    HeapState state{name_, maximum_, used_, peak_, allocations_, {}};
    for (BlockHeader *header = oldest_; header != nullptr; header = header->newer) {
      state.blocks.push_back({header->block(), header->size, header->returnAddress});
    }
    return state;
  }

 private:
  static constexpr size_t kFirstBuckets = 64;

  /* Over four times the buckets: most heaps hold few blocks, and some very many. Where there is no
   * memory for them, what there is does as well. */
  void spread() {
    try {
      buckets_.assign(buckets_.size() * 4, nullptr);
    } catch (const std::bad_alloc &) {
      return;
    }
    for (BlockHeader *header = oldest_; header != nullptr; header = header->newer) {
      BlockHeader *&bucket = bucketOf(header->block());
      header->nextInBucket = bucket;
      bucket = header;
    }
  }

  BlockHeader *&bucketOf(const void *block) {
    const auto address = reinterpret_cast<uintptr_t>(block) / kAlignment;
    return buckets_[(address ^ address >> 16) & (buckets_.size() - 1)];
  }

  HeapMemory &memory_;
  const std::string name_;
  const uint32_t maximum_;
  uint32_t used_ = 0;
  uint32_t peak_ = 0;
  uint64_t allocations_ = 0;
  size_t blocks_ = 0;
  BlockHeader *oldest_ = nullptr;
  BlockHeader *newest_ = nullptr;
  std::vector<BlockHeader *> buckets_;
};

std::mutex heapsLock;
HeapMemory *heapMemory = nullptr;    /* of heaps to come; null: malloc */
zel_HeapID lastHeapID = ZEL_NO_HEAP; /* IDs are never used twice: a stale one is recognised */

/* The heap that was last asked for, or ZEL_NO_HEAP: mostly it is the next one too. */
zel_HeapID recentHeapID = ZEL_NO_HEAP;
Heap *recentHeap = nullptr;

std::map<zel_HeapID, std::unique_ptr<Heap>> &heaps() {
  static std::map<zel_HeapID, std::unique_ptr<Heap>> table;
  return table;
}

Heap *findHeapLocked(zel_HeapID id) {
  if (id != recentHeapID) {
    const auto found = heaps().find(id);
    if (found == heaps().end()) return nullptr;
    recentHeapID = id;
    recentHeap = found->second.get();
  }
  return recentHeap;
}

HeapMemory &memoryLocked() {
  static Malloc ordinary;
  return heapMemory == nullptr ? ordinary : *heapMemory;
}

[[noreturn]] void panicNoHeap(const char *what, zel_HeapID id) {
  panic("%s: there is no heap 0x%" PRIx64, what, id);
}

void reportBlocks(const HeapState &state) {
  uint64_t total = 0;
  for (const HeapBlock &block : state.blocks) {
    total += block.size;
    logWarning("heap %s: block of %" PRIu32 " bytes at %p is still alive, asked for by %s",
               state.name.c_str(), block.size, block.address,
               symbolize(block.returnAddress).c_str());
  }
  logWarning("heap %s: %zu blocks of %" PRIu64 " bytes in total were alive at its end",
             state.name.c_str(), state.blocks.size(), total);
}

}  // namespace

uint32_t heapSpaceFor(uint32_t bytes) {
  const uint64_t rounded = (uint64_t{bytes} + kAlignment - 1) / kAlignment * kAlignment;
  const uint64_t space = rounded + sizeof(BlockHeader);
  /* No heap is larger than the type: a request that does not fit it fits no heap. */
  return static_cast<uint32_t>(std::min<uint64_t>(space, std::numeric_limits<uint32_t>::max()));
}

void setHeapMemory(HeapMemory *memory) {
  const std::lock_guard guard(heapsLock);
  heapMemory = memory;
}

zel_Status heapCreate(const zel_HeapProps &props, zel_HeapID *heap) {
  if (props.maximumSize == 0 || props.initialSize > props.maximumSize) return ZEL_BAD_PARAM;
  try {
    const std::lock_guard guard(heapsLock);
    auto created = std::make_unique<Heap>(props, memoryLocked());
    const zel_HeapID id = lastHeapID + 1;
    heaps().emplace(id, std::move(created));
    lastHeapID = id;
    *heap = id;
    return ZEL_OK;
  } catch (const std::bad_alloc &) {
    return ZEL_NO_MEMORY;
  }
}

void heapDestroy(zel_HeapID heap) {
  std::unique_ptr<Heap> ended;
  {
    const std::lock_guard guard(heapsLock);
    const auto found = heaps().find(heap);
    if (found != heaps().end()) {
      ended = std::move(found->second);
      heaps().erase(found);
      recentHeapID = ZEL_NO_HEAP;
      recentHeap = nullptr;
    }
  }
  if (!ended) panicNoHeap("destroying a heap", heap);
  const HeapState state = ended->state();
  if (!state.blocks.empty()) reportBlocks(state);
}

void *heapAlloc(zel_HeapID heap, uint32_t size, void *returnAddress) {
  {
    const std::lock_guard guard(heapsLock);
    if (Heap *const found = findHeapLocked(heap)) return found->allocate(size, returnAddress);
  }
  panicNoHeap("allocating", heap);
}

void heapFree(zel_HeapID heap, void *block) {
  if (block == nullptr) return;
  HeapMemory *origin = nullptr;
  void *memory = nullptr;
  {
    const std::lock_guard guard(heapsLock);
    if (Heap *const found = findHeapLocked(heap)) {
      origin = &found->memory();
      memory = found->release(block);
    }
  }
  if (memory != nullptr) return origin->put(memory);
  panic("freeing %p, which is not alive in heap 0x%" PRIx64, block, heap);
}

HeapState heapState(zel_HeapID heap) {
  {
    const std::lock_guard guard(heapsLock);
    if (const Heap *const found = findHeapLocked(heap)) return found->state();
  }
  panicNoHeap("reading a heap's state", heap);
}

std::vector<zel_HeapID> heapsAlive() {
  std::vector<zel_HeapID> alive;
  const std::lock_guard guard(heapsLock);
  for (const auto &[id, heap] : heaps()) alive.push_back(id);
  return alive;
}

}  // namespace host
