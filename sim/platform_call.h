/* What every platform function does before its own work: let another fiber go on, check the rules,
 * count, fail if asked to, and write the history.
 */
#pragma once

#include "sim/machine.h"

namespace sim {

/* One call, from its first line to its return. A call from inside another one (a module's allocator
 * that the directory calls, a host room that asks for the time) is no point of switching: the
 * host's own short sections stay whole. It can still be made to fail. */
class PlatformCall {
 public:
  /* `caller`: where the platform function that makes this was called from. */
  explicit PlatformCall(Call call, const Argument &argument = {},
                        const void *caller = __builtin_return_address(0));
  ~PlatformCall();
  PlatformCall(const PlatformCall &) = delete;
  PlatformCall &operator=(const PlatformCall &) = delete;

  /* The failure that was asked for; ZEL_OK when none was. */
  zel_Status fault() const { return fault_; }

  /* Notes the result, as a number, and gives it back. */
  template <typename Result>
  Result returns(Result result) {
    result_ = static_cast<uint64_t>(result);
    return result;
  }

  Machine &machine() { return machine_; }
  Fiber &fiber() { return fiber_; }

 private:
  Machine &machine_;
  Fiber &fiber_;
  bool recorded_ = true;
  zel_Status fault_ = ZEL_OK;
  uint64_t number_ = 0; /* in the history */
  uint64_t result_ = 0;
};

}  // namespace sim
