/* The directory's calls into modules. Each subscription and status registration goes through a record
 * of the simulator's, so that every call is seen: who is called for what, in which order, and that
 * none comes after the last. One OS thread, no lock.
 */
#pragma once

#include <list>
#include <map>
#include <tuple>

#include "host/directory/directory.h"
#include "platform/karst_directory.h"

namespace sim {

class CallbackTable {
 public:
  CallbackTable();
  ~CallbackTable();
  CallbackTable(const CallbackTable &) = delete;
  CallbackTable &operator=(const CallbackTable &) = delete;

  /* What stands behind the KARST_ functions of the same names. */
  zel_Status subscribe(host::Directory &directory, const KarstQuery *query, KarstSubscriptionFn fn,
                       void *data);
  void unsubscribe(host::Directory &directory, const KarstQuery *query, KarstSubscriptionFn fn,
                   void *data);
  zel_Status registerStatus(host::Directory &directory, KarstStatusFn fn, void *data);
  void deregisterStatus(host::Directory &directory, KarstStatusFn fn, void *data);

  /* Subscriptions whose last call has not returned, and registrations. */
  size_t subscriptions() const { return subscriptions_.size(); }
  size_t registrations() const { return registrations_.size(); }

 private:
  struct Subscription;
  struct Registration;

  static zel_Status callSubscriber(void *record, const KarstEntryHeader *header, void *argument,
                                   zel_Status status);
  static void callStatus(void *record, uint32_t status);

  using Key = std::tuple<const KarstQuery *, const void *, const void *>; /* query, fn, data */

  std::list<Subscription> subscriptions_;   /* oldest first */
  std::multimap<Key, Subscription *> open_; /* not cancelled; of equals the oldest first */
  std::list<Registration> registrations_;
};

}  // namespace sim
