/* Any bytes as a run of a scenario in the simulator: what is done, which platform calls fail, and who
 * runs when. Whatever the module must hold and does not stops the process. One thread, no lock.
 *
 * The bytes in order: which scenario; how many operations; how many faults; six bytes an operation,
 * three a fault; then two for each deviation from the course in which everybody runs on for as long
 * as possible: how many choices later, and which choice.
 */
#include "tests/scenarios/scenarios.h"

#include <algorithm>
#include <array>
#include <span>

#include "host/kernel/log.h"
#include "tests/fuzz/target.h"

namespace {

constexpr size_t mostOperations = 64;
constexpr size_t mostFaults = 4;
constexpr uint8_t mostPhases = 8;

/* Zeros, once everything was read. */
class Input {
 public:
  Input(const uint8_t *data, size_t size) : rest_(data, size) {}
  bool empty() const { return rest_.empty(); }
  uint8_t next() {
    if (rest_.empty()) return 0;
    const uint8_t byte = rest_.front();
    rest_ = rest_.subspan(1);
    return byte;
  }

 private:
  std::span<const uint8_t> rest_;
};

/* Runs on, except where the input says otherwise. */
class Deviations final : public sim::Strategy {
 public:
  explicit Deviations(Input &input) : input_(input), left_(input.next()) {}

  sim::Fiber &next(std::span<sim::Fiber *const> runnable, sim::Fiber *current) override {
    if (!deviates()) return current ? *current : *runnable.front();
    return *runnable[input_.next() % runnable.size()];
  }
  size_t pick(size_t count) override { return deviates() ? input_.next() % count : 0; }

 private:
  bool deviates() {
    if (input_.empty()) return false;
    if (left_-- != 0) return false;
    left_ = input_.next();
    return true;
  }

  Input &input_;
  unsigned left_; /* choices before the next deviation */
};

const std::vector<sim::Call> &callsThatCanFail() {
  static const std::vector<sim::Call> calls = [] {
    std::vector<sim::Call> found;
    for (size_t i = 0; i < sim::callCount; i++) {
      if (sim::callTraits[i].fault != ZEL_OK) found.push_back(static_cast<sim::Call>(i));
    }
    return found;
  }();
  return calls;
}

sim::Plan readPlan(Input &input, size_t actors) {
  sim::Plan plan;
  const size_t operations = input.next() % (mostOperations + 1);
  const size_t faults = input.next() % (mostFaults + 1);
  for (size_t i = 0; i < operations; i++) {
    const auto phase = static_cast<uint8_t>(input.next() % mostPhases);
    const auto actor = static_cast<uint8_t>(input.next() % actors);
    plan.operations.push_back(
        {phase, actor, input.next(), input.next(), input.next(), input.next()});
  }
  std::stable_sort(plan.operations.begin(), plan.operations.end(),
                   [](const auto &a, const auto &b) { return a.phase < b.phase; });
  for (size_t i = 0; i < faults; i++) {
    const sim::Call call = callsThatCanFail()[input.next() % callsThatCanFail().size()];
    const uint32_t nth = 1u + input.next();
    plan.faults.push_back({call, nth, 1u + input.next() % 4u});
  }
  return plan;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  static const auto all = scenarios();
  host::setLogThreshold(host::LogThreshold::Off);
  Input input(data, size);
  const sim::Scenario &scenario = *all[input.next() % all.size()];
  const sim::Plan plan = readPlan(input, scenario.actors().size());
  Deviations strategy(input);
  sim::Run run;
  run.module = KARST_RESOLVER_SO;
  run.strategy = &strategy;
  FUZZ_REQUIRE(scenario.play(plan, run).operations <= plan.operations.size());
  return 0;
}
