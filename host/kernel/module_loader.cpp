/* Loads modules with the system's dynamic linker. loadLock serialises loads and unloads and is held
 * across a module's own init and cleanup; listLock guards the list of loaded modules, keptLock the
 * list of kept ones, which all loaders share. Both are taken inside it and held briefly.
 */
#include "host/kernel/module_loader.h"

#include <dlfcn.h>
#include <link.h>

#include <algorithm>
#include <atomic>
#include <charconv>
#include <limits>
#include <mutex>
#include <optional>
#include <set>
#include <string_view>

#include "host/kernel/module_memory.h"
#include "host/kernel/panic.h"
#include "host/kernel/symbols.h"
#include "host/kernel/text.h"

zel_ModuleID zel_ModuleCurrentID = ZEL_NO_MODULE;

namespace host {
namespace {

constexpr uint64_t kVariablePointerOffset = 16; /* in a parameter's record */

struct ParameterValue {
  uint64_t record;
  int32_t value;
};

[[noreturn]] void refuse(const ModuleFile &file, const std::string &why) {
  throw ModuleError(file.path.string() + ": " + why);
}

std::string listText(const std::vector<std::string> &items) {
  std::string text;
  for (const std::string &item : items) text += (text.empty() ? "" : ", ") + item;
  return text.empty() ? "none" : text;
}

/* A decimal or 0x hexadecimal number with an optional minus sign, nothing before or after it. */
std::optional<int64_t> parseInteger(std::string_view text) {
  const bool negative = text.starts_with('-');
  if (negative) text.remove_prefix(1);
  const bool hexadecimal = text.starts_with("0x") || text.starts_with("0X");
  if (hexadecimal) text.remove_prefix(2);
  /* Without a sign: from_chars would take a second one. */
  uint64_t magnitude = 0;
  const auto [end, error] =
      std::from_chars(text.data(), text.data() + text.size(), magnitude, hexadecimal ? 16 : 10);
  if (end != text.data() + text.size() || error == std::errc::invalid_argument) return std::nullopt;
  const uint64_t most = std::numeric_limits<int64_t>::max();
  const auto value = static_cast<int64_t>(
      error == std::errc::result_out_of_range ? most : std::min(magnitude, most));
  return negative ? -value : value;
}

ParameterValue parseParameter(const ModuleFile &file, const std::string &assignment) {
  const size_t mark = assignment.find('=');
  if (mark == std::string::npos) refuse(file, "\"" + assignment + "\" is no NAME=VALUE");
  const std::string name = assignment.substr(0, mark);
  const std::string value = assignment.substr(mark + 1);
  const auto known = std::find_if(file.parameters.begin(), file.parameters.end(),
                                  [&](const ModuleParameter &own) { return own.name == name; });
  if (known == file.parameters.end()) {
    std::vector<std::string> names;
    for (const ModuleParameter &own : file.parameters) names.push_back(own.name);
    refuse(file, "has no parameter " + name + "; it has: " + listText(names));
  }
  if (known->type != kParameterInt) {
    refuse(file,
           formatText("parameter %s is of type %u, which this host does not know; leave it out",
                      name.c_str(), known->type));
  }
  const auto number = parseInteger(value);
  if (!number) {
    refuse(file, "parameter " + name + " is an int, and \"" + value +
                     "\" is none; give a decimal or 0x number");
  }
  constexpr int32_t least = std::numeric_limits<int32_t>::min();
  constexpr int32_t most = std::numeric_limits<int32_t>::max();
  if (*number < least || *number > most) {
    refuse(file, formatText("parameter %s is an int: %s is outside %d to %d", name.c_str(),
                            value.c_str(), least, most));
  }
  return {known->record, static_cast<int32_t>(*number)};
}

std::vector<ParameterValue> parseParameters(const ModuleFile &file,
                                            const std::vector<std::string> &assignments) {
  std::vector<ParameterValue> values;
  std::set<uint64_t> records;
  for (const std::string &assignment : assignments) {
    values.push_back(parseParameter(file, assignment));
    if (!records.insert(values.back().record).second) {
      refuse(file, "\"" + assignment + "\": the parameter is given twice");
    }
  }
  return values;
}

/* IDs are never used twice, whatever loader gives them. */
zel_ModuleID nextModuleID() {
  static std::atomic<zel_ModuleID> last{0};
  return ++last;
}

/* What the program, its libraries or a loaded module define. Asked of the program's own handle:
 * RTLD_DEFAULT would make the answer's object a dependency of the program and keep it for ever. */
void *findGlobalSymbol(const std::string &symbol) {
  static void *const program = dlopen(nullptr, RTLD_LAZY);
  return dlsym(program, symbol.c_str());
}

bool isResident(const std::string &path) {
  void *const handle = dlopen(path.c_str(), RTLD_LAZY | RTLD_NOLOAD);
  if (handle == nullptr) return false;
  dlclose(handle);
  return true;
}

}  // namespace

struct Module::Impl : std::enable_shared_from_this<Module::Impl> {
  explicit Impl(const std::filesystem::path &path) : file(path) {}
  static std::shared_ptr<Impl> of(const std::filesystem::path &path); /* kept from before, or new */
  static std::shared_ptr<Impl> keptAt(const std::filesystem::path &path); /* or null */
  void map();
  void unmap();
  void keep(const ElfImage &image);
  void setParameters(const std::vector<ParameterValue> &values) const;

  ModuleFile file;
  std::filesystem::path asked; /* what it was loaded by first */
  void *handle = nullptr;
  MappedModule mapped;
  std::set<const Module *> uses; /* whose namespaces it requires, or whose exports it calls */
  bool loaded = false;
  std::optional<ModuleMemory> memory; /* of one that is kept */

  static std::mutex keptLock;
  static bool keeping;
  static std::function<bool()> outOfReach;        /* of the embedder; or none */
  static std::vector<std::shared_ptr<Impl>> kept; /* mapped for good, loaded or not */
};

std::mutex Module::Impl::keptLock;
bool Module::Impl::keeping = false;
std::function<bool()> Module::Impl::outOfReach;
std::vector<std::shared_ptr<Module::Impl>> Module::Impl::kept;

std::shared_ptr<Module::Impl> Module::Impl::keptAt(const std::filesystem::path &path) {
  for (const auto &known : kept) {
    if (known->loaded || (known->asked != path && known->file.path != path)) continue;
    known->uses.clear();
    return known;
  }
  return nullptr;
}

/* One that is kept is mostly loaded by the same path again: the system need not be asked where that
 * leads. A relative one may lead elsewhere by now. */
std::shared_ptr<Module::Impl> Module::Impl::of(const std::filesystem::path &path) {
  const std::lock_guard guard(keptLock);
  if (path.is_absolute()) {
    if (auto known = keptAt(path)) return known;
  }
  std::error_code error;
  const auto canonical = std::filesystem::canonical(path, error);
  if (error) return std::make_shared<Impl>(path); /* reading it says what is wrong */
  if (auto known = keptAt(canonical)) return known;
  auto made = std::make_shared<Impl>(canonical);
  made->asked = path;
  return made;
}

/* One with constructors begins afresh only when it is mapped, and one that uses another goes with
 * it. */
void Module::Impl::keep(const ElfImage &image) {
  const std::lock_guard guard(keptLock);
  if (!keeping || image.hasConstructors() || !uses.empty()) return;
  memory.emplace(mapped.base, mapped.size);
  kept.push_back(shared_from_this());
}

void keepUnloadedModules(std::function<bool()> outOfReach) {
  const std::lock_guard guard(Module::Impl::keptLock);
  Module::Impl::keeping = true;
  Module::Impl::outOfReach = std::move(outOfReach);
}

void revealKeptModules() {
  for (const auto &module : Module::Impl::kept)
    if (!module->loaded) module->memory->reveal();
}

void Module::Impl::map() {
  loaded = true;
  if (memory) return memory->renew();
  const std::string path = file.path.string();
  const ElfImage image(file.path);
  handle = dlopen(path.c_str(), RTLD_NOW | RTLD_GLOBAL);
  if (handle == nullptr) {
    const char *const reason = dlerror();
    refuse(file, std::string("cannot be mapped: ") + (reason == nullptr ? "unknown" : reason));
  }
  const link_map *where = nullptr;
  if (dlinfo(handle, RTLD_DI_LINKMAP, &where) != 0) panic("%s: mapped nowhere", path.c_str());
  mapped.base = where->l_addr;
  mapped.size = image.memorySize();
  mapped.symbols = image.definedSymbols();
  addMappedModule(&mapped);
  keep(image);
}

void Module::Impl::unmap() {
  loaded = false;
  if (memory) { /* it still lies there: for reports, and nobody binds to it */
    if (!outOfReach || outOfReach()) memory->withdraw();
    return;
  }
  removeMappedModule(&mapped);
  dlclose(handle);
  handle = nullptr;
  /* What stays would greet the next load with old variables, and run code after its unload. */
  if (isResident(file.path.string())) {
    panic(
        "%s stays in the process after its unload: is it linked with -z nodelete, or opened by "
        "somebody else?",
        file.path.c_str());
  }
}

void Module::Impl::setParameters(const std::vector<ParameterValue> &values) const {
  for (const ParameterValue &value : values) {
    const uintptr_t record = mapped.base + value.record;
    int32_t *const variable = *reinterpret_cast<int32_t **>(record + kVariablePointerOffset);
    *variable = value.value;
  }
}

Module::Module(std::shared_ptr<Impl> impl) : impl_(std::move(impl)) {}
Module::~Module() = default;

const std::string &Module::name() const {
  return impl_->mapped.name;
}
const ModuleFile &Module::file() const {
  return impl_->file;
}
zel_ModuleID Module::id() const {
  return impl_->mapped.id;
}

void *Module::exported(const std::string &symbol) const {
  const auto &exports = impl_->file.exports;
  if (std::find(exports.begin(), exports.end(), symbol) == exports.end()) return nullptr;
  return dlsym(impl_->handle, symbol.c_str());
}

void *Module::anySymbol(const std::string &symbol) const {
  return impl_->mapped.find(symbol);
}

struct ModuleLoader::Impl {
  Impl(std::vector<Namespace> own, std::function<void()> quiesceHost)
      : provided(std::move(own)), quiesce(std::move(quiesceHost)) {}

  void checkNotLoaded(const ModuleFile &file) const;
  void checkRequired(Module::Impl &module) const;
  void checkProvided(const ModuleFile &file) const;
  void checkSymbols(Module::Impl &module) const;
  const Module *exporterOf(const std::string &symbol) const;
  void start(Module::Impl &module, const std::vector<ParameterValue> &parameters) const;
  void unload(Module &module);
  std::string providedText() const;

  const std::vector<Namespace> provided; /* by the host itself */
  const std::function<void()> quiesce;
  std::mutex loadLock;
  mutable std::mutex listLock;
  std::vector<std::unique_ptr<Module>> modules; /* in the order of loading */
};

void ModuleLoader::Impl::checkNotLoaded(const ModuleFile &file) const {
  /* Asks the system, not the list: the linker would answer with what is mapped already, also where
   * another loader, or the program itself, has mapped it. */
  if (isResident(file.path.string())) refuse(file, "is loaded already; unload it first");
}

std::string ModuleLoader::Impl::providedText() const {
  std::vector<std::string> texts;
  for (const Namespace &space : provided) texts.push_back(toString(space));
  for (const auto &module : modules) {
    for (const Namespace &space : module->file().provides) texts.push_back(toString(space));
  }
  return listText(texts);
}

void ModuleLoader::Impl::checkRequired(Module::Impl &module) const {
  const auto has = [](const std::vector<Namespace> &spaces, const Namespace &wanted) {
    return std::find(spaces.begin(), spaces.end(), wanted) != spaces.end();
  };
  for (const Namespace &wanted : module.file.required) {
    bool found = has(provided, wanted);
    for (const auto &loaded : modules) {
      if (!has(loaded->file().provides, wanted)) continue;
      module.uses.insert(loaded.get());
      found = true;
    }
    if (!found) {
      refuse(module.file, "requires " + toString(wanted) +
                              ", which nobody provides; load its provider first. Provided are: " +
                              providedText());
    }
  }
}

void ModuleLoader::Impl::checkProvided(const ModuleFile &file) const {
  const auto refuseTaken = [&](const Namespace &space, const std::string &owner) {
    refuse(file, "provides " + space.name + ", as " + owner + " does already; load one of the two");
  };
  for (const Namespace &own : file.provides) {
    const auto same = [&](const Namespace &other) { return other.name == own.name; };
    if (std::any_of(provided.begin(), provided.end(), same)) refuseTaken(own, "the host");
    for (const auto &loaded : modules) {
      const auto &theirs = loaded->file().provides;
      if (std::any_of(theirs.begin(), theirs.end(), same)) refuseTaken(own, loaded->name());
    }
  }
}

const Module *ModuleLoader::Impl::exporterOf(const std::string &symbol) const {
  for (const auto &loaded : modules) {
    if (loaded->exported(symbol) != nullptr) return loaded.get();
  }
  return nullptr;
}

void ModuleLoader::Impl::checkSymbols(Module::Impl &module) const {
  std::vector<std::string> missing;
  for (const std::string &symbol : module.file.undefinedSymbols) {
    if (const Module *const exporter = exporterOf(symbol)) {
      module.uses.insert(exporter);
      continue;
    }
    /* A loaded module may show more than it exports; that is not for others. */
    const void *const found = findGlobalSymbol(symbol);
    if (found == nullptr || isInMappedModule(found)) missing.push_back(symbol);
  }
  if (!missing.empty()) {
    refuse(module.file, "needs symbols that neither the host nor a loaded module has: " +
                            listText(missing) + "; load their provider first");
  }
}

void ModuleLoader::Impl::start(Module::Impl &module,
                               const std::vector<ParameterValue> &parameters) const {
  module.map();
  module.setParameters(parameters);
  zel_ModuleCurrentID = module.mapped.id;
  const auto init = reinterpret_cast<int (*)()>(dlsym(module.handle, "init_module"));
  const int result = init();
  if (result == 0) return;
  quiesce();
  module.unmap();
  refuse(module.file, formatText("init_module failed with %d; the log says why", result));
}

void ModuleLoader::Impl::unload(Module &module) {
  const auto cleanup = reinterpret_cast<void (*)()>(dlsym(module.impl_->handle, "cleanup_module"));
  cleanup();
  quiesce();
  std::unique_ptr<Module> ended;
  {
    const std::lock_guard guard(listLock);
    const auto place = std::find_if(modules.begin(), modules.end(),
                                    [&](const auto &loaded) { return loaded.get() == &module; });
    ended = std::move(*place);
    modules.erase(place);
  }
  ended->impl_->unmap();
}

ModuleLoader::ModuleLoader(std::vector<Namespace> provided, std::function<void()> quiesce)
    : impl_(std::make_unique<Impl>(std::move(provided), std::move(quiesce))) {}

ModuleLoader::~ModuleLoader() {
  /* A module's users were loaded after it. */
  while (!impl_->modules.empty()) impl_->unload(*impl_->modules.back());
}

Module &ModuleLoader::load(const std::filesystem::path &path,
                           const std::vector<std::string> &parameters) {
  const std::lock_guard loading(impl_->loadLock);
  const std::shared_ptr<Module::Impl> module = Module::Impl::of(path);
  module->mapped.name = module->file.path.filename().string();
  module->mapped.id = nextModuleID();

  if (!module->memory) impl_->checkNotLoaded(module->file);
  impl_->checkProvided(module->file);
  impl_->checkRequired(*module);
  if (!module->memory) impl_->checkSymbols(*module); /* else they are bound already */
  impl_->start(*module, parseParameters(module->file, parameters));

  const std::lock_guard guard(impl_->listLock);
  impl_->modules.push_back(std::unique_ptr<Module>(new Module(module)));
  return *impl_->modules.back();
}

void ModuleLoader::unload(Module &module) {
  const std::lock_guard unloading(impl_->loadLock);
  std::vector<std::string> users;
  for (const auto &other : impl_->modules) {
    if (other->impl_->uses.contains(&module)) users.push_back(other->name());
  }
  if (!users.empty()) {
    refuse(module.file(), "is in use by " + listText(users) + "; unload them first");
  }
  impl_->unload(module);
}

std::vector<const Module *> ModuleLoader::modules() const {
  std::vector<const Module *> loaded;
  const std::lock_guard guard(impl_->listLock);
  for (const auto &module : impl_->modules) loaded.push_back(module.get());
  return loaded;
}

}  // namespace host
