/* Somebody who watches what a module asks and is told, on the fiber and in the moment in which it
 * happens. No scheduling point lies between an event and its report. An observer must not call the
 * platform, nor the directory in a way that waits. One OS thread, no lock.
 */
#pragma once

#include "platform/karst_directory.h"
#include "sim/calls.h"
#include "sim/fiber.h"
#include "sim/locks.h"

namespace sim {

/* A question to the directory, and its answer. */
struct Lookup {
  Call call;
  uint8_t type;                   /* of the entries asked for; 0: by a header */
  zel_UUID uuid;                  /* zero: all of the type */
  uint32_t next;                  /* of KARST_FindEntry */
  zel_Status status;              /* what the module gets */
  const KarstEntryHeader *header; /* what was found; null when nothing was */
};

/* One call of a subscription's callback. */
struct SubscriptionCall {
  KarstSubscriptionFn fn;
  void *data;
  uint8_t type; /* of the query */
  const KarstEntryHeader *header;
  zel_Status status;
};

class Observer {
 public:
  Observer() = default;
  virtual ~Observer() = default;
  Observer(const Observer &) = delete;
  Observer &operator=(const Observer &) = delete;

  /* The fiber has just taken the lock; it is about to give it back. */
  virtual void locked(Fiber &, const Spinlock &) {}
  virtual void unlocking(Fiber &, const Spinlock &) {}

  virtual void lookedUp(Fiber &, const Lookup &) {}
  /* Behind the lookup whose data it was; `record` is as the decoder left it. */
  virtual void decoded(Fiber &, const char * /*name*/, zel_Status, const void * /*record*/) {}
  virtual void toldSelf(Fiber &, const zel_UUID &) {}

  virtual void subscribed(Fiber &, const KarstQuery &, void * /*data*/, zel_Status) {}
  virtual void subscriptionCalls(Fiber &, const SubscriptionCall &) {}
  virtual void subscriptionReturned(Fiber &, const SubscriptionCall &) {}

  virtual void statusRegistered(Fiber &, void * /*data*/, zel_Status) {} /* before any call */
  virtual void statusCalls(Fiber &, uint32_t /*status*/) {}
  virtual void statusReturned(Fiber &, uint32_t /*status*/) {}

  virtual void worldCreated(Fiber &, zel_Status) {}
  virtual void worldWaited(Fiber &, zel_Status) {}
  virtual void preemptionAnswered(Fiber &, bool) {}
};

}  // namespace sim
