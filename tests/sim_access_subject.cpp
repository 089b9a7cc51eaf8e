/* Small instrumented code for the tests of the recorder. */
#include "tests/sim_access_subject.h"

namespace subject {

uint64_t shared[4];
uint64_t flag;

uint64_t load(const uint64_t *word) {
  return *word;
}
void store(uint64_t *word, uint64_t value) {
  *word = value;
}
uint8_t loadByte(const void *memory) {
  return *static_cast<const uint8_t *>(memory);
}
void storeByte(void *memory, uint8_t value) {
  *static_cast<uint8_t *>(memory) = value;
}
void fill(void *memory, size_t size) {
  __builtin_memset(memory, 1, size);
}
void copy(void *to, const void *from, size_t size) {
  __builtin_memcpy(to, from, size);
}

/* An order that is no constant would be taken for the strongest. */
#define WITH_ORDER(call)             \
  switch (order) {                   \
    case __ATOMIC_RELAXED:           \
      return call(__ATOMIC_RELAXED); \
    case __ATOMIC_ACQUIRE:           \
      return call(__ATOMIC_ACQUIRE); \
    case __ATOMIC_RELEASE:           \
      return call(__ATOMIC_RELEASE); \
    case __ATOMIC_ACQ_REL:           \
      return call(__ATOMIC_ACQ_REL); \
    default:                         \
      return call(__ATOMIC_SEQ_CST); \
  }

uint64_t atomicLoad(const uint64_t *word, int order) {
  switch (order) {
    case __ATOMIC_RELAXED:
      return __atomic_load_n(word, __ATOMIC_RELAXED);
    case __ATOMIC_ACQUIRE:
      return __atomic_load_n(word, __ATOMIC_ACQUIRE);
    default:
      return __atomic_load_n(word, __ATOMIC_SEQ_CST);
  }
}
void atomicStore(uint64_t *word, uint64_t value, int order) {
  switch (order) {
    case __ATOMIC_RELAXED:
      return __atomic_store_n(word, value, __ATOMIC_RELAXED);
    case __ATOMIC_RELEASE:
      return __atomic_store_n(word, value, __ATOMIC_RELEASE);
    default:
      return __atomic_store_n(word, value, __ATOMIC_SEQ_CST);
  }
}
uint64_t atomicAdd(uint64_t *word, uint64_t value, int order) {
#define ADD(as) __atomic_fetch_add(word, value, as)
  WITH_ORDER(ADD)
#undef ADD
}
bool atomicExchangeIf(uint64_t *word, uint64_t expected, uint64_t value, int order) {
#define EXCHANGE(as) \
  __atomic_compare_exchange_n(word, &expected, value, false, as, __ATOMIC_RELAXED)
  WITH_ORDER(EXCHANGE)
#undef EXCHANGE
}
void fence(int order) {
#define FENCE(as) __atomic_thread_fence(as)
  WITH_ORDER(FENCE)
#undef FENCE
}

void withLocal(void (*use)(uint64_t *word)) {
  uint64_t word = 0;
  use(&word);
}

void *allocate(zel_HeapID heap, uint32_t size) {
  void *block = zel_HeapAllocWithRA(heap, size, nullptr);
  __asm__ volatile("");
  return block;
}

__attribute__((noinline)) void storeThrough(uint64_t *word, uint64_t value) {
  store(word, value);
  __asm__ volatile("");
}

}  // namespace subject
