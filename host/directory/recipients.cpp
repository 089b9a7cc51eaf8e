/* Subscriptions and status registrations: their queues and their calls. Lock: the directory's. */
#include "host/directory/recipients.h"

#include "host/threads/worlds.h"

namespace host {

Subscription::Subscription(const KarstQuery *query, KarstSubscriptionFn fn, void *data,
                           size_t bound, size_t *alive)
    : query_(query), fn_(fn), data_(data), bound_(bound), alive_(alive) {
  ++*alive_;
}

Subscription::~Subscription() {
  --*alive_;
}

bool Subscription::is(const KarstQuery *query, KarstSubscriptionFn fn, void *data) const {
  return query_ == query && fn_ == fn && data_ == data;
}

void Subscription::tellAtStart(const KarstEntryHeader &header, zel_Status status) {
  calls_.push_back({header, status});
  ++atStart_;
}

bool Subscription::tell(const KarstEntryHeader &header, zel_Status status) {
  if (overflowed_) return false;
  overflowed_ = calls_.size() - atStart_ >= bound_;
  if (overflowed_) {
    calls_.push_back({{}, ZEL_SUB_OVERFLOW});
  } else {
    calls_.push_back({header, status});
  }
  return overflowed_;
}

void Subscription::tellResync() {
  calls_.resize(atStart_);
  overflowed_ = false;
  calls_.push_back({{}, ZEL_SUB_RESYNC});
}

void Subscription::tellCancelled() {
  dropDue();
  calls_.push_back({{}, ZEL_SUB_CANCELLED});
}

void Subscription::dropDue() {
  calls_.clear();
  atStart_ = 0;
  overflowed_ = false;
}

void Subscription::serve(std::unique_lock<Mutex> &lock) {
  const Call call = calls_.front();
  calls_.pop_front();
  if (atStart_ != 0) --atStart_;
  /* Before the call: what changes from here on may be missed by what the call reads. */
  if (call.status == ZEL_SUB_OVERFLOW) overflowed_ = false;
  lock.unlock();
  {
    const WakeUpsPutOff putOff;
    fn_(data_, &call.header, nullptr, call.status);
  }
  lock.lock();
}

void StatusRegistration::tellChange() {
  /* A third change undoes the second before anybody has heard of it, which keeps the calls bounded
   * and alternating and the last one right, and still tells of every interruption. */
  if (changes_ == 2) {
    changes_ = 1;
  } else {
    ++changes_;
  }
}

void StatusRegistration::remove() {
  removed_ = true;
  changes_ = 0;
}

void StatusRegistration::serve(std::unique_lock<Mutex> &lock) {
  --changes_;
  told_ = !told_;
  const uint32_t status = told_ ? KARST_STATUS_USABLE : 0;
  lock.unlock();
  fn_(data_, status);
  lock.lock();
}

}  // namespace host
