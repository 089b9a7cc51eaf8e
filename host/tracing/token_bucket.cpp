/* Token buckets. A bucket's whole state is the moment since which its tokens have been gathering:
 * at one token an interval, a bucket whose moment lies n intervals back holds n tokens, and taking
 * one moves the moment an interval on. So a take is one compare-and-swap, without a lock, and a
 * refill needs nobody.
 */
#include "host/tracing/token_bucket.h"

#include <algorithm>
#include <atomic>
#include <limits>

#include "host/threads/clock.h"

namespace host {

namespace {

/* Earlier than any clock: a bucket that has gathered since then is full. */
constexpr int64_t kSinceEver = std::numeric_limits<int64_t>::min();

constexpr uint64_t kNever = std::numeric_limits<uint64_t>::max();

/* What a bucket's tokens gather by: nothing at all, the clock as of its last tick, or the clock. */
enum class Pace : uint64_t { Still, Ticks, Clock };

/* A rate made ready for counting. */
struct Gathering {
  int64_t interval; /* ns between two tokens */
  int64_t burst;
  Pace pace;
};

/* A tick's tokens come all at once. A bucket that has room for them loses none and gives out as many
 * as by the clock, a tick later at most; and refusing, which is what a dry bucket does at each event
 * of a flood, costs little. */
Pace paceOf(const TokenRate &rate, uint64_t interval, uint64_t burst) {
  if (rate.perSecond == 0) return Pace::Still;
  return interval * burst >= tickInterval() ? Pace::Ticks : Pace::Clock;
}

Gathering gatheringOf(const TokenRate &rate) {
  constexpr uint64_t kSecond = 1'000'000'000;
  const uint64_t interval =
      rate.perSecond == 0 ? 1 : std::max<uint64_t>(kSecond / rate.perSecond, 1);
  /* Keeps the moments of full buckets, and sums with them, inside the number's range. */
  const uint64_t mostTokens =
      static_cast<uint64_t>(std::numeric_limits<int64_t>::max() / 4) / interval;
  const uint64_t burst = std::min(rate.burst, mostTokens);
  return {static_cast<int64_t>(interval), static_cast<int64_t>(burst),
          paceOf(rate, interval, burst)};
}

/* The time that refills go by. For a bucket without refills it stands still. */
inline int64_t timeOf(const Gathering &gathering) {
  if (gathering.pace == Pace::Ticks) [[likely]]
    return static_cast<int64_t>(tickNanoseconds());
  if (gathering.pace == Pace::Still) return 0;
  return static_cast<int64_t>(zel_TimerTCToNS(zel_GetTimerCycles()));
}

int64_t cappedMoment(int64_t moment, const Gathering &gathering, int64_t now) {
  return std::max(moment, now - gathering.burst * gathering.interval);
}

uint64_t tokensSince(int64_t moment, const Gathering &gathering, int64_t now) {
  /* Negative when another thread, with a later clock, has moved the moment beyond our now. */
  const int64_t gathered = now - moment;
  return gathered < gathering.interval ? 0 : static_cast<uint64_t>(gathered / gathering.interval);
}

/* The whole rule, for buckets that may have enough. */
[[gnu::noinline]] bool takeTokens(uint64_t &word, const Gathering &gathering, int64_t now,
                                  uint64_t tokens, uint64_t *left) {
  const std::atomic_ref<uint64_t> state(word);
  uint64_t seen = state.load(std::memory_order_relaxed);
  for (;;) {
    const int64_t moment = cappedMoment(static_cast<int64_t>(seen), gathering, now);
    const uint64_t available = tokensSince(moment, gathering, now);
    if (tokens > available) {
      *left = available;
      return false;
    }
    const int64_t after = moment + static_cast<int64_t>(tokens) * gathering.interval;
    if (state.compare_exchange_weak(seen, static_cast<uint64_t>(after),
                                    std::memory_order_relaxed)) {
      *left = available - tokens;
      return true;
    }
  }
}

/* In line for either kind of bucket, and straight on where the bucket is dry, as nearly every event of
 * a flood finds it: one look at the clock, one comparison. */
[[gnu::always_inline]] inline bool useTokens(uint64_t &word, const Gathering &gathering,
                                             uint64_t tokens, uint64_t *left) {
  const int64_t now = timeOf(gathering);
  const auto moment = static_cast<int64_t>(std::atomic_ref(word).load(std::memory_order_relaxed));
  if (moment <= now - gathering.interval || tokens == 0) [[unlikely]] {
    return takeTokens(word, gathering, now, tokens, left);
  }
  *left = 0;
  return false;
}

uint64_t timeToToken(uint64_t &word, const Gathering &gathering) {
  const int64_t now = timeOf(gathering);
  const auto stored = static_cast<int64_t>(std::atomic_ref(word).load(std::memory_order_relaxed));
  const int64_t moment = cappedMoment(stored, gathering, now);
  if (gathering.burst > 0 && tokensSince(moment, gathering, now) > 0) return 0;
  if (gathering.burst == 0 || gathering.pace == Pace::Still) return kNever;
  return static_cast<uint64_t>(moment + gathering.interval - now);
}

/* What all small buckets share; perTraceTbConfig stands for it. Changed only while nobody emits. */
Gathering miniGathering{};

/* The words of a full bucket: its state, then its rate. */
enum FullBucketWord { kState, kInterval, kBurst, kPace };

Gathering gatheringOf(const TokenBucket &bucket) {
  return {std::max<int64_t>(static_cast<int64_t>(bucket.opaque[kInterval]), 1),
          static_cast<int64_t>(bucket.opaque[kBurst]), Pace{bucket.opaque[kPace]}};
}

}  // namespace

void setMiniBucketRate(const TokenRate &rate) {
  miniGathering = gatheringOf(rate);
}

void initTokenBucket(TokenBucket &bucket, const TokenRate &rate) {
  const Gathering gathering = gatheringOf(rate);
  bucket = {};
  bucket.opaque[kState] = static_cast<uint64_t>(kSinceEver);
  bucket.opaque[kInterval] = static_cast<uint64_t>(gathering.interval);
  bucket.opaque[kBurst] = static_cast<uint64_t>(gathering.burst);
  bucket.opaque[kPace] = static_cast<uint64_t>(gathering.pace);
}

uint64_t timeToToken(TokenBucket &bucket) {
  return timeToToken(bucket.opaque[kState], gatheringOf(bucket));
}

uint64_t timeToToken(TokenBucketMini &bucket) {
  return timeToToken(bucket.opaque[0], miniGathering);
}

}  // namespace host

using namespace host;

extern "C" {

/* The small buckets' rate is set at run time and lives above; its address is what modules hand in.
 */
extern const unsigned char perTraceTbConfig[] = {0};

void TokenBucket_InitMini(TokenBucketMini *bucket, const void *) {
  *bucket = {};
  bucket->opaque[0] = static_cast<uint64_t>(kSinceEver);
}

/* A small bucket that nobody has filled, all zero, counts as gathering since the clock's zero: full
 * on a machine that has been up for a moment. */
bool TokenBucket_UseTokensMini(TokenBucketMini *bucket, const void *, uint64_t tokens,
                               uint64_t *out) {
  return useTokens(bucket->opaque[0], miniGathering, tokens, out);
}

bool TokenBucket_UseTokens(TokenBucket *bucket, uint64_t tokens, uint64_t *out) {
  return useTokens(bucket->opaque[kState], gatheringOf(*bucket), tokens, out);
}

}  // extern "C"
