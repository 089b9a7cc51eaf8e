/* Worlds, sleep, time and preemption on fibers. A wake-up before the wait is kept, a stop ends the
 * wait: the same promises as with threads, and every order of events in which they must hold can be
 * played through. One OS thread, no lock.
 */
#include "sim/worlds.h"

#include <algorithm>
#include <atomic>
#include <new>

#include "host/kernel/heap.h"
#include "host/kernel/panic.h"
#include "host/kernel/text.h"
#include "host/threads/clock.h"
#include "host/threads/worlds.h"
#include "platform/tolm.h"
#include "sim/access/access.h"
#include "sim/lock_order.h"
#include "sim/observer.h"
#include "sim/platform_call.h"

namespace sim {

namespace {

constexpr uint32_t processors = 8;

void noteChange(Machine &machine) {
  ++machine.worlds().activity;
  machine.scheduler().wakeAll(machine.worlds().settled);
}

void runBody(const World &world, uint32_t (*body)(void *data), void *data) {
  const Inside inside(Machine::current().scheduler().running(), insideWorld(world.name.text));
  body(data);
}

void endWorld(World &world) {
  Machine &machine = Machine::current();
  access::publish(&world.end);
  world.ended = true;
  machine.scheduler().wakeAll(world.end);
  noteChange(machine);
}

/* The world that its owner wants to end, from now on marked so; panics when it cannot be. */
World &markStopping(Machine &machine, zel_WorldID id, const Fiber &caller) {
  const auto found = machine.worlds().worlds.find(id);
  if (found == machine.worlds().worlds.end() || found->second->stopping)
    host::panic("world %u is destroyed, but does not exist or is being destroyed already", id);
  World &world = *found->second;
  if (caller.world == &world) host::panic("world \"%s\" destroys itself", world.name.text);
  LockOrder::requireOrder(caller, LockOrder::classOf(insideWorld(world.name.text)));
  world.stopping = true;
  machine.scheduler().wakeAll(world.wait);
  return world;
}

}  // namespace

std::string World::describe() const {
  std::string state = ended ? "ended" : reason ? std::string("waits: ") + reason : "runs";
  if (stopping) state += ", is to stop";
  return std::string("world ") + name.text + " (" + state + ")";
}

bool WorldTable::allIdle() const {
  return std::all_of(worlds.begin(), worlds.end(),
                     [](const auto &entry) { return entry.second->idle(); });
}

std::vector<std::string> WorldTable::alive() const {
  std::vector<std::string> lines;
  for (const auto &[id, world] : worlds) lines.push_back(world->describe());
  return lines;
}

}  // namespace sim

/* ---- What the rest of the host asks ---------------------------------------------------------- */

namespace host {

/* Nothing to set: a stop that does not end is a deadlock here and found as one, and who has held a
 * lock for too long is the simulation's choice. */
void configureWorlds(const WorldSettings &) {}

/* Nothing to put off either: a wake-up here takes the processor from nobody. */
WakeUpsPutOff::WakeUpsPutOff() {}
WakeUpsPutOff::~WakeUpsPutOff() {}

void waitUntilWorldsIdle() {
  sim::Machine &machine = sim::Machine::current();
  while (!machine.worlds().allIdle())
    machine.scheduler().block(machine.worlds().settled, {.what = "all worlds to be idle"});
}

uint64_t worldsActivity() {
  return sim::Machine::current().worlds().activity;
}

std::vector<std::string> aliveWorldsAndLocks() {
  sim::Machine &machine = sim::Machine::current();
  std::vector<std::string> lines = machine.worlds().alive();
  for (std::string &line : machine.locks().alive()) lines.push_back(std::move(line));
  return lines;
}

}  // namespace host

/* ---- The platform's functions ---------------------------------------------------------------- */

using namespace sim;

extern "C" zel_Status TOLM_WorldCreate(zel_WorldID *world, const char *name, zel_ModuleID,
                                       uint32_t (*body)(void *data), void *data, uint32_t,
                                       zel_HeapID heap) {
  PlatformCall call(Call::TOLM_WorldCreate, Argument::text(name));
  zel_Status status = call.fault();
  void *memory = nullptr;
  if (status == ZEL_OK) {
    memory = host::heapAlloc(heap, sizeof(World), __builtin_return_address(0));
    status = call.returns(memory ? ZEL_OK : ZEL_NO_MEMORY);
  }
  if (Observer *observer = call.machine().observer()) observer->worldCreated(call.fiber(), status);
  if (status != ZEL_OK) return status;
  auto *created = new (memory) World;
  created->heap = heap;
  host::fillName(&created->name, name);
  WorldTable &table = call.machine().worlds();
  created->id = ++table.lastID;
  table.worlds.emplace(created->id, created);
  access::noteAtomicWrite(world, sizeof *world, __ATOMIC_RELEASE);
  std::atomic_ref(*world).store(created->id, std::memory_order_release);
  Fiber &fiber = call.machine().scheduler().spawn(
      created->name.text, [body, data, created] { runBody(*created, body, data); },
      [created] { endWorld(*created); });
  access::passOn(fiber);
  fiber.world = created;
  return ZEL_OK;
}

extern "C" void TOLM_WorldDestroy(zel_WorldID *world) {
  const zel_WorldID id = std::atomic_ref(*world).load(std::memory_order_acquire);
  access::noteAtomicRead(world, sizeof *world, __ATOMIC_ACQUIRE);
  PlatformCall call(Call::TOLM_WorldDestroy, Argument::number(id));
  if (id == ZEL_NO_WORLD) return;
  Machine &machine = call.machine();
  World &ending = markStopping(machine, id, call.fiber());
  while (!ending.ended)
    machine.scheduler().block(ending.end, {.what = "end of world", .object = ending.name.text});
  access::observe(&ending.end);
  machine.worlds().worlds.erase(id);
  access::noteAtomicWrite(world, sizeof *world, __ATOMIC_RELEASE);
  std::atomic_ref(*world).store(ZEL_NO_WORLD, std::memory_order_release);
  const zel_HeapID heap = ending.heap;
  access::forget(&ending.wait);
  access::forget(&ending.end);
  ending.~World();
  host::heapFree(heap, &ending);
}

extern "C" zel_Status zel_WorldWait(uint64_t event, zel_SpinlockHandle lock, uint32_t timeout,
                                    const char *reason) {
  PlatformCall call(Call::zel_WorldWait, Argument::text(reason));
  Machine &machine = call.machine();
  World *world = call.fiber().world;
  if (!world) host::panic("%s waits as a world and is none", call.fiber().name().c_str());
  if (event != 0 || lock != ZEL_NO_SPINLOCK)
    host::panic("world \"%s\" waits for an event or with a lock: neither is served",
                world->name.text);
  world->reason = reason;
  noteChange(machine);
  const uint64_t until =
      timeout == ZEL_TIMEOUT_NONE ? never : machine.scheduler().now() + timeout * 1'000'000ull;
  bool timedOut = false;
  while (!world->woken && !world->stopping && !timedOut)
    timedOut = !machine.scheduler().block(
        world->wait, {.what = "a wake-up:", .object = reason, .idle = true, .until = until});
  world->reason = nullptr;
  if (world->woken) access::observe(&world->wait);
  access::forget(&world->wait); /* the wake-ups are used up */
  world->woken = false;
  noteChange(machine);
  const zel_Status status = world->stopping ? ZEL_WORLD_STOPPING : ZEL_OK;
  if (Observer *observer = machine.observer()) observer->worldWaited(call.fiber(), status);
  return call.returns(status);
}

extern "C" void zel_WorldForceWakeup(zel_WorldID id) {
  PlatformCall call(Call::zel_WorldForceWakeup, Argument::number(id));
  const auto &worlds = call.machine().worlds().worlds;
  const auto found = worlds.find(id);
  if (found == worlds.end()) return;
  access::publish(&found->second->wait);
  found->second->woken = true;
  call.machine().scheduler().wakeAll(found->second->wait);
}

extern "C" void zel_WorldSleep(uint32_t microseconds) {
  PlatformCall call(Call::zel_WorldSleep, Argument::number(microseconds));
  call.machine().scheduler().sleep(microseconds * 1'000ull);
}

extern "C" uint64_t zel_GetTimerCycles(void) {
  PlatformCall call(Call::zel_GetTimerCycles);
  return call.returns(call.machine().scheduler().now());
}

extern "C" uint64_t zel_TimerTCToNS(uint64_t cycles) {
  PlatformCall call(Call::zel_TimerTCToNS, Argument::number(cycles));
  return call.returns(cycles);
}

/* Virtual time has no ticks: every reading is exact. */
static int virtualClock(clockid_t, timespec *now) {
  constexpr uint64_t second = 1'000'000'000;
  const uint64_t nanoseconds = zel_TimerTCToNS(zel_GetTimerCycles());
  now->tv_sec = static_cast<time_t>(nanoseconds / second);
  now->tv_nsec = static_cast<long>(nanoseconds % second);
  return 0;
}
constinit host::SystemClock host::systemClock = virtualClock;
uint64_t host::tickInterval() {
  return 0;
}

extern "C" void tolmapi_PreemptionEnable(void) {
  PlatformCall call(Call::tolmapi_PreemptionEnable);
}

extern "C" bool tolmapi_PreemptionIsPending(void) {
  PlatformCall call(Call::tolmapi_PreemptionIsPending);
  World *world = call.fiber().world;
  if (!world) return call.returns(false);
  world->preemptionAnswered = !world->preemptionAnswered && call.machine().answersPreemption();
  if (Observer *observer = call.machine().observer())
    observer->preemptionAnswered(call.fiber(), world->preemptionAnswered);
  return call.returns(world->preemptionAnswered);
}

extern "C" uint32_t tolmapi_GetPCPUNumPreemptible(void) {
  PlatformCall call(Call::tolmapi_GetPCPUNumPreemptible);
  return call.returns(call.fiber().id() % processors);
}
