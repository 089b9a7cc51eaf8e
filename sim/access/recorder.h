/* The recorder of memory accesses: every access of instrumented code comes here, is a point at which
 * the scheduler may switch, and is compared with what is known of its memory. Whatever is wrong with
 * it stops the system:
 *
 *   - memory of the module heap that nobody was given, or that was given back (arena.h)
 *   - a slot that is free, a field without its guard (rules.h)
 *   - a race with an earlier access (shadow.h)
 *
 * A machine has one. It costs nothing before an instrumented module is loaded. One OS thread, no
 * lock.
 */
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "sim/access/access.h"
#include "sim/access/arena.h"
#include "sim/access/call_stacks.h"
#include "sim/access/clock.h"
#include "sim/access/rules.h"
#include "sim/access/shadow.h"
#include "sim/access/strand.h"
#include "sim/scheduler.h"

namespace sim::access {

class Recorder final : private Arena::Listener {
 public:
  explicit Recorder(Scheduler &scheduler);
  ~Recorder() override;
  Recorder(const Recorder &) = delete;
  Recorder &operator=(const Recorder &) = delete;

  /* Starts watching: an instrumented object, which contains `code`, has been mapped. */
  void instrumented(const void *code);

  Rules &rules() { return rules_; }

  /* ---- What instrumented code does, on the running fiber. ------------------------------------ */

  void enterFunction(const void *returnTo) {
    Strand &strand = running();
    strand.stack = stacks_.enter(strand.stack, returnTo);
  }
  void leaveFunction() {
    Strand &strand = running();
    strand.stack = stacks_.leave(strand.stack);
  }

  /* Another fiber may go on before the access, except inside a platform call: the host's own short
   * sections stay whole. */
  void point() {
    if (scheduler_.running().callDepth == 0) scheduler_.point();
  }

  void access(const void *memory, size_t size, Kind kind, const void *code);

  /* Where the C++ memory model has an atomic access publish or observe. */
  void atomicRead(const void *memory, size_t size, int order, const void *code);
  void atomicWrite(const void *memory, size_t size, int order, const void *code);
  void atomicUpdate(const void *memory, size_t size, int order, const void *code);
  void fence(int order);

  /* ---- What access.h tells. ------------------------------------------------------------------ */

  void fiberBegins(const Fiber &fiber);
  void fiberEnds(Fiber &fiber);
  void passOn(Fiber &fiber);
  void publish(const void *object);
  void observe(const void *object);
  void forget(uintptr_t first, size_t size);

  /* ---- Texts --------------------------------------------------------------------------------- */

  /* "fiber reads 4 bytes at step 12, holding ...", and the call stack. */
  std::string text(const Moment &moment, const std::string &did) const;
  std::string callStack() const; /* of the running fiber */
  std::string describe(uintptr_t address);
  [[noreturn]] void stop(const std::string &headline, const Access &access);

 private:
  Strand &strandOf(const Fiber &fiber) { return fiber.strand ? *fiber.strand : beginStrand(fiber); }
  Strand &beginStrand(const Fiber &fiber);
  Strand &running() { return strandOf(scheduler_.running()); }
  Moment now(const void *code) const;
  void requireAlive(const Block *block, const Access &access);
  void record(const Access &access, const Strand &strand);

  void given(Block &block) override;
  void taken(Block &block) override;

  Scheduler &scheduler_;
  CallStacks stacks_;
  Strands strands_;
  Rules rules_;
  Arena arena_;
  Shadow shadow_;
  std::map<uintptr_t, Clock> published_;   /* by object, and by address of an atomic */
  std::vector<const std::string *> names_; /* of fibers, by ID; index 0: the driver */
};

}  // namespace sim::access
