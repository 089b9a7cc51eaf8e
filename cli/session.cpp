/* Puts kernel, module and sources together, and takes them apart. No lock. */
#include "cli/session.h"

#include "cli/diagnosis.h"
#include "host/kernel/text.h"
#include "host/sources/machine_uuid.h"

namespace cli {
namespace {

host::KernelSettings settingsOf(const SessionOptions &options) {
  host::KernelSettings settings;
  settings.witness = options.witness;
  return settings;
}

template <typename Function>
Function *neededFunction(const host::Module &module, const char *name) {
  auto *const function = module.function<Function>(name);
  if (function == nullptr) {
    throw host::ModuleError(module.file().path.string() + ": exports no " + name +
                            ": it is not the resolver; give the resolver with --module");
  }
  return function;
}

/* This host's node: as asked for, as the cluster file says, or as the machine's id has it. Only a
 * question that depends on it fails where nobody knows. */
zel_UUID chooseSelf(const SessionOptions &options, const std::optional<zel_UUID> &fromFile) {
  if (options.self) return *options.self;
  if (fromFile) return *fromFile;
  try {
    return host::machineUUID();
  } catch (const std::runtime_error &) {
    if (options.ownInterfaces || options.useLocalLocator) throw;
    return {};
  }
}

}  // namespace

Session::Session(const SessionOptions &options)
    : useLocalLocator_(options.useLocalLocator),
      witness_(options.witness),
      kernel_(settingsOf(options)),
      module_(&kernel_.modules().load(options.module, options.parameters)),
      create_(neededFunction<decltype(KARSTResolver_Create)>(*module_, "KARSTResolver_Create")),
      destroy_(neededFunction<decltype(KARSTResolver_Destroy)>(*module_, "KARSTResolver_Destroy")),
      setCallback_(neededFunction<decltype(KARSTResolver_SetCallback)>(
          *module_, "KARSTResolver_SetCallback")),
      getNodeLocators_(neededFunction<decltype(KARSTResolver_GetNodeLocators)>(
          *module_, "KARSTResolver_GetNodeLocators")) {
  feed(options);
  readNames();
  kernel_.directory().setUsable(true);
  settle();
}

Session::~Session() {
  close();
}

void Session::feed(const SessionOptions &options) {
  host::ClusterContent content;
  if (!options.directoryFile.empty()) {
    clusterFile_ =
        std::make_unique<host::ClusterFileSource>(options.directoryFile, kernel_.directory());
    clusterFile_->load();
    content = clusterFile_->content();
  }
  const zel_UUID self = chooseSelf(options, content.self);
  kernel_.directory().setSelf(self);
  if (!options.ownInterfaces) return;
  feedOwnInterfaces(options, self);
  /* Both know this host's node: what the cluster file says of it, its version say, stands. */
  for (const host::Entry &entry : content.entries) {
    if (entry.type == KARST_TYPE_NODE && entry.uuid == self) kernel_.directory().put(entry);
  }
}

void Session::feedOwnInterfaces(const SessionOptions &options, const zel_UUID &self) {
  host::OwnNode node;
  node.uuid = self;
  node.witness = options.witness;
  ownInterfaces_ = std::make_unique<host::OwnInterfacesSource>(node, kernel_.directory());
  ownInterfaces_->load();
  ownNode_ = self;
}

void Session::follow(const std::function<void()> &onChange) {
  if (clusterFile_) {
    clusterFile_->watch([onChange](const host::Reload &reload) {
      if (reload.refusal.empty()) onChange(); /* a refusal is in the log */
    });
  }
  if (ownInterfaces_) ownInterfaces_->watch([onChange](const host::Difference &) { onChange(); });
}

const Names &Session::readNames() {
  /* A thing that is gone keeps its name: there is still something to say of it. */
  Names now = clusterFile_ ? clusterFile_->content().names : Names();
  now.merge(names_);
  names_ = std::move(now);
  if (ownNode_) names_.try_emplace(*ownNode_, "this host");
  return names_;
}

KARSTResolverInstance *Session::create(const Target &target, zel_Status *status) {
  KARSTResolverInstance *instance = nullptr;
  const zel_UUID object = target.isObject ? target.uuid : zel_UUID{};
  const zel_UUID node = target.isObject ? target.hint : target.uuid;
  const uint32_t type = target.isObject ? target.type : 0;
  *status = create_(&instance, type, object, node, useLocalLocator_);
  return instance;
}

void Session::setCallback(KARSTResolverInstance *instance, KARSTResolverCallback callback,
                          void *data) {
  setCallback_(instance, callback, data);
}

void Session::destroy(KARSTResolverInstance *instance) {
  destroy_(instance);
}

Answer Session::answerOf(const Target &target, KARSTResolverInstance *instance,
                         const std::optional<zel_UUID> &boundNode) {
  KARSTResolverNodeLocators set{};
  set.capacity = KARST_RESOLVER_MAX_LOCATORS;
  if (getNodeLocators_(instance, &set) == ZEL_OK) return {target, set, ""};
  return {target, {}, reasonOf(target, boundNode)};
}

Answer Session::refusedAnswer(const Target &target, zel_Status status) {
  if (status == ZEL_NOT_FOUND) return {target, {}, reasonOf(target, {})};
  if (status == ZEL_NO_MEMORY) {
    return {
        target, {}, "the resolver's heap is full (KARST_RESOLVER_LEAST_MAX_HEAP sets its size)"};
  }
  return {target, {}, host::formatText("the resolver answers %s", host::statusText(status))};
}

std::string Session::reasonOf(const Target &target, const std::optional<zel_UUID> &boundNode) {
  const Viewpoint view{kernel_.directory(), names_, witness_};
  /* The directory may have changed since the resolver answered. */
  return whyUnresolved(view, target, boundNode).value_or(kUnexplained);
}

void Session::stopSources() {
  clusterFile_.reset();
  ownInterfaces_.reset();
}

std::vector<std::string> Session::close() {
  stopSources();
  if (module_ != nullptr) {
    kernel_.modules().unload(*module_);
    module_ = nullptr;
  }
  return kernel_.alive();
}

}  // namespace cli
