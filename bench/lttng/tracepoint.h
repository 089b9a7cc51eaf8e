/* The peer's tracepoints: six 64-bit words, as a record of ours has. Two alike: the session selects
 * one of them. Read several times over by the macros that make the provider from it. */
#undef LTTNG_UST_TRACEPOINT_PROVIDER
#define LTTNG_UST_TRACEPOINT_PROVIDER karst_bench

#undef LTTNG_UST_TRACEPOINT_INCLUDE
#define LTTNG_UST_TRACEPOINT_INCLUDE "bench/lttng/tracepoint.h"

#if !defined(BENCH_LTTNG_TRACEPOINT_H) || defined(LTTNG_UST_TRACEPOINT_HEADER_MULTI_READ)
#define BENCH_LTTNG_TRACEPOINT_H

#include <lttng/tracepoint.h>
#include <stdint.h>

/* clang-format off */
LTTNG_UST_TRACEPOINT_EVENT_CLASS(karst_bench, six_words,
  LTTNG_UST_TP_ARGS(uint64_t, a, uint64_t, b, uint64_t, c, uint64_t, d, uint64_t, e, uint64_t, f),
  LTTNG_UST_TP_FIELDS(
    lttng_ust_field_integer(uint64_t, a, a)
    lttng_ust_field_integer(uint64_t, b, b)
    lttng_ust_field_integer(uint64_t, c, c)
    lttng_ust_field_integer(uint64_t, d, d)
    lttng_ust_field_integer(uint64_t, e, e)
    lttng_ust_field_integer(uint64_t, f, f)))

LTTNG_UST_TRACEPOINT_EVENT_INSTANCE(karst_bench, six_words, karst_bench, on,
  LTTNG_UST_TP_ARGS(uint64_t, a, uint64_t, b, uint64_t, c, uint64_t, d, uint64_t, e, uint64_t, f))
LTTNG_UST_TRACEPOINT_EVENT_INSTANCE(karst_bench, six_words, karst_bench, off,
  LTTNG_UST_TP_ARGS(uint64_t, a, uint64_t, b, uint64_t, c, uint64_t, d, uint64_t, e, uint64_t, f))
/* clang-format on */

#endif

#include <lttng/tracepoint-event.h>
