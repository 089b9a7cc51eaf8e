/* Reading a cluster file again and again: what it says now against what it said before. The lock is
 * never held in onReload.
 */
#include "host/sources/cluster_file_source.h"

#include <filesystem>
#include <mutex>
#include <system_error>
#include <utility>

#include "host/kernel/log.h"

namespace host {

ClusterFileSource::ClusterFileSource(std::string path, Directory &directory)
    : path_(std::move(path)), published_(directory) {}

void ClusterFileSource::load() {
  const Reload result = reload();
  if (!result.refusal.empty()) throw ClusterFileError(result.refusal);
}

Reload ClusterFileSource::reload() {
  /* Reading and telling are one step: of two readers the later one must be the last to tell. */
  const std::lock_guard lock(mutex_);
  Reload result;
  try {
    ClusterContent now = parseClusterFile(path_);
    result.difference = published_.replace(now.entries);
    content_ = std::move(now);
  } catch (const ClusterFileError &error) {
    result.refusal = error.what();
  }
  return result;
}

ClusterContent ClusterFileSource::content() const {
  const std::lock_guard lock(mutex_);
  return content_;
}

void ClusterFileSource::watch(std::function<void(const Reload &)> onReload) {
  onReload_ = std::move(onReload);
  watch_ = std::make_unique<FileWatch>(path_);
  onFileEvent(FileWatch::Event::Written); /* perhaps, between load() and now */
  watch_->start([this](FileWatch::Event event) { onFileEvent(event); });
}

void ClusterFileSource::onFileEvent(FileWatch::Event event) {
  if (event == FileWatch::Event::FolderGone) {
    report({{}, path_ + ": its folder is gone, and changes are no longer noticed; start again"});
    return;
  }
  std::error_code unused;
  if (std::filesystem::exists(path_, unused)) {
    /* After Removed there may be a new file already; its own Written comes when it is whole. */
    if (event == FileWatch::Event::Written) report(reload());
  } else {
    report({{}, path_ + ": the file is gone; it is read when it is back"});
  }
}

void ClusterFileSource::report(const Reload &result) {
  const std::string before = std::exchange(lastRefusal_, result.refusal);
  if (result.refusal == before && result.difference.empty()) return;
  if (!result.refusal.empty()) {
    logWarning("%s (the answer given before stays)", result.refusal.c_str());
  } else {
    logInfo("%s: taken in, %zu entries changed, %zu removed", path_.c_str(),
            result.difference.changed.size(), result.difference.removed.size());
  }
  onReload_(result);
}

}  // namespace host
