/* Subscriptions and status registrations: what each has due and how it is told. Everything is
 * guarded by the directory's lock.
 */
#pragma once

#include <cstddef>
#include <cstdint>
#include <deque>

#include "host/directory/delivery.h"
#include "platform/karst_directory.h"

namespace host {

class Subscription final : public Recipient {
 public:
  /* `alive` counts the subscriptions until their last call has returned. */
  Subscription(const KarstQuery *query, KarstSubscriptionFn fn, void *data, size_t bound,
               size_t *alive);
  ~Subscription() override;

  bool is(const KarstQuery *query, KarstSubscriptionFn fn, void *data) const;

  /* An entry that matched already at the start. Does not count towards the bound: whoever
   * subscribes is told all that there is, however much. Comes before every other call. */
  void tellExisting(const KarstEntryHeader &header);

  /* A change. Where the queue is full it is lost: the first one lost puts a ZEL_SUB_OVERFLOW behind
   * what is due, and until that call begins all that follow are lost too, since what it makes the
   * subscriber read contains them. Returns whether this was the first one lost. */
  bool tell(const KarstEntryHeader &header, zel_Status status);

  /* Put one call in place of all that is due; the second is the last one ever. */
  void tellResync();
  void tellCancelled();

  void dropDue();

  bool due() const override { return !calls_.empty(); }

 private:
  struct Call {
    KarstEntryHeader header;
    zel_Status status;
  };

  void serve(std::unique_lock<Mutex> &lock) override;

  const KarstQuery *const query_; /* names the subscription; not read */
  const KarstSubscriptionFn fn_;
  void *const data_;
  const size_t bound_;
  size_t *const alive_;
  std::deque<Call> calls_;
  size_t existing_ = 0;     /* calls at the front that do not count towards the bound */
  bool overflowed_ = false; /* the last call due is the overflow's */
};

class StatusRegistration final : public Recipient {
 public:
  /* A registration starts from unusable, of which nobody need be told. */
  StatusRegistration(KarstStatusFn fn, void *data) : fn_(fn), data_(data) {}

  bool is(KarstStatusFn fn, void *data) const { return fn_ == fn && data_ == data; }

  /* The directory has turned from usable to unusable or back. */
  void tellChange();

  void remove();
  bool removed() const { return removed_; }

  bool due() const override { return changes_ != 0; }

 private:
  void serve(std::unique_lock<Mutex> &lock) override;

  const KarstStatusFn fn_;
  void *const data_;
  bool told_ = false;    /* usable, as the last call said */
  unsigned changes_ = 0; /* calls due, which alternate */
  bool removed_ = false;
};

}  // namespace host
