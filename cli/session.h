/* A host kernel with the resolver loaded and the directory fed: what every question is asked in. No
 * lock: one thread uses a session; only the sources call back on threads of their own.
 */
#pragma once

#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "cli/answer.h"
#include "cli/targets.h"
#include "host/host_kernel.h"
#include "host/sources/cluster_file_source.h"
#include "host/sources/own_interfaces_source.h"
#include "karst_resolver/karst_resolver.h"

namespace cli {

struct SessionOptions {
  std::string directoryFile; /* may be empty with ownInterfaces */
  std::optional<zel_UUID> self;
  bool ownInterfaces = false;
  bool useLocalLocator = false;
  bool witness = false;
  std::filesystem::path module;
  std::vector<std::string> parameters; /* NAME=VALUE */
};

class Session {
 public:
  /* Loads the module, feeds the directory and returns when the resolver has taken it in. Throws
   * host::ModuleError, host::ClusterFileError, std::runtime_error: each says what to do. */
  explicit Session(const SessionOptions &options);
  ~Session(); /* close(), if that was not done */
  Session(const Session &) = delete;
  Session &operator=(const Session &) = delete;

  /* From now on follows the sources' changes; `onChange` is called after each one that the
   * directory was told, on a source's thread. Once only. */
  void follow(const std::function<void()> &onChange);

  /* Stops the sources; no onChange runs any more when this returns. The directory stays as it is.
   */
  void stopSources();

  /* Returns when the resolver has done everything that the directory has told it so far. */
  void settle() { kernel_.settle(); }

  std::vector<Target> allTargets() { return cli::allTargets(kernel_.directory()); }

  /* What people call things, as the sources have it now; stays until it is asked for again. */
  const Names &readNames();
  const Names &names() const { return names_; }

  /* A resolver instance; the caller destroys it before the session ends. Null: `status` says why.
   */
  KARSTResolverInstance *create(const Target &target, zel_Status *status);
  void setCallback(KARSTResolverInstance *instance, KARSTResolverCallback callback, void *data);
  void destroy(KARSTResolverInstance *instance);

  /* What the instance says now. `boundNode`: the node that it stays with, if that is known. */
  Answer answerOf(const Target &target, KARSTResolverInstance *instance,
                  const std::optional<zel_UUID> &boundNode = {});

  /* What is said when the directory, as it is by the time it is asked, gives no reason. */
  static constexpr const char *kUnexplained = "nothing in the directory explains it";

  /* The answer to a target for which no instance could be made. */
  Answer refusedAnswer(const Target &target, zel_Status status);

  /* Stops the sources, unloads the module. What is left of it, a line each. */
  std::vector<std::string> close();

 private:
  void feed(const SessionOptions &options);
  void feedOwnInterfaces(const SessionOptions &options, const zel_UUID &self);
  std::string reasonOf(const Target &target, const std::optional<zel_UUID> &boundNode);

  const bool useLocalLocator_;
  const bool witness_;
  Names names_;
  std::optional<zel_UUID> ownNode_; /* when this machine's interfaces are published */

  host::Kernel kernel_;
  host::Module *module_;
  decltype(KARSTResolver_Create) *create_;
  decltype(KARSTResolver_Destroy) *destroy_;
  decltype(KARSTResolver_SetCallback) *setCallback_;
  decltype(KARSTResolver_GetNodeLocators) *getNodeLocators_;

  std::unique_ptr<host::ClusterFileSource> clusterFile_;
  std::unique_ptr<host::OwnInterfacesSource> ownInterfaces_;
};

}  // namespace cli
