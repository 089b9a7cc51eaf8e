/* Memory that child processes share with their parent. What is kept in it takes care of itself:
 * atomics, or one writer at a time.
 */
#pragma once

#include <sys/mman.h>

#include <cerrno>
#include <system_error>
#include <type_traits>

namespace sim {

/* A T that starts as zeroes, for which that must be a valid state. Pages that nobody touches cost
 * nothing. */
template <typename T>
class Shared {
  static_assert(std::is_trivially_destructible_v<T>);

 public:
  Shared() {
    void *memory = mmap(nullptr, sizeof(T), PROT_READ | PROT_WRITE,
                        MAP_SHARED | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (memory == MAP_FAILED) throw std::system_error(errno, std::generic_category(), "mmap");
    object_ = static_cast<T *>(memory);
  }
  ~Shared() { munmap(object_, sizeof(T)); }
  Shared(const Shared &) = delete;
  Shared &operator=(const Shared &) = delete;

  T &operator*() const { return *object_; }
  T *operator->() const { return object_; }

 private:
  T *object_;
};

}  // namespace sim
