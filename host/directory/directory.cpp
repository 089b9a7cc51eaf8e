/* The replica: entries by type and UUID, lookups, and who is told of which change. Lock: the
 * directory's, Impl::mutex.
 */
#include "host/directory/directory.h"

#include <algorithm>
#include <compare>
#include <cstring>
#include <map>
#include <mutex>
#include <utility>

#include "host/directory/delivery.h"
#include "host/directory/recipients.h"
#include "host/kernel/log.h"
#include "host/threads/sync.h"

namespace host {
namespace {

struct Key {
  uint8_t type;
  zel_UUID uuid; /* zero in a subscription: every entry of the type */
  bool operator==(const Key &) const = default;
  /* Byte by byte, by eight bytes at a time. */
  auto operator<=>(const Key &other) const {
    if (type != other.type) return type <=> other.type;
    const uint64_t first = wordAt(0), otherFirst = other.wordAt(0);
    if (first != otherFirst) return first <=> otherFirst;
    return wordAt(8) <=> other.wordAt(8);
  }

 private:
  uint64_t wordAt(size_t offset) const {
    uint64_t word;
    std::memcpy(&word, uuid.bytes + offset, sizeof word);
    return __builtin_bswap64(word); /* the first byte weighs most */
  }
};

/* The directory's own bytes of a header: they tell that it is the directory's, and of which type
 * its entry is, when it comes back as a place in a walk or as the name of an entry. */
struct HeaderMark {
  char text[4];
  uint8_t type;
  uint8_t reserved[23];
};
static_assert(sizeof(HeaderMark) == sizeof(KarstEntryHeader::directory));
constexpr char markText[4] = {'K', 'D', 'I', 'R'};

KarstEntryHeader headerOf(const Entry &entry) {
  HeaderMark mark{};
  std::memcpy(mark.text, markText, sizeof mark.text);
  mark.type = entry.type;
  KarstEntryHeader header{};
  header.uuid = entry.uuid;
  header.owner = entry.owner;
  std::memcpy(header.directory, &mark, sizeof mark);
  header.dataLength = static_cast<uint32_t>(entry.data.size());
  return header;
}

/* The entry that a header names; none for a header that no directory has filled. */
std::optional<Key> keyOf(const KarstEntryHeader &header) {
  HeaderMark mark;
  std::memcpy(&mark, header.directory, sizeof mark);
  if (std::memcmp(mark.text, markText, sizeof mark.text) != 0) return std::nullopt;
  return Key{mark.type, header.uuid};
}

/* What a query asks for; none for a query that names no type. */
std::optional<Key> keyOf(const KarstQuery &query) {
  if ((query.flags & KARST_QUERY_BY_TYPE) == 0) return std::nullopt;
  const bool all = (query.flags & KARST_QUERY_ALL) != 0;
  return Key{query.type, all ? zel_UUID{} : query.uuid};
}

/* An entry and its header, which is made once for all that are told of it or look it up. */
struct KeptEntry : Entry {
  explicit KeptEntry(Entry entry) : Entry(std::move(entry)), header(headerOf(*this)) {}
  KarstEntryHeader header;
};

using SharedEntry =
    std::shared_ptr<const KeptEntry>; /* never changed, so it is read without the lock */
using Entries = std::map<Key, SharedEntry>;

/* The first entry that the key asks for, or the end. */
Entries::iterator firstMatch(Entries &entries, const Key &key) {
  if (!isZero(key.uuid)) return entries.find(key);
  const auto first = entries.lower_bound(key);
  return first != entries.end() && first->first.type == key.type ? first : entries.end();
}

/* The first one behind `after`, or the end. `recent` is a guess where that is, or the end. */
Entries::iterator nextMatch(Entries &entries, const Key &key, const Key &after,
                            Entries::iterator recent) {
  if (!isZero(key.uuid)) return entries.end();
  const bool guessed = recent != entries.end() && recent->first == after;
  const auto next = guessed ? std::next(recent) : entries.upper_bound(after);
  return next != entries.end() && next->first.type == key.type ? next : entries.end();
}

/* Header and data in one block of the caller's. Without the lock: the allocator is a module's. */
zel_Status copyWhole(const SharedEntry &entry, const ExprMshAllocator &allocator,
                     KarstFullEntry **result) {
  if (entry == nullptr) return ZEL_NOT_FOUND;
  const size_t length = entry->data.size();
  void *block = allocator.alloc(allocator.context, sizeof(KarstFullEntry) + length);
  if (block == nullptr) return ZEL_NO_MEMORY;
  std::memcpy(block, &entry->header, sizeof entry->header);
  if (length != 0) {
    std::memcpy(static_cast<uint8_t *>(block) + sizeof entry->header, entry->data.data(), length);
  }
  *result = static_cast<KarstFullEntry *>(block);
  return ZEL_OK;
}

}  // namespace

struct Directory::Impl {
  explicit Impl(const DirectorySettings &settings)
      : queueBound(settings.queueBound),
        delivery(mutex, settings.deliveryThreads, [this] { settle(); }) {}

  /* An entry to be read without the lock, which these two take; null when there is none. */
  SharedEntry firstOf(const Key &wanted); /* what a query asks for */
  SharedEntry exactly(const Key &key);

  /* With the lock held. */
  bool isRecent(const Key &key) const { return recent != entries.end() && recent->first == key; }
  Entries::iterator find(const Key &key) { return isRecent(key) ? recent : entries.find(key); }
  void tell(const std::shared_ptr<Subscription> &subscription, const KarstEntryHeader &header,
            zel_Status status);
  void tellMatching(const KeptEntry &entry, zel_Status status);
  void tellMissed(Subscription &subscription, const Key &key);
  void tellResync();
  void settle();

  const size_t queueBound;
  Mutex mutex;
  /* Guarded by the mutex, to the end. */
  Entries entries;
  /* What was last put or walked to, or the end: who reads the entry that it was told of, walks a step
   * on, or changes the same entry again, need not search. */
  Entries::iterator recent = entries.end();
  zel_UUID self{};
  bool usable = false;
  bool interrupted = false; /* from unusable after usable to the end that settle() finds */
  std::optional<uint64_t> lastBefore; /* while usable again: the last call that may be an old one */
  Entries missed; /* removed since all had last been told everything, and not back */
  std::multimap<Key, std::shared_ptr<Subscription>> installed; /* by what they ask for */
  size_t subscriptionsAlive = 0;
  uint64_t overflows = 0;
  std::vector<std::shared_ptr<StatusRegistration>> registrations; /* removed ones while they run */
  Delivery delivery; /* ends first: its threads use the rest */
};

/* The lock of whoever may schedule calls, which are announced when it is given back. */
class Announcing {
 public:
  explicit Announcing(Mutex &mutex, Delivery &delivery) : lock_(mutex), delivery_(delivery) {}
  ~Announcing() { delivery_.announce(lock_); }
  Announcing(const Announcing &) = delete;
  Announcing &operator=(const Announcing &) = delete;
  std::unique_lock<Mutex> &lock() { return lock_; }

 private:
  std::unique_lock<Mutex> lock_;
  Delivery &delivery_;
};

SharedEntry Directory::Impl::firstOf(const Key &wanted) {
  const std::lock_guard<Mutex> lock(mutex);
  const auto found = isZero(wanted.uuid) ? firstMatch(entries, wanted) : find(wanted);
  return found != entries.end() ? found->second : nullptr;
}

SharedEntry Directory::Impl::exactly(const Key &key) {
  const std::lock_guard<Mutex> lock(mutex);
  const auto found = find(key);
  return found != entries.end() ? found->second : nullptr;
}

void Directory::Impl::tell(const std::shared_ptr<Subscription> &subscription,
                           const KarstEntryHeader &header, zel_Status status) {
  if (subscription->tell(header, status)) ++overflows;
  delivery.schedule(subscription);
}

void Directory::Impl::tellMatching(const KeptEntry &entry, zel_Status status) {
  const auto tellAll = [&](const Key &key) {
    const auto [first, last] = installed.equal_range(key);
    for (auto it = first; it != last; ++it) tell(it->second, entry.header, status);
  };
  tellAll({entry.type, zel_UUID{}});
  if (!isZero(entry.uuid)) tellAll({entry.type, entry.uuid});
}

/* A reader that follows a type only while the directory is usable may still go by entries of which
 * it was not told that they have gone. It is told when it starts to follow the type again. */
void Directory::Impl::tellMissed(Subscription &subscription, const Key &key) {
  /* Who follows one entry looks it up, and is not to be misled by an owner of the past. */
  if (!interrupted || !isZero(key.uuid)) return;
  for (auto it = firstMatch(missed, key); it != missed.end();
       it = nextMatch(missed, key, it->first, it)) {
    subscription.tellAtStart(it->second->header, ZEL_OK);
    subscription.tellAtStart(it->second->header, ZEL_NOT_FOUND);
  }
}

void Directory::Impl::tellResync() {
  for (const auto &[key, subscription] : installed) {
    subscription->tellResync();
    delivery.schedule(subscription);
  }
}

/* Ends an interruption as soon as every status call has returned: readers that had no use for what
 * they were told meanwhile have one now, and read it again. Calls that still run are waited for,
 * since one of a subscription that is cancelled by now may act late on what has changed since. What
 * was missed is kept until it was told: the next interruption may drop calls that are still due. */
void Directory::Impl::settle() {
  if (!usable) return;
  for (const auto &registration : registrations) {
    if (registration->due() || registration->running()) return;
  }
  if (interrupted) {
    if (!lastBefore) lastBefore = delivery.calls();
    if (delivery.anyRunning(*lastBefore)) return;
    interrupted = false;
    tellResync();
  }
  if (delivery.idle()) missed.clear();
}

Directory::Directory(const DirectorySettings &settings) : impl_(std::make_unique<Impl>(settings)) {}

Directory::~Directory() {
  {
    const std::lock_guard<Mutex> lock(impl_->mutex);
    impl_->interrupted = false; /* it is not told any more */
    for (const auto &[key, subscription] : impl_->installed) subscription->dropDue();
    for (const auto &registration : impl_->registrations) registration->remove();
  }
  impl_->delivery.end();
  for (const auto &[key, subscription] : impl_->installed) {
    logWarning("The directory ends with a subscription installed: type %u, %s", key.type,
               isZero(key.uuid) ? "every entry" : toString(key.uuid).c_str());
  }
}

void Directory::setSelf(const zel_UUID &uuid) {
  const std::lock_guard<Mutex> lock(impl_->mutex);
  impl_->self = uuid;
}

zel_UUID Directory::self() const {
  const std::lock_guard<Mutex> lock(impl_->mutex);
  return impl_->self;
}

/* ---- Status ---------------------------------------------------------------------------------- */

void Directory::setUsable(bool usable) {
  const Announcing announcing(impl_->mutex, impl_->delivery);
  if (impl_->usable == usable) return;
  impl_->usable = usable;
  if (!usable) impl_->interrupted = true;
  impl_->lastBefore.reset();
  for (const auto &registration : impl_->registrations) {
    if (registration->removed()) continue;
    registration->tellChange();
    impl_->delivery.schedule(registration);
  }
  impl_->settle();
}

zel_Status Directory::registerStatus(KarstStatusFn fn, void *data) {
  if (fn == nullptr) return ZEL_BAD_PARAM;
  const auto registration = std::make_shared<StatusRegistration>(fn, data);
  const Announcing announcing(impl_->mutex, impl_->delivery);
  impl_->registrations.push_back(registration);
  if (impl_->usable) {
    registration->tellChange();
    impl_->delivery.schedule(registration);
  }
  return ZEL_OK;
}

void Directory::deregisterStatus(KarstStatusFn fn, void *data) {
  Announcing announcing(impl_->mutex, impl_->delivery);
  std::vector<std::shared_ptr<StatusRegistration>> removed;
  for (const auto &registration : impl_->registrations) {
    if (!registration->is(fn, data)) continue;
    registration->remove();
    removed.push_back(registration);
  }
  for (const auto &registration : removed) {
    impl_->delivery.waitUntilReturned(*registration, announcing.lock());
  }
  /* One that still runs, because this call came from inside it, stays for others to wait for. */
  std::erase_if(impl_->registrations, [](const auto &registration) {
    return registration->removed() && !registration->running();
  });
  impl_->settle();
}

/* ---- Changes --------------------------------------------------------------------------------- */

void Directory::put(Entry entry) {
  const auto present = std::make_shared<const KeptEntry>(std::move(entry));
  SharedEntry before; /* ends when others have the lock and the news */
  const Announcing announcing(impl_->mutex, impl_->delivery);
  const Key key{present->type, present->uuid};
  impl_->missed.erase(key);
  if (!impl_->isRecent(key)) impl_->recent = impl_->entries.try_emplace(key).first;
  SharedEntry &place = impl_->recent->second;
  if (place != nullptr && *place == *present) return;
  before = std::exchange(place, present);
  if (before != nullptr && before->owner != present->owner) {
    impl_->tellMatching(*before, ZEL_NOT_FOUND);
  }
  impl_->tellMatching(*present, ZEL_OK);
}

void Directory::remove(uint8_t type, const zel_UUID &uuid) {
  const Announcing announcing(impl_->mutex, impl_->delivery);
  const Key key{type, uuid};
  const auto place = impl_->entries.find(key);
  if (place == impl_->entries.end()) return;
  const SharedEntry before = std::move(place->second);
  if (impl_->recent == place) impl_->recent = impl_->entries.end();
  impl_->entries.erase(place);
  impl_->missed.insert_or_assign(key, before);
  impl_->tellMatching(*before, ZEL_NOT_FOUND);
  impl_->settle();
}

void Directory::resync() {
  const Announcing announcing(impl_->mutex, impl_->delivery);
  impl_->tellResync();
}

/* ---- Subscriptions --------------------------------------------------------------------------- */

zel_Status Directory::subscribe(const KarstQuery *query, KarstSubscriptionFn fn, void *data) {
  if (query == nullptr || fn == nullptr) return ZEL_BAD_PARAM;
  const std::optional<Key> key = keyOf(*query);
  if (!key) return ZEL_BAD_PARAM;
  const Announcing announcing(impl_->mutex, impl_->delivery);
  const auto subscription = std::make_shared<Subscription>(query, fn, data, impl_->queueBound,
                                                           &impl_->subscriptionsAlive);
  /* In one go with the installation: what changes next is told behind what is there now. What is
   * gone comes first, so that a reader has its room free again for what is there. */
  impl_->tellMissed(*subscription, *key);
  for (auto it = firstMatch(impl_->entries, *key); it != impl_->entries.end();
       it = nextMatch(impl_->entries, *key, it->first, it)) {
    subscription->tellAtStart(it->second->header, ZEL_OK);
  }
  /* Who looked one entry up before it subscribed may have found what is gone by now. */
  if (!isZero(key->uuid) && impl_->entries.count(*key) == 0) {
    subscription->tellAtStart(headerOf({key->type, key->uuid, {}, {}}), ZEL_NOT_FOUND);
  }
  impl_->installed.emplace(*key, subscription);
  impl_->delivery.schedule(subscription);
  return ZEL_OK;
}

void Directory::unsubscribe(const KarstQuery *query, KarstSubscriptionFn fn, void *data) {
  const std::optional<Key> key = query != nullptr ? keyOf(*query) : std::nullopt;
  if (!key) return;
  const Announcing announcing(impl_->mutex, impl_->delivery);
  const auto [first, last] = impl_->installed.equal_range(*key);
  const auto it = std::find_if(
      first, last, [=](const auto &place) { return place.second->is(query, fn, data); });
  if (it == last) return;
  const std::shared_ptr<Subscription> subscription = std::move(it->second);
  impl_->installed.erase(it);
  subscription->tellCancelled();
  impl_->delivery.schedule(subscription);
}

/* ---- Lookups --------------------------------------------------------------------------------- */

zel_Status Directory::findEntry(const KarstQuery &query, uint32_t next,
                                KarstEntryHeader *header) const {
  const std::optional<Key> key = keyOf(query);
  if (!key || next > 1) return ZEL_BAD_PARAM;
  const std::optional<Key> after = next == 1 ? keyOf(*header) : key;
  if (!after || after->type != key->type) return ZEL_BAD_PARAM;
  const std::lock_guard<Mutex> lock(impl_->mutex);
  const auto found = next == 1 ? nextMatch(impl_->entries, *key, *after, impl_->recent)
                               : firstMatch(impl_->entries, *key);
  impl_->recent = found;
  if (found == impl_->entries.end()) return ZEL_NOT_FOUND;
  *header = found->second->header;
  return ZEL_OK;
}

zel_Status Directory::findFullEntry(const KarstQuery &query, const ExprMshAllocator &allocator,
                                    KarstFullEntry **entry) const {
  const std::optional<Key> key = keyOf(query);
  if (!key) return ZEL_BAD_PARAM;
  return copyWhole(impl_->firstOf(*key), allocator, entry);
}

zel_Status Directory::findFullEntry(const KarstEntryHeader &header,
                                    const ExprMshAllocator &allocator,
                                    KarstFullEntry **entry) const {
  const std::optional<Key> key = keyOf(header);
  if (!key) return ZEL_BAD_PARAM;
  return copyWhole(impl_->exactly(*key), allocator, entry);
}

/* ---- Reports and waits ----------------------------------------------------------------------- */

std::optional<Entry> Directory::entry(uint8_t type, const zel_UUID &uuid) const {
  const SharedEntry found = impl_->exactly(Key{type, uuid});
  return found != nullptr ? std::optional<Entry>(*found) : std::nullopt;
}

std::vector<Entry> Directory::entries(uint8_t type) const {
  const Key key{type, zel_UUID{}};
  std::vector<Entry> result;
  const std::lock_guard<Mutex> lock(impl_->mutex);
  for (auto it = firstMatch(impl_->entries, key); it != impl_->entries.end();
       it = nextMatch(impl_->entries, key, it->first, it)) {
    result.push_back(*it->second);
  }
  return result;
}

void Directory::waitUntilIdle() {
  std::unique_lock<Mutex> lock(impl_->mutex);
  impl_->delivery.waitUntilIdle(lock);
}

void Directory::waitForCallbacks() {
  std::unique_lock<Mutex> lock(impl_->mutex);
  impl_->delivery.waitForCallbacks(lock);
}

uint64_t Directory::activity() const {
  const std::lock_guard<Mutex> lock(impl_->mutex);
  return impl_->delivery.calls();
}

size_t Directory::subscriptions() const {
  const std::lock_guard<Mutex> lock(impl_->mutex);
  return impl_->subscriptionsAlive;
}

uint64_t Directory::overflows() const {
  const std::lock_guard<Mutex> lock(impl_->mutex);
  return impl_->overflows;
}

}  // namespace host
