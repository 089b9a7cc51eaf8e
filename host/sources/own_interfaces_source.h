/* This machine's own interfaces as a source of the directory: read once, then again whenever the
 * system reports a change. Its lock guards what the source has said so far and the reading; never
 * held in a callback.
 */
#pragma once

#include <functional>
#include <memory>

#include "host/sources/netlink.h"
#include "host/sources/own_interfaces.h"
#include "host/sources/published_entries.h"
#include "host/sources/waiting.h"
#include "host/threads/sync.h"

namespace host {

/* The entries stay in the directory when the source goes: the answer given last stands. */
class OwnInterfacesSource {
 public:
  /* Throws std::runtime_error where the system does not tell. */
  OwnInterfacesSource(const OwnNode &node, Directory &directory);
  ~OwnInterfacesSource(); /* returns when no call runs any more; not from onChange */
  OwnInterfacesSource(const OwnInterfacesSource &) = delete;
  OwnInterfacesSource &operator=(const OwnInterfacesSource &) = delete;

  /* Reads the interfaces and tells the directory what is new against the time before. Throws
   * std::runtime_error, and then nothing has changed. Any thread; blocks on the system. */
  Difference load();

  /* From now on does so whenever an interface or an address changes, those changes included that
   * happened since the source was made, on a thread of its own; calls onChange there for each time
   * that something was new. Once only. */
  void watch(std::function<void(const Difference &)> onChange);

 private:
  void run();

  const OwnNode node_;
  Mutex mutex_;
  Netlink netlink_;            /* mutex_, but for the change messages: the watching thread's */
  PublishedEntries published_; /* mutex_ */
  StopSignal stop_;
  std::function<void(const Difference &)> onChange_; /* set before the thread starts */
  std::unique_ptr<Thread> thread_;                   /* last: it uses all the rest */
};

}  // namespace host
