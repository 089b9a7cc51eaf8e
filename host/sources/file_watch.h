/* Tells when a file was written or replaced, by inotify on its folder: editors write a new file and
 * rename it over the old one, and a watch on the old file itself would end there. No lock: all
 * state belongs to the watching thread.
 */
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "host/sources/waiting.h"
#include "host/threads/sync.h"

namespace host {

class FileWatch {
 public:
  enum class Event {
    Written,    /* closed after writing, or renamed into place: what stands there is whole */
    Removed,    /* deleted or renamed away */
    FolderGone, /* nothing more will be noticed */
  };

  /* From now on nothing is missed. Throws std::system_error where the folder cannot be watched. A
   * symbolic link is watched as itself, not what it points to. */
  explicit FileWatch(const std::string &path);

  /* Calls onEvent, on a thread of its own, for whatever happens and has happened since the object
   * was made. Once only. */
  void start(std::function<void(Event)> onEvent);

  ~FileWatch(); /* returns when no call runs any more; not from onEvent */
  FileWatch(const FileWatch &) = delete;
  FileWatch &operator=(const FileWatch &) = delete;

 private:
  void run();
  void readEvents();

  const std::string name_;             /* of the file in its folder */
  std::function<void(Event)> onEvent_; /* set before the thread starts */
  Descriptor inotify_;
  StopSignal stop_;
  std::unique_ptr<Thread> thread_; /* last: it uses all the rest */
};

}  // namespace host
