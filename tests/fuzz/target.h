/* What every fuzz target has: its entry point, which takes any bytes, and the way to say that something
 * is wrong. One thread, no lock.
 */
#pragma once

#include <cstddef>
#include <cstdint>

#include "host/kernel/panic.h"

/* Plays one input. Returns 0; whatever must hold and does not ends the process. */
extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);

#define FUZZ_REQUIRE(condition)                                                               \
  do {                                                                                        \
    if (!(condition)) host::panic("%s:%d: %s does not hold", __FILE__, __LINE__, #condition); \
  } while (0)
