/* A module's heap, lock domain and locks, without a module. */
#pragma once

#include <gtest/gtest.h>

#include <vector>

#include "host/kernel/text.h"
#include "platform/zel.h"

struct SimHeap {
  SimHeap() {
    zel_HeapProps props{};
    host::fillName(&props.name, "test");
    props.maximumSize = 1 << 20;
    EXPECT_EQ(zel_HeapCreate(&props, &id), ZEL_OK);
    EXPECT_EQ(zel_LockDomainCreate(0, id, &props.name, &domain), ZEL_OK);
  }
  ~SimHeap() {
    for (const zel_SpinlockHandle made : locks) zel_SpinlockDestroy(made);
    zel_LockDomainDestroy(domain);
    zel_HeapDestroy(id);
  }
  SimHeap(const SimHeap &) = delete;
  SimHeap &operator=(const SimHeap &) = delete;

  uint64_t *get(uint32_t size) {
    return static_cast<uint64_t *>(zel_HeapAllocWithRA(id, size, nullptr));
  }
  void put(void *block) { zel_HeapFree(id, block); }

  zel_SpinlockHandle lock(const char *name, uint16_t rank) {
    zel_SpinlockProps props{};
    host::fillName(&props.name, name);
    props.heap = id;
    props.type = ZEL_SPINLOCK_RANKED;
    props.domain = domain;
    props.rank = rank;
    EXPECT_EQ(zel_SpinlockCreate(&props, &locks.emplace_back()), ZEL_OK);
    return locks.back();
  }

  zel_HeapID id = ZEL_NO_HEAP;
  zel_LockDomainID domain = ZEL_NO_LOCK_DOMAIN;
  std::vector<zel_SpinlockHandle> locks;
};
