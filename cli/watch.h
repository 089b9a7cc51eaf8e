/* karst watch */
#pragma once

#include "cli/output.h"
#include "cli/resolve.h"
#include "cli/session.h"
#include "host/sources/waiting.h"

namespace cli {

/* SIGINT and SIGTERM as something to wait for. Made before any other thread, which then inherits
 * that they are not for it. */
class EndSignals {
 public:
  EndSignals(); /* throws std::system_error */
  int descriptor() const { return signals_.get(); }

 private:
  host::Descriptor signals_;
};

/* Prints the answers, then a line for each callback, until a signal comes or the reader has gone;
 * then gives everything back and closes the session. kResolved after an orderly end. */
int watch(Session &session, const Question &question, Format format, Output &output,
          const EndSignals &signals);

}  // namespace cli
