/*
 * A host kernel in one file, written from the binary contract alone, for contract_test.c: it shares
 * no line with the module or with its hosts, so whatever it sees is what any other host would see.
 * Every call of the module is noted in a journal with what it passes; what the journal cannot show is
 * checked on the spot. Two threads, the scenario's and the cache world's, that take turns: no lock.
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
enum { CYCLES = 1000, CPU = 0x1da };

typedef struct {
  uint8_t b[16];
} Uuid;
typedef uint32_t (*SubFn)(void *data, const void *header, void *arg, uint32_t status);
typedef void (*StatusFn)(void *data, uint32_t status);
typedef void (*ClientFn)(void *data, void *instance, uint32_t state);

/* ---- checks and the journal ------------------------------------------------------------------ */

static int checks, failures;

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
#define WORD(pointer) ((uint64_t)(uintptr_t)(pointer))

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
static bool all_bytes(const void *base, size_t size, uint8_t value) {
  const uint8_t *bytes = base;
  return size == 0 || (bytes[0] == value && memcmp(bytes, bytes + 1, size - 1) == 0);
}

/* "c( T11 Wake )c": the cache lock taken, event 11 traced, the world woken, the lock given up. i(
 * is an instance's lock; a number behind a directory call is the entry type of its query. */
static char journal[4096];

__attribute__((format(printf, 1, 2))) static void called(const char *format, ...) {
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

/* ---- what is only noted, and what always has the same answer --------------------------------- */

uint32_t zel_ModuleCurrentID = MODULE_ID;
static int log_object;
static int alive;     /* blocks, locks and subscriptions */
static uint8_t *base; /* the module in memory */
static void *cache;   /* with its status callback, as the module registered them */
static StatusFn status_fn;
static struct {
  bool woken, stopping;
  uint32_t (*body)(void *);
  void *data;
  pthread_t thread;
  sem_t may_run, has_paused;
} world;

static uint16_t *rank_of(uint64_t lock) {
  return (uint16_t *)(uintptr_t)lock;
}
/* clang-format off */
#define ALWAYS(type, name, parameters, answer) type name parameters { return answer; }
#define NOTED(type, name, parameters, answer, ...) \
  type name parameters { called(__VA_ARGS__); return answer; }
NOTED(void, zel_HeapDestroy, (uint64_t heap), , "HeapDestroy:%" PRIx64, heap)
NOTED(void, zel_LockDomainDestroy, (uint64_t domain), , "DomainDestroy:%" PRIx64, domain)
NOTED(void, zel_SpinlockLock, (uint64_t lock), , *rank_of(lock) == 1 ? "c(" : "i(")
NOTED(void, zel_SpinlockUnlock, (uint64_t lock), , *rank_of(lock) == 1 ? ")c" : ")i")
NOTED(void, Tolm_LogCleanup, (void **log), , "LogCleanup:%d", *log == &log_object)
NOTED(void, zel_LogNoLevel, (uint32_t u, const char *format, ...), , "LogNoLevel%u %s", u, format)
NOTED(void, KARST_DeregisterStatusCallback, (StatusFn fn, void *data), ,
      "Deregister:%d", fn == status_fn && data == cache)
NOTED(void, Trace_Notify, (uint64_t handle), , "notify:%" PRIu64, handle)
NOTED(void, tolmapi_PreemptionEnable, (void), , "preemptible")
NOTED(bool, tolmapi_PreemptionIsPending, (void), false, "pending?")
NOTED(bool, TOLM_IsWitnessNode, (void), false, "witness?")
ALWAYS(const char *, zel_LogGetName, (void *log), log == &log_object ? "KARSTResolver log" : "")
ALWAYS(int32_t, zel_LogGetCurrentLogLevel, (void *log), log == &log_object ? LOG_LEVEL : -1)
ALWAYS(const char *, zel_StatusToString, (uint32_t status), status == REFUSED ? "REFUSED" : "?")
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

/* ---- heap ------------------------------------------------------------------------------------ */

struct heap_props {
  uint32_t type;
  char name[32];
  uint32_t module, initial, maximum, reserved;
};
struct block {
  uint64_t size, asker;
  uint8_t content[];
};
static struct block *block_of(void *content) {
  return (struct block *)content - 1;
}
static bool in_module(uint64_t address) {
  Dl_info found = {0};
  return dladdr((void *)(uintptr_t)address, &found) != 0 && found.dli_fbase == base;
}
void zel_NameInitialize(void *name, const char *text) {
  snprintf(name, 32, "%s", text);
}
uint32_t zel_HeapCreate(const void *props, uint64_t *heap) {
  const struct heap_props *p = props;
  called("HeapCreate:%u:%s:%x:%x:%x:%u", p->type, p->name, p->module, p->initial, p->maximum,
         p->reserved);
  *heap = HEAP_ID;
  return OK;
}
void *zel_HeapAllocWithRA(uint64_t heap, uint32_t size, void *asker) {
  struct block *block = malloc(sizeof *block + size);
  *block = (struct block){size, WORD(asker)};
  CHECK_EQ(heap, HEAP_ID);
  called("alloc");
  alive++;
  return memset(block->content, 0xa5, size);
}
void zel_HeapFree(uint64_t heap, void *at) {
  CHECK_EQ(heap, HEAP_ID);
  if (block_of(at)->size == 392) CHECK_BYTES(at, "\x94\x9e\x8d\x8c\x8b\x8d\x96\xff", 8);
  if (at == cache) CHECK_BYTES(at, "\x94\x9e\x8d\x8c\x8b\x8d\x9c\xff", 8);
  called("free");
  alive--;
  free(block_of(at));
}

/* ---- lock domain and spinlocks --------------------------------------------------------------- */

struct lock_props {
  uint32_t module;
  uint64_t heap;
  char name[32];
  uint8_t type;
  uint64_t domain;
  uint16_t rank;
};
uint32_t zel_LockDomainCreate(uint32_t module, uint64_t heap, const void *name, uint64_t *domain) {
  called("DomainCreate:%x:%" PRIx64 ":%s", module, heap, (const char *)name);
  *domain = DOMAIN_ID;
  return OK;
}
uint32_t zel_SpinlockCreate(const void *props, uint64_t *lock) {
  const struct lock_props *p = props;
  CHECK(p->module == MODULE_ID && p->heap == HEAP_ID && p->type == 1 && p->domain == DOMAIN_ID);
  called("LockCreate:%s:%u", p->name, p->rank);
  *lock = WORD(malloc(sizeof p->rank));
  *rank_of(*lock) = p->rank;
  alive++;
  return OK;
}
void zel_SpinlockDestroy(uint64_t lock) {
  called("LockDestroy");
  alive--;
  free(rank_of(lock));
}

/* ---- log, text, panic ------------------------------------------------------------------------ */

uint32_t Tolm_LogInit(const char *name, uint32_t module, uint32_t two, uint32_t zero, void **log) {
  called("LogInit:%s:%x:%u:%u", name, module, two, zero);
  *log = &log_object;
  return OK;
}
/* Noted without the source line. */
void zel_LogLevel(uint32_t urgency, void *log, int32_t level, const char *format, ...) {
  static const char prefix[] = "%s: %s:%d: ";
  char text[256];
  va_list args;
  va_start(args, format);
  const char *name = va_arg(args, const char *), *function = va_arg(args, const char *);
  CHECK(log == &log_object && level == LOG_LEVEL && va_arg(args, int) > 0);
  CHECK(strncmp(format, prefix, strlen(prefix)) == 0);
  vsnprintf(text, sizeof text, format + strlen(prefix), args);
  va_end(args);
  called("log%u %s: %s: %s", urgency, name, function, text);
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

/* ---- tracing --------------------------------------------------------------------------------- */

enum { SLOTS = 4096, EVENTS = 19 };
static struct {
  _Alignas(64) uint64_t sequence;
  uint64_t unused, bucket[5];
  uint8_t throttling;
  uint64_t notifyHandle, mask;
  uint8_t reserved[2];
  uint16_t lapShift;
  uint8_t more, enabled;
  _Alignas(64) uint64_t ring[SLOTS][8];
} stream = {.sequence = 1, .throttling = 1, .mask = SLOTS - 1, .lapShift = 12, .enabled = 1};
void *traceStreamTables[] = {NULL, &stream, NULL};
const unsigned char perTraceTbConfig[] = {1, 2, 3, 4};
static void *buckets[EVENTS];
static int bucket_count;

void TokenBucket_InitMini(void *bucket, const void *config) {
  CHECK(config == perTraceTbConfig);
  buckets[bucket_count++ % EVENTS] = bucket;
}
bool TokenBucket_UseTokensMini(void *bucket, const void *config, uint64_t tokens, uint64_t *left) {
  int event = 0;
  while (event < EVENTS && buckets[event] != bucket) event++;
  CHECK(config == perTraceTbConfig && tokens == 1);
  called("T%d", event + 1);
  *left = 1;
  return true;
}
bool TokenBucket_UseTokens(void *bucket, uint64_t tokens, uint64_t *left) {
  CHECK(bucket == stream.bucket && tokens == 1);
  *left = 1;
  return true;
}
void Trace_CreateWallClockEntry(void *of, void *record) {
  called("wallclock:%d:%d", of == &stream, (int)((uint64_t(*)[8])record - stream.ring));
}
static const uint64_t *newest(unsigned id) {
  uint64_t s = stream.sequence - 1;
  while (s > 0 && (stream.ring[s % SLOTS][1] >> 6 & 0x3fff) != id) s--;
  if (s == 0) give_up("an event was never traced");
  return stream.ring[s % SLOTS];
}
/* The newest record of an event: header words rebuilt from their fields, and the payload. */
static void judge_event(unsigned id, unsigned site, const uint64_t *payload, int line) {
  const uint64_t *record = newest(id);
  uint64_t s = record[1] >> 35, phase = 1 - (s >> 12 & 1);
  judge_number(record[0], phase | (CPU & 0xff) << 1 | (CYCLES * 3ull + 7) << 9, line, "word 0");
  judge_number(record[1], 8 | id << 6 | site << 20 | s << 35, line, "word 1");
  judge(record == stream.ring[s % SLOTS], line, "sequence", "of its slot", "not");
  for (int i = 0; i < 6; i++) judge_number(record[2 + i], payload[i], line, "payload");
}
#define TRACED(id, site, ...) judge_event(id, site, (uint64_t[6]){__VA_ARGS__}, __LINE__)
#define UUID_WORDS(uuid) number_at((uuid).b, 0, 8), number_at((uuid).b, 8, 8)

/* ---- the cache world: a thread that runs only when a scenario lets it ------------------------ */

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
  called("WorldCreate:%s:%x:%u:%" PRIx64, name, module, one, heap);
  world.body = body;
  world.data = data;
  sem_init(&world.may_run, 0, 0);
  sem_init(&world.has_paused, 0, 0);
  *id = WORLD_ID;
  if (pthread_create(&world.thread, NULL, world_thread, NULL) != 0) give_up("no thread");
  return OK;
}
void TOLM_WorldDestroy(uint32_t *id) {
  called("WorldDestroy:%u", *id);
  world.stopping = true;
  sem_post(&world.may_run);
  pthread_join(world.thread, NULL);
}
uint32_t zel_WorldWait(uint64_t event, uint64_t lock, uint32_t timeout, const char *reason) {
  called("Wait:%s", reason);
  CHECK(event == 0 && lock == UINT64_MAX && timeout == UINT32_MAX);
  if (!world.stopping) {
    sem_post(&world.has_paused);
    sem_wait(&world.may_run);
  }
  return world.stopping ? WORLD_STOPPING : OK;
}
void zel_WorldForceWakeup(uint32_t id) {
  called("Wake:%u", id);
  world.woken = true;
}

/* ---- the directory --------------------------------------------------------------------------- */

struct query {
  uint8_t before[16];
  Uuid uuid;
  uint8_t between[8], type, flags, after[6];
};
struct header {
  Uuid uuid, owner;
  uint8_t own[28]; /* the directory's: the first is the type */
  uint32_t length;
};
enum { ENTRIES = 8, SUBS = 8 };
static struct entry {
  struct header header;
  uint8_t data[280];
} entries[ENTRIES];
static int entry_count;
static struct sub {
  const struct query *query;
  struct query copy;
  SubFn fn;
  void *data;
  bool ended;
} subs[SUBS];
static const Uuid self_uuid = {{7, 7, 7}};
static const void *allocator;

/* Notes a call with the type and the flags of its query, and a star where that names no entry. */
static void asked(const char *call, const struct query *q) {
  CHECK(all_bytes(q->before, 16, 0) && all_bytes(q->between, 8, 0) && all_bytes(q->after, 6, 0));
  called("%s%d:%x%s", call, q->type, q->flags, all_bytes(&q->uuid, 16, 0) ? "*" : "");
}
uint32_t KARST_RegisterStatusCallback(StatusFn fn, void *data) {
  CHECK_BYTES(data, "karstrc", 8);
  status_fn = fn;
  cache = data;
  called("Register");
  return OK;
}
void KARST_GetSelfUUID(void *uuid) {
  called("Self");
  memcpy(uuid, &self_uuid, 16);
}
uint32_t KARST_Subscribe(const void *query, SubFn fn, void *data) {
  int i = 0;
  asked("Sub", query);
  while (i < SUBS - 1 && subs[i].fn != NULL) i++;
  subs[i] = (struct sub){query, *(const struct query *)query, fn, data, false};
  alive++;
  return OK;
}
void KARST_Unsubscribe(const void *query, SubFn fn, void *data) {
  asked("Unsub", query);
  for (int i = 0; i < SUBS; i++) {
    if (subs[i].query == query && subs[i].fn == fn && subs[i].data == data) subs[i].ended = true;
  }
}
/* The type, and the UUID where the query names one. */
static bool matches(const struct query *q, uint8_t type, const Uuid *uuid) {
  return q->type == type && (all_bytes(&q->uuid, 16, 0) || memcmp(&q->uuid, uuid, 16) == 0);
}
static struct entry *next_match(const struct query *q, int *cursor) {
  while (*cursor < entry_count) {
    struct entry *e = &entries[(*cursor)++];
    if (matches(q, e->header.own[0], &e->header.uuid)) return e;
  }
  return NULL;
}
uint32_t KARST_FindEntry(const void *query, uint32_t next, void *header, uint32_t size) {
  static int cursor;
  asked(next ? "Next" : "Find", query);
  if (next == 0) cursor = 0;
  const struct entry *e = next_match(query, &cursor);
  if (e != NULL) memcpy(header, &e->header, size);
  return e != NULL && size == 64 ? OK : NOT_FOUND;
}
/* The whole entry in a block from the module's allocator record, which takes 32 bits of a size. */
static uint32_t full_entry(const struct query *q, const void *record, void **out) {
  static unsigned turns;
  void *(*allocate[2])(void *context, uint64_t size);
  int cursor = 0;
  memcpy(allocate, record, sizeof allocate);
  allocator = record;
  CHECK(number_at(record, 24, 8) == 0);
  const struct entry *e = next_match(q, &cursor);
  if (e == NULL) return NOT_FOUND;
  uint32_t size = 64 + e->header.length;
  *out = allocate[turns++ % 2](NULL, 0x700000000 + (uint64_t)size);
  CHECK(block_of(*out)->size == size && all_bytes(*out, size, 0));
  CHECK(!in_module(block_of(*out)->asker));
  memcpy(*out, e, size);
  return OK;
}
uint32_t KARST_FindFullEntryByQuery(const void *query, uint32_t zero, const void *record,
                                    void **out) {
  asked("Full", query);
  CHECK_EQ(zero, 0);
  return full_entry(query, record, out);
}
uint32_t KARST_FindFullEntryByHeader(const void *header, uint32_t zero, const void *record,
                                     uint32_t one, void **out) {
  const struct header *h = header;
  called("FullByHeader:%u:%u", zero, one);
  return full_entry(&(struct query){.uuid = h->uuid, .type = h->own[0]}, record, out);
}
/* Cancelled subscriptions get their last call. */
static void deliver(void) {
  for (int i = 0; i < SUBS; i++) {
    struct sub s = subs[i];
    if (!s.ended) continue;
    CHECK_BYTES(s.query, &s.copy, 48); /* in place and unchanged until then */
    CHECK_EQ(s.fn(s.data, NULL, NULL, SUB_CANCELLED), OK);
    subs[i] = (struct sub){0};
    alive--;
  }
}
/* Calls every matching subscription. */
static void tell(uint8_t type, Uuid uuid, Uuid owner, uint32_t status) {
  const struct header header = {uuid, owner, {type}, 0};
  for (int i = 0; i < SUBS; i++) {
    struct sub s = subs[i];
    if (s.fn == NULL || s.ended || !matches(&s.copy, type, &uuid)) continue;
    CHECK_EQ(s.fn(s.data, &header, NULL, status), OK);
  }
}
static void put(uint8_t type, Uuid uuid, Uuid owner, const void *data, uint32_t length) {
  int before = 0;
  struct entry *e = next_match(&(struct query){.uuid = uuid, .type = type}, &before);
  if (e == NULL) e = &entries[entry_count++];
  e->header = (struct header){uuid, owner, {type}, length};
  if (length > 0) memcpy(e->data, data, length);
}
void zel_WorldSleep(uint32_t microseconds) {
  called("Sleep:%u", microseconds);
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
  called("decode%d", type);
  if (length != forms[type].size) return REFUSED;
  memcpy(record, data, length);
  return OK;
}

#endif
