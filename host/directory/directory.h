/* The local replica of the cluster directory: entries, lookups, subscriptions and their delivery. */
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
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
  unsigned deliveryThreads = 2;
  size_t queueBound = 1024; /* calls that a subscription may have due before it overflows */
};

class Directory {
 public:
  explicit Directory(const DirectorySettings &settings = {});
  ~Directory(); /* ends delivery; subscriptions that are still installed are reported */

  /* ---- What sources do. Any thread; never blocks on delivery. ---- */

  void setSelf(const zel_UUID &uuid);
  void setUsable(bool usable); /* tells the status callbacks, on a delivery thread */

  /* Adds or changes an entry; an equal one changes nothing and tells nobody. Where the owner changes,
   * subscribers learn first that the old pairing is gone (ZEL_NOT_FOUND with the old header), then of
   * the new one. */
  void put(Entry entry);
  void remove(uint8_t type, const zel_UUID &uuid); /* unknown: nothing happens */

  /* Tells every subscription ZEL_SUB_RESYNC in place of what it has due. */
  void resync();

  /* ---- What modules do (behind the KARST_ functions). ---- */

  zel_Status registerStatus(KarstStatusFn fn, void *data);
  void deregisterStatus(KarstStatusFn fn, void *data);
  zel_UUID self() const;
  zel_Status subscribe(const KarstQuery *query, KarstSubscriptionFn fn, void *data);
  void unsubscribe(const KarstQuery *query, KarstSubscriptionFn fn, void *data);
  zel_Status findEntry(const KarstQuery &query, uint32_t next, KarstEntryHeader *header) const;
  zel_Status findFullEntry(const KarstQuery &query, const ExprMshAllocator &allocator,
                           KarstFullEntry **entry) const;
  zel_Status findFullEntry(const KarstEntryHeader &header, const ExprMshAllocator &allocator,
                           KarstFullEntry **entry) const;

  /* ---- What reports and the kernel ask. ---- */

  std::optional<Entry> entry(uint8_t type, const zel_UUID &uuid) const;
  std::vector<Entry> entries(uint8_t type) const;
  void waitUntilIdle();       /* returns when nothing is due and no callback runs */
  uint64_t activity() const;  /* calls made so far, of any kind */
  void waitForCallbacks();    /* returns when every callback that runs now has returned */
  size_t subscriptions() const; /* installed or with their last call still due */
  uint64_t overflows() const;

 private:
  struct Impl;
  std::unique_ptr<Impl> impl_;
};

}  // namespace host
