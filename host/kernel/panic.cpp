/* The end of the world: message, report, backtrace, abort. Written straight to standard error: the
 * log may be what failed. panicReportLock guards the report's function.
 */
#include "host/kernel/panic.h"

#include <execinfo.h>

#include <array>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <mutex>

#include "host/kernel/module_loader.h"
#include "host/kernel/symbols.h"
#include "host/kernel/text.h"

namespace host {
namespace {

constexpr int kMostFrames = 64;

std::mutex panicReportLock;
std::function<std::string()> panicReport;

std::string currentReport() {
  std::function<std::string()> report;
  {
    const std::lock_guard guard(panicReportLock);
    report = panicReport;
  }
  return report ? report() : std::string();
}

void printBacktrace() {
  std::array<void *, kMostFrames> frames{};
  const int count = backtrace(frames.data(), kMostFrames);
  std::fputs("backtrace:\n", stderr);
  for (int i = 0; i < count; i++) {
    /* A return address may lie behind its function's last instruction, where the call was one that
     * never returns: one byte before it is inside the call. */
    const char *const call = static_cast<const char *>(frames[static_cast<size_t>(i)]) - 1;
    std::fprintf(stderr, "  #%-2d %s\n", i, symbolize(call).c_str());
  }
}

[[noreturn]] void stop(const std::string &message) {
  std::fprintf(stderr, "panic: %s\n", message.c_str());
  /* The report or the symbols may panic in their turn, and other threads may follow the first into
   * the ruin: only the first tells the whole story. */
  static std::atomic<bool> stopping{false};
  if (!stopping.exchange(true)) {
    const std::string report = currentReport();
    if (!report.empty()) std::fprintf(stderr, "%s\n", report.c_str());
    printBacktrace();
  }
  std::fflush(stderr);
  std::abort();
}

}  // namespace

void panic(const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  const std::string message = vformatText(format, arguments);
  va_end(arguments);
  stop(message);
}

void panicInModule(zel_ModuleID moduleID, const char *format, va_list arguments) {
  stop(mappedModuleName(moduleID) + ": " + vformatText(format, arguments));
}

void setPanicReport(std::function<std::string()> report) {
  const std::lock_guard guard(panicReportLock);
  panicReport = std::move(report);
}

}  // namespace host
