/* A module with one fault, TEST_FAULT says which; without a fault it loads. */
#include "tests/modules/test_module.h"

#define NO_MODINFO 1
#define NO_REQUIRED 2
#define UNENDED_STRING 3
#define BAD_NAMESPACE 4
#define HALF_RECORD 5
#define OUTSIDE_POINTER 6
#define CONSTANT_VARIABLE 7
#define UNDEFINED_EXPORT 8
#define NO_INIT 9
#define STAYS 10 /* linked with -z nodelete */

#if TEST_FAULT != NO_MODINFO
#if TEST_FAULT == UNENDED_STRING
TEST_SECTION(".karst.modinfo") static const char info[4] = "info";
#else
TEST_SECTION(".karst.modinfo") static const char info[] = "info";
#endif
#endif

#if TEST_FAULT != NO_REQUIRED
#if TEST_FAULT == BAD_NAMESPACE
TEST_SECTION(".karst.required") static const char required[] = "com.example.host";
#else
TEST_SECTION(".karst.required") static const char required[] = "com.example.host#7";
#endif
#endif

#if TEST_FAULT == CONSTANT_VARIABLE
static const int32_t variable = 1;
#else
static int32_t variable = 1;
#endif

#if TEST_FAULT == OUTSIDE_POINTER
#define PARAMETER_NAME ((const char *)0x7fffffffffff)
#else
#define PARAMETER_NAME "VARIABLE"
#endif

TEST_SECTION(".karst.params")
static const struct TestParameter parameters[] = {{PARAMETER_NAME, 1, (void *)&variable, {0, 0}}};

#if TEST_FAULT == HALF_RECORD
TEST_SECTION(".karst.params") static const uint64_t half[3] = {0, 0, 0};
#endif

#if TEST_FAULT == UNDEFINED_EXPORT
TEST_SECTION(".karst.exports") static const struct TestExport exports[] = {{"Missing_Export", 0}};
#endif

#if TEST_FAULT != NO_INIT
TEST_ENTRY int init_module(void) {
  return variable - 1;
}
#endif

TEST_ENTRY void cleanup_module(void) {}
