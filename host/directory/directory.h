/* The local replica of the cluster directory: entries, lookups, subscriptions and their delivery.
 *
 * One lock guards all of it. It is held for moments only and never while somebody is called, so
 * that modules may look up, subscribe and unsubscribe under their spinlocks, and callbacks may call
 * everything here except the waits.
 */
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <vector>

#include "host/kernel/uuid.h"
#include "platform/karst_directory.h"

namespace host {

struct Entry {
  uint8_t type = 0;
  zel_UUID uuid{};
  zel_UUID owner{};
  std::vector<uint8_t> data; /* the marshalled record */
  bool operator==(const Entry &) const = default;
};

struct DirectorySettings {
  /* Threads that make the calls, at least one. A status callback may take long (a module that
   * disables itself waits for its world); the other threads deliver meanwhile. */
  unsigned deliveryThreads = 2;
  /* Changes that a subscription may have due before it overflows. What it is told at its start does
   * not count. */
  size_t queueBound = 1024;
};

class Directory {
 public:
  explicit Directory(const DirectorySettings &settings = {});
  /* Ends delivery: last calls that are due are made, subscriptions that are still installed are
   * reported and told nothing more. Waits for callbacks that run. */
  ~Directory();
  Directory(const Directory &) = delete;
  Directory &operator=(const Directory &) = delete;

  /* ---- What sources do. Any thread; never blocks on delivery. -------------------------------- */

  void setSelf(const zel_UUID &uuid);

  /* Tells the status callbacks, on a delivery thread. Unusable at first. An interruption is told
   * even when it is over before the callback was called; of several such, one. How it ends for
   * subscribers is said at KARST_RegisterStatusCallback. */
  void setUsable(bool usable);

  /* Adds or changes an entry; an equal one changes nothing and tells nobody. Where the owner
   * changes, subscribers learn first that the old pairing is gone (ZEL_NOT_FOUND with the old
   * header), then of the new one. */
  void put(Entry entry);
  /* An unknown one changes nothing. A removed one takes memory until nothing is due any more. */
  void remove(uint8_t type, const zel_UUID &uuid);

  /* Tells every subscription ZEL_SUB_RESYNC in place of the changes that it has due. */
  void resync();

  /* ---- What modules do (behind the KARST_ functions; statuses as there). --------------------- */

  zel_Status registerStatus(KarstStatusFn fn, void *data);
  /* Waits for a call of the pair that runs, unless it is called from inside that very call. */
  void deregisterStatus(KarstStatusFn fn, void *data);
  zel_UUID self() const;
  zel_Status subscribe(const KarstQuery *query, KarstSubscriptionFn fn, void *data);
  /* Of a triple that is installed more than once, the oldest goes. One that was cancelled and has
   * its last call still due does not stand in the way of the same triple's next subscription. */
  void unsubscribe(const KarstQuery *query, KarstSubscriptionFn fn, void *data);
  zel_Status findEntry(const KarstQuery &query, uint32_t next, KarstEntryHeader *header) const;
  zel_Status findFullEntry(const KarstQuery &query, const ExprMshAllocator &allocator,
                           KarstFullEntry **entry) const;
  zel_Status findFullEntry(const KarstEntryHeader &header, const ExprMshAllocator &allocator,
                           KarstFullEntry **entry) const;

  /* ---- What reports and the kernel ask. The two waits: not from inside a callback. ----------- */

  std::optional<Entry> entry(uint8_t type, const zel_UUID &uuid) const;
  std::vector<Entry> entries(uint8_t type) const; /* in ascending order of UUID */
  void waitUntilIdle();         /* returns when nothing is due and no callback runs */
  uint64_t activity() const;    /* calls made so far, of any kind */
  void waitForCallbacks();      /* returns when every callback that runs now has returned */
  size_t subscriptions() const; /* installed or with their last call still due or running */
  uint64_t overflows() const;   /* how often a subscription's queue has overflowed */

 private:
  struct Impl;
  std::unique_ptr<Impl> impl_;
};

}  // namespace host
