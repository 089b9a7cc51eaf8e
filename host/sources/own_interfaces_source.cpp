/* Reading this machine's interfaces again and again. The lock is never held in onChange. */
#include "host/sources/own_interfaces_source.h"

#include <exception>
#include <mutex>
#include <utility>

#include "host/kernel/log.h"

namespace host {

OwnInterfacesSource::OwnInterfacesSource(const OwnNode &node, Directory &directory)
    : node_(node), published_(directory) {}

OwnInterfacesSource::~OwnInterfacesSource() {
  stop_.give();
}

Difference OwnInterfacesSource::load() {
  /* Reading and telling are one step: of two readers the later one must be the last to tell. */
  const std::lock_guard lock(mutex_);
  return published_.replace(entriesOf(node_, netlink_.interfaces()));
}

void OwnInterfacesSource::watch(std::function<void(const Difference &)> onChange) {
  onChange_ = std::move(onChange);
  thread_ = std::make_unique<Thread>("interface watch", [this] { run(); });
}

void OwnInterfacesSource::run() {
  while (waitReadable(netlink_.changeDescriptor(), stop_)) {
    netlink_.takeChanges();
    try {
      const Difference news = load();
      if (!news.empty()) onChange_(news);
    } catch (const std::exception &error) {
      logWarning("this machine's interfaces: %s (the answer given before stays)", error.what());
    }
  }
}

}  // namespace host
