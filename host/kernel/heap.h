/* Bounded heaps that know each block's size and the code that asked for it. */
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/zel.h"

namespace host {

/* What one request of `bytes` takes from a heap's maximum: the block rounded up and its header. */
uint32_t heapSpaceFor(uint32_t bytes);

/* Where the memory of blocks comes from. */
class HeapMemory {
 public:
  HeapMemory() = default;
  virtual ~HeapMemory() = default;
  HeapMemory(const HeapMemory &) = delete;
  HeapMemory &operator=(const HeapMemory &) = delete;

  /* `front` bytes for the heap's own record and `size` for the block behind it, aligned to 16; null
   * when there are no more. Called under the heaps' lock: must not sleep, log or panic. */
  virtual void *get(size_t front, size_t size) = 0;

  /* Takes back what get() gave. Called without the lock. */
  virtual void put(void *memory) = 0;
};

/* Serves the heaps that are created from now on, and must outlive them. Null: malloc and free. */
void setHeapMemory(HeapMemory *memory);

zel_Status heapCreate(const zel_HeapProps &props, zel_HeapID *heap);
void heapDestroy(zel_HeapID heap); /* reports what is alive, through the log */
void *heapAlloc(zel_HeapID heap, uint32_t size, void *returnAddress);
void heapFree(zel_HeapID heap, void *block);

struct HeapBlock {
  void *address;
  uint32_t size; /* as asked */
  void *returnAddress;
};
struct HeapState {
  std::string name;
  uint32_t maximum; /* bytes */
  uint32_t used;    /* bytes that live blocks consume */
  uint32_t peak;    /* most that was ever used */
  uint64_t allocations;
  std::vector<HeapBlock> blocks; /* alive, oldest first */
};
HeapState heapState(zel_HeapID heap);

/* Every heap that exists: for tests, reports and "nothing left behind". */
std::vector<zel_HeapID> heapsAlive();

}  // namespace host
