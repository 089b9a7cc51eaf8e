/* Lock domains: they own the locks created in them. One mutex guards the list of domains and each
 * domain's list of locks; taking and giving back a lock never comes here.
 */
#include <algorithm>
#include <cinttypes>
#include <mutex>
#include <new>

#include "host/kernel/heap.h"
#include "host/kernel/log.h"
#include "host/kernel/panic.h"
#include "host/threads/spinlock.h"

namespace host {

struct LockDomain {
  zel_Name name{};
  zel_HeapID heap = ZEL_NO_HEAP;
  Spinlock *firstLock = nullptr;
};

namespace {

std::mutex domainsMutex;
std::vector<LockDomain *> domains;

zel_LockDomainID idOf(const LockDomain *domain) {
  return reinterpret_cast<zel_LockDomainID>(domain);
}

LockDomain *findDomain(zel_LockDomainID id) {
  const auto found = std::find_if(domains.begin(), domains.end(),
                                  [id](const LockDomain *domain) { return idOf(domain) == id; });
  return found == domains.end() ? nullptr : *found;
}

bool isHeap(zel_HeapID heap) {
  const std::vector<zel_HeapID> heaps = heapsAlive();
  return std::find(heaps.begin(), heaps.end(), heap) != heaps.end();
}

/* Names come from modules and go into reports. */
zel_Name terminated(zel_Name name) {
  name.text[sizeof name.text - 1] = '\0';
  return name;
}

void link(Spinlock &lock, LockDomain &domain) {
  lock.domain = &domain;
  lock.next = domain.firstLock;
  if (lock.next != nullptr) lock.next->previous = &lock;
  domain.firstLock = &lock;
}

void unlink(Spinlock &lock) {
  (lock.previous != nullptr ? lock.previous->next : lock.domain->firstLock) = lock.next;
  if (lock.next != nullptr) lock.next->previous = lock.previous;
}

void release(Spinlock &lock) {
  const zel_HeapID heap = lock.heap;
  lock.~Spinlock();
  heapFree(heap, &lock);
}

}  // namespace

std::vector<std::string> aliveLocks() {
  const std::lock_guard guard(domainsMutex);
  std::vector<std::string> alive;
  for (const LockDomain *domain : domains) {
    alive.push_back(std::string("lock domain ") + domain->name.text);
    for (const Spinlock *lock = domain->firstLock; lock != nullptr; lock = lock->next) {
      alive.push_back(std::string("lock ") + lock->name.text + " in domain " + domain->name.text);
    }
  }
  return alive;
}

}  // namespace host

using namespace host;

extern "C" zel_Status zel_LockDomainCreate(zel_ModuleID, zel_HeapID heap, const zel_Name *name,
                                           zel_LockDomainID *domain) {
  requireNoSpinlock("creates a lock domain", name->text);
  void *memory = heapAlloc(heap, sizeof(LockDomain), __builtin_return_address(0));
  if (memory == nullptr) return ZEL_NO_MEMORY;
  auto *created = new (memory) LockDomain{terminated(*name), heap};
  const std::lock_guard guard(domainsMutex);
  domains.push_back(created);
  *domain = idOf(created);
  return ZEL_OK;
}

extern "C" void zel_LockDomainDestroy(zel_LockDomainID id) {
  LockDomain *domain = nullptr;
  {
    const std::lock_guard guard(domainsMutex);
    domain = findDomain(id);
    if (domain != nullptr) std::erase(domains, domain);
  }
  if (domain == nullptr) panic("destroying a lock domain: there is none 0x%" PRIx64, id);
  requireNoSpinlock("destroys lock domain", domain->name.text);
  while (domain->firstLock != nullptr) {
    Spinlock &lock = *domain->firstLock;
    logWarning("lock domain \"%s\" ends with spinlock \"%s\" still in it\n", domain->name.text,
               lock.name.text);
    requireUnused(lock, "released with its domain");
    unlink(lock);
    release(lock);
  }
  const zel_HeapID heap = domain->heap;
  domain->~LockDomain();
  heapFree(heap, domain);
}

extern "C" uint32_t zel_SpinlockAllocSize(uint32_t type) {
  return type == ZEL_SPINLOCK_RANKED ? heapSpaceFor(sizeof(Spinlock)) : 0;
}

extern "C" zel_Status zel_SpinlockCreate(const zel_SpinlockProps *props, zel_SpinlockHandle *lock) {
  if (props->type != ZEL_SPINLOCK_RANKED || !isHeap(props->heap)) return ZEL_BAD_PARAM;
  const std::lock_guard guard(domainsMutex);
  LockDomain *domain = findDomain(props->domain);
  if (domain == nullptr) return ZEL_BAD_PARAM;
  void *memory = heapAlloc(props->heap, sizeof(Spinlock), __builtin_return_address(0));
  if (memory == nullptr) return ZEL_NO_MEMORY;
  auto *created = new (memory) Spinlock;
  created->rank = props->rank;
  created->name = terminated(props->name);
  created->heap = props->heap;
  link(*created, *domain);
  *lock = reinterpret_cast<zel_SpinlockHandle>(created);
  return ZEL_OK;
}

extern "C" void zel_SpinlockDestroy(zel_SpinlockHandle handle) {
  Spinlock &lock = lockOf(handle);
  requireUnused(lock, "destroyed");
  {
    const std::lock_guard guard(domainsMutex);
    unlink(lock);
  }
  release(lock);
}
