/* Provides com.example.counter: parameters, an export, a hidden variable. */
#include "tests/modules/test_module.h"

TEST_SECTION(".karst.modinfo")
static const char info[] = "nsProvides=com.example.counter#1.2";

TEST_SECTION(".karst.required")
static const char required[] = "com.example.host#7";

int32_t counterStart = 40;
int32_t counterFail = 0;
int64_t counterHidden = 0x1234; /* no dynamic symbol */

TEST_SECTION(".karst.params")
static const struct TestParameter parameters[] = {
    {"COUNTER_START", 1, &counterStart, {0, 0}},
    {"COUNTER_FAIL", 1, &counterFail, {0, 0}},
    {"COUNTER_NAME", 2, &counterHidden, {0, 0}},
};

TEST_SECTION(".karst.exports")
static const struct TestExport exports[] = {{"Counter_Next", 0}};

TEST_ENTRY int32_t Counter_Next(void) {
  return ++counterStart;
}

/* Visible to the dynamic linker, but not exported. */
TEST_ENTRY int32_t Counter_Internal(void) {
  return 0;
}

TEST_ENTRY int init_module(void) {
  testRecord("provider init", counterStart);
  testRecord("provider id", zel_ModuleCurrentID);
  return counterFail;
}

TEST_ENTRY void cleanup_module(void) {
  testRecord("provider cleanup", counterStart);
}
