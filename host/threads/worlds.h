/* What the rest of the host asks of the worlds and spinlocks layer, beside the platform functions
 * (zel_World..., TOLM_World..., zel_Spinlock..., zel_LockDomain..., tolmapi_Preemption...).
 * Implemented by host/threads and by sim.
 */
#pragma once

#include <chrono>
#include <cstdint>
#include <string>
#include <vector>

namespace host {

struct WorldSettings {
  /* A stop that takes longer is fatal: the report says which world hangs and where. */
  std::chrono::milliseconds stopTimeout{30'000};
  /* A lock that is held longer while somebody waits for it: its holder is asked to give way. */
  std::chrono::microseconds lockSlice{2'000};
};

/* Takes effect at once, for stops and holds that begin later. Any thread, under any lock. */
void configureWorlds(const WorldSettings &settings);

/* In its life a wake-up that the calling thread asks for is put off until its end, or until the thread
 * blocks: modules wake their worlds under a lock, which the world would run straight into, and, on the
 * processor of its holder, keep it from giving it back. Not one inside another. */
class WakeUpsPutOff {
 public:
  WakeUpsPutOff();
  ~WakeUpsPutOff();
  WakeUpsPutOff(const WakeUpsPutOff &) = delete;
  WakeUpsPutOff &operator=(const WakeUpsPutOff &) = delete;
};

/* Returns when every world sleeps in its wait with no wake-up pending, or has ended. Blocks; not
 * from a world, which panics. */
void waitUntilWorldsIdle();

/* How often any world has been woken or has gone to sleep: unchanged between two idle moments means
 * that nothing ran in between. */
uint64_t worldsActivity();

/* What is alive: "world KARSTResolverCache (waits: KARSTResolverCacheWorld)", "lock ... in domain
 * ...", one line each; empty when all was given back. */
std::vector<std::string> aliveWorldsAndLocks();

}  // namespace host
