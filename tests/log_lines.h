/* The host's log, as a test reads it. Read the texts only when nothing logs any more. */
#pragma once

#include <string>
#include <vector>

#include "host/kernel/log.h"

/* Keeps the log's lines while it lives, in place of standard error. */
struct LogLines {
  LogLines() {
    host::setLogSink([this](const host::LogLine &line) { texts.push_back(line.text); }, true);
  }
  ~LogLines() { host::setLogSink({}, false); }

  std::vector<std::string> texts;
};
