/* Slots of vector clocks: given out, taken back, used again. One OS thread, no lock. */
#include "sim/access/strand.h"

#include "sim/lock_order.h"
#include "sim/locks.h"

namespace sim::access {

uint32_t lockSet(const Fiber &fiber) {
  uint32_t set = 0;
  for (uint32_t i = 0; i < fiber.heldCount; ++i) set = set << 8 | fiber.held[i]->lockClass;
  return set;
}

std::string lockSetText(uint32_t set) {
  if (set == 0) return "no lock";
  std::string text;
  for (int shift = 24; shift >= 0; shift -= 8) {
    const uint32_t lock = set >> shift & 0xff;
    if (lock != 0) text += (text.empty() ? "" : ", ") + LockOrder::name(lock);
  }
  return text;
}

Strand &Strands::begin(uint32_t fiber) {
  Strand *strand;
  if (strands_.size() >= fewest && !ended_.empty()) {
    strand = strands_[ended_.front()].get();
    ended_.pop_front();
    const uint16_t slot = strand->slot;
    const uint32_t time = strand->time();
    *strand = {};
    strand->slot = slot;
    strand->clock.set(slot, time);
  } else {
    strand = strands_.emplace_back(std::make_unique<Strand>()).get();
    strand->slot = static_cast<uint16_t>(strands_.size() - 1);
  }
  strand->fiber = fiber;
  strand->tick();
  return *strand;
}

void Strands::end(Strand &strand) {
  ended_.push_back(strand.slot);
}

}  // namespace sim::access
