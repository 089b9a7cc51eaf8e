/* Records of subscriptions and registrations, and the functions that the directory calls in their
 * place. One OS thread, no lock.
 */
#include "sim/callbacks.h"

#include <algorithm>
#include <iterator>

#include "host/kernel/panic.h"
#include "sim/access/access.h"
#include "sim/lock_order.h"
#include "sim/machine.h"
#include "sim/observer.h"

namespace sim {

struct CallbackTable::Subscription {
  CallbackTable *table;
  const KarstQuery *query;
  KarstSubscriptionFn fn;
  void *data;
  uint8_t type;
  bool cancelled = false; /* only the last call is left */
  std::list<Subscription>::iterator place{};

  Key key() const { return {query, reinterpret_cast<const void *>(fn), data}; }
};

struct CallbackTable::Registration {
  KarstStatusFn fn;
  void *data;
};

CallbackTable::CallbackTable() = default;
CallbackTable::~CallbackTable() = default;

/* ---- Subscriptions --------------------------------------------------------------------------- */

zel_Status CallbackTable::subscribe(host::Directory &directory, const KarstQuery *query,
                                    KarstSubscriptionFn fn, void *data) {
  if (!query || !fn) return ZEL_BAD_PARAM;
  subscriptions_.push_back({this, query, fn, data, query->type, {}});
  Subscription &made = subscriptions_.back();
  made.place = std::prev(subscriptions_.end());
  access::publish(&made);
  const zel_Status status = directory.subscribe(query, &callSubscriber, &made);
  if (status == ZEL_OK) {
    open_.emplace(made.key(), &made);
  } else {
    access::forget(&made);
    subscriptions_.pop_back();
  }
  return status;
}

void CallbackTable::unsubscribe(host::Directory &directory, const KarstQuery *query,
                                KarstSubscriptionFn fn, void *data) {
  const auto found = open_.find({query, reinterpret_cast<const void *>(fn), data});
  if (found == open_.end()) return;
  Subscription &subscription = *found->second;
  open_.erase(found);
  access::publish(&subscription.cancelled);
  subscription.cancelled = true;
  directory.unsubscribe(query, &callSubscriber, &subscription);
}

zel_Status CallbackTable::callSubscriber(void *record, const KarstEntryHeader *header,
                                         void *argument, zel_Status status) {
  auto &subscription = *static_cast<Subscription *>(record);
  Machine &machine = Machine::current();
  Fiber &fiber = machine.scheduler().running();
  access::observe(&subscription);
  if (status == ZEL_SUB_CANCELLED) access::observe(&subscription.cancelled);
  const SubscriptionCall call{subscription.fn, subscription.data, subscription.type, header,
                              status};
  if (Observer *observer = machine.observer()) observer->subscriptionCalls(fiber, call);
  machine.note("subscription is called",
               Argument::entry(call.type, header ? header->uuid : zel_UUID{}), status);
  const zel_Status result = call.fn(call.data, header, argument, status);
  /* On its way out of the last call: this is where the module's code may be unmapped too early. */
  if (status == ZEL_SUB_CANCELLED) machine.scheduler().point();
  machine.note("subscription returns", {});
  requireNoSpinlock(fiber, "returns from a subscription's callback");
  access::publish(&subscription);
  if (Observer *observer = machine.observer()) observer->subscriptionReturned(fiber, call);
  if (status == ZEL_SUB_CANCELLED) {
    access::forget(&subscription);
    access::forget(&subscription.cancelled);
    subscription.table->subscriptions_.erase(subscription.place);
  }
  return result;
}

/* ---- Status ---------------------------------------------------------------------------------- */

zel_Status CallbackTable::registerStatus(host::Directory &directory, KarstStatusFn fn, void *data) {
  if (!fn) return ZEL_BAD_PARAM;
  registrations_.push_back({fn, data});
  access::publish(&registrations_.back());
  const zel_Status status = directory.registerStatus(&callStatus, &registrations_.back());
  if (status != ZEL_OK) {
    access::forget(&registrations_.back());
    registrations_.pop_back();
  }
  Machine &machine = Machine::current();
  if (Observer *observer = machine.observer())
    observer->statusRegistered(machine.scheduler().running(), data, status);
  return status;
}

void CallbackTable::deregisterStatus(host::Directory &directory, KarstStatusFn fn, void *data) {
  const Fiber &fiber = Machine::current().scheduler().running();
  const uint8_t running = LockOrder::classOf(insideStatusCallback);
  /* From inside a call it does not wait for that call. */
  const auto entered = fiber.inside.begin() + fiber.insideCount;
  if (std::find(fiber.inside.begin(), entered, running) == entered)
    LockOrder::requireOrder(fiber, running);
  for (auto it = registrations_.begin(); it != registrations_.end();) {
    if (it->fn == fn && it->data == data) {
      directory.deregisterStatus(&callStatus, &*it);
      access::observe(&*it);
      access::forget(&*it);
      it = registrations_.erase(it);
    } else {
      ++it;
    }
  }
}

void CallbackTable::callStatus(void *record, uint32_t status) {
  const Registration registration = *static_cast<Registration *>(record);
  access::observe(record);
  Machine &machine = Machine::current();
  Fiber &fiber = machine.scheduler().running();
  if (Observer *observer = machine.observer()) observer->statusCalls(fiber, status);
  machine.note("status is called", Argument::number(status));
  {
    const Inside inside(fiber, insideStatusCallback);
    registration.fn(registration.data, status);
  }
  machine.note("status returns", {});
  requireNoSpinlock(fiber, "returns from a status callback");
  access::publish(record);
  if (Observer *observer = machine.observer()) observer->statusReturned(fiber, status);
}

}  // namespace sim
