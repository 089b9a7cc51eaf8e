/* Cases, played and as text. No lock. */
#include "sim/explore/case.h"

#include <charconv>
#include <functional>
#include <stdexcept>

#include "host/kernel/text.h"

namespace sim {

Case makeCase(const Scenario &scenario, uint64_t seed, const StrategyName &strategy,
              size_t length) {
  return {.scenario = &scenario,
          .seed = seed,
          .strategySeed = seed,
          .strategy = strategy,
          .schedule = std::nullopt,
          .plan = scenario.plan(seed, length)};
}

Outcome play(const Case &played, const Playing &playing, ScheduleLog *log) {
  std::unique_ptr<Strategy> decides;
  if (played.schedule)
    decides = std::make_unique<Replay>(*played.schedule);
  else
    decides = played.strategy.make(played.strategySeed);
  std::unique_ptr<Strategy> recorder;
  if (log) {
    log->clear();
    recorder = std::make_unique<Recorder>(*decides, *log);
  }
  Run run{.seed = played.seed,
          .module = playing.module,
          .strategy = recorder ? recorder.get() : decides.get()};
  run.historyLength = playing.historyLength;
  return played.scenario->play(played.plan, run);
}

/* ---- Text ------------------------------------------------------------------------------------ */

namespace {

template <typename Item>
std::string join(const std::vector<Item> &items, std::string (*text)(const Item &)) {
  if (items.empty()) return "-";
  std::string joined;
  for (const Item &item : items) joined += (joined.empty() ? "" : ".") + text(item);
  return joined;
}

std::vector<std::string> split(const std::string &text, char separator) {
  std::vector<std::string> parts;
  for (size_t begin = 0;;) {
    const size_t end = text.find(separator, begin);
    parts.push_back(text.substr(begin, end - begin));
    if (end == std::string::npos) return parts;
    begin = end + 1;
  }
}

template <typename Item>
std::vector<Item> itemsFrom(const std::string &text, Item (*read)(const std::string &)) {
  std::vector<Item> items;
  if (text == "-") return items;
  for (const std::string &part : split(text, '.')) items.push_back(read(part));
  return items;
}

[[noreturn]] void refuse(const std::string &text, const char *what) {
  throw std::invalid_argument("\"" + text + "\" is no " + what);
}

uint32_t numberFrom(const std::string &text, int base = 10) {
  uint32_t number = 0;
  const char *const end = text.data() + text.size();
  const auto [stop, error] = std::from_chars(text.data(), end, number, base);
  if (text.empty() || error != std::errc() || stop != end) refuse(text, "number");
  return number;
}

std::string operationText(const Operation &operation) {
  return host::formatText("%02x%02x%02x%02x%02x%02x", operation.phase, operation.actor,
                          operation.kind, operation.a, operation.b, operation.c);
}

Operation operationFrom(const std::string &text) {
  if (text.size() != 12) refuse(text, "operation; write 12 hexadecimal digits");
  const auto byte = [&](size_t place) {
    return static_cast<uint8_t>(numberFrom(text.substr(2 * place, 2), 16));
  };
  return {byte(0), byte(1), byte(2), byte(3), byte(4), byte(5)};
}

std::string faultText(const PlannedFault &fault) {
  return host::formatText("%s:%u:%u", traits(fault.call).name, fault.nth, fault.count);
}

PlannedFault faultFrom(const std::string &text) {
  const std::vector<std::string> parts = split(text, ':');
  for (size_t call = 0; call < callCount && parts.size() == 3; ++call)
    if (callTraits[call].name == parts[0])
      return {static_cast<Call>(call), numberFrom(parts[1]), numberFrom(parts[2])};
  refuse(text, "fault; write CALL:USE:TIMES");
}

std::string deviationText(const Deviation &deviation) {
  return host::formatText("%u:%u", deviation.choice, deviation.answer);
}

Deviation deviationFrom(const std::string &text) {
  const std::vector<std::string> parts = split(text, ':');
  if (parts.size() != 2) refuse(text, "deviation; write CHOICE:ANSWER");
  return {numberFrom(parts[0]), numberFrom(parts[1])};
}

}  // namespace

std::string textOf(const std::vector<Operation> &operations) {
  return join(operations, &operationText);
}

std::string textOf(const std::vector<PlannedFault> &faults) {
  return join(faults, &faultText);
}

std::string textOf(const Schedule &schedule) {
  return join(schedule, &deviationText);
}

std::vector<Operation> operationsFrom(const std::string &text) {
  return itemsFrom(text, &operationFrom);
}

std::vector<PlannedFault> faultsFrom(const std::string &text) {
  return itemsFrom(text, &faultFrom);
}

Schedule scheduleFrom(const std::string &text) {
  return itemsFrom(text, &deviationFrom);
}

std::string replayOptions(const Case &played, size_t length) {
  std::string text =
      "--scenario " + played.scenario->name() + " --seed " + std::to_string(played.seed);
  if (!played.schedule) {
    text += " --strategy " + played.strategy.toString() + " --runs 1";
    return length == 0 ? text : text + " --length " + std::to_string(length);
  }
  text += " --operations " + textOf(played.plan.operations);
  if (!played.plan.faults.empty()) text += " --faults " + textOf(played.plan.faults);
  return text + " --schedule " + textOf(*played.schedule);
}

}  // namespace sim
