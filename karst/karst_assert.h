/* Code that must never run, registered where the module loader and its tools can list it. */
#ifndef KARST_KARST_ASSERT_H
#define KARST_KARST_ASSERT_H

#include <stdint.h>

#define KARST_ASSERT_NOT_IMPLEMENTED 1u

/* One row of the module's assertion table, the section .karst.asserts. */
struct KARSTAssertion {
  uint64_t kind;
  const char *source;
  uint64_t line;
};
static_assert(sizeof(KARSTAssertion) == 24, "layout of an assertion row");

/* The body of a function that is not supported: a row in the table, and a trap. */
#define KARST_NOT_IMPLEMENTED(sourceName)                                                      \
  do {                                                                                         \
    __attribute__((section(".karst.asserts"), used)) static const KARSTAssertion assertion = { \
        KARST_ASSERT_NOT_IMPLEMENTED, sourceName, __LINE__};                                   \
    __builtin_trap();                                                                          \
  } while (0)

#endif
