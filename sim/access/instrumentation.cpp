/* What code compiled with -fsanitize=thread calls: the entry points that the thread sanitizer's own
 * library would have, and the memory functions of the module. Each is a point of the scheduler, then
 * a check, then the access. One OS thread, no lock.
 */
#include <cstring>

#include "sim/access/recorder.h"
#include "sim/machine.h"

using namespace sim::access;

namespace {

/* Where the instrumented code goes on: names the line that made the access. */
#define CODE __builtin_return_address(0)

void touch(const void *memory, size_t size, Kind kind, const void *code) {
  if (!watching) return;
  watching->point();
  watching->access(memory, size, kind, code);
}

/* One point for both: what is copied is what the checks have seen. */
void touchBoth(const void *to, const void *from, size_t size, const void *code) {
  if (!watching) return;
  watching->point();
  watching->access(from, size, Kind::Read, code);
  watching->access(to, size, Kind::Write, code);
}

template <typename Value>
Value atomicLoad(const volatile Value *memory, int order, const void *code) {
  if (watching) {
    watching->point();
    watching->atomicRead(const_cast<const Value *>(memory), sizeof *memory, order, code);
  }
  return __atomic_load_n(memory, __ATOMIC_SEQ_CST);
}

template <typename Value>
void atomicStore(volatile Value *memory, Value value, int order, const void *code) {
  if (watching) {
    watching->point();
    watching->atomicWrite(const_cast<const Value *>(memory), sizeof *memory, order, code);
  }
  __atomic_store_n(memory, value, __ATOMIC_SEQ_CST);
}

/* Before an operation that reads and writes in one. */
template <typename Value>
volatile Value *updating(volatile Value *memory, int order, const void *code) {
  if (watching) {
    watching->point();
    watching->atomicUpdate(const_cast<const Value *>(memory), sizeof *memory, order, code);
  }
  return memory;
}

/* One that fails is a read. */
template <typename Value>
bool compareExchange(volatile Value *memory, Value *expected, Value desired, int order,
                     int failureOrder, const void *code) {
  if (watching) {
    watching->point();
    const auto *place = const_cast<const Value *>(memory);
    if (*memory == *expected) {
      watching->atomicUpdate(place, sizeof *memory, order, code);
    } else {
      watching->atomicRead(place, sizeof *memory, failureOrder, code);
    }
  }
  return __atomic_compare_exchange_n(memory, expected, desired, false, __ATOMIC_SEQ_CST,
                                     __ATOMIC_SEQ_CST);
}

}  // namespace

extern "C" {

/* The names are the compiler's. NOLINTBEGIN(bugprone-reserved-identifier) */

/* ---- Functions ------------------------------------------------------------------------------- */

/* Called when the object is mapped, before anything in it runs. */
void __tsan_init() {
  if (sim::Machine *machine = sim::Machine::existing()) machine->watch().instrumented(CODE);
}

void __tsan_func_entry(void *returnTo) {
  if (watching) watching->enterFunction(returnTo);
}
void __tsan_func_exit() {
  if (watching) watching->leaveFunction();
}

/* ---- Plain accesses -------------------------------------------------------------------------- */

#define PLAIN(size)                                          \
  void __tsan_read##size(void *memory) {                     \
    touch(memory, size, Kind::Read, CODE);                   \
  }                                                          \
  void __tsan_write##size(void *memory) {                    \
    touch(memory, size, Kind::Write, CODE);                  \
  }                                                          \
  void __tsan_read_write##size(void *memory) {               \
    touch(memory, size, Kind::Write, CODE);                  \
  }                                                          \
  void __tsan_volatile_read##size(void *memory) {            \
    touch(memory, size, Kind::Read, CODE);                   \
  }                                                          \
  void __tsan_volatile_write##size(void *memory) {           \
    touch(memory, size, Kind::Write, CODE);                  \
  }                                                          \
  void __tsan_unaligned_read##size(void *memory) {           \
    touch(memory, size, Kind::Read, CODE);                   \
  }                                                          \
  void __tsan_unaligned_write##size(void *memory) {          \
    touch(memory, size, Kind::Write, CODE);                  \
  }                                                          \
  void __tsan_unaligned_read_write##size(void *memory) {     \
    touch(memory, size, Kind::Write, CODE);                  \
  }                                                          \
  void __tsan_unaligned_volatile_read##size(void *memory) {  \
    touch(memory, size, Kind::Read, CODE);                   \
  }                                                          \
  void __tsan_unaligned_volatile_write##size(void *memory) { \
    touch(memory, size, Kind::Write, CODE);                  \
  }
PLAIN(1)
PLAIN(2)
PLAIN(4)
PLAIN(8)
PLAIN(16)
#undef PLAIN

void __tsan_read_range(void *memory, unsigned long size) {
  touch(memory, size, Kind::Read, CODE);
}
void __tsan_write_range(void *memory, unsigned long size) {
  touch(memory, size, Kind::Write, CODE);
}
void __tsan_vptr_update(void **place, void *) {
  touch(place, sizeof *place, Kind::Write, CODE);
}
void __tsan_vptr_read(void **place) {
  touch(place, sizeof *place, Kind::Read, CODE);
}

/* ---- Memory functions ------------------------------------------------------------------------ */

#define MEMORY_FUNCTIONS(prefix)                                   \
  void *prefix##memcpy(void *to, const void *from, size_t size) {  \
    touchBoth(to, from, size, CODE);                               \
    return std::memcpy(to, from, size);                            \
  }                                                                \
  void *prefix##memmove(void *to, const void *from, size_t size) { \
    touchBoth(to, from, size, CODE);                               \
    return std::memmove(to, from, size);                           \
  }                                                                \
  void *prefix##memset(void *memory, int value, size_t size) {     \
    touch(memory, size, Kind::Write, CODE);                        \
    return std::memset(memory, value, size);                       \
  }                                                                \
  int prefix##memcmp(const void *a, const void *b, size_t size) {  \
    touch(a, size, Kind::Read, CODE);                              \
    touch(b, size, Kind::Read, CODE);                              \
    return std::memcmp(a, b, size);                                \
  }                                                                \
  int prefix##bcmp(const void *a, const void *b, size_t size) {    \
    touch(a, size, Kind::Read, CODE);                              \
    touch(b, size, Kind::Read, CODE);                              \
    return std::memcmp(a, b, size);                                \
  }
MEMORY_FUNCTIONS(__wrap_)
MEMORY_FUNCTIONS(__tsan_)
#undef MEMORY_FUNCTIONS

/* ---- Atomics --------------------------------------------------------------------------------- */

#define UPDATE(bits, name)                                                          \
  uint##bits##_t __tsan_atomic##bits##_##name(volatile uint##bits##_t *memory,      \
                                              uint##bits##_t value, int order) {    \
    return __atomic_##name(updating(memory, order, CODE), value, __ATOMIC_SEQ_CST); \
  }
#define ATOMIC(bits)                                                                               \
  uint##bits##_t __tsan_atomic##bits##_load(const volatile uint##bits##_t *memory, int order) {    \
    return atomicLoad(memory, order, CODE);                                                        \
  }                                                                                                \
  void __tsan_atomic##bits##_store(volatile uint##bits##_t *memory, uint##bits##_t value,          \
                                   int order) {                                                    \
    atomicStore(memory, value, order, CODE);                                                       \
  }                                                                                                \
  uint##bits##_t __tsan_atomic##bits##_exchange(volatile uint##bits##_t *memory,                   \
                                                uint##bits##_t value, int order) {                 \
    return __atomic_exchange_n(updating(memory, order, CODE), value, __ATOMIC_SEQ_CST);            \
  }                                                                                                \
  UPDATE(bits, fetch_add)                                                                          \
  UPDATE(bits, fetch_sub)                                                                          \
  UPDATE(bits, fetch_and)                                                                          \
  UPDATE(bits, fetch_or)                                                                           \
  UPDATE(bits, fetch_xor)                                                                          \
  UPDATE(bits, fetch_nand)                                                                         \
  int __tsan_atomic##bits##_compare_exchange_strong(                                               \
      volatile uint##bits##_t *memory, uint##bits##_t *expected, uint##bits##_t desired,           \
      int order, int failureOrder) {                                                               \
    return compareExchange(memory, expected, desired, order, failureOrder, CODE);                  \
  }                                                                                                \
  int __tsan_atomic##bits##_compare_exchange_weak(                                                 \
      volatile uint##bits##_t *memory, uint##bits##_t *expected, uint##bits##_t desired,           \
      int order, int failureOrder) {                                                               \
    return compareExchange(memory, expected, desired, order, failureOrder, CODE);                  \
  }                                                                                                \
  uint##bits##_t __tsan_atomic##bits##_compare_exchange_val(                                       \
      volatile uint##bits##_t *memory, uint##bits##_t expected, uint##bits##_t desired, int order, \
      int failureOrder) {                                                                          \
    compareExchange(memory, &expected, desired, order, failureOrder, CODE);                        \
    return expected;                                                                               \
  }
ATOMIC(8)
ATOMIC(16)
ATOMIC(32)
ATOMIC(64)
#undef ATOMIC
#undef UPDATE

void __tsan_atomic_thread_fence(int order) {
  if (!watching) return;
  watching->point();
  watching->fence(order);
}
void __tsan_atomic_signal_fence(int) {}

/* NOLINTEND(bugprone-reserved-identifier) */

}  // extern "C"
