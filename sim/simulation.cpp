/* The host kernel on the simulated machine. Whatever makes or ends host objects that have threads
 * does so on a fiber, since it may have to wait for them.
 */
#include "sim/simulation.h"

#include "host/kernel/panic.h"

namespace sim {

namespace {

Simulation *onlySimulation = nullptr;

}  // namespace

Simulation::Simulation(const Settings &settings) : Machine(settings) {
  onlySimulation = this;
  host::configureTracing(settings.tracing);
  call("host", [&] {
    directory_ = std::make_unique<host::Directory>(host::DirectorySettings{
        .deliveryThreads = settings.deliveryThreads, .queueBound = settings.queueBound});
    modules_ = std::make_unique<host::ModuleLoader>(host::platformNamespaces(),
                                                    [this] { directory_->waitForCallbacks(); });
  });
  keepFibers(true);
}

Simulation::~Simulation() {
  releaseAll();
  call("host", [&] {
    modules_.reset();
    directory_.reset();
  });
  keepFibers(false);
  settleAndRequireNothingLeft();
  onlySimulation = nullptr;
}

Simulation &Simulation::current() {
  if (!onlySimulation) host::panic("no simulation is there");
  return *onlySimulation;
}

host::Module &Simulation::load(const std::filesystem::path &path,
                               const std::vector<std::string> &parameters) {
  host::Module *module = nullptr;
  call("loader", [&] { module = &modules_->load(path, parameters); });
  return *module;
}

void Simulation::unload(host::Module &module) {
  call("loader", [&] { modules_->unload(module); });
}

std::vector<std::string> Simulation::alive() const {
  std::vector<std::string> lines = Machine::alive();
  for (const host::Module *module : modules_->modules())
    lines.push_back("module " + module->name());
  if (directory_->subscriptions() > 0)
    lines.push_back("subscriptions: " + std::to_string(directory_->subscriptions()));
  return lines;
}

}  // namespace sim
