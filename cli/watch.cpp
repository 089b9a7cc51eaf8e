/* Follows targets through instances with callbacks. One thread, this one, makes instances, reads
 * them and prints; callbacks and sources only leave notes for it.
 */
#include "cli/watch.h"

#include <poll.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <ctime>
#include <memory>
#include <system_error>

#include "cli/notes.h"
#include "cli/table.h"

namespace cli {

struct Watched {
  Target target;
  Notes *notes;
  KARSTResolverInstance *instance = nullptr; /* none while it cannot be made */
  std::optional<zel_UUID> boundNode = {};    /* that the instance stays with */
  std::string lastDetail = {};               /* of the line printed last */
  bool shownUnresolved = false;              /* likewise: what the line said */
};

namespace {

void noteCall(void *data, KARSTResolverInstance *, uint32_t) {
  auto *const watched = static_cast<Watched *>(data);
  watched->notes->addCall(watched);
}

sigset_t endSignals() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGTERM);
  return set;
}

int openSignals() {
  const sigset_t set = endSignals();
  if (pthread_sigmask(SIG_BLOCK, &set, nullptr) != 0) return -1;
  return ::signalfd(-1, &set, SFD_CLOEXEC);
}

/* Local time: "12:04:31.007", or "2026-01-31T12:04:31.007+0100". */
std::string timeText(Moment time, Format format) {
  const auto sinceEpoch = std::chrono::floor<std::chrono::milliseconds>(time.time_since_epoch());
  const std::time_t seconds = std::chrono::floor<std::chrono::seconds>(sinceEpoch).count();
  const long milliseconds = static_cast<long>(sinceEpoch.count() % 1000);
  std::tm local{};
  localtime_r(&seconds, &local);
  char day[16];
  char clock[16];
  char zone[8];
  std::strftime(day, sizeof day, "%Y-%m-%dT", &local);
  std::strftime(clock, sizeof clock, "%H:%M:%S", &local);
  std::strftime(zone, sizeof zone, "%z", &local);
  char fraction[8];
  std::snprintf(fraction, sizeof fraction, ".%03ld", milliseconds);
  if (format == Format::Text) return std::string(clock) + fraction;
  return std::string(day) + clock + fraction + zone;
}

class Watch {
 public:
  Watch(Session &session, const Question &question, Format format, Output &output)
      : session_(session),
        all_(question.all),
        format_(format),
        output_(output),
        colour_(output.colour()) {
    for (const Target &target : all_ ? session.allTargets() : question.targets) add(target);
  }
  ~Watch() {
    session_.stopSources(); /* before the notes that they leave go */
    for (const auto &watched : watched_) release(*watched);
  }
  Watch(const Watch &) = delete;
  Watch &operator=(const Watch &) = delete;

  void printStart();
  void follow() {
    session_.follow([this] { notes_.addChange(); });
  }
  void runUntil(int endDescriptor);

 private:
  Watched &add(const Target &target);
  std::optional<Answer> tryCreate(Watched &watched);
  void release(Watched &watched);
  void printCalls();
  void afterChange();
  void retry(Watched &watched);
  void show(Watched &watched, const Answer &answer);
  void printLine(const char *event, Watched &watched, const Answer &answer, Moment time);
  std::string labelOf(const Target &target) const;

  Session &session_;
  const bool all_;
  const Format format_;
  Output &output_;
  const bool colour_;
  Notes notes_;
  std::vector<std::unique_ptr<Watched>> watched_;
};

Watched &Watch::add(const Target &target) {
  watched_.push_back(std::make_unique<Watched>(Watched{.target = target, .notes = &notes_}));
  return *watched_.back();
}

/* Makes the instance; its callback notes the first answer at once. Otherwise the answer is why. */
std::optional<Answer> Watch::tryCreate(Watched &watched) {
  zel_Status status = ZEL_OK;
  watched.instance = session_.create(watched.target, &status);
  if (watched.instance == nullptr) return session_.refusedAnswer(watched.target, status);
  const Answer first = session_.answerOf(watched.target, watched.instance);
  if (first.locators) watched.boundNode = first.locators->nodeUUID;
  session_.setCallback(watched.instance, noteCall, &watched);
  return {};
}

/* No callback begins once the instance is destroyed, so that no note of it comes later. */
void Watch::release(Watched &watched) {
  if (watched.instance == nullptr) return;
  session_.destroy(watched.instance);
  watched.instance = nullptr;
  watched.boundNode.reset();
  notes_.forgetCalls(&watched);
}

/* Remembers what is printed of the target. An object's instance that is unresolved may be so for
 * good, since it does not follow its object to another node: that calls for a new one. */
void Watch::show(Watched &watched, const Answer &answer) {
  watched.lastDetail = detailText(answer, session_.names());
  watched.shownUnresolved = !answer.locators;
  if (watched.instance != nullptr && watched.target.isObject && watched.shownUnresolved) {
    notes_.addChange();
  }
}

void Watch::printStart() {
  std::vector<Answer> answers;
  for (const auto &watched : watched_) {
    auto refused = tryCreate(*watched);
    /* The first call is told by the table; a later one has its own line. */
    notes_.forgetCalls(watched.get());
    answers.push_back(
        refused ? *refused
                : session_.answerOf(watched->target, watched->instance, watched->boundNode));
    show(*watched, answers.back());
  }
  if (format_ == Format::Text) {
    output_.write(toTable(answers, session_.names(), colour_) + "\n");
    return;
  }
  const std::string now = timeText(std::chrono::system_clock::now(), format_);
  for (const Answer &answer : answers) {
    nlohmann::ordered_json line{{"event", "start"}, {"time", now}};
    line.update(toJson(answer, session_.names()));
    output_.write(jsonLine(line));
  }
}

/* By name, or by UUID where the name is missing or another target has it too. */
std::string Watch::labelOf(const Target &target) const {
  const std::string name = nameOf(session_.names(), target.uuid);
  const auto sameName = [&](const auto &other) {
    return kindOf(other->target) == kindOf(target) && other->target.uuid != target.uuid &&
           nameOf(session_.names(), other->target.uuid) == name;
  };
  const bool unclear = name.empty() || std::any_of(watched_.begin(), watched_.end(), sameName);
  return kindOf(target) + " " + (unclear ? host::toString(target.uuid) : printable(name));
}

void Watch::printLine(const char *event, Watched &watched, const Answer &answer, Moment time) {
  const std::string detail = detailText(answer, session_.names());
  const bool unchanged = detail == watched.lastDetail;
  show(watched, answer);
  const std::string timeOfLine = timeText(time, format_);
  if (format_ == Format::Text) {
    output_.write(timeOfLine + "  " + labelOf(watched.target) + "  " +
                  stateText(answer.locators.has_value(), colour_) + "  " + detail +
                  (unchanged ? "  (as before)\n" : "\n"));
    return;
  }
  nlohmann::ordered_json line{{"event", event}, {"time", timeOfLine}};
  line.update(toJson(answer, session_.names()));
  output_.write(jsonLine(line));
}

/* A line says what the instance answers when the line is printed: of two calls in quick succession
 * both may tell the second one's answer, and the last line is always the present one. */
void Watch::printCalls() {
  while (const auto note = notes_.takeCall()) {
    Watched &watched = *note->watched;
    const Answer answer = session_.answerOf(watched.target, watched.instance, watched.boundNode);
    printLine("callback", watched, answer, note->time);
  }
}

/* An object's instance that is unresolved, and was shown to be, is given up for a new one if that
 * can be had now. One of a node becomes resolved by itself. */
void Watch::retry(Watched &watched) {
  if (watched.instance != nullptr) {
    if (!watched.target.isObject || !watched.shownUnresolved) return;
    if (session_.answerOf(watched.target, watched.instance).locators) return;
    release(watched);
  }
  auto refused = tryCreate(watched);
  if (refused && refused->reason == Session::kUnexplained) { /* the reason has gone meanwhile */
    session_.settle();
    refused = tryCreate(watched);
  }
  if (refused && detailText(*refused, session_.names()) != watched.lastDetail) {
    printLine("retry", watched, *refused, std::chrono::system_clock::now());
  }
}

void Watch::afterChange() {
  session_.settle();
  session_.readNames();
  printCalls(); /* what has happened to the instances there are, before new ones take over */
  if (all_) {
    for (const Target &target : session_.allTargets()) {
      const bool known = std::any_of(watched_.begin(), watched_.end(), [&](const auto &watched) {
        return watched->target == target;
      });
      if (!known) add(target);
    }
  }
  for (const auto &watched : watched_) retry(*watched);
}

void Watch::runUntil(int endDescriptor) {
  /* Of standard output only the error is waited for, which is always reported: the reader has gone.
   */
  pollfd waits[] = {
      {endDescriptor, POLLIN, 0}, {STDOUT_FILENO, 0, 0}, {notes_.descriptor(), POLLIN, 0}};
  while (!output_.readerGone()) {
    if (::poll(waits, std::size(waits), -1) < 0) {
      if (errno == EINTR) continue;
      throw std::system_error(errno, std::generic_category(), "poll");
    }
    if (waits[0].revents != 0 || (waits[1].revents & POLLERR) != 0) return;
    notes_.seen();
    printCalls();
    if (notes_.takeChange()) afterChange();
  }
}

}  // namespace

EndSignals::EndSignals() : signals_(openSignals(), "signalfd") {}

int watch(Session &session, const Question &question, Format format, Output &output,
          const EndSignals &signals) {
  {
    Watch watching(session, question, format, output);
    watching.printStart();
    watching.follow();
    watching.runUntil(signals.descriptor());
  }
  const std::vector<std::string> left = session.close();
  if (!left.empty()) {
    std::string text = "the resolver left behind:";
    for (const std::string &line : left) text += "\n  " + line;
    throw std::runtime_error(text);
  }
  if (format == Format::Text) {
    output.write("\nstopped: instances destroyed, module unloaded, nothing left behind\n");
  } else {
    output.write(jsonLine({{"event", "end"}}));
  }
  return kResolved;
}

}  // namespace cli
