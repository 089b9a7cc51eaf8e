/* Which pages a module has, and with which rights, is asked of the system; nothing else knows what
 * the linker has made of the file.
 */
#include "host/kernel/module_memory.h"

#include <sys/mman.h>

#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <utility>

#include "host/kernel/panic.h"

namespace host {

namespace {

void protect(uintptr_t begin, uintptr_t end, int protection) {
  if (mprotect(reinterpret_cast<void *>(begin), end - begin, protection) != 0)
    panic("the memory of a module cannot be protected");
}

}  // namespace

ModuleMemory::ModuleMemory(uintptr_t base, size_t size) {
  std::ifstream maps("/proc/self/maps");
  for (std::string line; std::getline(maps, line);) {
    uintptr_t begin = 0, end = 0;
    char rights[5] = {};
    if (std::sscanf(line.c_str(), "%" SCNxPTR "-%" SCNxPTR " %4s", &begin, &end, rights) != 3 ||
        begin >= base + size || end <= base) {
      continue;
    }
    const int protection = (rights[0] == 'r' ? PROT_READ : 0) |
                           (rights[1] == 'w' ? PROT_WRITE : 0) | (rights[2] == 'x' ? PROT_EXEC : 0);
    const bool writable = protection & PROT_WRITE;
    if (pages_.empty() || writable || pages_.back().protection & PROT_WRITE) {
      pages_.push_back({begin, 0, 0, {}});
    }
    Pages &pages = pages_.back();
    pages.size += end - begin;
    pages.protection |= protection;
    if (writable) pages.content.assign(reinterpret_cast<const char *>(begin), pages.size);
  }
  if (pages_.empty()) panic("the pages of a module are not known");
}

void ModuleMemory::withdraw() {
  withdrawn_ = true;
  protect(pages_.front().begin, pages_.back().begin + pages_.back().size, PROT_NONE);
}

void ModuleMemory::reveal() const {
  protect(pages_.front().begin, pages_.back().begin + pages_.back().size, PROT_READ);
}

void ModuleMemory::renew() {
  const bool outOfReach = std::exchange(withdrawn_, false);
  for (const Pages &pages : pages_) {
    if (outOfReach) protect(pages.begin, pages.begin + pages.size, pages.protection);
    std::memcpy(reinterpret_cast<void *>(pages.begin), pages.content.data(), pages.content.size());
  }
}

}  // namespace host
