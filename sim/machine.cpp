/* Driving the machine, failures on demand, and what stands around every platform call. One OS
 * thread, no lock.
 */
#include "sim/machine.h"

#include <algorithm>

#include "host/kernel/heap.h"
#include "host/kernel/log.h"
#include "host/kernel/panic.h"
#include "host/kernel/text.h"
#include "sim/access/recorder.h"
#include "sim/platform_call.h"

namespace sim {

namespace {

std::unique_ptr<Strategy> strategyOf(Switching switching, uint64_t seed) {
  if (switching == Switching::Random) return std::make_unique<RandomWalk>(seed);
  return std::make_unique<RunOn>();
}

}  // namespace

Machine::Machine(const Settings &settings)
    : settings_(settings),
      scheduler_(strategyOf(settings.switching, settings.seed)),
      history_(settings.historyLength) {
  existing_ = this;
  scheduler_.setStepLimit(settings.stepLimit);
  host::setPanicReport([this] {
    return host::formatText("seed %llu, step %llu%s",
                            static_cast<unsigned long long>(settings_.seed),
                            static_cast<unsigned long long>(scheduler_.steps()),
                            history_.keeps() ? "; the last calls:\n" : "") +
           timeline(History::reportLines());
  });
}

Machine::~Machine() {
  settleAndRequireNothingLeft();
  host::setPanicReport({});
  existing_ = nullptr;
}

void Machine::requireExisting() {
  if (!existing_) host::panic("no simulated machine is there");
}

access::Recorder &Machine::watch() {
  if (!recorder_) recorder_ = std::make_unique<access::Recorder>(scheduler_);
  return *recorder_;
}

/* ---- Running --------------------------------------------------------------------------------- */

Task Machine::spawn(const std::string &name, std::function<void()> body) {
  const auto end = [](bool *flag) {
    access::forget(flag);
    delete flag;
  };
  const std::shared_ptr<bool> ended(new bool(false), end);
  Fiber &fiber = scheduler_.spawn(name, std::move(body), [ended] {
    access::publish(ended.get());
    *ended = true;
  });
  access::passOn(fiber);
  return Task(ended);
}

void Machine::run() {
  scheduler_.drive({});
}

bool Machine::step(uint64_t steps) {
  return scheduler_.drive({.steps = steps}) != Scheduler::Stop::Quiet;
}

void Machine::finish(const Task &task) {
  if (scheduler_.drive({.until = task.ended_.get()}) == Scheduler::Stop::Quiet)
    scheduler_.reportDeadlock("what was called cannot end");
  access::observe(task.ended_.get());
}

void Machine::advance(std::chrono::nanoseconds duration) {
  scheduler_.drive({.time = scheduler_.now() + static_cast<uint64_t>(duration.count())});
}

void Machine::setSwitching(Switching switching) {
  scheduler_.setStrategy(strategyOf(switching, settings_.seed));
}

void Machine::setStrategy(std::unique_ptr<Strategy> strategy) {
  scheduler_.setStrategy(std::move(strategy));
}

std::vector<std::string> Machine::alive() const {
  std::vector<std::string> lines;
  for (const auto &fiber : scheduler_.fibers())
    if (fiber->id() > lastOwnFiber_ && !fiber->world)
      lines.push_back("fiber " + fiber->name() + ": " + fiber->describe());
  for (std::string &line : worlds_.alive()) lines.push_back(std::move(line));
  for (std::string &line : locks_.alive()) lines.push_back(std::move(line));
  for (const zel_HeapID heap : host::heapsAlive()) {
    const host::HeapState state = host::heapState(heap);
    lines.push_back(host::formatText("heap %s: %zu blocks, %u bytes", state.name.c_str(),
                                     state.blocks.size(), state.used));
  }
  for (const std::string &log : host::logsOpen()) lines.push_back("log " + log);
  return lines;
}

void Machine::keepFibers(bool keep) {
  lastOwnFiber_ = keep && !scheduler_.fibers().empty() ? scheduler_.fibers().back()->id() : 0;
}

void Machine::settleAndRequireNothingLeft() {
  releaseAll();
  run();
  const std::vector<std::string> left = Machine::alive();
  if (left.empty()) return;
  std::string text = "left behind at the end of the simulation:";
  for (const std::string &line : left) text += "\n  " + line;
  host::panic("%s", text.c_str());
}

void Machine::note(const char *what, const Argument &argument, std::optional<zel_Status> status) {
  if (!history_.keeps()) return;
  const Fiber &fiber = scheduler_.running();
  history_.note({.step = scheduler_.steps(),
                 .time = scheduler_.now(),
                 .fiber = fiber.id(),
                 .note = what,
                 .returned = status.has_value(),
                 .result = status.value_or(ZEL_OK),
                 .argument = argument,
                 .fiberName = &fiber.name()});
}

/* ---- Failures and preemption ----------------------------------------------------------------- */

void Machine::failAt(Call call, uint64_t nth, uint64_t count, std::optional<zel_Status> status) {
  if (traits(call).fault == ZEL_OK) host::panic("%s cannot fail", traits(call).name);
  if (nth == 0 || count == 0) host::panic("uses of %s are counted from 1", traits(call).name);
  Faults &faults = faults_[static_cast<size_t>(call)];
  const uint64_t first = faults.uses + nth;
  const uint64_t last = count == everyFurther ? everyFurther : first + count - 1;
  faults.ranges.push_back({first, last, status.value_or(traits(call).fault)});
}

void Machine::clearFaults() {
  for (Faults &faults : faults_) faults.ranges.clear();
}

bool Machine::answersPreemption() {
  if (forcedPreemptions_ > 0) {
    --forcedPreemptions_;
    return true;
  }
  return preemption_ == Preemption::Random && scheduler_.pick(2) == 1;
}

/* ---- Around every platform call -------------------------------------------------------------- */

PlatformCall::PlatformCall(Call call, const Argument &argument, const void *caller)
    : machine_(Machine::current()), fiber_(machine_.scheduler_.running()) {
  if (traits(call).where == Where::Unlocked) requireNoSpinlock(fiber_, "calls", traits(call).name);
  const bool nested = fiber_.callDepth++ > 0;
  if (!nested) fiber_.callSite = caller;
  if (!nested) machine_.scheduler_.point();

  Machine::Faults &faults = machine_.faults_[static_cast<size_t>(call)];
  const uint64_t use = ++faults.uses;
  for (const Machine::Faults::Range &range : faults.ranges) {
    if (use < range.first || use > range.last) continue;
    fault_ = range.status;
    ++machine_.faultsInjected_;
    break;
  }

  recorded_ = !nested || traits(call).fault != ZEL_OK;
  if (!recorded_) return;
  Scheduler &scheduler = machine_.scheduler_;
  scheduler.mix((static_cast<uint64_t>(call) << 32 | fiber_.id()) + argument.hash());
  machine_.history_.follows(fiber_, call);
  if (!machine_.history_.keeps()) return;
  number_ = machine_.history_.begin({.step = scheduler.steps(),
                                     .time = scheduler.now(),
                                     .fiber = fiber_.id(),
                                     .call = call,
                                     .argument = argument,
                                     .fiberName = &fiber_.name()});
}

PlatformCall::~PlatformCall() {
  --fiber_.callDepth;
  if (!recorded_) return;
  if (fault_ != ZEL_OK) result_ = fault_;
  machine_.scheduler_.mix(result_);
  if (machine_.history_.keeps()) machine_.history_.end(number_, result_, fault_ != ZEL_OK);
}

}  // namespace sim
