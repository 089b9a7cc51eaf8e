/* Asks for each target once. No lock. */
#include "cli/resolve.h"

#include "cli/table.h"

namespace cli {
namespace {

/* One instance at a time, so that any number of targets fits into the resolver's heap. */
Answer ask(Session &session, const Target &target) {
  zel_Status status = ZEL_OK;
  KARSTResolverInstance *const instance = session.create(target, &status);
  if (instance == nullptr) return session.refusedAnswer(target, status);
  Answer answer = session.answerOf(target, instance);
  session.destroy(instance);
  return answer;
}

}  // namespace

int resolve(Session &session, const Question &question, Format format, Output &output) {
  std::vector<Answer> answers;
  bool allResolved = true;
  for (const Target &target : question.all ? session.allTargets() : question.targets) {
    answers.push_back(ask(session, target));
    allResolved = allResolved && answers.back().locators.has_value();
  }
  if (format == Format::Text) {
    output.write(toTable(answers, session.names(), output.colour()));
  } else {
    for (const Answer &answer : answers) output.write(jsonLine(toJson(answer, session.names())));
  }
  return allResolved ? kResolved : kNotResolved;
}

}  // namespace cli
