/* Small instrumented code for the tests of the recorder. */
#pragma once

#include <cstddef>
#include <cstdint>

#include "platform/zel.h"

namespace subject {

extern uint64_t shared[4]; /* what the fibers of a test fight for, */
extern uint64_t flag;      /* and what they synchronise by */

uint64_t load(const uint64_t *word);
void store(uint64_t *word, uint64_t value);
void storeByte(void *memory, uint8_t value);
void fill(void *memory, size_t size);
void copy(void *to, const void *from, size_t size);

void *allocate(zel_HeapID heap, uint32_t size);

/* Store through another function, so that its frame shows. */
void storeThrough(uint64_t *word, uint64_t value);

}  // namespace subject

/* What the compiler has instrumented code call for an atomic operation; `order` as of its built-in
 * functions. NOLINTBEGIN(bugprone-reserved-identifier) */
extern "C" {
uint64_t __tsan_atomic64_load(const volatile uint64_t *word, int order);
void __tsan_atomic64_store(volatile uint64_t *word, uint64_t value, int order);
uint64_t __tsan_atomic64_fetch_add(volatile uint64_t *word, uint64_t value, int order);
int __tsan_atomic64_compare_exchange_strong(volatile uint64_t *word, uint64_t *expected,
                                            uint64_t value, int order, int failureOrder);
void __tsan_atomic_thread_fence(int order);
}
/* NOLINTEND(bugprone-reserved-identifier) */
