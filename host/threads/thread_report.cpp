/* Where another thread is. The thread writes its own report, in a signal handler, into the one
 * buffer here; the semaphore hands it over.
 */
#include "host/threads/thread_report.h"

#include <execinfo.h>
#include <semaphore.h>

#include <algorithm>
#include <csignal>
#include <ctime>

#include "host/kernel/module_loader.h"
#include "host/threads/spinlock.h"

namespace host {

namespace {

constexpr int kMostFrames = 48;
constexpr uint32_t kMostLocks = 16; /* nobody nests more */

/* The default action of this signal is to ignore it, so a thread that is interrupted late, when the
 * handler is gone, is not harmed. */
constexpr int kReportSignal = SIGURG;

struct ThreadReport {
  zel_Name held[kMostLocks];
  uint32_t heldCount;
  zel_Name waitingFor; /* empty: for none */
  void *frames[kMostFrames];
  int frameCount;
  sem_t written;
};
ThreadReport report;

/* Runs in the thread reported on. Names are copied here and now: the locks that a thread holds or
 * waits for exist, but once it has gone on they may not. */
void writeReport(int) {
  report.heldCount = 0;
  for (const Spinlock *lock = heldLocks.last; lock != nullptr; lock = lock->outer) {
    if (report.heldCount < kMostLocks) report.held[report.heldCount++] = lock->name;
  }
  report.waitingFor = heldLocks.waitingFor != nullptr ? heldLocks.waitingFor->name : zel_Name{};
  report.frameCount = backtrace(report.frames, kMostFrames);
  sem_post(&report.written);
}

bool waitForReport() {
  timespec deadline{};
  clock_gettime(CLOCK_REALTIME, &deadline);
  deadline.tv_sec += 1;
  return sem_timedwait(&report.written, &deadline) == 0;
}

}  // namespace

std::string reportOnThread(pthread_t thread) {
  void *unused[1];
  backtrace(unused, 1); /* loads the unwinder now: a handler must not */
  sem_init(&report.written, 0, 0);
  struct sigaction action {};
  action.sa_handler = writeReport;
  action.sa_flags = SA_RESTART;
  sigaction(kReportSignal, &action, nullptr);
  if (pthread_kill(thread, kReportSignal) != 0 || !waitForReport()) {
    return "  it does not answer: no backtrace";
  }
  std::string text;
  for (uint32_t i = 0; i < report.heldCount; ++i) {
    text += std::string("  holds spinlock \"") + report.held[i].text + "\"\n";
  }
  if (report.waitingFor.text[0] != '\0') {
    text += std::string("  waits for spinlock \"") + report.waitingFor.text + "\"\n";
  }
  for (int i = 0; i < report.frameCount; ++i) {
    text += "  at " + symbolize(report.frames[i]) + "\n";
  }
  return text;
}

}  // namespace host
