/* A cluster file as a source of the directory: taken in as a difference, and again whenever the
 * file changes. Its lock guards what the source has said so far; it is held while the directory is
 * told, never in a callback.
 */
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "host/sources/cluster_file.h"
#include "host/sources/file_watch.h"
#include "host/sources/published_entries.h"
#include "host/threads/sync.h"

namespace host {

/* What came of reading the file again. */
struct Reload {
  Difference difference; /* what the directory was told; empty when the file was refused */
  std::string refusal;   /* why the file was not taken in, one line; empty when it was */
};

/* The entries stay in the directory when the source goes: the answer given last stands. An entry
 * has one source: where two say different things of the same one, the directory holds what was said
 * last. */
class ClusterFileSource {
 public:
  ClusterFileSource(std::string path, Directory &directory);

  /* Reads the file and tells the directory what is new against the time before. Throws
   * ClusterFileError, and then nothing has changed. Any thread; blocks on the file. */
  void load();

  /* The same, with the refusal as a result. */
  Reload reload();

  /* From now on reads the file again whenever it was written or replaced, on a thread of its own,
   * and calls onReload there for each reload that changed something, or was refused for another
   * reason than the last one, or ended a time of refusals. What has happened to the file since
   * load() is found, and reported, before this returns. A file that is removed changes nothing and
   * is reported once, as a refusal. Each report also goes to the log. Once only. Throws
   * std::system_error where the file's folder cannot be watched. */
  void watch(std::function<void(const Reload &)> onReload);

  /* What was taken in last. "self" is a matter of the start: whoever made the source decides. */
  ClusterContent content() const;

 private:
  void onFileEvent(FileWatch::Event event);
  void report(const Reload &result);

  const std::string path_;
  mutable Mutex mutex_;
  PublishedEntries published_; /* mutex_ */
  ClusterContent content_;     /* mutex_ */

  std::function<void(const Reload &)> onReload_; /* set before the watch starts */
  std::string lastRefusal_; /* watch(), then its thread: of the last report, if it was one */
  std::unique_ptr<FileWatch> watch_; /* last: its thread uses all the rest */
};

}  // namespace host
