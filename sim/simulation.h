/* A whole host kernel in the simulator: the machine, the directory and the module loader. One at a
 * time.
 *
 *   sim::Simulation sim({.seed = 7});
 *   host::Module &resolver = sim.load("karst_resolver.so");
 *   sim.directory().put(...);  sim.directory().setUsable(true);
 *   sim.run();
 *   auto *create = resolver.function<decltype(KARSTResolver_Create)>("KARSTResolver_Create");
 *   zel_Status status = sim.call("client", [&] { return create(...); });
 *   sim.call("client", [&] { destroy(...); });
 *   sim.unload(resolver);
 */
#pragma once

#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "host/directory/directory.h"
#include "host/kernel/module_loader.h"
#include "sim/machine.h"

namespace sim {

class Simulation : public Machine {
 public:
  explicit Simulation(const Settings &settings = {});
  ~Simulation() override; /* unloads what is loaded; what is left behind afterwards is fatal */

  static Simulation &current(); /* panics when there is none */

  /* The directory may be told and asked from anywhere. What it tells others runs on fibers named
   * karst-delivery..., when the machine runs. */
  host::Directory &directory() { return *directory_; }
  host::ModuleLoader &modules() { return *modules_; }

  /* Load and unload on a fiber "loader", run until done; throws host::ModuleError. */
  host::Module &load(const std::filesystem::path &path,
                     const std::vector<std::string> &parameters = {});
  void unload(host::Module &module);

  /* Also modules and subscriptions. */
  std::vector<std::string> alive() const override;

 private:
  std::unique_ptr<host::Directory> directory_;
  std::unique_ptr<host::ModuleLoader> modules_;
};

}  // namespace sim
