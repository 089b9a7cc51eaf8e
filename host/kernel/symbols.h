/* Where loaded modules lie in memory and what their symbols are; behind symbolize(). One lock, held
 * briefly and with none under it: reports come from anywhere, also from inside a load.
 */
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "host/kernel/elf_image.h"
#include "platform/zel.h"

namespace host {

struct MappedModule {
  zel_ModuleID id = ZEL_NO_MODULE;
  std::string name;
  uintptr_t base = 0;             /* where address 0 of the file lies */
  uintptr_t size = 0;             /* bytes from there */
  std::vector<ElfSymbol> symbols; /* all that the file defines */

  bool contains(uintptr_t address) const { return address >= base && address - base < size; }

  /* Where a symbol lies; null when the file has none of the name. */
  void *find(const std::string &symbol) const;
};

/* `module` stays in place until removed, and unchanged but for the ID of a kept one. */
void addMappedModule(const MappedModule *module);
void removeMappedModule(const MappedModule *module);

/* Does the address belong to a loaded module? */
bool isInMappedModule(const void *address);

/* "karst_resolver.so", or "module 7" when none of the ID is mapped. */
std::string mappedModuleName(zel_ModuleID id);

}  // namespace host
