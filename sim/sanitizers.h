/* What the sanitizers must be told about fibers; nothing where they are off. No lock. */
#pragma once

#include <cstddef>

#if defined(__SANITIZE_ADDRESS__)
#define SIM_ADDRESS_SANITIZER 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define SIM_ADDRESS_SANITIZER 1
#endif
#endif

#if defined(__SANITIZE_THREAD__)
#define SIM_THREAD_SANITIZER 1
#elif defined(__has_feature)
#if __has_feature(thread_sanitizer)
#define SIM_THREAD_SANITIZER 1
#endif
#endif

#ifdef SIM_ADDRESS_SANITIZER
#include <sanitizer/asan_interface.h>
#include <sanitizer/common_interface_defs.h>
#include <sanitizer/lsan_interface.h>
#endif
#ifdef SIM_THREAD_SANITIZER
#include <sanitizer/tsan_interface.h>
#endif

namespace sim::sanitizers {

/* Instrumented frames are several times as large. */
#if defined(SIM_ADDRESS_SANITIZER) || defined(SIM_THREAD_SANITIZER)
inline constexpr size_t stackSize = size_t{1024} * 1024;
#else
inline constexpr size_t stackSize = size_t{256} * 1024;
#endif

/* Address sanitizer: around every switch. `fakeStack` is the place where the fiber that is left
 * keeps its own; null for one that will never run again. */
inline void beforeSwitch([[maybe_unused]] void **fakeStack, [[maybe_unused]] const void *bottom,
                         [[maybe_unused]] size_t size) {
#ifdef SIM_ADDRESS_SANITIZER
  __sanitizer_start_switch_fiber(fakeStack, bottom, size);
#endif
}
inline void afterSwitch([[maybe_unused]] void *fakeStack) {
#ifdef SIM_ADDRESS_SANITIZER
  __sanitizer_finish_switch_fiber(fakeStack, nullptr, nullptr);
#endif
}

/* A stack's memory: what lives only there is alive, and a new fiber finds nothing poisoned. */
inline void stackMade([[maybe_unused]] void *bottom, [[maybe_unused]] size_t size) {
#ifdef SIM_ADDRESS_SANITIZER
  __lsan_register_root_region(bottom, size);
#endif
}
inline void stackCleaned([[maybe_unused]] void *bottom, [[maybe_unused]] size_t size) {
#ifdef SIM_ADDRESS_SANITIZER
  __asan_unpoison_memory_region(bottom, size);
#endif
}
inline void stackGone([[maybe_unused]] void *bottom, [[maybe_unused]] size_t size) {
#ifdef SIM_ADDRESS_SANITIZER
  __asan_unpoison_memory_region(bottom, size);
  __lsan_unregister_root_region(bottom, size);
#endif
}

/* Thread sanitizer: a fiber counts as a thread, and a switch as a synchronisation. */
inline void *threadOfCaller() {
#ifdef SIM_THREAD_SANITIZER
  return __tsan_get_current_fiber();
#else
  return nullptr;
#endif
}
inline void *makeThread([[maybe_unused]] const char *name) {
#ifdef SIM_THREAD_SANITIZER
  void *fiber = __tsan_create_fiber(0);
  __tsan_set_fiber_name(fiber, name);
  return fiber;
#else
  return nullptr;
#endif
}
inline void switchThread([[maybe_unused]] void *fiber) {
#ifdef SIM_THREAD_SANITIZER
  __tsan_switch_to_fiber(fiber, 0);
#endif
}
inline void endThread([[maybe_unused]] void *fiber) {
#ifdef SIM_THREAD_SANITIZER
  __tsan_destroy_fiber(fiber);
#endif
}

}  // namespace sim::sanitizers
