/* What the rest of the simulator tells the recorder of memory accesses (recorder.h): which fibers
 * begin and end, what happens before what, and what the platform itself reads and writes in a
 * module's place. Nothing happens while no instrumented module is being watched. One OS thread, no
 * lock.
 */
#pragma once

#include <cstddef>
#include <cstdint>

#include "sim/fiber.h"

namespace sim::access {

class Recorder;

/* Of the machine that exists, once an instrumented module has been loaded; else null. */
inline Recorder *watching = nullptr;

/* ---- Fibers ---------------------------------------------------------------------------------- */

void begins(const Fiber &fiber); /* on a stack that may have been another one's */
void ends(Fiber &fiber);

/* All that the running fiber has done happens before what the new one will do. */
void passOn(Fiber &fiber);

/* ---- Happens before -------------------------------------------------------------------------- */

/* Whatever anybody did before he published to the object happens before what anybody does after he
 * observed it. Only what the platform promises to modules is told here: a module must not live on
 * the accidents of a host's own locks. An object is forgotten when it ends. */
void publish(const void *object);
void observe(const void *object);
void forget(const void *object);

/* ---- Memory ---------------------------------------------------------------------------------- */

/* The running fiber, in a platform function, reads or writes what belongs to its caller. */
void noteRead(const void *memory, size_t size);
void noteText(const char *text); /* read, with its NUL */
void noteWrite(const void *memory, size_t size);
void noteAtomicRead(const void *memory, size_t size, int order);
void noteAtomicWrite(const void *memory, size_t size, int order);
void noteAtomicUpdate(const void *memory, size_t size, int order); /* read and write in one */

}  // namespace sim::access

namespace sim {

/* Clients that give an instance, or anything else, to each other: all before a give() happens before
 * what follows a take(). */
class HandOver {
 public:
  HandOver() = default;
  ~HandOver() { access::forget(this); }
  HandOver(const HandOver &) = delete;
  HandOver &operator=(const HandOver &) = delete;

  void give() const { access::publish(this); }
  void take() const { access::observe(this); }
};

}  // namespace sim
