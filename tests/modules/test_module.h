/* What the modules of the loader's tests have in common: their sections and what they tell the test
 * program. Plain C.
 */
#ifndef TESTS_MODULES_TEST_MODULE_H
#define TESTS_MODULES_TEST_MODULE_H

#include <stdint.h>

#include "platform/zel.h"

#define TEST_SECTION(name) __attribute__((section(name), used))
#define TEST_ENTRY __attribute__((visibility("default")))

/* The test program's: remembers what happened, in order. */
void testRecord(const char *event, int64_t value);

struct TestParameter {
  const char *name;
  uint64_t type;
  void *variable;
  uint64_t reserved[2];
};

struct TestExport {
  const char *name;
  uint64_t reserved;
};

#endif
