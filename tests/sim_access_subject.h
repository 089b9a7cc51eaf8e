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
uint8_t loadByte(const void *memory);
void storeByte(void *memory, uint8_t value);
void fill(void *memory, size_t size);
void copy(void *to, const void *from, size_t size);

/* `order` as of the compiler's atomic functions. */
uint64_t atomicLoad(const uint64_t *word, int order);
void atomicStore(uint64_t *word, uint64_t value, int order);
uint64_t atomicAdd(uint64_t *word, uint64_t value, int order);
bool atomicExchangeIf(uint64_t *word, uint64_t expected, uint64_t value, int order);
void fence(int order);

/* Calls `use` with a word on its own stack. */
void withLocal(void (*use)(uint64_t *word));

void *allocate(zel_HeapID heap, uint32_t size);

/* Store through another function, so that its frame shows. */
void storeThrough(uint64_t *word, uint64_t value);

}  // namespace subject
