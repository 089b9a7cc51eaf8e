/*
 * A host kernel in one file, written from the binary contract alone, for contract_test.c: it shares
 * no line with the module or with its hosts, so whatever it sees is what any other host would see.
 * Each stand-in for the platform judges the calls it gets: arguments, locks held, order.
 *
 * The cache world is a thread that runs only when a scenario hands it the turn, unless everything
 * runs `at_once`. The host's own data is under `gate`, never held while waiting for a lock of the
 * module's.
 */
#ifndef CONTRACT_HOST_H
#define CONTRACT_HOST_H

#include <dlfcn.h>
#include <elf.h>
#include <inttypes.h>
#include <pthread.h>
#include <sched.h>
#include <stdarg.h>
#include <stdatomic.h>
#include <stdbool.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

enum {
  OK = 0,
  NOT_FOUND = 0x0bad0003,
  BAD_PARAM = 0x0bad0007,
  NO_MEMORY = 0x0bad0014,
  SUB_OVERFLOW = 0x0bad002f,
  SUB_CANCELLED = 0x0bad0030,
  NOT_INITIALIZED = 0x0bad0031,
  WORLD_STOPPING = 0x0bad0069,
  SUB_RESYNC = 0x0bad0113,
  REFUSED = 0x0bad0777 /* what this host says when a scenario asks it to refuse */
};
enum { NODE = 3, NETIF = 6, HEALTH = 7, OBJECT = 9, OBJECT_AS_PASSED = 0x109 };
enum { MODULE_ID = 0x4b52, HEAP_ID = 0x7ea9, DOMAIN_ID = 0x10c4, LOG_LEVEL = 5, BLOCKS = 4096 };
enum { LOCKS = 2048, SUBS = 2048, ENTRIES = 1024, EVENT_ROOM = 8192 };
enum { NO_LOCK = 0, CACHE_LOCK = 1, INSTANCE_LOCK = 2 };

typedef struct {
  uint8_t b[16];
} Uuid;
typedef uint32_t (*SubFn)(void *data, const void *header, void *arg, uint32_t status);
typedef void (*StatusFn)(void *data, uint32_t status);
typedef void (*ClientFn)(void *data, void *instance, uint32_t state);

/* ---- checks ---------------------------------------------------------------------------------- */

static atomic_int checks, failures;
static const char *scenario = "";

#define TEXT_OF(line) #line
#define AT(file, line) file ":" TEXT_OF(line)
#define HERE AT(__FILE__, __LINE__)

static void judge(bool good, const char *where, const char *what, const char *expected,
                  const char *actual) {
  atomic_fetch_add(&checks, 1);
  if (good) return;
  atomic_fetch_add(&failures, 1);
  fprintf(stderr, "%s: [%s] %s\n  expected: %s\n  actual:   %s\n", where, scenario, what, expected,
          actual);
}

static void judge_number(uint64_t actual, uint64_t expected, const char *where, const char *what) {
  char want[32] = "";
  char have[32] = "";
  if (actual == expected) {
    judge(true, where, what, want, have);
    return;
  }
  snprintf(want, sizeof want, "0x%" PRIx64, expected);
  snprintf(have, sizeof have, "0x%" PRIx64, actual);
  judge(actual == expected, where, what, want, have);
}

static void judge_bytes(const void *actual, const void *expected, size_t size, const char *where,
                        const char *what) {
  char want[80] = "";
  char have[80] = "";
  size_t at = 0;
  while (at < size && ((const uint8_t *)actual)[at] == ((const uint8_t *)expected)[at]) at++;
  if (at < size) {
    snprintf(want, sizeof want, "0x%02x at byte %zu", ((const uint8_t *)expected)[at], at);
    snprintf(have, sizeof have, "0x%02x", ((const uint8_t *)actual)[at]);
  }
  judge(at == size, where, what, want, have);
}

/* The scenario cannot go on. */
static _Noreturn void give_up(const char *why) {
  fprintf(stderr, "[%s] %s\n", scenario, why);
  abort();
}

#define CHECK(cond) judge((cond), HERE, #cond, "true", "false")
#define CHECK_EQ(actual, expected) \
  judge_number((uint64_t)(actual), (uint64_t)(expected), HERE, #actual)
#define CHECK_STR(actual, expected) \
  judge(strcmp((actual), (expected)) == 0, HERE, #actual, (expected), (actual))
#define CHECK_BYTES(actual, expected, size) judge_bytes((actual), (expected), (size), HERE, #actual)

static uint64_t number_at(const void *base, size_t offset, size_t width) {
  uint64_t value = 0;
  memcpy(&value, (const uint8_t *)base + offset, width);
  return value;
}
static void set_number(void *base, size_t offset, size_t width, uint64_t value) {
  memcpy((uint8_t *)base + offset, &value, width);
}
static bool all_bytes(const void *base, size_t size, uint8_t value) {
  for (size_t i = 0; i < size; i++) {
    if (((const uint8_t *)base)[i] != value) return false;
  }
  return true;
}
static bool same_uuid(const void *a, const void *b) {
  return memcmp(a, b, 16) == 0;
}
#define WORD(pointer) ((uint64_t)(uintptr_t)(pointer))

/* ---- the journal: every call of the module, in order; locks show as brackets ----------------- */

/* "c( T11 Wake )c": the cache lock taken, event 11 traced, the world woken, the lock given up. i( is
 * an instance's lock; a number behind a directory call is the entry type of its query; a refused
 * allocation is "alloc!", the end of a subscription that does not exist "unsub". */
static pthread_mutex_t gate;
static char journal[1 << 16];
static size_t journal_length;
static bool journal_on = true;
static bool at_once; /* the last scenario: no turns, everything runs */
static _Thread_local unsigned held;

static void note(const char *format, ...) {
  if (!journal_on) return;
  va_list args;
  va_start(args, format);
  size_t room = sizeof journal - journal_length;
  if (journal_length > 0) journal_length += (size_t)snprintf(journal + journal_length, room, " ");
  room = sizeof journal - journal_length;
  journal_length += (size_t)vsnprintf(journal + journal_length, room, format, args);
  va_end(args);
  if (journal_length > sizeof journal - 256) give_up("the journal is full");
}
static void forget(void) {
  journal[0] = 0;
  journal_length = 0;
}
static void judge_calls(const char *expected, const char *where) {
  judge(strcmp(journal, expected) == 0, where, "calls", expected, journal);
  forget();
}
#define CALLS(expected) judge_calls((expected), HERE)
#define HELD(locks) CHECK_EQ(held, (locks))
static void start(pthread_t *thread, void *(*body)(void *)) {
  if (pthread_create(thread, NULL, body, NULL) != 0) give_up("no thread");
}
static void enter(void) {
  pthread_mutex_lock(&gate);
}
static void leave(void) {
  pthread_mutex_unlock(&gate);
}

/* What the scenario wants refused; each is forgotten once used. */
static struct {
  uint32_t log, heap, domain, lock, status_callback, world, subscribe[256], full[256], decode[256];
  int allocation; /* 1: the next one */
} refuse;
static uint32_t take(uint32_t *refusal) {
  uint32_t status = *refusal;
  *refusal = OK;
  return status;
}

/* ---- heap ------------------------------------------------------------------------------------ */

uint32_t zel_ModuleCurrentID = MODULE_ID;

static struct block {
  uint8_t *at;
  uint32_t size;
  uintptr_t asked_by;
} blocks[BLOCKS];
static int live_blocks, live_locks, live_subs;
static void *cache; /* as the module registered it */
static bool heap_exists, domain_exists, log_open;
static uint8_t heap_props[52];
static bool for_library;         /* the directory allocates, not the module itself */
static uintptr_t text_begin, text_end;

static bool in_module(uintptr_t address) {
  return address > text_begin && address <= text_end;
}
static struct block *find_block(const void *at) {
  for (int i = 0; i < BLOCKS; i++) {
    if (blocks[i].at == at && at != NULL) return &blocks[i];
  }
  return NULL;
}
/* The nth live block of a size, oldest slot first. */
static struct block *nth_block(uint32_t size, int n) {
  for (int i = 0; i < BLOCKS; i++) {
    if (blocks[i].at != NULL && blocks[i].size == size && n-- == 0) return &blocks[i];
  }
  return NULL;
}

void zel_NameInitialize(void *name, const char *text) {
  char padded[32] = "";
  CHECK(strlen(text) < sizeof padded);
  memcpy(padded, text, strnlen(text, sizeof padded - 1));
  memcpy(name, padded, sizeof padded);
}

uint32_t zel_HeapCreate(const void *props, uint64_t *heap) {
  HELD(NO_LOCK);
  note("HeapCreate");
  memcpy(heap_props, props, sizeof heap_props);
  CHECK(!heap_exists);
  uint32_t status = take(&refuse.heap);
  if (status != OK) return status;
  heap_exists = true;
  *heap = HEAP_ID;
  return OK;
}
void zel_HeapDestroy(uint64_t heap) {
  note("HeapDestroy");
  CHECK_EQ(heap, HEAP_ID);
  CHECK(heap_exists && !domain_exists);
  CHECK_EQ(live_blocks, 0);
  CHECK_EQ(live_locks, 0);
  heap_exists = false;
}

enum { GUARD = 16, DIRT = 0xa5 };
void *zel_HeapAllocWithRA(uint64_t heap, uint32_t size, void *return_address) {
  enter();
  CHECK_EQ(heap, HEAP_ID);
  CHECK(heap_exists);
  if (!for_library) HELD(NO_LOCK);
  bool refused = refuse.allocation > 0 && --refuse.allocation == 0;
  if (!for_library) note(refused ? "alloc!" : "alloc");
  uint8_t *at = NULL;
  if (!refused) {
    at = malloc(size + GUARD);
    if (at == NULL) give_up("no memory");
    memset(at, DIRT, size + GUARD);
    for (int i = 0;; i++) {
      if (i == BLOCKS) give_up("too many blocks");
      if (blocks[i].at != NULL) continue;
      blocks[i] = (struct block){at, size, (uintptr_t)return_address};
      break;
    }
    live_blocks++;
  }
  leave();
  return at;
}
void zel_HeapFree(uint64_t heap, void *at) {
  enter();
  note("free");
  CHECK_EQ(heap, HEAP_ID);
  struct block *found = find_block(at);
  CHECK(found != NULL);
  if (found == NULL) give_up("not a block");
  CHECK(all_bytes(found->at + found->size, GUARD, DIRT));
  CHECK(memcmp(at, "karstr", 6) != 0);
  if (found->size == 392)
    CHECK_BYTES(at, "\x94\x9e\x8d\x8c\x8b\x8d\x96\xff", 8);
  if (at == cache) CHECK_BYTES(at, "\x94\x9e\x8d\x8c\x8b\x8d\x9c\xff", 8);
  free(found->at);
  *found = (struct block){0};
  live_blocks--;
  leave();
}

/* ---- lock domain and spinlocks --------------------------------------------------------------- */

static struct lock {
  bool live;
  unsigned rank;
  pthread_mutex_t mutex;
  _Atomic(pthread_t) owner;
} locks[LOCKS];
enum { LOCK_BASE = 0x5000 };
static void (*at_cache_unlock)(void); /* another party's move, right after the cache lock is free */
static int at_cache_unlock_in;

uint32_t zel_LockDomainCreate(uint32_t module, uint64_t heap, const void *name, uint64_t *domain) {
  HELD(NO_LOCK);
  note("DomainCreate");
  CHECK_EQ(module, MODULE_ID);
  CHECK_EQ(heap, HEAP_ID);
  CHECK_STR((const char *)name, "KARSTResolver");
  uint32_t status = take(&refuse.domain);
  if (status != OK) return status;
  domain_exists = true;
  *domain = DOMAIN_ID;
  return OK;
}
void zel_LockDomainDestroy(uint64_t domain) {
  note("DomainDestroy");
  CHECK_EQ(domain, DOMAIN_ID);
  CHECK(domain_exists);
  CHECK_EQ(live_locks, 0);
  domain_exists = false;
}

static uint32_t lock_size = 64;
uint32_t zel_SpinlockAllocSize(uint32_t type) {
  CHECK_EQ(type, 1);
  return lock_size;
}
uint32_t zel_SpinlockCreate(const void *props, uint64_t *lock) {
  enter();
  HELD(NO_LOCK);
  note("LockCreate");
  unsigned rank = (unsigned)number_at(props, 64, 2);
  CHECK_EQ(number_at(props, 0, 4), MODULE_ID);
  CHECK_EQ(number_at(props, 8, 8), HEAP_ID);
  CHECK_EQ(number_at(props, 48, 1), 1);
  CHECK_EQ(number_at(props, 56, 8), DOMAIN_ID);
  CHECK(rank == 1 || rank == 2);
  CHECK_STR((const char *)props + 16, rank == 1 ? "KARSTResolverCache" : "KARSTResolverInstance");
  uint32_t status = take(&refuse.lock);
  for (unsigned i = 0; status == OK; i++) {
    if (i == LOCKS) give_up("too many locks");
    if (locks[i].live) continue;
    locks[i].live = true;
    locks[i].rank = rank;
    pthread_mutex_init(&locks[i].mutex, NULL);
    live_locks++;
    *lock = LOCK_BASE + i;
    break;
  }
  leave();
  return status;
}
static struct lock *find_lock(uint64_t lock) {
  uint64_t i = lock - LOCK_BASE;
  bool known = i < LOCKS && locks[i].live;
  CHECK(known);
  if (!known) give_up("not a lock");
  return &locks[i];
}
void zel_SpinlockDestroy(uint64_t lock) {
  enter();
  note("LockDestroy");
  CHECK((held & INSTANCE_LOCK) == 0);
  struct lock *l = find_lock(lock);
  CHECK(pthread_mutex_trylock(&l->mutex) == 0);
  pthread_mutex_unlock(&l->mutex);
  pthread_mutex_destroy(&l->mutex);
  l->live = false;
  live_locks--;
  leave();
}
void zel_SpinlockLock(uint64_t lock) {
  enter();
  struct lock *l = find_lock(lock);
  leave();
  CHECK(held < l->rank); /* rank 1 under nothing, rank 2 at most under rank 1 */
  if (held >= l->rank) give_up("a deadlock");
  pthread_mutex_lock(&l->mutex);
  l->owner = pthread_self();
  held |= l->rank;
  enter();
  note(l->rank == 1 ? "c(" : "i(");
  leave();
}
void zel_SpinlockUnlock(uint64_t lock) {
  enter();
  struct lock *l = find_lock(lock);
  CHECK((held & l->rank) != 0 && pthread_equal(l->owner, pthread_self()));
  note(l->rank == 1 ? ")c" : ")i");
  held &= ~l->rank;
  leave();
  bool was_cache = l->rank == 1;
  pthread_mutex_unlock(&l->mutex);
  if (was_cache && at_cache_unlock_in > 0 && --at_cache_unlock_in == 0) at_cache_unlock();
}

/* ---- log, text, time, panic ------------------------------------------------------------------ */

static int log_object;
static struct {
  int count;
  uint32_t urgency;
  char function[64], text[256];
} logged;

uint32_t Tolm_LogInit(const char *name, uint32_t module, uint32_t two, uint32_t zero, void **log) {
  HELD(NO_LOCK);
  note("LogInit");
  CHECK_STR(name, "KARSTResolver");
  CHECK_EQ(module, MODULE_ID);
  CHECK_EQ(two, 2);
  CHECK_EQ(zero, 0);
  uint32_t status = take(&refuse.log);
  if (status != OK) return status;
  log_open = true;
  *log = &log_object;
  return OK;
}
void Tolm_LogCleanup(void **log) {
  note("LogCleanup");
  CHECK(*log == &log_object && log_open && !heap_exists && !domain_exists);
  log_open = false;
  *log = NULL;
}
const char *zel_LogGetName(void *log) {
  CHECK(log == &log_object);
  return "KARSTResolver log";
}
int32_t zel_LogGetCurrentLogLevel(void *log) {
  CHECK(log == &log_object);
  return LOG_LEVEL;
}
void zel_LogLevel(uint32_t urgency, void *log, int32_t level, const char *format, ...) {
  static const char prefix[] = "%s: %s:%d: ";
  enter();
  note("log");
  CHECK(log == &log_object && log_open);
  CHECK_EQ(level, LOG_LEVEL);
  CHECK(strncmp(format, prefix, strlen(prefix)) == 0);
  va_list args;
  va_start(args, format);
  const char *name = va_arg(args, const char *);
  CHECK_STR(name, "KARSTResolver log");
  snprintf(logged.function, sizeof logged.function, "%s", va_arg(args, const char *));
  int source_line = va_arg(args, int);
  CHECK(source_line > 0);
  vsnprintf(logged.text, sizeof logged.text, format + strlen(prefix), args);
  va_end(args);
  logged.urgency = urgency;
  logged.count++;
  leave();
}
void zel_LogNoLevel(uint32_t urgency, const char *format, ...) {
  note("log-without-handle");
  CHECK_EQ(urgency, 2);
  CHECK(format != NULL && !log_open);
}
static void judge_log(uint32_t urgency, const char *function, const char *text, const char *where) {
  judge_number((uint64_t)logged.count, 1, where, "reports");
  judge_number(logged.urgency, urgency, where, "urgency");
  judge(strcmp(logged.function, function) == 0, where, "function", function, logged.function);
  judge(strcmp(logged.text, text) == 0, where, "report", text, logged.text);
  logged.count = 0;
}
#define LOGGED(urgency, function, text) judge_log(urgency, function, text, HERE)

const char *zel_StatusToString(uint32_t status) {
  static _Thread_local char text[32];
  snprintf(text, sizeof text, "<%08x>", status);
  return text;
}
int zel_Snprintf(char *buffer, size_t size, const char *format, ...) {
  va_list args;
  va_start(args, format);
  CHECK_EQ(size, 64);
  int length = vsnprintf(buffer, size, format, args);
  va_end(args);
  return length;
}
void zel_PanicWithModuleID(uint32_t module, const char *format, ...) {
  va_list args;
  va_start(args, format);
  fprintf(stderr, "panic of module 0x%x: ", module);
  vfprintf(stderr, format, args);
  va_end(args);
  abort();
}

static uint32_t associations;
static uint32_t request_space = 448;
uint32_t tolmapi_HeapRequest2Size(uint32_t bytes) {
  CHECK_EQ(bytes, 392);
  return request_space;
}
uint32_t QXT_GetMaxAssocCount(void) {
  return associations;
}
uint64_t tolmapi_GetReturnAddress(uint32_t frame) {
  CHECK(frame >= 1 && frame <= 3);
  return 0x1000 + frame;
}
static bool host_is_witness;
bool TOLM_IsWitnessNode(void) {
  HELD(CACHE_LOCK);
  note("witness?");
  return host_is_witness;
}

/* ---- tracing --------------------------------------------------------------------------------- */

enum { SEQUENCE = 0, GLOBAL_BUCKET = 16, THROTTLING = 56, MASK = 72, LAP_SHIFT = 82, FLAGS = 85 };
enum { NOTIFY = 96, RING = 128, SLOTS = 4096, EVENTS = 19 };
static _Alignas(64) uint8_t stream[RING + 64 * SLOTS];
void *traceStreamTables[] = {NULL, stream, NULL};
const unsigned char perTraceTbConfig[] = {1, 2, 3, 4};

static int32_t class_level[3]; /* classes 35, 36, 37 */
static const uint8_t class_of[EVENTS] = {37, 37, 37, 37, 37, 37, 37, 35, 35, 35,
                                         35, 36, 37, 36, 35, 36, 37, 37, 0};
static _Thread_local uint32_t asked_class;
static void *buckets[EVENTS];
static int bucket_count;
static bool mini_grants = true;
static bool global_grants = true;
static uint64_t mini_out = 1;
static uint64_t global_out = 1;
static bool trace_in_detail; /* the journal shows each step of an emission, not only the event */
static uint32_t cpu = 0x5a;
static uint64_t cycles = 1000;
static uint8_t wall_clock_record[64];
static uint32_t per_event_notice_id = 901;
static uint32_t global_notice_id = 902;

static int event_of(const void *bucket) {
  for (int i = 0; i < EVENTS; i++) {
    if (buckets[i] == bucket) return i + 1;
  }
  CHECK(bucket == stream + GLOBAL_BUCKET);
  return 0;
}
static void detail(const char *what, int number) {
  if (trace_in_detail) note("%s%d", what, number);
}
int32_t Trace_ClassLevelGet(uint32_t class) {
  enter();
  CHECK(class >= 35 && class <= 37);
  detail("level", (int)class);
  asked_class = class;
  leave();
  return class_level[class - 35];
}
void TokenBucket_InitMini(void *bucket, const void *config) {
  CHECK(config == perTraceTbConfig);
  CHECK(all_bytes(bucket, 16, 0) || bucket == buckets[bucket_count % EVENTS]);
  for (int i = 0; i < bucket_count && i < EVENTS; i++) {
    uintptr_t apart = WORD(bucket) > WORD(buckets[i]) ? WORD(bucket) - WORD(buckets[i])
                                                      : WORD(buckets[i]) - WORD(bucket);
    if (bucket_count < EVENTS) CHECK(apart >= 16);
  }
  buckets[bucket_count++ % EVENTS] = bucket;
  memset(bucket, 0xb0, 16);
}
bool TokenBucket_UseTokensMini(void *bucket, const void *config, uint64_t tokens, uint64_t *out) {
  enter();
  CHECK(config == perTraceTbConfig);
  CHECK_EQ(tokens, 1);
  int event = event_of(bucket);
  if (event > 0) CHECK_EQ(asked_class, class_of[event - 1]);
  note(trace_in_detail ? "mini%d" : "T%d", event);
  *out = mini_out;
  leave();
  return mini_grants;
}
bool TokenBucket_UseTokens(void *bucket, uint64_t tokens, uint64_t *out) {
  enter();
  CHECK_EQ(event_of(bucket), 0);
  CHECK_EQ(tokens, 1);
  detail("global", 0);
  *out = global_out;
  leave();
  return global_grants;
}
uint64_t TokenBucket_TimeToGetTokens(void *bucket) {
  detail("time", event_of(bucket));
  return 7000 + (uint64_t)event_of(bucket);
}
uint32_t Trace_GetPerTraceThrottledTraceId(void) {
  return per_event_notice_id;
}
uint32_t Trace_GetGlobalThrottledTraceId(void) {
  return global_notice_id;
}
uint32_t tolmapi_GetPCPUNumPreemptible(void) {
  enter();
  detail("cpu", 0);
  leave();
  return cpu;
}
uint64_t zel_GetTimerCycles(void) {
  return cycles;
}
uint64_t zel_TimerTCToNS(uint64_t c) {
  CHECK_EQ(c, cycles);
  return c * 3 + 7;
}
void Trace_CreateWallClockEntry(void *of, void *record) {
  note("wallclock");
  CHECK(of == stream);
  memcpy(wall_clock_record, record, 64);
  CHECK((uint8_t *)record >= stream + RING && (WORD(record) - WORD(stream) - RING) % 64 == 0);
}
void Trace_Notify(uint64_t handle) {
  note("notify");
  CHECK_EQ(handle, number_at(stream, NOTIFY, 8));
}

static void open_stream(uint64_t mask, unsigned shift) {
  memset(stream, 0, sizeof stream);
  set_number(stream, THROTTLING, 1, 1);
  set_number(stream, MASK, 8, mask);
  set_number(stream, LAP_SHIFT, 2, shift);
  set_number(stream, FLAGS, 1, 1);
  for (int i = 0; i < 3; i++) class_level[i] = 2;
}
static uint64_t records(void) {
  return number_at(stream, SEQUENCE, 8);
}

/* Record number s as a whole: header words rebuilt from their fields and compared. */
static void judge_record(uint64_t s, unsigned type, unsigned id, unsigned site,
                         const uint64_t *payload, const char *where) {
  uint64_t mask = number_at(stream, MASK, 8);
  unsigned shift = (unsigned)number_at(stream, LAP_SHIFT, 2);
  const uint8_t *record = stream + RING + 64 * (s & mask);
  uint64_t phase = 1 - ((s >> shift) & 1);
  uint64_t time = (cycles * 3 + 7) << 9;
  uint64_t word1 = type | (uint64_t)(id & 0x3fff) << 6 | (uint64_t)site << 20 | s << 35;
  judge_number(number_at(record, 0, 8), phase | (uint64_t)(cpu & 0xff) << 1 | time, where,
               "word 0");
  judge_number(number_at(record, 8, 8), word1, where, "word 1");
  judge_bytes(record + 16, payload, 48, where, "payload");
}
/* The newest record of an event. */
static void judge_event(unsigned id, unsigned site, const uint64_t *payload, const char *where) {
  for (uint64_t s = records(); s-- > 0;) {
    const uint8_t *record = stream + RING + 64 * (s & (SLOTS - 1));
    if ((number_at(record, 8, 8) >> 6 & 0x3fff) == id) {
      judge_record(s, 8, id, site, payload, where);
      return;
    }
  }
  judge(false, where, "event", "written", "never written");
}
#define TRACED(id, site, ...) judge_event(id, site, (uint64_t[6]){__VA_ARGS__}, HERE)
#define LO(uuid) number_at((uuid).b, 0, 8)
#define HI(uuid) number_at((uuid).b, 8, 8)
static const uint8_t *newest(unsigned id, int nth) {
  for (uint64_t s = records(); s-- > 0;) {
    const uint8_t *record = stream + RING + 64 * (s & (SLOTS - 1));
    if ((number_at(record, 8, 8) >> 6 & 0x3fff) == id && nth-- == 0) return record;
  }
  return NULL;
}
/* The first payload word of an event: the node, interface or instance that it is about. */
static uint64_t traced_pointer(unsigned id, int nth_newest) {
  const uint8_t *record = newest(id, nth_newest);
  return record != NULL ? number_at(record, 16, 8) : 0;
}

/* ---- the cache world ------------------------------------------------------------------------- */

static struct {
  bool alive, stopping, woken, has_turn;
  uint32_t id;
  uint32_t (*body)(void *);
  void *data;
  pthread_t thread;
} world;
static pthread_mutex_t turn = PTHREAD_MUTEX_INITIALIZER;
static pthread_cond_t turned = PTHREAD_COND_INITIALIZER;
static int preemptions; /* how often to ask for the processor */

static void await_turn(void) {
  while (!world.has_turn && !at_once) pthread_cond_wait(&turned, &turn);
}
static void give_turn_back(void) {
  world.has_turn = false;
  pthread_cond_broadcast(&turned);
}
static void *world_thread(void *unused) {
  pthread_mutex_lock(&turn);
  await_turn();
  pthread_mutex_unlock(&turn);
  CHECK_EQ(world.body(world.data), 0);
  pthread_mutex_lock(&turn);
  world.alive = false;
  give_turn_back();
  pthread_mutex_unlock(&turn);
  return unused;
}
/* Lets the world run until it has nothing more to do. */
static void run_world(void) {
  pthread_mutex_lock(&turn);
  if (world.alive) {
    world.has_turn = true;
    pthread_cond_broadcast(&turned);
    while (world.has_turn) pthread_cond_wait(&turned, &turn);
  }
  pthread_mutex_unlock(&turn);
}

uint32_t TOLM_WorldCreate(uint32_t *id, const char *name, uint32_t module,
                          uint32_t (*body)(void *data), void *data, uint32_t one, uint64_t heap) {
  HELD(NO_LOCK);
  enter();
  note("WorldCreate");
  leave();
  CHECK_STR(name, "KARSTResolverCache");
  CHECK_EQ(module, MODULE_ID);
  CHECK_EQ(one, 1);
  CHECK_EQ(heap, HEAP_ID);
  CHECK(!world.alive);
  uint32_t status = take(&refuse.world);
  if (status != OK) return status;
  static uint32_t ids = 70;
  world.alive = true;
  world.stopping = world.woken = world.has_turn = false;
  world.id = ++ids;
  world.body = body;
  world.data = data;
  *id = world.id;
  start(&world.thread, world_thread);
  return OK;
}
void TOLM_WorldDestroy(uint32_t *id) {
  HELD(NO_LOCK);
  enter();
  note("WorldDestroy");
  leave();
  pthread_mutex_lock(&turn);
  bool exists = world.alive;
  if (exists) CHECK_EQ(*id, world.id);
  world.stopping = true;
  pthread_cond_broadcast(&turned);
  pthread_mutex_unlock(&turn);
  if (!exists) return;
  if (!at_once) run_world();
  pthread_join(world.thread, NULL);
  CHECK(!world.alive);
}
uint32_t zel_WorldWait(uint64_t event, uint64_t lock, uint32_t timeout, const char *reason) {
  HELD(NO_LOCK);
  enter();
  note("Wait");
  leave();
  CHECK_EQ(event, 0);
  CHECK_EQ(lock, UINT64_MAX);
  CHECK_EQ(timeout, UINT32_MAX);
  CHECK_STR(reason, "KARSTResolverCacheWorld");
  pthread_mutex_lock(&turn);
  while (!world.stopping && !world.woken) {
    if (at_once) {
      pthread_cond_wait(&turned, &turn);
    } else {
      give_turn_back();
      await_turn();
    }
  }
  world.woken = false;
  uint32_t status = world.stopping ? WORLD_STOPPING : OK;
  pthread_mutex_unlock(&turn);
  return status;
}
void zel_WorldForceWakeup(uint32_t id) {
  HELD(CACHE_LOCK);
  enter();
  note("Wake");
  leave();
  pthread_mutex_lock(&turn);
  CHECK_EQ(id, world.id);
  world.woken = true;
  pthread_cond_broadcast(&turned);
  pthread_mutex_unlock(&turn);
}
void tolmapi_PreemptionEnable(void) {
  HELD(NO_LOCK);
  note("preemptible");
}
bool tolmapi_PreemptionIsPending(void) {
  enter();
  HELD(CACHE_LOCK);
  note("pending?");
  bool pending = preemptions > 0 && preemptions-- > 0;
  leave();
  return pending;
}

/* ---- the directory --------------------------------------------------------------------------- */

static struct entry {
  uint8_t type;
  Uuid uuid, owner;
  uint32_t length;
  uint8_t data[280];
} entries[ENTRIES];
static int entry_count;
static struct sub {
  const uint8_t *query;
  uint8_t copy[48];
  SubFn fn;
  void *data;
  bool ended;
} subs[SUBS];
static struct event {
  int sub;
  uint32_t status;
  uint8_t header[64];
} events[EVENT_ROOM];
static unsigned events_in, events_out;
static pthread_cond_t work = PTHREAD_COND_INITIALIZER; /* events to deliver; with the gate */
static StatusFn status_fn;
static Uuid self_uuid;
static const void *allocator;

uint32_t KARST_RegisterStatusCallback(StatusFn fn, void *data) {
  HELD(NO_LOCK);
  note("Register");
  uint32_t status = take(&refuse.status_callback);
  if (status != OK) return status;
  CHECK(status_fn == NULL);
  CHECK_BYTES(data, "karstrc", 8);
  status_fn = fn;
  cache = data;
  return OK;
}
void KARST_DeregisterStatusCallback(StatusFn fn, void *data) {
  HELD(NO_LOCK);
  note("Deregister");
  if (status_fn != NULL) CHECK(fn == status_fn && data == cache);
  status_fn = NULL;
}
void KARST_GetSelfUUID(void *uuid) {
  HELD(NO_LOCK);
  note("Self");
  memcpy(uuid, &self_uuid, 16);
}

static uint64_t cache_references(void) {
  return number_at(cache, 8, 8);
}
static unsigned lock_for(uint8_t type) {
  return type == HEALTH ? CACHE_LOCK : NO_LOCK;
}
/* A query has its UUID, type and flag byte set and is zero elsewhere. */
static void judge_query(const uint8_t *query, uint8_t flags, bool one_entry) {
  CHECK(all_bytes(query, 16, 0) && all_bytes(query + 32, 8, 0) && all_bytes(query + 42, 6, 0));
  CHECK_EQ(query[41], flags);
  CHECK_EQ(!all_bytes(query + 16, 16, 0), one_entry);
}
static struct sub *find_sub(const void *query, SubFn fn, const void *data) {
  for (int i = 0; i < SUBS; i++) {
    struct sub *s = &subs[i];
    if (s->fn == fn && s->query == query && s->data == data && !s->ended) return s;
  }
  return NULL;
}
uint32_t KARST_Subscribe(const void *query, SubFn fn, void *data) {
  const uint8_t *q = query;
  HELD(lock_for(q[40]));
  enter();
  note("Sub%d", q[40]);
  bool everything = q[40] == NODE || q[40] == NETIF;
  judge_query(q, everything ? 0x0b : 0x09, !everything);
  uint32_t status = take(&refuse.subscribe[q[40]]);
  for (int i = 0; status == OK; i++) {
    if (i == SUBS) give_up("too many subscriptions");
    if (subs[i].fn != NULL) continue;
    subs[i] = (struct sub){.query = q, .fn = fn, .data = data};
    memcpy(subs[i].copy, q, 48);
    live_subs++;
    break;
  }
  leave();
  return status;
}
static void queue_event(int sub, uint32_t status, const void *header) {
  if (events_in - events_out == EVENT_ROOM) give_up("too many events");
  struct event *event = &events[events_in++ % EVENT_ROOM];
  event->sub = sub;
  event->status = status;
  memset(event->header, 0, 64);
  if (header != NULL) memcpy(event->header, header, 64);
  pthread_cond_broadcast(&work);
}
void KARST_Unsubscribe(const void *query, SubFn fn, void *data) {
  const uint8_t *q = query;
  HELD(lock_for(q[40]));
  enter();
  struct sub *found = find_sub(query, fn, data);
  note(found != NULL ? "Unsub%d" : "unsub%d", q[40]);
  if (found != NULL) {
    found->ended = true;
    queue_event((int)(found - subs), SUB_CANCELLED, NULL);
  }
  leave();
}

static void fill_header(uint8_t *header, uint8_t type, Uuid uuid, Uuid owner, uint32_t length) {
  memset(header, 0, 64);
  memcpy(header, &uuid, 16);
  memcpy(header + 16, &owner, 16);
  header[32] = type; /* the directory's own bytes */
  header[59] = 0xdd;
  set_number(header, 60, 4, length);
}
static struct entry *next_match(const uint8_t *query, int *cursor) {
  while (*cursor < entry_count) {
    struct entry *e = &entries[(*cursor)++];
    bool any = all_bytes(query + 16, 16, 0);
    if (e->type == query[40] && (any || same_uuid(query + 16, &e->uuid))) return e;
  }
  return NULL;
}
uint32_t KARST_FindEntry(const void *query, uint32_t next, void *header, uint32_t size) {
  static _Thread_local int cursor;
  const uint8_t *q = query;
  enter();
  note(next ? "Next%d" : "Find%d", q[40]);
  bool everything = q[40] == NODE || q[40] == NETIF;
  HELD(everything ? CACHE_LOCK : NO_LOCK);
  judge_query(q, everything ? 0x0b : 0x09, !everything);
  CHECK(next <= 1);
  CHECK_EQ(size, 64);
  for (int i = 0; i < SUBS; i++) {
    if (everything && subs[i].fn != NULL) CHECK(subs[i].query != q); /* a walk runs on a copy */
  }
  if (next == 0) cursor = 0;
  struct entry *e = next_match(q, &cursor);
  if (e != NULL) fill_header(header, e->type, e->uuid, e->owner, e->length);
  leave();
  return e != NULL ? OK : NOT_FOUND;
}

typedef void *(*AllocFn)(void *context, uint64_t size);
/* What an allocator record hands out: zero-filled, and recorded as asked for from here. */
__attribute__((noinline)) static void *allocate_entry(const void *record, uint32_t size) {
  static unsigned turns;
  void *const *functions = record;
  if (allocator == NULL) allocator = record;
  CHECK(record == allocator && functions[3] == NULL);
  AllocFn alloc;
  memcpy(&alloc, &functions[turns++ % 2], sizeof alloc);
  for_library = true;
  uint8_t *at = alloc(functions[3], 0x700000000 + (uint64_t)size);
  for_library = false;
  CHECK(at != NULL);
  if (at == NULL) give_up("no entry");
  struct block *block = find_block(at);
  CHECK_EQ(block->size, size);
  CHECK(all_bytes(at, size, 0) && all_bytes(at + size, GUARD, DIRT));
  CHECK(!in_module(block->asked_by));
  CHECK(block->asked_by - (uintptr_t)allocate_entry < 4096);
  return at;
}
static uint32_t full_entry(struct entry *e, uint8_t type, const void *record, void **out) {
  uint32_t status = take(&refuse.full[type]);
  if (status == OK && e == NULL) status = NOT_FOUND;
  if (status == OK) {
    uint8_t *full = allocate_entry(record, 64 + e->length);
    fill_header(full, e->type, e->uuid, e->owner, e->length);
    memcpy(full + 64, e->data, e->length);
    *out = full;
  }
  return status;
}
uint32_t KARST_FindFullEntryByQuery(const void *query, uint32_t zero, const void *record,
                                    void **out) {
  const uint8_t *q = query;
  int cursor = 0;
  HELD(CACHE_LOCK);
  enter();
  note("Full%d", q[40]);
  CHECK_EQ(zero, 0);
  judge_query(q, q[40] == NODE ? 0x05 : 0x09, true);
  uint32_t status = full_entry(next_match(q, &cursor), q[40], record, out);
  leave();
  return status;
}
uint32_t KARST_FindFullEntryByHeader(const void *header, uint32_t zero, const void *record,
                                     uint32_t one, void **out) {
  HELD(CACHE_LOCK);
  enter();
  note("FullByHeader");
  CHECK_EQ(zero, 0);
  CHECK_EQ(one, 1);
  struct entry *found = NULL;
  for (int i = 0; i < entry_count; i++) {
    uint8_t own[64];
    fill_header(own, entries[i].type, entries[i].uuid, entries[i].owner, entries[i].length);
    if (memcmp(own, header, 64) == 0) found = &entries[i];
  }
  CHECK(found != NULL || at_once); /* at once, it may have changed since */
  uint32_t status = full_entry(found, NODE, record, out);
  leave();
  return status;
}

static struct entry *find_entry(uint8_t type, Uuid uuid) {
  for (int i = 0; i < entry_count; i++) {
    if (entries[i].type == type && same_uuid(&entries[i].uuid, &uuid)) return &entries[i];
  }
  return NULL;
}
static void put(uint8_t type, Uuid uuid, Uuid owner, const void *data, uint32_t length) {
  enter();
  struct entry *e = find_entry(type, uuid);
  if (e == NULL) e = &entries[entry_count++];
  if (entry_count == ENTRIES) give_up("too many entries");
  *e = (struct entry){.type = type, .uuid = uuid, .owner = owner, .length = length};
  if (length > 0) memcpy(e->data, data, length);
  leave();
}
static void drop(uint8_t type, Uuid uuid) {
  enter();
  struct entry *e = find_entry(type, uuid);
  if (e != NULL) *e = entries[--entry_count];
  leave();
}
/* Queues one call of every matching subscription. */
static void announce(uint8_t type, Uuid uuid, Uuid owner, uint32_t status) {
  uint8_t header[64];
  fill_header(header, type, uuid, owner, 0);
  enter();
  for (int i = 0; i < SUBS; i++) {
    struct sub *s = &subs[i];
    if (s->fn == NULL || s->ended || s->copy[40] != type) continue;
    if (all_bytes(s->copy + 16, 16, 0) || same_uuid(s->copy + 16, &uuid))
      queue_event(i, status, header);
  }
  leave();
}
static bool deliver_one(void) {
  enter();
  bool any = events_out != events_in;
  struct event event;
  struct sub s;
  if (any) {
    event = events[events_out++ % EVENT_ROOM];
    s = subs[event.sub];
    CHECK_BYTES(s.query, s.copy, 48); /* in place and unchanged as long as it is installed */
  }
  leave();
  if (!any) return false;
  HELD(NO_LOCK);
  CHECK_EQ(s.fn(s.data, event.header, (void *)1, event.status), OK);
  HELD(NO_LOCK);
  if (event.status == SUB_CANCELLED) {
    enter();
    subs[event.sub] = (struct sub){0};
    live_subs--;
    leave();
  }
  return true;
}
static void deliver(void) {
  while (deliver_one()) continue;
}
static int idle_sleeps;
static void (*at_sleep)(void);
void zel_WorldSleep(uint32_t microseconds) {
  HELD(NO_LOCK);
  enter();
  note("Sleep");
  leave();
  CHECK_EQ(microseconds, 100000);
  if (at_once) {
    sched_yield();
    return;
  }
  if (deliver_one()) return;
  if (at_sleep != NULL) {
    void (*move)(void) = at_sleep;
    at_sleep = NULL;
    move();
  } else if (++idle_sleeps > 100) {
    give_up("the unload waits for nothing");
  }
}

/* ---- the marshaller: records travel as their own image --------------------------------------- */

uint32_t ExprMsh_MshNetInterfaceEntry(void) {
  give_up(__func__);
}
uint32_t ExprMsh_UmshNetInterfaceEntry(void) {
  give_up(__func__);
}
uint32_t ExprMsh_MshNetInterfaceEntryIpAddresses(void) {
  give_up(__func__);
}
uint32_t ExprMsh_UmshNetInterfaceEntryIpAddresses(void) {
  give_up(__func__);
}

struct row {
  uint64_t code, offset;
  const char *name;
  uint32_t (*encode)(void), (*decode)(void);
};
static const struct row node_rows[] = {{1, 0, "majorVersionNum", NULL, NULL},
                                       {1, 4, "minorVersionNum", NULL, NULL},
                                       {1, 8, "flags", NULL, NULL},
                                       {1, 12, "requiredTolmMajorVersion", NULL, NULL},
                                       {1, 16, "requiredTolmMinorVersion", NULL, NULL}};
static const struct row netif_rows[] = {
    {28, 0, "networkType", ExprMsh_MshNetInterfaceEntry, ExprMsh_UmshNetInterfaceEntry},
    {1, 68, "agentGroupPort", NULL, NULL},
    {1, 72, "masterGroupPort", NULL, NULL},
    {1, 76, "multicastTTL", NULL, NULL},
    {0, 80, "bandwidth", NULL, NULL},
    {12, 88, "macAddress", NULL, NULL},
    {10, 94, "agentV6Group", NULL, NULL},
    {10, 110, "masterV6Group", NULL, NULL},
    {28, 128, "numIpAddresses", ExprMsh_MshNetInterfaceEntryIpAddresses,
     ExprMsh_UmshNetInterfaceEntryIpAddresses},
    {0, 272, "trafficTypeMask", NULL, NULL}};
static const struct row health_rows[] = {{1, 0, "healthFlags", NULL, NULL},
                                         {0, 8, "timestamp", NULL, NULL},
                                         {1, 16, "healthReason", NULL, NULL}};

static void judge_table(const uint8_t *table, const struct row *rows, size_t count) {
  for (size_t i = 0; i < count; i++, table += 64) {
    CHECK_EQ(number_at(table, 0, 8), rows[i].code);
    CHECK_EQ(number_at(table, 8, 8), rows[i].offset);
    CHECK_EQ(number_at(table, 16, 8), 0);
    CHECK_STR((const char *)(uintptr_t)number_at(table, 24, 8), rows[i].name);
    CHECK_EQ(number_at(table, 32, 8), WORD(rows[i].encode));
    CHECK_EQ(number_at(table, 40, 8), WORD(rows[i].decode));
    CHECK(all_bytes(table + 48, 16, 0));
  }
  CHECK(all_bytes(table, 64, 0));
}
uint32_t ExprMsh_UmshSingleStructure(const void *record_allocator, const void *table,
                                     const void *data, uint32_t length, const char *name,
                                     void *record) {
  HELD(CACHE_LOCK);
  enter();
  struct block *block = find_block((const uint8_t *)data - 64);
  CHECK(block != NULL && block->size == 64 + length);
  CHECK(record_allocator == allocator);
  uint8_t type = block != NULL ? block->at[32] : 0;
  note("decode%d", type);
  uint32_t size = 0;
  if (type == NODE) {
    CHECK_STR(name, "KarstNodeEntry");
    judge_table(table, node_rows, 5);
    size = 20;
  } else if (type == NETIF) {
    CHECK_STR(name, "KarstNetInterfaceEntry");
    judge_table(table, netif_rows, 10);
    size = 280;
  } else {
    CHECK_STR(name, "KarstHealthStatusEntry");
    judge_table(table, health_rows, 3);
    size = 24;
  }
  CHECK(all_bytes(record, size, 0));
  uint32_t status = take(&refuse.decode[type]);
  if (length != size) status = REFUSED;
  memcpy(record, data, length < size ? length : size);
  leave();
  return status;
}

/* ---- the module's file ----------------------------------------------------------------------- */

static uint8_t *image; /* the file */
static uint8_t *base;  /* the module in memory */
static bool sanitized; /* then it has more symbols than its own */
static int (*init_module)(void);
static void (*cleanup_module)(void);
static uint32_t (*create)(void **, uint32_t, Uuid, Uuid, bool);
static void (*destroy)(void *);
static void (*set_callback)(void *, ClientFn, void *);
static uint32_t (*get_locators)(void *, void *);

static const Elf64_Shdr *section(const char *name) {
  const Elf64_Ehdr *header = (const Elf64_Ehdr *)image;
  const Elf64_Shdr *sections = (const Elf64_Shdr *)(image + header->e_shoff);
  const char *names = (const char *)image + sections[header->e_shstrndx].sh_offset;
  for (int i = 0; i < header->e_shnum; i++) {
    if (strcmp(names + sections[i].sh_name, name) == 0) return &sections[i];
  }
  return NULL;
}
static const Elf64_Sym *dynamic_symbols(size_t *count, const char **names) {
  const Elf64_Shdr *table = section(".dynsym");
  *count = table->sh_size / sizeof(Elf64_Sym);
  *names = (const char *)image + section(".dynstr")->sh_offset;
  return (const Elf64_Sym *)(image + table->sh_offset);
}
static void find_function(void *library, const char *name, void *function) {
  void *at = dlsym(library, name);
  if (at == NULL) {
    fprintf(stderr, "%s is missing\n", name);
    exit(2);
  }
  memcpy(function, &at, sizeof at);
}
static void map_module(const char *path) {
  FILE *file = fopen(path, "rb");
  if (file == NULL || fseek(file, 0, SEEK_END) != 0) exit(2);
  size_t size = (size_t)ftell(file);
  image = malloc(size);
  rewind(file);
  if (image == NULL || fread(image, 1, size, file) != size) exit(2);
  fclose(file);
  void *library = dlopen(path, RTLD_NOW | RTLD_LOCAL);
  if (library == NULL) {
    fprintf(stderr, "%s\n", dlerror());
    exit(2);
  }
  find_function(library, "init_module", &init_module);
  find_function(library, "cleanup_module", &cleanup_module);
  find_function(library, "KARSTResolver_Create", &create);
  find_function(library, "KARSTResolver_Destroy", &destroy);
  find_function(library, "KARSTResolver_SetCallback", &set_callback);
  find_function(library, "KARSTResolver_GetNodeLocators", &get_locators);
  size_t count;
  const char *names;
  const Elf64_Sym *symbols = dynamic_symbols(&count, &names);
  for (size_t i = 0; i < count; i++) {
    const char *name = names + symbols[i].st_name;
    if (strcmp(name, "init_module") == 0)
      base = (uint8_t *)(uintptr_t)(WORD(init_module) - symbols[i].st_value);
    if (strstr(name, "san_") != NULL) sanitized = true;
  }
  text_begin = WORD(base) + section(".text")->sh_addr;
  text_end = text_begin + section(".text")->sh_size;
}

#endif
