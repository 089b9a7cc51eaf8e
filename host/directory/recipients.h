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

  /* What there is to tell at the start. Does not count towards the bound: whoever subscribes is told
   * all that there is, however much. Comes before every other call. */
  void tellAtStart(const KarstEntryHeader &header, zel_Status status);

  /* A change. Where the queue is full it is lost: the first one lost puts a ZEL_SUB_OVERFLOW behind
   * what is due, and until that call begins all that follow are lost too, since what it makes the
   * subscriber read contains them. Returns whether this was the first one lost. */
  bool tell(const KarstEntryHeader &header, zel_Status status);

  /* Puts one call in place of the changes that are due. What there was to tell at the start stays:
   * who reads everything again would not find in it what had gone before. */
  void tellResync();

  /* Puts one call, the last one ever, in place of all that is due. */
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
  size_t atStart_ = 0;      /* calls at the front that do not count towards the bound */
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
