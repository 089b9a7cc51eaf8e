/* Uses com.example.counter. What it requires and calls is the build's choice. */
#include "tests/modules/test_module.h"

#ifndef TEST_NAMESPACE
#define TEST_NAMESPACE "com.example.counter"
#endif
#ifndef TEST_VERSION
#define TEST_VERSION "1.2"
#endif
#ifndef TEST_CALLS
#define TEST_CALLS Counter_Next
#endif

int32_t TEST_CALLS(void);

TEST_SECTION(".karst.modinfo")
static const char info[] = "nsRequired=" TEST_NAMESPACE "#" TEST_VERSION;

TEST_SECTION(".karst.required")
static const char required[] = TEST_NAMESPACE "#" TEST_VERSION;

TEST_ENTRY int init_module(void) {
  testRecord("user init", TEST_CALLS());
  return 0;
}

TEST_ENTRY void cleanup_module(void) {}
