/* A heap, a lock domain and locks, as a module has them, without a module. */
#pragma once

#include <gtest/gtest.h>

#include <utility>
#include <vector>

#include "host/kernel/text.h"
#include "platform/zel.h"

struct TestHeap {
  explicit TestHeap(uint32_t maximum = 1 << 20) {
    zel_HeapProps props{};
    host::fillName(&props.name, "test");
    props.maximumSize = maximum;
    EXPECT_EQ(zel_HeapCreate(&props, &id), ZEL_OK);
  }
  ~TestHeap() { zel_HeapDestroy(id); }
  TestHeap(const TestHeap &) = delete;
  TestHeap &operator=(const TestHeap &) = delete;

  uint64_t *get(uint32_t size, void *asker = nullptr) const {
    return static_cast<uint64_t *>(zel_HeapAllocWithRA(id, size, asker));
  }
  void put(void *block) const { zel_HeapFree(id, block); }

  zel_HeapID id = ZEL_NO_HEAP;
};

struct TestLocks : TestHeap {
  TestLocks() {
    const zel_Name name = props("test", 0).name;
    EXPECT_EQ(zel_LockDomainCreate(1, id, &name, &domain), ZEL_OK);
  }
  ~TestLocks() { end(); }
  void end() {
    for (const zel_SpinlockHandle made : std::exchange(kept, {})) zel_SpinlockDestroy(made);
    if (domain != ZEL_NO_LOCK_DOMAIN) zel_LockDomainDestroy(domain);
    domain = ZEL_NO_LOCK_DOMAIN;
  }

  zel_SpinlockProps props(const char *name, uint16_t rank) const {
    zel_SpinlockProps props{};
    props.heap = id;
    host::fillName(&props.name, name);
    props.type = ZEL_SPINLOCK_RANKED;
    props.domain = domain;
    props.rank = rank;
    return props;
  }
  /* Who makes one destroys it; those that are kept end with the domain. */
  zel_SpinlockHandle make(const char *name, uint16_t rank) const {
    const zel_SpinlockProps wanted = props(name, rank);
    zel_SpinlockHandle made = ZEL_NO_SPINLOCK;
    EXPECT_EQ(zel_SpinlockCreate(&wanted, &made), ZEL_OK);
    return made;
  }
  zel_SpinlockHandle keep(const char *name, uint16_t rank) {
    return kept.emplace_back(make(name, rank));
  }

  zel_LockDomainID domain = ZEL_NO_LOCK_DOMAIN;
  std::vector<zel_SpinlockHandle> kept;
};
