/* Spinlocks, lock domains and the rules that are checked on the way: rank, recursion, foreign
 * unlock, a lock that goes while it is held. One OS thread, no lock.
 */
#include "sim/locks.h"

#include <algorithm>
#include <new>

#include "host/kernel/heap.h"
#include "host/kernel/log.h"
#include "host/kernel/panic.h"
#include "sim/access/access.h"
#include "sim/lock_order.h"
#include "sim/observer.h"
#include "sim/platform_call.h"

namespace sim {

struct LockDomain {
  zel_Name name{};
  zel_HeapID heap = ZEL_NO_HEAP;
  std::vector<Spinlock *> locks{}; /* in the order of their making */
};

namespace {

Spinlock &lockOf(zel_SpinlockHandle handle) {
  auto *lock = reinterpret_cast<Spinlock *>(handle);
  if (handle == 0 || handle == ZEL_NO_SPINLOCK || lock->tag != Spinlock::alive)
    host::panic("0x%llx is no spinlock", static_cast<unsigned long long>(handle));
  return *lock;
}

LockDomain *findDomain(zel_LockDomainID id) {
  const auto &domains = Machine::current().locks().domains;
  const auto found = std::find(domains.begin(), domains.end(), reinterpret_cast<LockDomain *>(id));
  return found == domains.end() ? nullptr : *found;
}

bool isHeap(zel_HeapID heap) {
  const std::vector<zel_HeapID> heaps = host::heapsAlive();
  return std::find(heaps.begin(), heaps.end(), heap) != heaps.end();
}

void requireOrder(const Spinlock &lock, const Fiber &fiber) {
  if (fiber.heldCount == 0) return;
  const auto end = fiber.held.begin() + fiber.heldCount;
  if (std::find(fiber.held.begin(), end, &lock) != end)
    host::panic("spinlock \"%s\" (rank %u) is taken again by %s, which holds \"%s\" already",
                lock.name.text, lock.rank, fiber.name().c_str(), lock.name.text);
  const Spinlock &last = *fiber.held[fiber.heldCount - 1];
  if (lock.rank <= last.rank)
    host::panic(
        "spinlock \"%s\" (rank %u) is taken while \"%s\" (rank %u) is held: ranks must rise",
        lock.name.text, lock.rank, last.name.text, last.rank);
  if (fiber.heldCount == fiber.held.size())
    host::panic("spinlock \"%s\" is taken by %s, which holds %zu already, the last \"%s\"",
                lock.name.text, fiber.name().c_str(), fiber.held.size(), last.name.text);
}

void requireUnused(const Spinlock &lock, const char *doing) {
  if (lock.holder)
    host::panic("spinlock \"%s\" is %s while %s holds it", lock.name.text, doing,
                lock.holder->name().c_str());
  if (lock.waiters.first)
    host::panic("spinlock \"%s\" is %s while %s waits for it", lock.name.text, doing,
                lock.waiters.first->name().c_str());
}

void forget(Fiber &fiber, const Spinlock &lock) {
  const auto end = fiber.held.begin() + fiber.heldCount;
  std::copy(std::find(fiber.held.begin(), end, &lock) + 1, end,
            std::find(fiber.held.begin(), end, &lock));
  --fiber.heldCount;
}

void release(Spinlock &lock) {
  const zel_HeapID heap = lock.heap;
  lock.tag = ~Spinlock::alive;
  access::forget(&lock);
  host::heapFree(heap, &lock);
}

}  // namespace

void requireNoSpinlock(const Fiber &fiber, const char *doing, const char *what) {
  if (fiber.heldCount == 0) return;
  host::panic("%s %s%s%s while it holds spinlock \"%s\"", fiber.name().c_str(), doing,
              what ? " " : "", what ? what : "", fiber.held[fiber.heldCount - 1]->name.text);
}

std::vector<std::string> LockTable::alive() const {
  std::vector<std::string> lines;
  for (const LockDomain *domain : domains) {
    lines.push_back(std::string("lock domain ") + domain->name.text);
    for (const Spinlock *lock : domain->locks)
      lines.push_back(std::string("lock ") + lock->name.text + " in domain " + domain->name.text);
  }
  return lines;
}

}  // namespace sim

using namespace sim;

extern "C" zel_Status zel_LockDomainCreate(zel_ModuleID, zel_HeapID heap, const zel_Name *name,
                                           zel_LockDomainID *domain) {
  PlatformCall call(Call::zel_LockDomainCreate, Argument::name(*name));
  access::noteRead(name, sizeof *name);
  if (call.fault()) return call.fault();
  void *memory = host::heapAlloc(heap, sizeof(LockDomain), __builtin_return_address(0));
  if (!memory) return call.returns(ZEL_NO_MEMORY);
  auto *created = new (memory) LockDomain{*name, heap};
  call.machine().locks().domains.push_back(created);
  access::noteWrite(domain, sizeof *domain);
  *domain = reinterpret_cast<zel_LockDomainID>(created);
  return call.returns(ZEL_OK);
}

extern "C" void zel_LockDomainDestroy(zel_LockDomainID id) {
  LockDomain *domain = findDomain(id);
  if (!domain)
    host::panic("lock domain 0x%llx does not exist", static_cast<unsigned long long>(id));
  PlatformCall call(Call::zel_LockDomainDestroy, Argument::name(domain->name));
  std::erase(call.machine().locks().domains, domain);
  for (Spinlock *lock : domain->locks) {
    host::logWarning("lock domain \"%s\" ends with spinlock \"%s\" still in it\n",
                     domain->name.text, lock->name.text);
    requireUnused(*lock, "released with its domain");
    release(*lock);
  }
  const zel_HeapID heap = domain->heap;
  domain->~LockDomain();
  host::heapFree(heap, domain);
}

extern "C" uint32_t zel_SpinlockAllocSize(uint32_t type) {
  PlatformCall call(Call::zel_SpinlockAllocSize, Argument::number(type));
  return call.returns(type == ZEL_SPINLOCK_RANKED ? host::heapSpaceFor(sizeof(Spinlock)) : 0);
}

extern "C" zel_Status zel_SpinlockCreate(const zel_SpinlockProps *props, zel_SpinlockHandle *lock) {
  PlatformCall call(Call::zel_SpinlockCreate, Argument::name(props->name));
  access::noteRead(props, sizeof *props);
  if (call.fault()) return call.fault();
  LockDomain *domain = findDomain(props->domain);
  if (props->type != ZEL_SPINLOCK_RANKED || !domain || !isHeap(props->heap))
    return call.returns(ZEL_BAD_PARAM);
  void *memory = host::heapAlloc(props->heap, sizeof(Spinlock), __builtin_return_address(0));
  if (!memory) return call.returns(ZEL_NO_MEMORY);
  auto *created = new (memory) Spinlock;
  created->name = props->name;
  created->rank = props->rank;
  created->lockClass = LockOrder::classOf(props->name.text);
  created->heap = props->heap;
  created->domain = domain;
  domain->locks.push_back(created);
  access::noteWrite(lock, sizeof *lock);
  *lock = reinterpret_cast<zel_SpinlockHandle>(created);
  return call.returns(ZEL_OK);
}

extern "C" void zel_SpinlockDestroy(zel_SpinlockHandle handle) {
  Spinlock &lock = lockOf(handle);
  PlatformCall call(Call::zel_SpinlockDestroy, Argument::name(lock.name));
  requireUnused(lock, "destroyed");
  std::erase(lock.domain->locks, &lock);
  release(lock);
}

extern "C" void zel_SpinlockLock(zel_SpinlockHandle handle) {
  Spinlock &lock = lockOf(handle);
  PlatformCall call(Call::zel_SpinlockLock, Argument::name(lock.name));
  Fiber &fiber = call.fiber();
  requireOrder(lock, fiber);
  LockOrder::requireOrder(fiber, lock.lockClass);
  while (lock.holder) {
    call.machine().scheduler().block(
        lock.waiters, {.what = "spinlock", .object = lock.name.text, .holder = lock.holder});
    if (lock.tag != Spinlock::alive)
      host::panic("a spinlock went away while %s waited for it", fiber.name().c_str());
  }
  lock.holder = &fiber;
  fiber.held[fiber.heldCount++] = &lock;
  access::observe(&lock);
  if (Observer *observer = call.machine().observer()) observer->locked(fiber, lock);
}

extern "C" void zel_SpinlockUnlock(zel_SpinlockHandle handle) {
  Spinlock &lock = lockOf(handle);
  PlatformCall call(Call::zel_SpinlockUnlock, Argument::name(lock.name));
  Fiber &fiber = call.fiber();
  if (lock.holder != &fiber)
    host::panic("spinlock \"%s\" is unlocked by %s %s%s", lock.name.text, fiber.name().c_str(),
                lock.holder ? "but held by " : "while nobody holds it",
                lock.holder ? lock.holder->name().c_str() : "");
  if (Observer *observer = call.machine().observer()) observer->unlocking(fiber, lock);
  access::publish(&lock);
  lock.holder = nullptr;
  forget(fiber, lock);
  call.machine().scheduler().wakeAll(lock.waiters);
}
