/* The rules: which object an access is to, whether its slot is free, who may touch the field. One OS
 * thread, no lock.
 */
#include "sim/access/rules.h"

#include <algorithm>
#include <cstring>

#include "host/kernel/panic.h"
#include "host/kernel/text.h"
#include "platform/zel.h"
#include "sim/locks.h"

namespace sim::access {

namespace {

bool overlap(size_t offset, size_t size, size_t otherOffset, size_t otherSize) {
  return offset < otherOffset + otherSize && otherOffset < offset + size;
}

bool within(size_t offset, size_t size, const Range &range) {
  return offset >= range.offset && offset + size <= size_t{range.offset} + range.length;
}

bool holdsNamed(const Fiber &fiber, const char *name) {
  for (uint32_t i = 0; i < fiber.heldCount; ++i) {
    if (std::strcmp(fiber.held[i]->name.text, name) == 0) return true;
  }
  return false;
}

bool holdsOwn(const Fiber &fiber, const Structure &structure, uintptr_t object) {
  zel_SpinlockHandle handle;
  std::memcpy(&handle, reinterpret_cast<const void *>(object + structure.ownLock), sizeof handle);
  const auto *end = fiber.held.data() + fiber.heldCount;
  return std::find(fiber.held.data(), end, reinterpret_cast<Spinlock *>(handle)) != end;
}

/* What the fiber lacks to touch the field; null when it may. */
const char *lacks(const Field &field, const Structure &structure, uintptr_t object, Kind kind,
                  const Fiber &fiber) {
  if (field.guard == Guard::Free) return nullptr;
  if (field.guard == Guard::Constant) return writes(kind) ? "is constant by now" : nullptr;
  if (field.guard == Guard::Atomic) return isAtomic(kind) ? nullptr : "must be touched atomically";
  if (field.unlockedReads) {
    if (kind == Kind::AtomicRead) return nullptr;
    if (kind == Kind::Write) return "is read without a lock and must be written atomically";
  }
  if (field.guard == Guard::Lock) {
    return holdsNamed(fiber, structure.lock) ? nullptr : "needs the outer lock";
  }
  const bool own = holdsOwn(fiber, structure, object);
  if (field.guard == Guard::OwnLock) return own ? nullptr : "needs its own lock";
  const bool outer = holdsNamed(fiber, structure.lock);
  if (writes(kind)) {
    return own && outer ? nullptr : "needs the outer and its own lock to be written";
  }
  return own || outer ? nullptr : "needs the outer or its own lock to be read";
}

void requireSound(const Structure &structure) {
  for (const Field &field : structure.fields) {
    const std::string name = std::string(structure.name) + "." + field.name;
    const bool ownNeeded = field.guard == Guard::OwnLock || field.guard == Guard::Both;
    if (size_t{field.offset} + field.length > structure.size) {
      host::panic("%s lies outside its structure", name.c_str());
    }
    if (field.guard == Guard::Free && !field.reason) {
      host::panic("%s is guarded by nothing, without a reason", name.c_str());
    }
    if (ownNeeded && structure.ownLock == Structure::noLock) {
      host::panic("%s needs a lock of its own that the structure has not", name.c_str());
    }
  }
  for (const Exemption &exemption : structure.exempt) {
    if (!exemption.reason) host::panic("%s is exempt without a reason", exemption.function);
  }
}

}  // namespace

/* ---- Declarations ---------------------------------------------------------------------------- */

Region &Rules::add(const Structure &structure, const Slots *slots, const void *base, size_t count) {
  const auto address = reinterpret_cast<uintptr_t>(base);
  Region &region = regions_.emplace_back(Region{address, count, &structure, slots, {}});
  region.lives.resize(count);
  if (!arena_->contains(address)) {
    outside_[address + region.size()] = &region;
    return region;
  }
  Block *block = arena_->find(address);
  if (!block || !block->live || block->region) {
    host::panic("%s is declared where no block is, or one that is declared already",
                structure.name);
  }
  block->region = &region;
  return region;
}

void Rules::object(const Structure &structure, const void *address) {
  requireSound(structure);
  Region &region = add(structures_.emplace_back(structure), nullptr, address, 1);
  region.lives[0].shared = true;
}

void Rules::pool(const Structure &structure, const Slots &slots, const void *base, size_t count) {
  requireSound(structure);
  if (slots.freeTag.size() != slots.tag.length) {
    host::panic("%s: its tag has another length than the bytes of a free one", structure.name);
  }
  Region &region =
      add(structures_.emplace_back(structure), &slots_.emplace_back(slots), base, count);
  for (Region::Life &life : region.lives) life.shared = true;
}

void Rules::blocks(const Structure &structure, const char *function) {
  requireSound(structure);
  blockRules_.push_back({&structures_.emplace_back(structure), function});
}

void Rules::clear() {
  for (const Region &region : regions_) {
    if (!arena_->contains(region.base)) continue;
    if (Block *block = arena_->find(region.base)) block->region = nullptr;
  }
  outside_.clear();
  blockRules_.clear();
  regions_.clear();
  structures_.clear();
  slots_.clear();
}

void Rules::blockBegins(Block &block) {
  constexpr size_t frames = 4;
  const Moment &at = block.allocated;
  for (const BlockRule &rule : blockRules_) {
    if (rule.structure->size != block.size) continue;
    if (!stacks_.calledFrom(at.code, at.stack, rule.function, frames)) continue;
    regions_.push_back({block.base, 1, rule.structure, nullptr, {Region::Life{}}});
    block.region = &regions_.back();
    return;
  }
}

void Rules::blockEnds(Block &block) {
  if (!block.region) return;
  regions_.remove_if([&](const Region &region) { return &region == block.region; });
  block.region = nullptr;
}

void Rules::ended(uintptr_t address, size_t size) {
  for (auto it = outside_.upper_bound(address); it != outside_.end();) {
    const Region *region = it->second;
    if (region->base >= address + size) break;
    it = outside_.erase(it);
    regions_.remove_if([=](const Region &one) { return &one == region; });
  }
}

/* ---- Checks ---------------------------------------------------------------------------------- */

Region *Rules::regionAt(uintptr_t address, const Block *block) {
  if (block) {
    Region *region = block->region;
    return region && address - region->base < region->size() ? region : nullptr;
  }
  const auto found = outside_.upper_bound(address);
  return found != outside_.end() && found->second->base <= address ? found->second : nullptr;
}

std::string Rules::check(const Access &access, const Block *block, const Fiber &fiber) {
  if (!block && outside_.empty()) return {};
  Region *region = regionAt(access.address, block);
  if (!region) return {};
  const size_t number = (access.address - region->base) / region->structure->size;
  const size_t offset = (access.address - region->base) % region->structure->size;
  if (offset + access.size > region->structure->size) {
    return host::formatText("reaches beyond one %s", region->structure->name);
  }
  if (region->slots) {
    std::string wrong = checkSlot(*region, number, offset, access);
    if (!wrong.empty()) return wrong;
  }
  Region::Life &life = region->lives[number];
  if (!life.touched && !life.shared) life = {.fiber = fiber.id(), .touched = true};
  if (life.fiber != fiber.id()) life.shared = true;
  std::string wrong;
  if (life.shared) wrong = checkFields(*region, number, offset, access, fiber);
  const bool anew = region->slots && writes(access.kind) && access.size == region->structure->size;
  if (anew) life = {.fiber = fiber.id(), .touched = true};
  return wrong;
}

std::string Rules::checkSlot(const Region &region, size_t number, size_t offset,
                             const Access &access) {
  const Structure &structure = *region.structure;
  const Slots &slots = *region.slots;
  const auto *slot = reinterpret_cast<const char *>(region.base + number * structure.size);
  if (std::memcmp(slot + slots.tag.offset, slots.freeTag.data(), slots.tag.length) != 0) return {};
  if (writes(access.kind) && access.size == structure.size) return {};
  if (within(offset, access.size, slots.tag)) return {};
  for (const Range &open : slots.open) {
    if (within(offset, access.size, open)) return {};
  }
  return host::formatText("%s number %zu is free: bytes %zu to %zu of it must not be touched",
                          structure.name, number, offset, offset + access.size - 1);
}

std::string Rules::checkFields(const Region &region, size_t number, size_t offset,
                               const Access &access, const Fiber &fiber) {
  const Structure &structure = *region.structure;
  const uintptr_t object = region.base + number * structure.size;
  const bool whole = access.size == structure.size;
  bool declared = whole;
  for (const Field &field : structure.fields) {
    if (!overlap(offset, access.size, field.offset, field.length)) continue;
    declared = true;
    const bool begins = whole && field.guard == Guard::Constant; /* another object, from here on */
    const char *lack = begins ? nullptr : lacks(field, structure, object, access.kind, fiber);
    if (!lack || exempt(structure, access.at)) continue;
    return host::formatText("%s.%s %s; the outer lock is \"%s\"", structure.name, field.name, lack,
                            structure.lock);
  }
  if (declared) return {};
  return host::formatText("byte %zu of %s belongs to no field that was declared", offset,
                          structure.name);
}

bool Rules::exempt(const Structure &structure, const Moment &at) {
  return std::any_of(structure.exempt.begin(), structure.exempt.end(), [&](const Exemption &one) {
    return stacks_.calledFrom(at.code, at.stack, one.function, one.frames);
  });
}

}  // namespace sim::access
