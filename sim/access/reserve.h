/* Ranges of zero-filled addresses that take memory only where they are used. No lock. */
#pragma once

#include <sys/mman.h>

#include <cstddef>

#include "host/kernel/panic.h"

namespace sim::access {

inline void *reserve(size_t bytes) {
  void *memory = mmap(nullptr, bytes, PROT_READ | PROT_WRITE,
                      MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
  if (memory == MAP_FAILED) host::panic("no %zu bytes of addresses to be had", bytes);
  return memory;
}

inline void unreserve(void *memory, size_t bytes) {
  munmap(memory, bytes);
}

}  // namespace sim::access
