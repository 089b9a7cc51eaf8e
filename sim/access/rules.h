/* What a test declares about the memory of a module: slots that must not be touched while they are
 * free, and which lock guards which field. The recorder asks here about every access. One OS thread,
 * no lock.
 */
#pragma once

#include <cstddef>
#include <cstdint>
#include <list>
#include <map>
#include <string>
#include <vector>

#include "sim/access/arena.h"
#include "sim/access/call_stacks.h"
#include "sim/access/shadow.h"
#include "sim/fiber.h"

namespace sim::access {

/* Who may touch a field. Nothing is asked of a fiber as long as it is the only one that has ever
 * touched the object: it is still private. */
enum class Guard : uint8_t {
  Lock,     /* holders of the structure's lock */
  OwnLock,  /* holders of the object's own lock */
  Both,     /* holders of both to write, holders of one of them to read */
  Constant, /* anybody to read; nobody writes any more */
  Atomic,   /* anybody, with atomic operations only */
  Free,     /* anybody; the field's reason says why that is right */
};

struct Field {
  uint32_t offset; /* in the structure, bytes */
  uint32_t length;
  const char *name;
  Guard guard;
  const char *reason = nullptr;        /* of Free; must be there */
  const char *unlockedReads = nullptr; /* why atomic reads need no lock; writes are
                                        * atomic then. Null: they need it */
};

/* A function that may do without the guards, by itself (frames: 1) or through what it calls. */
struct Exemption {
  const char *function;
  size_t frames; /* of those innermost it is one */
  const char *reason;
};

struct Structure {
  static constexpr uint32_t noLock = UINT32_MAX;

  const char *name;
  uint32_t size;                   /* bytes */
  const char *lock = "";           /* name of the lock of Lock and Both */
  uint32_t ownLock = noLock;       /* offset of the zel_SpinlockHandle of OwnLock and Both */
  std::vector<Field> fields;       /* other bytes are touched only with the whole structure */
  std::vector<Exemption> exempt{}; /* whoever else does without a guard stops the system */
};

/* A range of bytes within a slot. */
struct Range {
  uint32_t offset;
  uint32_t length;
};

struct Slots {
  Range tag;               /* lies within the slot and tells whether it is free: */
  std::string freeTag;     /* it has these bytes while it is */
  std::vector<Range> open; /* what may be touched meanwhile, besides the tag */
};

/* Objects of one structure that lie one behind the other. */
struct Region {
  uintptr_t base;
  size_t count;
  const Structure *structure;
  const Slots *slots; /* null: the objects are never free */

  struct Life {
    uint32_t fiber = 0; /* the only one that has touched the object; 0: nobody yet */
    bool touched = false;
    bool shared = false;
  };
  std::vector<Life> lives; /* by object */

  size_t size() const { return count * structure->size; }
};

class Rules {
 public:
  explicit Rules(CallStacks &stacks) : stacks_(stacks) {}

  /* An object at an address; it may have been shared already. */
  void object(const Structure &structure, const void *address);

  /* A pool of `count` slots from `base` on. */
  void pool(const Structure &structure, const Slots &slots, const void *base, size_t count);

  /* Every block of the structure's size, from now on, that `function` asks for, itself or through
   * up to three functions in between. */
  void blocks(const Structure &structure, const char *function);

  /* Declarations about memory that ended are gone with it; this ends all of them. */
  void clear();

  /* ---- For the recorder. --------------------------------------------------------------------- */

  void attach(Arena &arena) { arena_ = &arena; }
  void blockBegins(Block &block);
  void blockEnds(Block &block);
  void ended(uintptr_t address, size_t size); /* what lay there outside of blocks */

  /* Why the access is wrong; empty when it is not. `fiber` makes it. */
  std::string check(const Access &access, const Block *block, const Fiber &fiber);

 private:
  struct BlockRule {
    const Structure *structure;
    const char *function;
  };

  Region &add(const Structure &structure, const Slots *slots, const void *base, size_t count);
  Region *regionAt(uintptr_t address, const Block *block);
  std::string checkSlot(const Region &region, size_t number, size_t offset, const Access &access);
  std::string checkFields(const Region &region, size_t number, size_t offset, const Access &access,
                          const Fiber &fiber);
  bool exempt(const Structure &structure, const Moment &at);

  CallStacks &stacks_;
  Arena *arena_ = nullptr;
  std::list<Structure> structures_;
  std::list<Slots> slots_;
  std::list<Region> regions_;
  std::map<uintptr_t, Region *> outside_; /* regions that are not in blocks, by their ends */
  std::vector<BlockRule> blockRules_;
};

}  // namespace sim::access
