/* Addresses as text: loaded modules by their symbol tables, the program by its dynamic symbols.
 * mappedLock guards the list of mapped modules.
 */
#include "host/kernel/symbols.h"

#include <cxxabi.h>
#include <dlfcn.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <mutex>

#include "host/kernel/module_loader.h"
#include "host/kernel/text.h"

namespace host {
namespace {

std::mutex mappedLock;
std::vector<const MappedModule *> &mappedModules() {
  static std::vector<const MappedModule *> list;
  return list;
}

std::string demangle(const char *symbol) {
  int status = 0;
  const std::unique_ptr<char, decltype(&std::free)> text(
      abi::__cxa_demangle(symbol, nullptr, nullptr, &status), std::free);
  return text ? text.get() : symbol;
}

/* "symbol+0x42 in object", without the symbol where none is known. */
std::string placeText(const std::string &symbol, uintptr_t offset, const std::string &object) {
  if (symbol.empty()) return formatText("0x%zx in %s", offset, object.c_str());
  return formatText("%s+0x%zx in %s", demangle(symbol.c_str()).c_str(), offset, object.c_str());
}

/* The symbol that spans the address, or else the last one before it that says no size. */
const ElfSymbol *symbolAt(const MappedModule &module, uintptr_t offset) {
  const ElfSymbol *best = nullptr;
  for (const ElfSymbol &symbol : module.symbols) {
    if (symbol.address > offset) continue;
    if (symbol.size != 0 && offset - symbol.address >= symbol.size) continue;
    if (best == nullptr || symbol.address > best->address) best = &symbol;
  }
  return best;
}

std::string moduleTextLocked(uintptr_t address) {
  for (const MappedModule *module : mappedModules()) {
    if (!module->contains(address)) continue;
    const uintptr_t offset = address - module->base;
    const ElfSymbol *const symbol = symbolAt(*module, offset);
    if (symbol == nullptr) return placeText("", offset, module->name);
    return placeText(symbol->name, offset - symbol->address, module->name);
  }
  return {};
}

std::string programText(const void *address) {
  Dl_info info{};
  if (dladdr(address, &info) == 0 || info.dli_fname == nullptr) return formatText("%p", address);
  const std::string object = std::filesystem::path(info.dli_fname).filename().string();
  const auto distance = [address](const void *from) {
    return reinterpret_cast<uintptr_t>(address) - reinterpret_cast<uintptr_t>(from);
  };
  if (info.dli_sname == nullptr) return placeText("", distance(info.dli_fbase), object);
  return placeText(info.dli_sname, distance(info.dli_saddr), object);
}

}  // namespace

void *MappedModule::find(const std::string &symbol) const {
  const auto found = std::find_if(symbols.begin(), symbols.end(),
                                  [&](const ElfSymbol &known) { return known.name == symbol; });
  if (found == symbols.end()) return nullptr;
  return reinterpret_cast<void *>(base + found->address);
}

void addMappedModule(const MappedModule *module) {
  const std::lock_guard guard(mappedLock);
  mappedModules().push_back(module);
}

void removeMappedModule(const MappedModule *module) {
  const std::lock_guard guard(mappedLock);
  std::erase(mappedModules(), module);
}

bool isInMappedModule(const void *address) {
  const std::lock_guard guard(mappedLock);
  const auto &modules = mappedModules();
  return std::any_of(modules.begin(), modules.end(), [=](const MappedModule *module) {
    return module->contains(reinterpret_cast<uintptr_t>(address));
  });
}

std::string mappedModuleName(zel_ModuleID id) {
  const std::lock_guard guard(mappedLock);
  for (const MappedModule *module : mappedModules()) {
    if (module->id == id) return module->name;
  }
  return formatText("module %u", id);
}

std::string symbolize(const void *address) {
  {
    const std::lock_guard guard(mappedLock);
    std::string text = moduleTextLocked(reinterpret_cast<uintptr_t>(address));
    if (!text.empty()) return text;
  }
  return programText(address);
}

}  // namespace host
