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
void storeByte(void *memory, uint8_t value) {
  *static_cast<uint8_t *>(memory) = value;
}
void fill(void *memory, size_t size) {
  __builtin_memset(memory, 1, size);
}
void copy(void *to, const void *from, size_t size) {
  __builtin_memcpy(to, from, size);
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
