/* inotify on a folder, boiled down to what happened to one file in it. No lock. */
#include "host/sources/file_watch.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <system_error>
#include <utility>

namespace host {
namespace {

void watchFolderOf(const std::string &path, int inotify) {
  auto folder = std::filesystem::path(path).parent_path();
  if (folder.empty()) folder = ".";
  const uint32_t events = IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE |
                          IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
  if (inotify_add_watch(inotify, folder.c_str(), events) < 0) {
    throw std::system_error(errno, std::generic_category(), "cannot watch " + folder.string());
  }
}

std::optional<FileWatch::Event> meaningOf(const inotify_event &event, const std::string &name) {
  if (event.mask & IN_Q_OVERFLOW) return FileWatch::Event::Written; /* perhaps: look */
  if (event.mask & (IN_DELETE_SELF | IN_MOVE_SELF)) return FileWatch::Event::FolderGone;
  if (event.len == 0 || name != event.name) return std::nullopt;
  return event.mask & (IN_CLOSE_WRITE | IN_MOVED_TO) ? FileWatch::Event::Written
                                                     : FileWatch::Event::Removed;
}

}  // namespace

FileWatch::FileWatch(const std::string &path)
    : name_(std::filesystem::path(path).filename()),
      inotify_(inotify_init1(IN_CLOEXEC | IN_NONBLOCK), "inotify_init1") {
  watchFolderOf(path, inotify_.get());
}

void FileWatch::start(std::function<void(Event)> onEvent) {
  onEvent_ = std::move(onEvent);
  thread_ = std::make_unique<Thread>("file watch", [this] { run(); });
}

FileWatch::~FileWatch() {
  stop_.give();
}

void FileWatch::run() {
  while (waitReadable(inotify_.get(), stop_)) readEvents();
}

/* Takes all events that are due, and tells the last one that matters: it is the state of things. */
void FileWatch::readEvents() {
  std::optional<Event> last;
  alignas(inotify_event) char buffer[16 * 1024];
  for (;;) {
    const ssize_t length = read(inotify_.get(), buffer, sizeof buffer);
    if (length < 0 && errno == EINTR) continue;
    if (length <= 0) break;
    for (ssize_t offset = 0; offset < length;) {
      const auto *event = reinterpret_cast<const inotify_event *>(buffer + offset);
      if (const auto meaning = meaningOf(*event, name_)) last = meaning;
      offset += static_cast<ssize_t>(sizeof *event + event->len);
    }
  }
  if (last) onEvent_(*last);
}

}  // namespace host
