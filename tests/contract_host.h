/*
 * A host kernel in one file, written from the binary contract alone, for contract_test.c: it shares
 * no line with the module or with its hosts, so whatever it sees is what any other host would see.
 * Every call of the module is checked for its arguments and locks and noted in a journal. Two
 * threads, the scenario's and the cache world's, that take turns: no lock of its own.
 */
#ifndef CONTRACT_HOST_H
#define CONTRACT_HOST_H

#define _GNU_SOURCE
#include <dlfcn.h>
#include <inttypes.h>
#include <pthread.h>
#include <semaphore.h>
#include <stdarg.h>
#include <stdbool.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

enum { OK = 0, NOT_FOUND = 0x0bad0003, SUB_CANCELLED = 0x0bad0030, WORLD_STOPPING = 0x0bad0069 };
enum {
  SUB_RESYNC = 0x0bad0113,
  REFUSED = 0x0bad0777 /* what this host's decoder says of a record that is not one */
};
enum { NODE = 3, NETIF = 6, HEALTH = 7, OBJECT = 9 };
enum { MODULE_ID = 0x4b52, HEAP_ID = 0x7ea9, DOMAIN_ID = 0x10c4, LOG_LEVEL = 5, WORLD_ID = 71 };
enum { NO_LOCK = 0, CACHE_LOCK = 1, INSTANCE_LOCK = 2, ANY_LOCK = 4 };

typedef struct {
  uint8_t b[16];
} Uuid;
typedef uint32_t (*SubFn)(void *data, const void *header, void *arg, uint32_t status);
typedef void (*StatusFn)(void *data, uint32_t status);
typedef void (*ClientFn)(void *data, void *instance, uint32_t state);

/* ---- checks and the journal ------------------------------------------------------------------ */

static int checks, failures;
static _Thread_local unsigned held;

static void judge(bool good, int line, const char *what, const char *expected, const char *actual) {
  checks++;
  if (good) return;
  failures++;
  fprintf(stderr, "line %d: %s\n  expected: %s\n  actual:   %s\n", line, what, expected, actual);
}
static void judge_number(uint64_t actual, uint64_t expected, int line, const char *what) {
  char want[32], have[32];
  snprintf(want, sizeof want, "0x%" PRIx64, expected);
  snprintf(have, sizeof have, "0x%" PRIx64, actual);
  judge(actual == expected, line, what, want, have);
}
#define CHECK(cond) judge((cond), __LINE__, #cond, "true", "false")
#define CHECK_EQ(actual, expected) \
  judge_number((uint64_t)(actual), (uint64_t)(expected), __LINE__, #actual)
#define CHECK_STR(actual, expected) \
  judge(strcmp((actual), (expected)) == 0, __LINE__, #actual, (expected), (actual))
#define CHECK_BYTES(actual, expected, size) CHECK(memcmp((actual), (expected), (size)) == 0)

/* The scenario cannot go on. */
static _Noreturn void give_up(const char *why) {
  fprintf(stderr, "%s\n", why);
  abort();
}
static uint64_t number_at(const void *base, size_t offset, size_t width) {
  uint64_t value = 0;
  memcpy(&value, (const uint8_t *)base + offset, width);
  return value;
}
static void set_number(void *base, size_t offset, size_t width, uint64_t value) {
  memcpy((uint8_t *)base + offset, &value, width);
}
static bool all_bytes(const void *base, size_t size, uint8_t value) {
  const uint8_t *bytes = base;
  return size == 0 || (bytes[0] == value && memcmp(bytes, bytes + 1, size - 1) == 0);
}
#define WORD(pointer) ((uint64_t)(uintptr_t)(pointer))

/* "c( T11 Wake )c": the cache lock taken, event 11 traced, the world woken, the lock given up. i(
 * is an instance's lock; a number behind a directory call is the entry type of its query. */
static char journal[4096];

/* Notes a call made under these locks. */
__attribute__((format(printf, 2, 3))) static void called(unsigned locks, const char *format, ...) {
  if (locks != ANY_LOCK) CHECK_EQ(held, locks);
  size_t length = strlen(journal);
  va_list args;
  if (length > 0) journal[length++] = ' ';
  va_start(args, format);
  size_t size = (size_t)vsnprintf(journal + length, sizeof journal - length, format, args);
  va_end(args);
  if (length + size >= sizeof journal - 1) give_up("the journal is full");
}
static void judge_calls(const char *expected, int line) {
  judge(strcmp(journal, expected) == 0, line, "calls", expected, journal);
  journal[0] = 0;
}
#define CALLS(expected) judge_calls((expected), __LINE__)

/* ---- heap ------------------------------------------------------------------------------------ */

uint32_t zel_ModuleCurrentID = MODULE_ID;
static uint8_t *base; /* the module in memory */
static void *cache;   /* as the module registered it */
static int live_blocks, live_locks, live_subs;

static bool in_module(uint64_t address) {
  Dl_info found = {0};
  return dladdr((void *)(uintptr_t)address, &found) != 0 && found.dli_fbase == base;
}
void zel_NameInitialize(void *name, const char *text) {
  CHECK(strlen(text) < 32);
  strncpy(name, text, 32);
}
uint32_t zel_HeapCreate(const void *props, uint64_t *heap) {
  static const uint32_t sizes[] = {MODULE_ID, 0x40000, 0xa00000, 0};
  CHECK_STR((const char *)props + 4, "KARSTResolver");
  CHECK(number_at(props, 0, 4) == 0 && memcmp((char *)props + 36, sizes, sizeof sizes) == 0);
  called(NO_LOCK, "HeapCreate");
  *heap = HEAP_ID;
  return OK;
}
void zel_HeapDestroy(uint64_t heap) {
  called(NO_LOCK, "HeapDestroy");
  CHECK(heap == HEAP_ID && live_blocks == 0);
}
void *zel_HeapAllocWithRA(uint64_t heap, uint32_t size, void *return_address) {
  CHECK_EQ(heap, HEAP_ID);
  called(ANY_LOCK, "alloc");
  uint64_t *block = malloc(size + 16);
  if (block == NULL) give_up("no memory");
  block[0] = size;
  block[1] = WORD(return_address);
  live_blocks++;
  return memset(block + 2, 0xa5, size);
}
#define SIZE_OF_BLOCK(at) number_at((const uint8_t *)(at)-16, 0, 8)
#define ASKER_OF_BLOCK(at) number_at((const uint8_t *)(at)-16, 8, 8)
void zel_HeapFree(uint64_t heap, void *at) {
  called(ANY_LOCK, "free");
  CHECK_EQ(heap, HEAP_ID);
  if (SIZE_OF_BLOCK(at) == 392) CHECK_BYTES(at, "\x94\x9e\x8d\x8c\x8b\x8d\x96\xff", 8);
  if (at == cache) CHECK_BYTES(at, "\x94\x9e\x8d\x8c\x8b\x8d\x9c\xff", 8);
  live_blocks--;
  free((uint8_t *)at - 16);
}

/* ---- lock domain and spinlocks --------------------------------------------------------------- */

struct lock {
  unsigned rank;
  bool taken;
};
uint32_t zel_LockDomainCreate(uint32_t module, uint64_t heap, const void *name, uint64_t *domain) {
  CHECK(module == MODULE_ID && heap == HEAP_ID);
  CHECK_STR((const char *)name, "KARSTResolver");
  called(NO_LOCK, "DomainCreate");
  *domain = DOMAIN_ID;
  return OK;
}
void zel_LockDomainDestroy(uint64_t domain) {
  called(NO_LOCK, "DomainDestroy");
  CHECK(domain == DOMAIN_ID && live_locks == 0);
}
uint32_t zel_SpinlockCreate(const void *props, uint64_t *handle) {
  unsigned rank = (unsigned)number_at(props, 64, 2);
  CHECK(number_at(props, 0, 4) == MODULE_ID && number_at(props, 8, 8) == HEAP_ID);
  CHECK_STR((const char *)props + 16, rank == 1 ? "KARSTResolverCache" : "KARSTResolverInstance");
  CHECK(number_at(props, 48, 1) == 1 && number_at(props, 56, 8) == DOMAIN_ID);
  CHECK(rank == CACHE_LOCK || rank == INSTANCE_LOCK);
  called(NO_LOCK, "LockCreate");
  struct lock *lock = malloc(sizeof *lock);
  *lock = (struct lock){rank, false};
  live_locks++;
  *handle = WORD(lock);
  return OK;
}
void zel_SpinlockDestroy(uint64_t handle) {
  struct lock *lock = (struct lock *)(uintptr_t)handle;
  called(ANY_LOCK, "LockDestroy");
  CHECK(!lock->taken);
  live_locks--;
  free(lock);
}
void zel_SpinlockLock(uint64_t handle) {
  struct lock *lock = (struct lock *)(uintptr_t)handle;
  CHECK(held < lock->rank); /* rank 1 under nothing, rank 2 at most under rank 1 */
  CHECK(!lock->taken);      /* whoever has the turn waits for nobody */
  lock->taken = true;
  held |= lock->rank;
  called(ANY_LOCK, lock->rank == 1 ? "c(" : "i(");
}
void zel_SpinlockUnlock(uint64_t handle) {
  struct lock *lock = (struct lock *)(uintptr_t)handle;
  called(ANY_LOCK, lock->rank == 1 ? ")c" : ")i");
  CHECK(lock->taken && (held & lock->rank));
  lock->taken = false;
  held &= ~lock->rank;
}

/* ---- log, text, time, panic ------------------------------------------------------------------ */

static int log_object;

uint32_t Tolm_LogInit(const char *name, uint32_t module, uint32_t two, uint32_t zero, void **log) {
  CHECK_STR(name, "KARSTResolver");
  CHECK(module == MODULE_ID && two == 2 && zero == 0);
  called(NO_LOCK, "LogInit");
  *log = &log_object;
  return OK;
}
void Tolm_LogCleanup(void **log) {
  called(NO_LOCK, "LogCleanup");
  CHECK(*log == &log_object);
}
/* Noted as "log<urgency> <function>: <text>". */
void zel_LogLevel(uint32_t urgency, void *log, int32_t level, const char *format, ...) {
  static const char prefix[] = "%s: %s:%d: ";
  char text[256];
  va_list args;
  CHECK(log == &log_object && level == LOG_LEVEL);
  CHECK(strncmp(format, prefix, strlen(prefix)) == 0);
  va_start(args, format);
  const char *name = va_arg(args, const char *);
  CHECK_STR(name, "KARSTResolver log");
  const char *function = va_arg(args, const char *);
  CHECK(va_arg(args, int) > 0); /* a source line */
  vsnprintf(text, sizeof text, format + strlen(prefix), args);
  va_end(args);
  called(ANY_LOCK, "log%u %s: %s", urgency, function, text);
}
void zel_LogNoLevel(uint32_t urgency, const char *format, ...) {
  called(NO_LOCK, "LogNoLevel%u %s", urgency, format);
}
const char *zel_StatusToString(uint32_t status) {
  static _Thread_local char text[32];
  snprintf(text, sizeof text, "<%08x>", status);
  return text;
}
int zel_Snprintf(char *buffer, size_t size, const char *format, ...) {
  va_list args;
  va_start(args, format);
  int length = vsnprintf(buffer, size, format, args);
  va_end(args);
  return length;
}
void zel_PanicWithModuleID(uint32_t module, const char *format, ...) {
  fprintf(stderr, "panic of module 0x%x: ", module);
  give_up(format);
}
bool TOLM_IsWitnessNode(void) {
  called(CACHE_LOCK, "witness?");
  return false;
}

/* ---- tracing --------------------------------------------------------------------------------- */

enum { SEQUENCE = 0, THROTTLING = 56, MASK = 72, LAP_SHIFT = 82, FLAGS = 85 };
enum { RING = 128, SLOTS = 4096, EVENTS = 19, CYCLES = 1000, CPU = 0x15a };
static _Alignas(64) uint8_t stream[RING + 64 * SLOTS];
void *traceStreamTables[] = {NULL, stream, NULL};
const unsigned char perTraceTbConfig[] = {1, 2, 3, 4};
static void *buckets[EVENTS];
static int bucket_count;

void TokenBucket_InitMini(void *bucket, const void *config) {
  CHECK(config == perTraceTbConfig);
  buckets[bucket_count++ % EVENTS] = bucket;
}
bool TokenBucket_UseTokensMini(void *bucket, const void *config, uint64_t tokens, uint64_t *out) {
  int event = 0;
  while (event < EVENTS && buckets[event] != bucket) event++;
  CHECK(event < EVENTS && config == perTraceTbConfig && tokens == 1);
  called(ANY_LOCK, "T%d", event + 1);
  *out = 1;
  return true;
}
bool TokenBucket_UseTokens(void *bucket, uint64_t tokens, uint64_t *out) {
  CHECK(bucket == stream + 16 && tokens == 1);
  *out = 1;
  return true;
}
void Trace_CreateWallClockEntry(void *of, void *record) {
  uint64_t at = WORD(record) - WORD(stream) - RING;
  CHECK(of == stream && at % 64 == 0);
  called(ANY_LOCK, "wallclock%d", (int)(at / 64));
}
void Trace_Notify(uint64_t handle) {
  called(ANY_LOCK, "notify%d", (int)handle);
}
static void open_stream(void) {
  memset(stream, 0, sizeof stream);
  set_number(stream, SEQUENCE, 8, 1);
  set_number(stream, THROTTLING, 1, 1);
  set_number(stream, MASK, 8, SLOTS - 1);
  set_number(stream, LAP_SHIFT, 2, 12);
  set_number(stream, FLAGS, 1, 1);
}
static const uint8_t *newest(unsigned id) {
  for (uint64_t s = number_at(stream, SEQUENCE, 8); s-- > 1;) {
    const uint8_t *record = stream + RING + 64 * (s & (SLOTS - 1));
    if ((number_at(record, 8, 8) >> 6 & 0x3fff) == id) return record;
  }
  give_up("an event was never traced");
}
/* The newest record of an event: header words rebuilt from their fields, and the payload. */
static void judge_event(unsigned id, unsigned site, const uint64_t *payload, int line) {
  const uint8_t *record = newest(id);
  uint64_t word1 = number_at(record, 8, 8);
  uint64_t s = word1 >> 35;
  uint64_t phase = 1 - (s >> 12 & 1);
  uint64_t word0 = phase | (CPU & 0xff) << 1 | (uint64_t)(CYCLES * 3 + 7) << 9;
  judge_number(number_at(record, 0, 8), word0, line, "word 0");
  judge_number(word1, 8 | id << 6 | site << 20 | s << 35, line, "word 1");
  judge(record == stream + RING + 64 * (s % SLOTS), line, "sequence", "of its slot", "not");
  for (int i = 0; i < 6; i++)
    judge_number(number_at(record, 16 + 8 * i, 8), payload[i], line, "payload");
}
#define TRACED(id, site, ...) judge_event(id, site, (uint64_t[6]){__VA_ARGS__}, __LINE__)
#define UUID_WORDS(uuid) number_at((uuid).b, 0, 8), number_at((uuid).b, 8, 8)

/* ---- what always has the same answer --------------------------------------------------------- */

/* clang-format off */
#define ALWAYS(type, name, parameters, answer) type name parameters { return answer; }
ALWAYS(const char *, zel_LogGetName, (void *log), log == &log_object ? "KARSTResolver log" : "")
ALWAYS(int32_t, zel_LogGetCurrentLogLevel, (void *log), log == &log_object ? LOG_LEVEL : -1)
ALWAYS(uint32_t, zel_SpinlockAllocSize, (uint32_t type), type == 1 ? 64 : 0)
ALWAYS(uint32_t, tolmapi_HeapRequest2Size, (uint32_t bytes), bytes + 56)
ALWAYS(uint32_t, QXT_GetMaxAssocCount, (void), 0)
ALWAYS(uint64_t, tolmapi_GetReturnAddress, (uint32_t frame), 0x1000 + frame)
ALWAYS(int32_t, Trace_ClassLevelGet, (uint32_t class), class >= 35 && class <= 37 ? 2 : -1)
ALWAYS(uint64_t, TokenBucket_TimeToGetTokens, (void *bucket), WORD(bucket))
ALWAYS(uint32_t, Trace_GetPerTraceThrottledTraceId, (void), 901)
ALWAYS(uint32_t, Trace_GetGlobalThrottledTraceId, (void), 902)
ALWAYS(uint32_t, tolmapi_GetPCPUNumPreemptible, (void), CPU)
ALWAYS(uint64_t, zel_GetTimerCycles, (void), CYCLES)
ALWAYS(uint64_t, zel_TimerTCToNS, (uint64_t cycles), cycles * 3 + 7)
ALWAYS(uint32_t, ExprMsh_MshNetInterfaceEntry, (void), REFUSED)
ALWAYS(uint32_t, ExprMsh_UmshNetInterfaceEntry, (void), REFUSED)
ALWAYS(uint32_t, ExprMsh_MshNetInterfaceEntryIpAddresses, (void), REFUSED)
ALWAYS(uint32_t, ExprMsh_UmshNetInterfaceEntryIpAddresses, (void), REFUSED)
/* clang-format on */

/* ---- the cache world: a thread that runs only when a scenario lets it ------------------------ */

static struct {
  bool alive, woken, stopping;
  uint32_t (*body)(void *);
  void *data;
  pthread_t thread;
  sem_t may_run, has_paused;
} world;

static void *world_thread(void *unused) {
  sem_wait(&world.may_run);
  CHECK_EQ(world.body(world.data), 0);
  return unused;
}
/* Lets the world run until it waits with nothing left to do. */
static void run_world(void) {
  do {
    world.woken = false;
    sem_post(&world.may_run);
    sem_wait(&world.has_paused);
  } while (world.woken);
}
uint32_t TOLM_WorldCreate(uint32_t *id, const char *name, uint32_t module,
                          uint32_t (*body)(void *data), void *data, uint32_t one, uint64_t heap) {
  CHECK_STR(name, "KARSTResolverCache");
  CHECK(module == MODULE_ID && one == 1 && heap == HEAP_ID && !world.alive);
  called(NO_LOCK, "WorldCreate");
  world.alive = true;
  world.stopping = false;
  world.body = body;
  world.data = data;
  sem_init(&world.may_run, 0, 0);
  sem_init(&world.has_paused, 0, 0);
  *id = WORLD_ID;
  if (pthread_create(&world.thread, NULL, world_thread, NULL) != 0) give_up("no thread");
  return OK;
}
void TOLM_WorldDestroy(uint32_t *id) {
  called(NO_LOCK, "WorldDestroy");
  CHECK(world.alive && *id == WORLD_ID);
  world.stopping = true;
  sem_post(&world.may_run);
  pthread_join(world.thread, NULL);
  world.alive = false;
}
uint32_t zel_WorldWait(uint64_t event, uint64_t lock, uint32_t timeout, const char *reason) {
  called(NO_LOCK, "Wait");
  CHECK(event == 0 && lock == UINT64_MAX && timeout == UINT32_MAX);
  CHECK_STR(reason, "KARSTResolverCacheWorld");
  if (!world.stopping) {
    sem_post(&world.has_paused);
    sem_wait(&world.may_run);
  }
  return world.stopping ? WORLD_STOPPING : OK;
}
void zel_WorldForceWakeup(uint32_t id) {
  called(CACHE_LOCK, "Wake");
  CHECK_EQ(id, WORLD_ID);
  world.woken = true;
}
void tolmapi_PreemptionEnable(void) {
  called(NO_LOCK, "preemptible");
}
bool tolmapi_PreemptionIsPending(void) {
  called(CACHE_LOCK, "pending?");
  return false;
}

/* ---- the directory --------------------------------------------------------------------------- */

enum { ENTRIES = 8, SUBS = 8 };
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
static StatusFn status_fn;
static const Uuid self_uuid = {{7, 7, 7}};
static const void *allocator;

uint32_t KARST_RegisterStatusCallback(StatusFn fn, void *data) {
  CHECK_BYTES(data, "karstrc", 8);
  status_fn = fn;
  cache = data;
  called(NO_LOCK, "Register");
  return OK;
}
void KARST_DeregisterStatusCallback(StatusFn fn, void *data) {
  called(NO_LOCK, "Deregister");
  CHECK(status_fn == NULL || (fn == status_fn && data == cache));
  status_fn = NULL;
}
void KARST_GetSelfUUID(void *uuid) {
  called(NO_LOCK, "Self");
  memcpy(uuid, &self_uuid, 16);
}
/* A query has its UUID, type and flag byte set and is zero elsewhere. */
static void judge_query(const uint8_t *query, uint8_t one_entry, uint8_t everything) {
  bool any = all_bytes(query + 16, 16, 0);
  CHECK_EQ(any, everything != 0 && (query[40] == NODE || query[40] == NETIF));
  CHECK_EQ(query[41], any ? everything : one_entry);
  CHECK(all_bytes(query, 16, 0) && all_bytes(query + 32, 8, 0) && all_bytes(query + 42, 6, 0));
}
uint32_t KARST_Subscribe(const void *query, SubFn fn, void *data) {
  const uint8_t *q = query;
  judge_query(q, 0x09, 0x0b);
  called(q[40] == HEALTH ? CACHE_LOCK : NO_LOCK, "Sub%d", q[40]);
  int i = 0;
  while (i < SUBS && subs[i].fn != NULL) i++;
  if (i == SUBS) give_up("too many subscriptions");
  subs[i] = (struct sub){.query = q, .fn = fn, .data = data};
  memcpy(subs[i].copy, q, 48);
  live_subs++;
  return OK;
}
void KARST_Unsubscribe(const void *query, SubFn fn, void *data) {
  const uint8_t *q = query;
  called(q[40] == HEALTH ? CACHE_LOCK : NO_LOCK, "Unsub%d", q[40]);
  for (int i = 0; i < SUBS; i++) {
    if (subs[i].query == query && subs[i].fn == fn && subs[i].data == data) subs[i].ended = true;
  }
}
/* The type, and the UUID where the query names one. */
static bool matches(const uint8_t *query, uint8_t type, const void *uuid) {
  return query[40] == type && (all_bytes(query + 16, 16, 0) || memcmp(query + 16, uuid, 16) == 0);
}
static void fill_header(uint8_t *header, uint8_t type, Uuid uuid, Uuid owner, uint32_t length) {
  memset(header, 0, 64);
  memcpy(header, &uuid, 16);
  memcpy(header + 16, &owner, 16);
  header[32] = type; /* the directory's own bytes */
  set_number(header, 60, 4, length);
}
static struct entry *next_match(const uint8_t *query, int *cursor) {
  while (*cursor < entry_count) {
    struct entry *e = &entries[(*cursor)++];
    if (matches(query, e->type, &e->uuid)) return e;
  }
  return NULL;
}
uint32_t KARST_FindEntry(const void *query, uint32_t next, void *header, uint32_t size) {
  static int cursor;
  const uint8_t *q = query;
  called(q[40] == OBJECT ? NO_LOCK : CACHE_LOCK, next ? "Next%d" : "Find%d", q[40]);
  judge_query(q, 0x09, 0x0b);
  CHECK_EQ(size, 64);
  if (next == 0) cursor = 0;
  struct entry *e = next_match(q, &cursor);
  if (e != NULL) fill_header(header, e->type, e->uuid, e->owner, e->length);
  return e != NULL ? OK : NOT_FOUND;
}
/* The whole entry in a block from the module's allocator record, which takes 32 bits of a size. */
static uint32_t full_entry(const uint8_t *query, const void *record, void **out) {
  static unsigned turns;
  void *(*allocate[2])(void *context, uint64_t size);
  int cursor = 0;
  memcpy(allocate, record, sizeof allocate);
  allocator = record;
  CHECK(number_at(record, 24, 8) == 0);
  struct entry *e = next_match(query, &cursor);
  if (e != NULL) {
    uint32_t size = 64 + e->length;
    uint8_t *full = allocate[turns++ % 2](NULL, 0x700000000 + (uint64_t)size);
    CHECK(SIZE_OF_BLOCK(full) == size && all_bytes(full, size, 0));
    CHECK(!in_module(ASKER_OF_BLOCK(full)));
    fill_header(full, e->type, e->uuid, e->owner, e->length);
    memcpy(full + 64, e->data, e->length);
    *out = full;
  }
  return e != NULL ? OK : NOT_FOUND;
}
uint32_t KARST_FindFullEntryByQuery(const void *query, uint32_t zero, const void *record,
                                    void **out) {
  const uint8_t *q = query;
  CHECK_EQ(zero, 0);
  judge_query(q, q[40] == NODE ? 0x05 : 0x09, 0);
  called(CACHE_LOCK, "Full%d", q[40]);
  return full_entry(q, record, out);
}
uint32_t KARST_FindFullEntryByHeader(const void *header, uint32_t zero, const void *record,
                                     uint32_t one, void **out) {
  uint8_t query[48] = {0};
  CHECK(zero == 0 && one == 1);
  called(CACHE_LOCK, "FullByHeader");
  memcpy(query + 16, header, 16);
  query[40] = (uint8_t)number_at(header, 32, 1);
  return full_entry(query, record, out);
}
/* Cancelled subscriptions get their last call. */
static void deliver(void) {
  for (int i = 0; i < SUBS; i++) {
    struct sub s = subs[i];
    if (!s.ended) continue;
    CHECK_BYTES(s.query, s.copy, 48); /* in place and unchanged until then */
    CHECK_EQ(s.fn(s.data, NULL, NULL, SUB_CANCELLED), OK);
    subs[i] = (struct sub){0};
    live_subs--;
  }
}
/* Calls every matching subscription. */
static void tell(uint8_t type, Uuid uuid, Uuid owner, uint32_t status) {
  uint8_t header[64];
  fill_header(header, type, uuid, owner, 0);
  for (int i = 0; i < SUBS; i++) {
    struct sub s = subs[i];
    if (s.fn == NULL || s.ended || !matches(s.copy, type, &uuid)) continue;
    CHECK_EQ(s.fn(s.data, header, NULL, status), OK);
    CHECK_EQ(held, NO_LOCK);
  }
  deliver();
}
static void put(uint8_t type, Uuid uuid, Uuid owner, const void *data, uint32_t length) {
  int i = 0;
  while (i < entry_count && (entries[i].type != type || memcmp(&entries[i].uuid, &uuid, 16) != 0))
    i++;
  if (i == ENTRIES) give_up("too many entries");
  if (i == entry_count) entry_count++;
  entries[i] = (struct entry){.type = type, .uuid = uuid, .owner = owner, .length = length};
  if (length > 0) memcpy(entries[i].data, data, length);
}
void zel_WorldSleep(uint32_t microseconds) {
  called(NO_LOCK, "Sleep");
  CHECK_EQ(microseconds, 100000);
  deliver();
}

/* ---- the marshaller: records travel as their own image --------------------------------------- */

static const struct {
  uint32_t size;
  const char *name, *table; /* its rows: type code @ offset, name, nested functions */
} forms[] = {
    [NODE] = {20, "KarstNodeEntry",
              "1@0 majorVersionNum, 1@4 minorVersionNum, 1@8 flags, 1@12 requiredTolmMajorVersion, "
              "1@16 requiredTolmMinorVersion, "},
    [NETIF] = {280, "KarstNetInterfaceEntry",
               "28@0 networkType ExprMsh_MshNetInterfaceEntry ExprMsh_UmshNetInterfaceEntry, "
               "1@68 agentGroupPort, 1@72 masterGroupPort, 1@76 multicastTTL, 0@80 bandwidth, "
               "12@88 macAddress, 10@94 agentV6Group, 10@110 masterV6Group, 28@128 numIpAddresses "
               "ExprMsh_MshNetInterfaceEntryIpAddresses ExprMsh_UmshNetInterfaceEntryIpAddresses, "
               "0@272 trafficTypeMask, "},
    [HEALTH] = {24, "KarstHealthStatusEntry",
                "1@0 healthFlags, 0@8 timestamp, 1@16 healthReason, "},
};
static void judge_table(const uint8_t *row, const char *expected) {
  char text[512] = "";
  size_t end = 0;
  for (; !all_bytes(row, 64, 0); row += 64) {
    end += (size_t)sprintf(text + end, "%d@%d %s", (int)number_at(row, 0, 8),
                           (int)number_at(row, 8, 8), (char *)number_at(row, 24, 8));
    for (size_t at = 32; at <= 40; at += 8) {
      Dl_info function = {0};
      dladdr((void *)number_at(row, at, 8), &function);
      if (function.dli_sname != NULL) end += (size_t)sprintf(text + end, " %s", function.dli_sname);
    }
    end += (size_t)sprintf(text + end, ", ");
    CHECK(number_at(row, 16, 8) == 0 && all_bytes(row + 48, 16, 0));
  }
  CHECK_STR(text, expected);
}
uint32_t ExprMsh_UmshSingleStructure(const void *record_allocator, const void *table,
                                     const void *data, uint32_t length, const char *name,
                                     void *record) {
  uint8_t type = (uint8_t)number_at((const uint8_t *)data - 64, 32, 1);
  CHECK(record_allocator == allocator);
  CHECK_STR(name, forms[type].name);
  CHECK(all_bytes(record, forms[type].size, 0));
  judge_table(table, forms[type].table);
  called(CACHE_LOCK, "decode%d", type);
  if (length != forms[type].size) return REFUSED;
  memcpy(record, data, length);
  return OK;
}

#endif
