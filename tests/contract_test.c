/*
 * Can somebody who has only the binary contract host the module? A host kernel in one file that shares
 * no line with the module or with its hosts: every record, offset, number and text is typed again.
 * The module lives one whole life in it. One thread: its world is run up to its wait, and stopped
 * there.
 */
#define _GNU_SOURCE
#include <dlfcn.h>
#include <stdarg.h>
#include <stdbool.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

enum { OK = 0, NOT_FOUND = 0x0bad0003, SUB_CANCELLED = 0x0bad0030, WORLD_STOPPING = 0x0bad0069 };
enum { NODE = 3, NETIF = 6, HEALTH = 7, OBJECT = 9 };
enum { MODULE_ID = 0x4b52, HEAP_ID = 0x7ea9, DOMAIN_ID = 0x10c4, LOG_LEVEL = 5, WORLD_ID = 71 };

typedef struct {
  uint8_t b[16];
} Uuid;
typedef uint32_t (*SubFn)(void *data, const void *header, void *arg, uint32_t status);
typedef void (*StatusFn)(void *data, uint32_t status);
typedef void (*ClientFn)(void *data, void *instance, uint32_t state);

static _Noreturn void give_up(int line, const char *why) {
  fprintf(stderr, "line %d: %s\n", line, why);
  abort();
}
#define CHECK(condition) ((condition) ? (void)0 : give_up(__LINE__, "not so: " #condition))
#define CHECK_TEXT(actual, expected) CHECK(strcmp((actual), (expected)) == 0)
#define CHECK_BYTES(actual, expected, size) CHECK(memcmp((actual), (expected), (size)) == 0)

static uint64_t number_at(const void *base, size_t offset, size_t width) {
  uint64_t value = 0;
  memcpy(&value, (const uint8_t *)base + offset, width);
  return value;
}
static bool all_bytes(const void *base, size_t size, uint8_t value) {
  const uint8_t *bytes = base;
  return bytes[0] == value && memcmp(bytes, bytes + 1, size - 1) == 0;
}

/* ---- Answers that are always the same --------------------------------------------------------- */

uint32_t zel_ModuleCurrentID = MODULE_ID;
static int log_object;
static void *cache; /* as the module gives it to its status callback */
static int alive; /* heap, domain, log, world, blocks, locks, subscriptions, the status callback */

/* clang-format off */
#define ALWAYS(type, name, parameters, answer) type name parameters { return answer; }
ALWAYS(const char *, zel_LogGetName, (void), "KARSTResolver")
ALWAYS(int32_t, zel_LogGetCurrentLogLevel, (void), LOG_LEVEL)
ALWAYS(const char *, zel_StatusToString, (void), "?")
ALWAYS(uint32_t, zel_SpinlockAllocSize, (uint32_t type), type == 1 ? 64 : 0)
ALWAYS(uint32_t, tolmapi_HeapRequest2Size, (uint32_t bytes), bytes + 56)
ALWAYS(uint32_t, QXT_GetMaxAssocCount, (void), 0x20000)
ALWAYS(uint64_t, tolmapi_GetReturnAddress, (uint32_t frame), 0x1000 + frame)
ALWAYS(int32_t, Trace_ClassLevelGet, (uint32_t class), class >= 35 && class <= 37 ? 2 : -1)
ALWAYS(uint64_t, TokenBucket_TimeToGetTokens, (void), 0)
ALWAYS(uint32_t, Trace_GetPerTraceThrottledTraceId, (void), 901)
ALWAYS(uint32_t, Trace_GetGlobalThrottledTraceId, (void), 902)
ALWAYS(uint32_t, tolmapi_GetPCPUNumPreemptible, (void), 0x1da)
ALWAYS(uint64_t, zel_GetTimerCycles, (void), 1000)
ALWAYS(uint64_t, zel_TimerTCToNS, (uint64_t cycles), cycles * 3 + 7)
ALWAYS(bool, tolmapi_PreemptionIsPending, (void), false)
ALWAYS(bool, TOLM_IsWitnessNode, (void), false)
ALWAYS(uint32_t, ExprMsh_MshNetInterfaceEntry, (void), NOT_FOUND)
ALWAYS(uint32_t, ExprMsh_UmshNetInterfaceEntry, (void), NOT_FOUND)
ALWAYS(uint32_t, ExprMsh_MshNetInterfaceEntryIpAddresses, (void), NOT_FOUND)
ALWAYS(uint32_t, ExprMsh_UmshNetInterfaceEntryIpAddresses, (void), NOT_FOUND)
/* clang-format on */

/* ---- Heap, locks ------------------------------------------------------------------------------- */

void zel_NameInitialize(void *name, const char *text) {
  snprintf(name, 32, "%s", text);
}
uint32_t zel_HeapCreate(const void *props, uint64_t *heap) {
  const struct {
    uint32_t type;
    char name[32];
    uint32_t module, initial, maximum, reserved;
  } *p = props;
  CHECK(p->type == 0 && p->module == MODULE_ID && p->initial == 0x40000 && p->reserved == 0);
  CHECK(p->maximum == 0x500000 + 0x20000 * (392 + 56 + 64));
  CHECK_TEXT(p->name, "KARSTResolver");
  *heap = HEAP_ID;
  alive++;
  return OK;
}
void zel_HeapDestroy(uint64_t heap) {
  CHECK(heap == HEAP_ID);
  alive--;
}
void *zel_HeapAllocWithRA(uint64_t heap, uint32_t size, void *asker) {
  CHECK(heap == HEAP_ID && asker != NULL);
  alive++;
  return memset(malloc(size), 0xa5, size);
}
void zel_HeapFree(uint64_t heap, void *block) {
  CHECK(heap == HEAP_ID);
  alive--;
  free(block);
}
uint32_t zel_LockDomainCreate(uint32_t module, uint64_t heap, const void *name, uint64_t *domain) {
  CHECK(module == MODULE_ID && heap == HEAP_ID);
  CHECK_TEXT(name, "KARSTResolver");
  *domain = DOMAIN_ID;
  alive++;
  return OK;
}
void zel_LockDomainDestroy(uint64_t domain) {
  CHECK(domain == DOMAIN_ID);
  alive--;
}
/* A lock's handle is its rank. */
uint32_t zel_SpinlockCreate(const void *props, uint64_t *lock) {
  const struct {
    uint32_t module;
    uint64_t heap;
    char name[32];
    uint8_t type;
    uint64_t domain;
    uint16_t rank;
  } *p = props;
  CHECK(p->module == MODULE_ID && p->heap == HEAP_ID && p->type == 1 && p->domain == DOMAIN_ID);
  CHECK_TEXT(p->name, p->rank == 1 ? "KARSTResolverCache" : "KARSTResolverInstance");
  *lock = p->rank;
  alive++;
  return OK;
}
void zel_SpinlockDestroy(uint64_t lock) {
  CHECK(lock == 1 || lock == 2);
  alive--;
}
void zel_SpinlockLock(uint64_t lock) {
  CHECK(lock == 1 || lock == 2);
}
void zel_SpinlockUnlock(uint64_t lock) {
  CHECK(lock == 1 || lock == 2);
}

/* ---- Log, text, panic -------------------------------------------------------------------------- */

uint32_t Tolm_LogInit(const char *name, uint32_t module, uint32_t two, uint32_t zero, void **log) {
  CHECK(module == MODULE_ID && two == 2 && zero == 0);
  CHECK_TEXT(name, "KARSTResolver");
  *log = &log_object;
  alive++;
  return OK;
}
void Tolm_LogCleanup(void **log) {
  CHECK(*log == &log_object);
  alive--;
}
void zel_LogLevel(uint32_t urgency, void *log, int32_t level, const char *format, ...) {
  CHECK(urgency == 2 && log == &log_object && level == LOG_LEVEL && format != NULL);
}
void zel_LogNoLevel(uint32_t urgency, const char *format, ...) {
  CHECK(urgency == 0 && format != NULL);
}
int zel_Snprintf(char *buffer, size_t size, const char *format, ...) {
  va_list args;
  va_start(args, format);
  int length = vsnprintf(buffer, size, format, args);
  va_end(args);
  return length;
}
void zel_PanicWithModuleID(uint32_t module, const char *format, ...) {
  CHECK(module == MODULE_ID);
  give_up(0, format);
}

/* ---- Tracing ----------------------------------------------------------------------------------- */

enum { SLOTS = 512 };
static struct {
  _Alignas(64) uint64_t sequence;
  uint64_t unused, bucket[5];
  uint8_t throttling, library0[15];
  uint64_t mask;
  uint16_t library1, lapShift;
  uint8_t library2, enabled, library3[10];
  uint64_t notifyHandle;
  _Alignas(64) uint64_t ring[SLOTS][8];
} stream = {.throttling = 1, .notifyHandle = 9, .mask = SLOTS - 1, .lapShift = 9, .enabled = 1};
void *traceStreamTables[] = {NULL, &stream, NULL};
const unsigned char perTraceTbConfig[] = {1, 2, 3, 4};

void TokenBucket_InitMini(void *bucket, const void *config) {
  CHECK(bucket != NULL && config == perTraceTbConfig);
}
bool TokenBucket_UseTokensMini(void *bucket, const void *config, uint64_t tokens, uint64_t *left) {
  CHECK(bucket != NULL && config == perTraceTbConfig && tokens == 1);
  *left = 1; /* none would make a notice of the event */
  return true;
}
bool TokenBucket_UseTokens(void *bucket, uint64_t tokens, uint64_t *left) {
  CHECK(bucket == stream.bucket && tokens == 1);
  *left = 1;
  return true;
}
void Trace_CreateWallClockEntry(void *of, void *record) {
  CHECK(of == &stream && record == stream.ring);
}
void Trace_Notify(uint64_t handle) {
  CHECK(handle == stream.notifyHandle);
}

/* ---- The cache world --------------------------------------------------------------------------- */

static struct {
  uint32_t (*body)(void *);
  void *data;
  bool woken, preemptible;
} world;

uint32_t TOLM_WorldCreate(uint32_t *id, const char *name, uint32_t module,
                          uint32_t (*body)(void *data), void *data, uint32_t one, uint64_t heap) {
  CHECK(module == MODULE_ID && one == 1 && heap == HEAP_ID);
  CHECK_TEXT(name, "KARSTResolverCache");
  world.body = body;
  world.data = data;
  *id = WORLD_ID;
  alive++;
  return OK;
}
void TOLM_WorldDestroy(uint32_t *id) {
  CHECK(*id == WORLD_ID);
  alive--;
}
void tolmapi_PreemptionEnable(void) {
  world.preemptible = true;
}
uint32_t zel_WorldWait(uint64_t event, uint64_t lock, uint32_t timeout, const char *reason) {
  CHECK(event == 0 && lock == UINT64_MAX && timeout == UINT32_MAX);
  CHECK_TEXT(reason, "KARSTResolverCacheWorld");
  return WORLD_STOPPING;
}
void zel_WorldForceWakeup(uint32_t id) {
  CHECK(id == WORLD_ID);
  world.woken = true;
}
static void run_world(void) {
  world.preemptible = world.woken = false;
  CHECK(world.body(world.data) == 0 && world.preemptible);
}

/* ---- The directory: records travel as their own image ------------------------------------------ */

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
static struct sub {
  const struct query *query;
  SubFn fn;
  void *data;
  bool ended;
} subs[SUBS];
static StatusFn status_fn;
static const Uuid nobody, self_uuid = {{7, 7, 7}};

uint32_t KARST_RegisterStatusCallback(StatusFn fn, void *data) {
  status_fn = fn;
  cache = data;
  alive++;
  return OK;
}
void KARST_DeregisterStatusCallback(StatusFn fn, void *data) {
  CHECK(fn == status_fn && data == cache);
  alive--;
}
void KARST_GetSelfUUID(void *uuid) {
  memcpy(uuid, &self_uuid, 16);
}
/* The type, and the UUID where the query names one; everything but these and the flags is zero. */
static bool matches(const struct query *q, uint8_t type, const Uuid *uuid) {
  CHECK(all_bytes(q->before, 16, 0) && all_bytes(q->between, 8, 0) && all_bytes(q->after, 6, 0));
  return q->type == type && (all_bytes(&q->uuid, 16, 0) || memcmp(&q->uuid, uuid, 16) == 0);
}
static struct entry *entry_for(const struct query *q) {
  struct entry *e = entries;
  while (e < entries + ENTRIES && !matches(q, e->header.own[0], &e->header.uuid)) e++;
  return e < entries + ENTRIES ? e : NULL;
}
uint32_t KARST_Subscribe(const void *query, SubFn fn, void *data) {
  const struct query *q = query;
  struct sub *s = subs;
  CHECK(q->flags == (all_bytes(&q->uuid, 16, 0) ? 0x0b : 0x09));
  while (s->fn != NULL) s++;
  *s = (struct sub){query, fn, data, false};
  alive++;
  return OK;
}
void KARST_Unsubscribe(const void *query, SubFn fn, void *data) {
  struct sub *s = subs;
  while (s->query != query || s->fn != fn || s->data != data) s++;
  s->ended = true;
}
uint32_t KARST_FindEntry(const void *query, uint32_t next, void *header, uint32_t size) {
  const struct entry *e = next == 0 ? entry_for(query) : NULL; /* one of each type, so far */
  if (e == NULL) return NOT_FOUND;
  CHECK(size == 64);
  memcpy(header, &e->header, 64);
  return OK;
}
/* The whole entry in a zeroed block from the module's allocator. */
uint32_t KARST_FindFullEntryByQuery(const void *query, uint32_t zero, const void *allocator,
                                    void **out) {
  void *(*allocate)(void *context, uint64_t size);
  const struct entry *e = entry_for(query);
  const struct query *q = query;
  CHECK(zero == 0 && q->flags == (q->type == NODE ? 0x05 : 0x09));
  if (e == NULL) return NOT_FOUND;
  memcpy(&allocate, allocator, sizeof allocate);
  *out = allocate(NULL, sizeof *e);
  CHECK(all_bytes(*out, sizeof *e, 0));
  memcpy(*out, e, sizeof *e);
  return OK;
}
uint32_t KARST_FindFullEntryByHeader(const void *header, uint32_t zero, const void *allocator,
                                     uint32_t one, void **out) {
  const struct header *h = header;
  const struct query q = {.uuid = h->uuid, .type = h->own[0], .flags = 0x05};
  CHECK(one == 1);
  return KARST_FindFullEntryByQuery(&q, zero, allocator, out);
}
uint32_t ExprMsh_UmshSingleStructure(const void *allocator, const void *table, const void *data,
                                     uint32_t length, const char *name, void *record) {
  CHECK(allocator != NULL && number_at(table, 0, 8) != 0);
  CHECK_TEXT(name, length == 20   ? "KarstNodeEntry"
                   : length == 24 ? "KarstHealthStatusEntry"
                                  : "KarstNetInterfaceEntry");
  memcpy(record, data, length);
  return OK;
}
/* Puts an entry (removes it, where the status says so), and calls every matching subscription. */
static void tell(uint8_t type, Uuid uuid, Uuid owner, const void *data, uint32_t length,
                 uint32_t status) {
  const struct query q = {.uuid = uuid, .type = type};
  struct entry *e = entry_for(&q);
  if (e == NULL) e = entry_for(&(struct query){0}); /* a free place: of type 0 */
  e->header = (struct header){uuid, owner, {status == OK ? type : 0}, length};
  memcpy(e->data, data, length);
  for (int i = 0; i < SUBS; i++) {
    const struct sub s = subs[i];
    if (s.fn == NULL || s.ended || !matches(s.query, type, &uuid)) continue;
    CHECK(s.fn(s.data, &(struct header){uuid, owner, {type}, 0}, NULL, status) == OK);
  }
}
/* Cancelled subscriptions get their last call while the module waits for it. */
void zel_WorldSleep(uint32_t microseconds) {
  CHECK(microseconds == 100000);
  for (int i = 0; i < SUBS; i++) {
    const struct sub s = subs[i];
    if (!s.ended) continue;
    subs[i] = (struct sub){0};
    alive--;
    CHECK(s.fn(s.data, NULL, NULL, SUB_CANCELLED) == OK);
  }
}

/* ---- A life ------------------------------------------------------------------------------------ */

static int (*init_module)(void);
static void (*cleanup_module)(void);
static uint32_t (*create)(void **, uint32_t, Uuid, Uuid, bool);
static void (*destroy)(void *);
static void (*set_callback)(void *, ClientFn, void *);
static uint32_t (*get_locators)(void *, void *);

static const Uuid node = {{16, 17, 18, 19, 20, 21, 22, 23, 24, 25, 26, 27, 28, 29, 30, 31}};
static const Uuid nic = {{32, 33, 34, 35, 36, 37, 38, 39, 40, 41, 42, 43, 44, 45, 46, 47}};
static const Uuid object = {{48, 49, 50, 51, 52, 53, 54, 55, 56, 57, 58, 59, 60, 61, 62, 63}};

static void map_module(const char *path) {
  void *library = dlopen(path, RTLD_NOW | RTLD_LOCAL);
  if (library == NULL) give_up(__LINE__, dlerror());
  *(void **)&init_module = dlsym(library, "init_module");
  *(void **)&cleanup_module = dlsym(library, "cleanup_module");
  *(void **)&create = dlsym(library, "KARSTResolver_Create");
  *(void **)&destroy = dlsym(library, "KARSTResolver_Destroy");
  *(void **)&set_callback = dlsym(library, "KARSTResolver_SetCallback");
  *(void **)&get_locators = dlsym(library, "KARSTResolver_GetNodeLocators");
}
/* Its interface, healthy, has this IPv4 address. */
static void tell_interface(uint32_t ipv4) {
  const uint32_t record[70] = {1, ipv4, 0x777 /* nobody's */};
  tell(HEALTH, nic, nobody, (uint32_t[6]){0}, 24, OK);
  tell(NETIF, nic, node, record, sizeof record, OK);
  CHECK(world.woken);
  run_world();
}
static void tell_object(uint32_t status) {
  tell(OBJECT, object, node, "", 0, status);
}
static void note_state(void *state_seen, void *instance, uint32_t state) {
  CHECK_BYTES(instance, "karstri", 8);
  *(uint32_t *)state_seen = state;
}

static void loads_and_learns(void) {
  CHECK(init_module() == 0);
  CHECK_BYTES(cache, "karstrc", 8);
  status_fn(cache, 1);
  CHECK_BYTES((uint8_t *)cache + 36, &self_uuid, 16);
  run_world();
  tell(NODE, node, node, (uint32_t[5]){0x01020304, 0x05060708, 0, 77, 78}, 20, OK);
  tell_interface(0xa1);
  tell_object(OK);
}

static uint8_t answer[52 + 20 * 4]; /* room for four locators */
static uint32_t read_out(void *instance) {
  memset(answer, 0xee, sizeof answer);
  memcpy(answer + 48, "\4", 2);
  return get_locators(instance, answer);
}

static void answers_for_an_object(void) {
  void *instance = NULL;
  uint32_t state = 99;
  const uint64_t sequence = stream.sequence, *traced = stream.ring[sequence];
  CHECK(create(&instance, OBJECT, object, node, false) == OK);
  CHECK(traced[0] == (1 | 0xda << 1 | 3007 << 9));               /* first lap, processor, time */
  CHECK(traced[1] == (8 | 1 << 6 | 485 << 20 | sequence << 35)); /* kind, event, line, sequence */
  CHECK(traced[2] == (uintptr_t)instance && traced[3] == OBJECT);
  CHECK_BYTES(traced + 4, &object, 16);
  CHECK_BYTES(traced + 6, &node, 16);
  CHECK_TEXT((char *)instance + 32, "object:30313233-3435-3637-3839-3a3b3c3d3e3f");
  CHECK(number_at(instance, 132, 4) == OBJECT);

  CHECK(read_out(instance) == OK);
  CHECK_BYTES(answer, &node, 16);
  CHECK(number_at(answer, 16, 8) == 0x0506070801020304);
  CHECK(all_bytes(answer + 24, 16, 0xee) && number_at(answer, 40, 8) == 0);
  CHECK(number_at(answer, 48, 4) == (4 | 1 << 16));
  CHECK_BYTES(answer + 52, "\1\0\0\0\xa1\0\0\0\0\0\0\0", 12);
  CHECK(all_bytes(answer + 72, sizeof answer - 72, 0xee));

  set_callback(instance, note_state, &state);
  CHECK(state == 1);
  state = 99;
  tell_interface(0xb1);
  CHECK(state == 1 && read_out(instance) == OK && answer[56] == 0xb1);
  tell_object(NOT_FOUND);
  CHECK(state == 2 && read_out(instance) == NOT_FOUND);
  destroy(instance);
}
static void disables_and_unloads(void) {
  status_fn(cache, 0);
  cleanup_module();
  CHECK(alive == 0);
}

int main(int argc, char **argv) {
  if (argc != 2) give_up(__LINE__, "usage: contract_test karst_resolver.so");
  map_module(argv[1]);
  loads_and_learns();
  answers_for_an_object();
  disables_and_unloads();
  return 0;
}
