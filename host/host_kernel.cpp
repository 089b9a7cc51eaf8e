/* Puts the host kernel's rooms together. currentKernel is the process's one kernel: an atomic, set
 * before modules can run and cleared after the last one has gone.
 */
#include "host/host_kernel.h"

#include <atomic>

#include "host/kernel/heap.h"
#include "host/kernel/log.h"
#include "host/kernel/panic.h"
#include "host/kernel/text.h"
#include "host/platform.h"

namespace host {
namespace {

std::atomic<Kernel *> currentKernel{nullptr};

std::string heapText(zel_HeapID id) {
  const HeapState heap = heapState(id);
  std::string text = formatText("heap %s: %zu blocks alive, %u of %u bytes used", heap.name.c_str(),
                                heap.blocks.size(), heap.used, heap.maximum);
  for (const HeapBlock &block : heap.blocks) {
    text += formatText("\n  %u bytes at %p, asked for by %s", block.size, block.address,
                       symbolize(block.returnAddress).c_str());
  }
  return text;
}

}  // namespace

struct Kernel::Impl {
  explicit Impl(const KernelSettings &wanted)
      : settings(wanted),
        directory(wanted.directory),
        modules(std::make_unique<ModuleLoader>(platformNamespaces(),
                                               [this] { directory.waitForCallbacks(); })) {}

  const KernelSettings settings;
  Directory directory;
  std::unique_ptr<ModuleLoader> modules; /* null once the last module has been unloaded for good */
};

Kernel::Kernel(const KernelSettings &settings) {
  linkPlatform();
  configureWorlds(settings.worlds);
  configureTracing(settings.tracing);
  impl_ = std::make_unique<Impl>(settings);
  Kernel *none = nullptr;
  if (!currentKernel.compare_exchange_strong(none, this)) {
    panic("this process has a host kernel already: the platform's functions can serve only one");
  }
}

Kernel::~Kernel() {
  impl_->modules.reset();
  /* A cancelled subscription's last call may still be under way to a module that is gone: that is
   * one of the things left behind. */
  const std::vector<std::string> left = alive();
  if (!left.empty()) {
    for (const std::string &line : left) logWarning("left behind: %s", line.c_str());
    panic("%zu things were left behind by modules; the log names them", left.size());
  }
  currentKernel = nullptr;
}

Kernel &Kernel::current() {
  Kernel *const kernel = currentKernel;
  if (kernel == nullptr) panic("a platform function was called without a host kernel");
  return *kernel;
}

const KernelSettings &Kernel::settings() const {
  return impl_->settings;
}
Directory &Kernel::directory() {
  return impl_->directory;
}
ModuleLoader &Kernel::modules() {
  return *impl_->modules;
}

void Kernel::settle() {
  /* Delivery wakes worlds and worlds subscribe: only a round in which neither did anything is the
   * end. */
  for (;;) {
    const uint64_t delivered = impl_->directory.activity();
    const uint64_t woken = worldsActivity();
    impl_->directory.waitUntilIdle();
    waitUntilWorldsIdle();
    if (impl_->directory.activity() == delivered && worldsActivity() == woken) return;
  }
}

std::vector<std::string> Kernel::alive() const {
  std::vector<std::string> lines = aliveWorldsAndLocks();
  if (impl_->modules) {
    for (const Module *module : impl_->modules->modules()) {
      lines.push_back("module " + module->name());
    }
  }
  for (const zel_HeapID heap : heapsAlive()) lines.push_back(heapText(heap));
  if (const size_t count = impl_->directory.subscriptions()) {
    lines.push_back(formatText("%zu subscriptions to the directory", count));
  }
  for (const std::string &log : logsOpen()) lines.push_back("log " + log);
  return lines;
}

}  // namespace host
