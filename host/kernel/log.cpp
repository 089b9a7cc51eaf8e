/* The log, through spdlog, and the modules' log handles. logsLock guards the open logs and sinkLock
 * the embedder's sink, which is called under it; neither is held while the other is taken.
 */
#include "host/kernel/log.h"

#include <pthread.h>
#include <spdlog/pattern_formatter.h>
#include <spdlog/sinks/stdout_color_sinks.h>
#include <spdlog/spdlog.h>

#include <algorithm>
#include <cstring>
#include <memory>
#include <mutex>

#include "host/kernel/panic.h"
#include "host/kernel/text.h"

/* A module's log. The platform calls it zel_Log and leaves it opaque. */
struct zel_Log {
  std::string name;
  zel_ModuleID moduleID;
  int32_t level;
};

namespace host {
namespace {

/* The name of the thread that writes the line: the kernel's worlds and threads all have one. */
class ThreadNameFlag : public spdlog::custom_flag_formatter {
 public:
  void format(const spdlog::details::log_msg &, const std::tm &,
              spdlog::memory_buf_t &destination) override {
    char name[16] = "?";
    pthread_getname_np(pthread_self(), name, sizeof name);
    destination.append(name, name + std::strlen(name));
  }
  std::unique_ptr<custom_flag_formatter> clone() const override {
    return std::make_unique<ThreadNameFlag>();
  }
};

std::shared_ptr<spdlog::logger> makeLogger() {
  auto sink = std::make_shared<spdlog::sinks::stderr_color_sink_mt>(spdlog::color_mode::automatic);
  auto logger = std::make_shared<spdlog::logger>("karst", std::move(sink));
  auto formatter = std::make_unique<spdlog::pattern_formatter>();
  formatter->add_flag<ThreadNameFlag>('*').set_pattern("%Y-%m-%d %H:%M:%S.%e %^%l%$ [%*] %v");
  logger->set_formatter(std::move(formatter));
  logger->flush_on(spdlog::level::info);
  return logger;
}

spdlog::logger &logger() {
  static const std::shared_ptr<spdlog::logger> instance = makeLogger();
  return *instance;
}

std::mutex sinkLock;
std::function<void(const LogLine &)> embedderSink;
bool embedderSinkOnly = false;

std::mutex logsLock;
std::vector<std::unique_ptr<zel_Log>> &logs() {
  static std::vector<std::unique_ptr<zel_Log>> open;
  return open;
}

void writeLine(uint32_t urgency, const zel_Log *log, std::string text) {
  if (text.ends_with('\n')) text.pop_back();
  bool sinkOnly = false;
  {
    const std::lock_guard guard(sinkLock);
    if (embedderSink) {
      embedderSink({urgency, text, log == nullptr ? std::string() : log->name});
      sinkOnly = embedderSinkOnly;
    }
  }
  if (sinkOnly) return;
  const bool warns = urgency >= ZEL_LOG_URGENCY_WARNING;
  logger().log(warns ? spdlog::level::warn : spdlog::level::info, text);
}

}  // namespace

void logInfo(const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  writeLine(ZEL_LOG_URGENCY_INFO, nullptr, vformatText(format, arguments));
  va_end(arguments);
}

void logWarning(const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  writeLine(ZEL_LOG_URGENCY_WARNING, nullptr, vformatText(format, arguments));
  va_end(arguments);
}

void setLogThreshold(LogThreshold threshold) {
  switch (threshold) {
    case LogThreshold::Info:
      return logger().set_level(spdlog::level::info);
    case LogThreshold::Warning:
      return logger().set_level(spdlog::level::warn);
    case LogThreshold::Off:
      return logger().set_level(spdlog::level::off);
  }
}

void setLogSink(std::function<void(const LogLine &)> sink, bool only) {
  const std::lock_guard guard(sinkLock);
  embedderSink = std::move(sink);
  embedderSinkOnly = only;
}

zel_Status logOpen(const char *name, zel_ModuleID moduleID, uint32_t level, zel_Log **log) {
  try {
    auto opened = std::make_unique<zel_Log>(zel_Log{name, moduleID, static_cast<int32_t>(level)});
    zel_Log *const handle = opened.get();
    const std::lock_guard guard(logsLock);
    logs().push_back(std::move(opened));
    *log = handle;
    return ZEL_OK;
  } catch (const std::bad_alloc &) {
    return ZEL_NO_MEMORY;
  }
}

void logClose(zel_Log **log) {
  const zel_Log *const closed = *log;
  size_t removed = 0;
  {
    const std::lock_guard guard(logsLock);
    removed = std::erase_if(logs(), [closed](const auto &open) { return open.get() == closed; });
  }
  if (removed == 0) panic("closing log %p, which is not open", static_cast<const void *>(closed));
  *log = nullptr;
}

void logVWrite(uint32_t urgency, zel_Log *log, const char *format, va_list arguments) {
  writeLine(urgency, log, vformatText(format, arguments));
}

const char *logName(zel_Log *log) {
  return log->name.c_str();
}

int32_t logLevel(zel_Log *log) {
  return log->level;
}

std::vector<std::string> logsOpen() {
  std::vector<std::string> names;
  const std::lock_guard guard(logsLock);
  for (const auto &log : logs()) names.push_back(log->name);
  return names;
}

}  // namespace host
