/* The recorder: what an access is compared with, what synchronises, and the reports. One OS thread,
 * no lock.
 */
#include "sim/access/recorder.h"

#include <dlfcn.h>
#include <link.h>

#include <cstring>

#include "host/kernel/module_loader.h"
#include "host/kernel/panic.h"
#include "host/kernel/text.h"
#include "sim/lock_order.h"
#include "sim/locks.h"

namespace sim::access {

namespace {

bool observes(int order) {
  return order == __ATOMIC_CONSUME || order == __ATOMIC_ACQUIRE || order == __ATOMIC_ACQ_REL ||
         order == __ATOMIC_SEQ_CST;
}

bool publishes(int order) {
  return order == __ATOMIC_RELEASE || order == __ATOMIC_ACQ_REL || order == __ATOMIC_SEQ_CST;
}

const char *verb(Kind kind) {
  switch (kind) {
    case Kind::Read:
      return "reads";
    case Kind::Write:
      return "writes";
    case Kind::AtomicRead:
      return "atomically reads";
    case Kind::AtomicWrite:
      return "atomically writes";
  }
  return "";
}

std::string did(const Access &access) {
  if (access.frees) return "gives it back";
  return host::formatText("%s %zu bytes", verb(access.kind), access.size);
}

uintptr_t addressOf(const void *object) {
  return reinterpret_cast<uintptr_t>(object);
}

/* The writable segments of the object that contains `code`. */
struct Image {
  uintptr_t code;
  std::vector<std::pair<uintptr_t, size_t>> segments;
};

int collectSegments(dl_phdr_info *info, size_t, void *data) {
  auto *image = static_cast<Image *>(data);
  bool contains = false;
  std::vector<std::pair<uintptr_t, size_t>> writable;
  for (size_t i = 0; i < info->dlpi_phnum; ++i) {
    const auto &segment = info->dlpi_phdr[i];
    if (segment.p_type != PT_LOAD) continue;
    const uintptr_t start = info->dlpi_addr + segment.p_vaddr;
    contains = contains || image->code - start < segment.p_memsz;
    if (segment.p_flags & PF_W) writable.emplace_back(start, segment.p_memsz);
  }
  if (contains) image->segments = writable;
  return contains;
}

}  // namespace

Recorder::Recorder(Scheduler &scheduler)
    : scheduler_(scheduler), rules_(stacks_), arena_(*this), shadow_(arena_.base(), Arena::size) {
  rules_.attach(arena_);
  host::setHeapMemory(&arena_);
  watching = this;
}

Recorder::~Recorder() {
  watching = nullptr;
  host::setHeapMemory(nullptr);
  for (const auto &fiber : scheduler_.fibers()) fiber->strand = nullptr;
}

void Recorder::instrumented(const void *code) {
  Image image{addressOf(code), {}};
  dl_iterate_phdr(collectSegments, &image);
  for (const auto &[start, size] : image.segments) {
    shadow_.clear(start, size);
    forget(start, size);
    rules_.ended(start, size);
  }
}

/* ---- Accesses -------------------------------------------------------------------------------- */

Moment Recorder::now(const void *code) const {
  const Fiber &fiber = scheduler_.running();
  if (!code && fiber.callDepth > 0) code = fiber.callSite;
  return {scheduler_.steps(), code, fiber.id(), fiber.strand->stack, lockSet(fiber)};
}

void Recorder::access(const void *memory, size_t size, Kind kind, const void *code) {
  if (size == 0) return;
  const Strand &strand = running();
  const Access access{addressOf(memory), size, kind, now(code)};
  const Block *block = nullptr;
  if (arena_.contains(access.address)) {
    block = arena_.find(access.address);
    requireAlive(block, access);
  }
  const std::string wrong = rules_.check(access, block, scheduler_.running());
  if (!wrong.empty()) stop(wrong, access);
  record(access, strand);
}

void Recorder::requireAlive(const Block *block, const Access &access) {
  const bool inside = block && access.address >= block->base &&
                      access.address - block->base + access.size <= block->size;
  if (inside && block->live) return;
  stop(inside ? "memory is touched that was given back" : "memory is touched that nobody was given",
       access);
}

void Recorder::record(const Access &access, const Strand &strand) {
  const Shadow::Race race = shadow_.record(access, strand);
  if (!race.found) return;
  stop("a race: neither of two accesses happens before the other\nThe earlier one: " +
           text(race.earlier.at, did(race.earlier)) + "The later one:",
       access);
}

void Recorder::given(Block &block) {
  running();
  block.allocated = now(nullptr);
  rules_.blockBegins(block);
}

void Recorder::taken(Block &block) {
  const Strand &strand = running();
  block.freed = now(nullptr);
  record({block.base, block.size, Kind::Write, block.freed, true}, strand);
  shadow_.clear(block.base, block.size);
  forget(block.base, block.size);
  rules_.blockEnds(block);
}

/* ---- Atomics --------------------------------------------------------------------------------- */

/* A release store, and the updates that follow it, are the head and the body of a release sequence:
 * who observes any of them knows what the head's fiber knew. Any other store begins anew. */

void Recorder::atomicRead(const void *memory, size_t size, int order, const void *code) {
  access(memory, size, Kind::AtomicRead, code);
  const auto found = published_.find(addressOf(memory));
  if (found == published_.end()) return;
  Strand &strand = running();
  (observes(order) ? strand.clock : strand.unfenced).join(found->second);
}

void Recorder::atomicWrite(const void *memory, size_t size, int order, const void *code) {
  access(memory, size, Kind::AtomicWrite, code);
  Strand &strand = running();
  if (publishes(order)) {
    published_[addressOf(memory)] = strand.clock;
    strand.tick();
  } else if (strand.hasFence) {
    published_[addressOf(memory)] = strand.fenced;
  } else {
    published_.erase(addressOf(memory));
  }
}

void Recorder::atomicUpdate(const void *memory, size_t size, int order, const void *code) {
  access(memory, size, Kind::AtomicWrite, code);
  Strand &strand = running();
  const auto found = published_.find(addressOf(memory));
  if (found != published_.end()) {
    (observes(order) ? strand.clock : strand.unfenced).join(found->second);
  }
  if (publishes(order)) {
    published_[addressOf(memory)].join(strand.clock);
    strand.tick();
  } else if (strand.hasFence) {
    published_[addressOf(memory)].join(strand.fenced);
  }
}

void Recorder::fence(int order) {
  Strand &strand = running();
  if (observes(order)) strand.clock.join(strand.unfenced);
  if (!publishes(order)) return;
  strand.fenced = strand.clock;
  strand.hasFence = true;
  strand.tick();
}

/* ---- Happens before -------------------------------------------------------------------------- */

Strand &Recorder::beginStrand(const Fiber &fiber) {
  if (fiber.id() >= names_.size()) names_.resize(fiber.id() + 1);
  names_[fiber.id()] = &fiber.name();
  fiber.strand = &strands_.begin(fiber.id());
  return *fiber.strand;
}

void Recorder::fiberBegins(const Fiber &fiber) {
  const auto bottom = reinterpret_cast<uintptr_t>(fiber.stackBottom());
  const auto size = static_cast<size_t>(fiber.stackTop() - fiber.stackBottom());
  shadow_.clear(bottom, size);
  forget(bottom, size);
}

void Recorder::fiberEnds(Fiber &fiber) {
  if (fiber.strand) strands_.end(*fiber.strand);
  fiber.strand = nullptr;
}

void Recorder::passOn(Fiber &fiber) {
  Strand &giver = running();
  strandOf(fiber).clock.join(giver.clock);
  giver.tick();
}

void Recorder::publish(const void *object) {
  Strand &strand = running();
  published_[addressOf(object)].join(strand.clock);
  strand.tick();
}

void Recorder::observe(const void *object) {
  const auto found = published_.find(addressOf(object));
  if (found != published_.end()) running().clock.join(found->second);
}

void Recorder::forget(uintptr_t first, size_t size) {
  published_.erase(published_.lower_bound(first), published_.lower_bound(first + size));
}

/* ---- Texts ----------------------------------------------------------------------------------- */

std::string Recorder::text(const Moment &moment, const std::string &what) const {
  const std::string *name = moment.fiber < names_.size() ? names_[moment.fiber] : nullptr;
  return host::formatText("%s %s at step %llu, holding %s\n", name ? name->c_str() : "nobody",
                          what.c_str(), static_cast<unsigned long long>(moment.step),
                          lockSetText(moment.locks).c_str()) +
         stacks_.text(moment.code, moment.stack);
}

std::string Recorder::callStack() const {
  const Fiber &fiber = scheduler_.running();
  return fiber.strand ? stacks_.text(nullptr, fiber.strand->stack) : std::string();
}

std::string Recorder::describe(uintptr_t address) {
  if (arena_.contains(address)) {
    const Block *block = arena_.find(address);
    if (!block) return "memory of the module heap that was never given\n";
    std::string lines =
        host::formatText("byte %td of a block of %zu bytes\n",
                         static_cast<ptrdiff_t>(address - block->base), block->size);
    lines += text(block->allocated, "allocated it");
    if (!block->live) lines += text(block->freed, "freed it");
    return lines;
  }
  for (const auto &fiber : scheduler_.fibers()) {
    const char *place = reinterpret_cast<const char *>(address);
    if (place < fiber->stackBottom() || place >= fiber->stackTop()) continue;
    return host::formatText("the stack of %s, %td bytes below its top\n", fiber->name().c_str(),
                            fiber->stackTop() - place);
  }
  return host::symbolize(reinterpret_cast<const void *>(address)) + "\n";
}

void Recorder::stop(const std::string &headline, const Access &access) {
  const std::string report =
      headline + "\n" + text(access.at, did(access)) + "The memory: " + describe(access.address);
  host::panic("%s", report.c_str());
}

/* ---- access.h -------------------------------------------------------------------------------- */

void begins(const Fiber &fiber) {
  if (watching) watching->fiberBegins(fiber);
}

void ends(Fiber &fiber) {
  if (watching) watching->fiberEnds(fiber);
}

void passOn(Fiber &fiber) {
  if (watching) watching->passOn(fiber);
}

void publish(const void *object) {
  if (watching) watching->publish(object);
}

void observe(const void *object) {
  if (watching) watching->observe(object);
}

void forget(const void *object) {
  if (watching) watching->forget(addressOf(object), 1);
}

void noteRead(const void *memory, size_t size) {
  if (watching) watching->access(memory, size, Kind::Read, nullptr);
}

void noteText(const char *text) {
  if (watching && text) watching->access(text, std::strlen(text) + 1, Kind::Read, nullptr);
}

void noteWrite(const void *memory, size_t size) {
  if (watching) watching->access(memory, size, Kind::Write, nullptr);
}

void noteAtomicRead(const void *memory, size_t size, int order) {
  if (watching) watching->atomicRead(memory, size, order, nullptr);
}

void noteAtomicWrite(const void *memory, size_t size, int order) {
  if (watching) watching->atomicWrite(memory, size, order, nullptr);
}

void noteAtomicUpdate(const void *memory, size_t size, int order) {
  if (watching) watching->atomicUpdate(memory, size, order, nullptr);
}

}  // namespace sim::access
