/* Worlds: OS threads with an ID, a wait that keeps its wake-ups, and a stop. One mutex guards the
 * table of worlds and every world's state; it is only ever held for a few instructions, so that a
 * wake-up may come from under a spinlock.
 */
#include "host/threads/worlds.h"

#include <sched.h>
#include <sys/rseq.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <new>
#include <system_error>
#include <thread>
#include <utility>

#include "host/kernel/heap.h"
#include "host/kernel/panic.h"
#include "host/kernel/text.h"
#include "host/threads/spinlock.h"
#include "host/threads/thread_name.h"
#include "host/threads/thread_report.h"
#include "host/threads/wake_up.h"
#include "platform/tolm.h"

namespace host {

namespace {

enum class WorldState { Starting, Running, Waiting, Sleeping, Ended };

/* Lives in the heap of the module that created it, from TOLM_WorldCreate to TOLM_WorldDestroy. */
struct World {
  zel_WorldID id = ZEL_NO_WORLD;
  zel_Name name{};
  zel_HeapID heap = ZEL_NO_HEAP;
  uint32_t (*body)(void *) = nullptr;
  void *data = nullptr;
  std::thread thread{};

  WorldState state = WorldState::Starting;
  const char *reason = nullptr; /* of the wait that it is in, or was in last */
  bool released = false;        /* its ID is known to its creator: the body may run */
  bool woken = false;           /* a wake-up that no wait has used up yet */
  bool stopping = false;
  /* Shared with whoever wakes it up: that is done after the mutex was given back, or the world would
   * run straight into it; and by then the world may have ended. */
  std::shared_ptr<WakeUp> wake = std::make_shared<WakeUp>();
};

struct Worlds {
  std::mutex mutex;
  std::condition_variable settled; /* some world went to sleep or ended */
  std::map<zel_WorldID, World *> alive;
  zel_WorldID lastID = ZEL_NO_WORLD;
  uint64_t activity = 0;
};

Worlds &worlds() {
  static auto *everlasting = new Worlds; /* threads may outlive the program's static objects */
  return *everlasting;
}

std::atomic<int64_t> stopTimeoutMilliseconds{30'000};

thread_local World *currentWorld = nullptr;

/* Of the calling thread: does it put wake-ups off, and which it has. A second world that it wakes
 * meanwhile makes the first one's due. */
thread_local bool putsOff = false;
thread_local std::shared_ptr<WakeUp> putOff;

/* The next number that no living world has: a number comes back only after all others were used. */
zel_WorldID newIDLocked(Worlds &all) {
  do {
    ++all.lastID;
  } while (all.lastID == ZEL_NO_WORLD || all.alive.contains(all.lastID));
  return all.lastID;
}

std::string describeLocked(const World &world) {
  const std::string reason = world.reason != nullptr ? world.reason : "";
  switch (world.state) {
    case WorldState::Starting:
      return "starting";
    case WorldState::Running:
      return reason.empty() ? "running" : "running, last wait: " + reason;
    case WorldState::Waiting:
      return "waits: " + reason;
    case WorldState::Sleeping:
      return "sleeps";
    case WorldState::Ended:
      return "ended";
  }
  return "";
}

bool isIdleLocked(const World &world) {
  if (world.state == WorldState::Ended) return true;
  return world.state == WorldState::Waiting && !world.woken && !world.stopping;
}

bool areAllIdleLocked(const Worlds &all) {
  for (const auto &[id, world] : all.alive) {
    if (!isIdleLocked(*world)) return false;
  }
  return true;
}

void runWorld(World &world) {
  Worlds &all = worlds();
  nameThisThread(world.name.text);
  currentWorld = &world;
  {
    std::unique_lock guard(all.mutex);
    while (!world.released) world.wake->wait(guard);
    world.state = WorldState::Running;
  }
  world.body(world.data);
  requireNoSpinlock("ends its world", world.name.text);
  currentWorld = nullptr;
  const std::lock_guard guard(all.mutex);
  world.state = WorldState::Ended;
  all.settled.notify_all();
}

/* Until the world is woken or asked to stop, or for so many milliseconds. */
void sleepUntilDue(World &world, std::unique_lock<std::mutex> &guard, uint32_t timeout) {
  using Clock = std::chrono::steady_clock;
  const auto end = Clock::now() + std::chrono::milliseconds(timeout);
  while (!world.woken && !world.stopping) {
    if (timeout == ZEL_TIMEOUT_NONE) {
      world.wake->wait(guard);
      continue;
    }
    const auto left = end - Clock::now();
    if (left <= left.zero()) return;
    world.wake->wait(guard, left);
  }
}

void dispose(World *world) {
  const zel_HeapID heap = world->heap;
  world->~World();
  heapFree(heap, world);
}

[[noreturn]] void panicOnHang(World &world, std::unique_lock<std::mutex> guard) {
  const std::string state = describeLocked(world);
  guard.unlock();
  panic("world \"%s\" (%u) does not stop within %lld ms (%s)\n%s", world.name.text, world.id,
        static_cast<long long>(stopTimeoutMilliseconds.load()), state.c_str(),
        reportOnThread(world.thread.native_handle()).c_str());
}

/* The world that its owner wants to end, from now on marked so; panics when it cannot be. */
World *markStopping(Worlds &all, zel_WorldID id) {
  {
    const std::lock_guard guard(all.mutex);
    const auto found = all.alive.find(id);
    if (found != all.alive.end() && !found->second->stopping && found->second != currentWorld) {
      World *world = found->second;
      world->stopping = true;
      world->wake->one();
      return world;
    }
  }
  if (currentWorld != nullptr && currentWorld->id == id) {
    panic("world \"%s\" (%u) destroys itself", currentWorld->name.text, id);
  }
  panic("world %u is destroyed, but does not exist or is being destroyed already", id);
}

}  // namespace

void configureWorlds(const WorldSettings &settings) {
  stopTimeoutMilliseconds = settings.stopTimeout.count();
  setLockSlice(settings.lockSlice);
}

void makeWakeUps() {
  if (putOff != nullptr) std::exchange(putOff, nullptr)->one();
}

WakeUpsPutOff::WakeUpsPutOff() {
  putsOff = true;
}

WakeUpsPutOff::~WakeUpsPutOff() {
  putsOff = false;
  makeWakeUps();
}

void waitUntilWorldsIdle() {
  if (currentWorld != nullptr) {
    panic("world \"%s\" waits until all worlds are idle, itself among them",
          currentWorld->name.text);
  }
  Worlds &all = worlds();
  std::unique_lock guard(all.mutex);
  all.settled.wait(guard, [&] { return areAllIdleLocked(all); });
}

uint64_t worldsActivity() {
  Worlds &all = worlds();
  const std::lock_guard guard(all.mutex);
  return all.activity;
}

std::vector<std::string> aliveWorldsAndLocks() {
  std::vector<std::string> alive;
  Worlds &all = worlds();
  {
    const std::lock_guard guard(all.mutex);
    for (const auto &[id, world] : all.alive) {
      alive.push_back(std::string("world ") + world->name.text + " (" + describeLocked(*world) +
                      ")");
    }
  }
  for (std::string &line : aliveLocks()) alive.push_back(std::move(line));
  return alive;
}

}  // namespace host

using namespace host;

extern "C" zel_Status TOLM_WorldCreate(zel_WorldID *world, const char *name, zel_ModuleID,
                                       uint32_t (*body)(void *data), void *data, uint32_t,
                                       zel_HeapID heap) {
  requireNoSpinlock("creates world", name);
  void *memory = heapAlloc(heap, sizeof(World), __builtin_return_address(0));
  if (memory == nullptr) return ZEL_NO_MEMORY;
  auto *created = new (memory) World{.heap = heap, .body = body, .data = data};
  fillName(&created->name, name);
  try {
    created->thread = std::thread(runWorld, std::ref(*created));
  } catch (const std::system_error &) {
    dispose(created);
    return ZEL_NO_MEMORY;
  }
  Worlds &all = worlds();
  const std::lock_guard guard(all.mutex);
  created->id = newIDLocked(all);
  all.alive.emplace(created->id, created);
  /* The thread exists but stays behind its gate until here: nothing can fail any more, and whatever
   * the body makes others do finds the ID in its place. */
  std::atomic_ref(*world).store(created->id, std::memory_order_release);
  created->released = true;
  created->wake->one();
  return ZEL_OK;
}

extern "C" void TOLM_WorldDestroy(zel_WorldID *world) {
  const zel_WorldID id = std::atomic_ref(*world).load(std::memory_order_acquire);
  if (id == ZEL_NO_WORLD) return;
  requireNoSpinlock("destroys a world", std::to_string(id).c_str());
  makeWakeUps();
  Worlds &all = worlds();
  World *ending = markStopping(all, id);
  {
    std::unique_lock guard(all.mutex);
    const std::chrono::milliseconds timeout(stopTimeoutMilliseconds.load());
    const bool ended =
        all.settled.wait_for(guard, timeout, [&] { return ending->state == WorldState::Ended; });
    if (!ended) panicOnHang(*ending, std::move(guard));
  }
  ending->thread.join();
  {
    /* From here on a late wake-up finds no world, and only now may the record go. */
    const std::lock_guard guard(all.mutex);
    all.alive.erase(id);
    all.settled.notify_all();
  }
  std::atomic_ref(*world).store(ZEL_NO_WORLD, std::memory_order_release);
  dispose(ending);
}

extern "C" zel_Status zel_WorldWait(uint64_t event, zel_SpinlockHandle lock, uint32_t timeout,
                                    const char *reason) {
  World *world = currentWorld;
  if (world == nullptr) {
    panic("%s waits as a world (%s) and is none", describeThread(gettid()).c_str(), reason);
  }
  requireNoSpinlock("waits", reason);
  if (event != 0 || lock != ZEL_NO_SPINLOCK) {
    panic("world \"%s\" waits (%s) for an event or with a lock: neither is served",
          world->name.text, reason);
  }
  Worlds &all = worlds();
  std::unique_lock guard(all.mutex);
  world->state = WorldState::Waiting;
  world->reason = reason;
  ++all.activity;
  all.settled.notify_all();
  sleepUntilDue(*world, guard, timeout);
  world->state = WorldState::Running;
  ++all.activity;
  world->woken = false;
  return world->stopping ? ZEL_WORLD_STOPPING : ZEL_OK;
}

extern "C" void zel_WorldForceWakeup(zel_WorldID id) {
  std::shared_ptr<WakeUp> wake;
  {
    Worlds &all = worlds();
    const std::lock_guard guard(all.mutex);
    const auto found = all.alive.find(id);
    if (found == all.alive.end()) return;
    World &world = *found->second;
    /* One that runs, or has been woken already, looks before it waits. */
    if (!world.woken && world.state == WorldState::Waiting) wake = world.wake;
    world.woken = true;
  }
  if (wake == nullptr) return;
  if (putsOff) std::swap(wake, putOff);
  if (wake != nullptr) wake->one();
}

extern "C" void zel_WorldSleep(uint32_t microseconds) {
  requireNoSpinlock("sleeps", "zel_WorldSleep");
  makeWakeUps();
  const auto setState = [](WorldState state) {
    if (currentWorld == nullptr) return;
    const std::lock_guard guard(worlds().mutex);
    currentWorld->state = state;
  };
  setState(WorldState::Sleeping);
  std::this_thread::sleep_for(std::chrono::microseconds(microseconds));
  setState(WorldState::Running);
}

/* The system takes the processor from its threads whenever it likes; what is left to check is that
 * a world that declares itself ready for that holds no lock. */
extern "C" void tolmapi_PreemptionEnable(void) {
  requireNoSpinlock("enables preemption", "tolmapi_PreemptionEnable");
}

/* The kernel keeps the number in a place of the thread's own (rseq), unless the C library has not
 * asked for that; then it is below zero there. */
extern "C" uint32_t tolmapi_GetPCPUNumPreemptible(void) {
  const auto *area = static_cast<const char *>(__builtin_thread_pointer()) + __rseq_offset;
  const uint32_t known = reinterpret_cast<const volatile struct rseq *>(area)->cpu_id;
  if (static_cast<int32_t>(known) >= 0) return known;
  const int processor = sched_getcpu();
  return processor < 0 ? 0 : static_cast<uint32_t>(processor);
}
