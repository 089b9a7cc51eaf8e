/* Token buckets: one word of state each, changed by compare-and-swap. No lock. */
#pragma once

#include <cstdint>

#include "platform/tracing.h"

namespace host {

/* How fast a bucket fills and how much it holds. */
struct TokenRate {
  uint64_t burst = 0;     /* tokens of a full bucket */
  uint64_t perSecond = 0; /* 0: what is taken never comes back */
};

/* The rate of all small buckets. */
void setMiniBucketRate(const TokenRate &rate);

/* Makes a full bucket full, with a rate of its own. */
void initTokenBucket(TokenBucket &bucket, const TokenRate &rate);

/* Time until a bucket has a token, in nanoseconds; UINT64_MAX when it never will. */
uint64_t timeToToken(TokenBucket &bucket);
uint64_t timeToToken(TokenBucketMini &bucket);

}  // namespace host
