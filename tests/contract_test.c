/*
 * Can somebody who has only the binary contract host the module? Scenarios on the host kernel of
 * contract_host.h, with every record, offset, number and text typed again: nothing here comes from
 * the module or its headers. One thread at a time, under its turn; the last scenario runs all at
 * once. Silent but for failures; the last line counts them.
 */
#define _GNU_SOURCE
#include <signal.h>

#include "contract_host.h"

/* ---- scenarios: what they are made of -------------------------------------------------------- */

static Uuid uuid_of(unsigned n) {
  Uuid uuid;
  for (unsigned i = 0; i < 16; i++) uuid.b[i] = (uint8_t)(n * 16 + i);
  uuid.b[1] = (uint8_t)(n >> 4);
  return uuid;
}
static const Uuid nobody;

static void put_node_flags(Uuid node, uint32_t major, uint32_t minor, uint32_t flags) {
  uint32_t record[5] = {major, minor, flags, 77, 78};
  put(NODE, node, node, record, sizeof record);
}
static void put_node(Uuid node) {
  put_node_flags(node, 3, 4, 0);
}
static void put_health(Uuid netif, uint32_t flags, uint64_t time) {
  uint8_t record[24] = {0};
  set_number(record, 0, 4, flags);
  set_number(record, 8, 8, time);
  put(HEALTH, netif, nobody, record, sizeof record);
}
struct netif {
  uint32_t type, ipv4, addresses;
  uint64_t traffic;
  uint8_t address[7][20];
};
static void put_netif(Uuid netif, Uuid owner, const struct netif *of) {
  uint8_t record[280] = {0};
  set_number(record, 0, 4, of->type);
  set_number(record, 4, 4, of->ipv4);
  set_number(record, 128, 4, of->addresses);
  memcpy(record + 132, of->address, sizeof of->address);
  set_number(record, 272, 8, of->traffic);
  put(NETIF, netif, owner, record, sizeof record);
}
static void put_ipv4_netif(Uuid netif, Uuid owner, uint32_t ipv4) {
  struct netif plain = {.type = 1, .ipv4 = ipv4};
  put_netif(netif, owner, &plain);
}
static void tell(uint8_t type, Uuid uuid, Uuid owner, uint32_t status) {
  announce(type, uuid, owner, status);
  deliver();
}
static void node_changed(Uuid node) {
  tell(NODE, node, node, OK);
}
static void netif_changed(Uuid netif, Uuid owner) {
  tell(NETIF, netif, owner, OK);
}
static void health_changed(Uuid netif) {
  tell(HEALTH, netif, nobody, OK);
}

#define LOADED "HeapCreate DomainCreate alloc LockCreate alloc alloc alloc alloc alloc Register"
#define GONE "c( )c free free free free free LockDestroy free DomainDestroy HeapDestroy LogCleanup"
#define TRACKED "T1 c( i( )i T3 i( T6 )i )c i( )i i( )i"
#define NOT_CREATED "alloc LockCreate c( )c " TRACKED " T2 c( i( )i )c T18 LockDestroy free"
/* An interface with its health known to be good, of a node that is cached. */
#define NETIF_IN "c( T8 Full7 decode7 free Full6 decode6 free T10 Wake )c"

static void begin(const char *name) {
  scenario = name;
  open_stream(SLOTS - 1, 12);
  entry_count = 0;
  self_uuid = uuid_of(0xe);
  host_is_witness = false;
  associations = 0;
  forget();
}
static void load(void) {
  CHECK_EQ(init_module(), 0);
  forget();
}
static void enable(void) {
  status_fn(cache, 1);
  run_world();
  forget();
}
static void nothing_left(void) {
  CHECK_EQ(live_blocks, 0);
  CHECK_EQ(live_locks, 0);
  CHECK_EQ(live_subs, 0);
  CHECK(!heap_exists && !domain_exists && !log_open && status_fn == NULL && !world.alive);
  CHECK_EQ(logged.count, 0);
  CHECK_EQ(held, 0);
}
static void unload(void) {
  cleanup_module();
  nothing_left();
  forget();
}
static void begin_enabled(const char *name) {
  begin(name);
  load();
  enable();
}
/* Node n as others see it in a healthy cluster: entry, one interface (n + 0x20), good health. */
static Uuid netif_of(unsigned n) {
  return uuid_of(n + 0x20);
}
static void healthy_node(unsigned n) {
  put_node(uuid_of(n));
  put_health(netif_of(n), 0, 1);
  put_ipv4_netif(netif_of(n), uuid_of(n), 0x0100000a + (n << 24));
  node_changed(uuid_of(n));
  netif_changed(netif_of(n), uuid_of(n));
  run_world();
  forget();
}
static void client(void *name, void *instance, uint32_t state) {
  HELD(INSTANCE_LOCK);
  CHECK_BYTES(instance, "karstri", 8);
  note("%s%u", (const char *)name, state);
}
static void *node_instance(unsigned n) {
  void *instance = NULL;
  CHECK_EQ(create(&instance, 0, nobody, uuid_of(n), false), OK);
  return instance;
}
static uint32_t state_of(const void *instance) {
  return (uint32_t)number_at(instance, 232, 4);
}
static uint64_t references(const void *instance) {
  return number_at(instance, 8, 8);
}

/* ---- scenarios: the module's file, load, unload ---------------------------------------------- */

static void judge_section(const char *name, const char *content, size_t size) {
  const Elf64_Shdr *found = section(name);
  CHECK(found != NULL);
  if (found == NULL) return;
  CHECK_EQ(found->sh_size, size);
  if (found->sh_size == size) CHECK_BYTES(image + found->sh_offset, content, size);
}
static void declares_itself(void) {
  static const char strings[] =
      "param_KARST_RESOLVER_LEAST_MAX_HEAP:int\0"
      "nsRequired=com.tarvik.tracing#0.0.0.1\0nsRequired=com.tarvik.qxt#0.0.0.1\0"
      "nsRequired=com.tarvik.tolmutil#0.0.0.1\0nsRequired=com.tarvik.karst#0.0.0.1\0"
      "nsProvides=com.tarvik.karst.resolver#0.0.0.1\0"
      "param_desc_KARST_RESOLVER_LEAST_MAX_HEAP=Min heap size in bytes (default: 10MB)\0"
      "nsRequired=com.tarvik.tolmapi#0.0.0.2\0nsRequired=com.tarvik.zelapi#v2_4_0_0\0"
      "nsRequired=com.tarvik.zelapi.incompat#v2_4_0_0";
  static const char required[] =
      "com.tarvik.tracing#0.0.0.1\0com.tarvik.qxt#0.0.0.1\0com.tarvik.tolmutil#0.0.0.1\0"
      "com.tarvik.karst#0.0.0.1\0com.tarvik.tolmapi#0.0.0.2\0com.tarvik.zelapi#v2_4_0_0\0"
      "com.tarvik.zelapi.incompat#v2_4_0_0";
  static const char *const exports[] = {"KARSTResolver_GetNodeLocators",
                                        "KARSTResolver_SetCallback", "KARSTResolver_Destroy",
                                        "KARSTResolver_Create"};
  begin("the module's declaration");
  judge_section(".karst.modinfo", strings, sizeof strings);
  judge_section(".karst.required", required, sizeof required);
  CHECK_EQ(section(".karst.params")->sh_size, 40);
  const uint8_t *param = base + section(".karst.params")->sh_addr;
  CHECK_STR((const char *)(uintptr_t)number_at(param, 0, 8), "KARST_RESOLVER_LEAST_MAX_HEAP");
  CHECK_EQ(number_at(param, 8, 8), 1);
  CHECK_EQ(*(const int *)(uintptr_t)number_at(param, 16, 8), 0xa00000);
  CHECK(all_bytes(param + 24, 16, 0));
  CHECK_EQ(section(".karst.exports")->sh_size, 64);
  for (int i = 0; i < 4; i++) {
    const uint8_t *record = base + section(".karst.exports")->sh_addr + 16 * i;
    CHECK_STR((const char *)(uintptr_t)number_at(record, 0, 8), exports[i]);
    CHECK_EQ(number_at(record, 8, 8), 0);
  }
  CHECK_EQ(section(".karst.asserts")->sh_size, 24);
  const uint8_t *row = base + section(".karst.asserts")->sh_addr;
  CHECK_EQ(number_at(row, 0, 8), 1);
  CHECK_STR((const char *)(uintptr_t)number_at(row, 8, 8), "karst/karst_rbtree_impl");
  CHECK(number_at(row, 16, 8) > 0);
}

/* The names that this program defines for the module, and the few that any C library has. */
static bool promised(const char *name) {
  static const char *const start[] = {"zel_",   "Tolm_",    "TOLM_",  "tolmapi_",    "QXT_",
                                      "KARST_", "ExprMsh_", "Trace_", "TokenBucket_"};
  static const char *const whole[] = {
      "traceStreamTables", "perTraceTbConfig", "memcpy", "memmove", "memset", "memcmp", "bcmp"};
  for (size_t i = 0; i < sizeof start / sizeof *start; i++) {
    if (strncmp(name, start[i], strlen(start[i])) == 0) return true;
  }
  for (size_t i = 0; i < sizeof whole / sizeof *whole; i++) {
    if (strcmp(name, whole[i]) == 0) return true;
  }
  return false;
}
static void links_to_nothing_else(void) {
  begin("the module's symbols");
  if (sanitized) return;
  size_t count;
  const char *names;
  int exported = 0;
  const Elf64_Sym *symbols = dynamic_symbols(&count, &names);
  for (size_t i = 1; i < count; i++) {
    const char *name = names + symbols[i].st_name;
    bool undefined = symbols[i].st_shndx == SHN_UNDEF;
    exported += !undefined;
    judge(!undefined || promised(name), HERE, "undefined symbol", "of the contract", name);
  }
  CHECK_EQ(exported, 6);
  CHECK(section(".init_array") == NULL && section(".tdata") == NULL && section(".tbss") == NULL);
}

static void loads_and_unloads(void) {
  begin("load and unload");
  bucket_count = 0;
  memset(buckets, 0, sizeof buckets);
  CHECK_EQ(init_module(), 0);
  CALLS("LogInit " LOADED);
  CHECK_EQ(bucket_count, EVENTS);
  CHECK_EQ(number_at(heap_props, 0, 4), 0);
  CHECK_STR((const char *)heap_props + 4, "KARSTResolver");
  CHECK_EQ(number_at(heap_props, 36, 4), MODULE_ID);
  CHECK_EQ(number_at(heap_props, 40, 4), 0x40000);
  CHECK_EQ(number_at(heap_props, 44, 4), 0xa00000);
  CHECK_EQ(number_at(heap_props, 48, 4), 0);
  CHECK_EQ(live_blocks, 6);
  CHECK_EQ(cache_references(), 0);
  CHECK_EQ(number_at(cache, 16, 1), 0);
  CHECK_EQ(number_at(cache, 32, 4), 0);
  struct block *nodes = &blocks[1];
  struct block *netifs = &blocks[2];
  CHECK(nodes->size % 128 == 0 && netifs->size % 512 == 0);
  for (uint32_t i = 0; i < 128; i++)
    CHECK_BYTES(nodes->at + i * (nodes->size / 128), "\x94\x9e\x8d\x8c\x8b\x8d\x91\xff", 8);
  for (uint32_t i = 0; i < 512; i++)
    CHECK_BYTES(netifs->at + i * (netifs->size / 512), "\x94\x9e\x8d\x8c\x8b\x8d\x91\x96", 8);
  CHECK(nth_block(72, 0) != NULL && nth_block(24, 0) != NULL && nth_block(36, 0) != NULL);
  for (int i = 0; i < 6; i++) {
    CHECK(in_module(blocks[i].asked_by));
    for (int j = 0; j < i; j++) CHECK(blocks[i].asked_by != blocks[j].asked_by);
  }
  cleanup_module();
  CALLS("Deregister c( )c " GONE);
  nothing_left();
}

static void heap_is_sized(void) {
  static const struct {
    uint32_t associations, request, lock;
    int parameter;
    uint32_t maximum;
  } rows[] = {
      {0, 448, 64, 0xa00000, 0xa00000},        {0, 448, 64, 1, 0x500000},
      {20000, 448, 64, 0xa00000, 0xec4000},    {1, 100, 28, 0x500080, 0x500080},
      {1, 100, 28, 0x500081, 0x500081},        {0x800000, 448, 64, 1, 0x500000},
      {0xffffffff, 1, 0, 0x4ffffe, 0x4fffff},  {20000, 448, 64, -1, 0xffffffff},
      {0x400000, 0x200, 0x100, 7, 0xc0500000},
  };
  begin("the heap's size");
  int *parameter = (int *)(uintptr_t)number_at(base + section(".karst.params")->sh_addr, 16, 8);
  for (size_t i = 0; i < sizeof rows / sizeof *rows; i++) {
    associations = rows[i].associations;
    request_space = rows[i].request;
    lock_size = rows[i].lock;
    *parameter = rows[i].parameter;
    load();
    CHECK_EQ(number_at(heap_props, 44, 4), rows[i].maximum);
    unload();
  }
  *parameter = 0xa00000;
  request_space = 448;
  lock_size = 64;
}

static void failed_load(uint32_t *refusal, int allocation, const char *calls, const char *function,
                        const char *report) {
  if (refusal != NULL) *refusal = REFUSED;
  refuse.allocation = allocation;
  forget();
  CHECK_EQ(init_module(), -1);
  CALLS(calls);
  if (report != NULL) LOGGED(2, function, report);
  nothing_left();
  CHECK_EQ(refuse.allocation, 0);
}
static void failed_loads_leave_nothing(void) {
#define TO_DOMAIN "LogInit HeapCreate DomainCreate"
#define BACK "DomainDestroy HeapDestroy LogCleanup"
#define POOL "log Deregister c( )c c( )c"
  static const char init[] = "KARSTResolverInit";
  static const char in_cache[] = "KARSTResolverCacheInit";
  begin("failed loads");
  failed_load(&refuse.log, 0, "LogInit", NULL, NULL);
  failed_load(&refuse.heap, 0, "LogInit HeapCreate log LogCleanup", init,
              "Failed to create heap: <0bad0777>\n");
  failed_load(&refuse.domain, 0, TO_DOMAIN " log HeapDestroy LogCleanup", init,
              "Failed to create lock domain: <0bad0777>\n");
  failed_load(NULL, 1, TO_DOMAIN " alloc! " BACK, NULL, NULL);
  failed_load(&refuse.lock, 0, TO_DOMAIN " alloc LockCreate log Deregister free " BACK, in_cache,
              "Failed to create spinlock: <0bad0777>\n");
  failed_load(NULL, 2, TO_DOMAIN " alloc LockCreate alloc! " POOL " LockDestroy free " BACK,
              in_cache, "Failed to allocate node pool\n");
  failed_load(NULL, 3,
              TO_DOMAIN " alloc LockCreate alloc alloc! " POOL " free LockDestroy free " BACK,
              in_cache, "Failed to allocate netif pool\n");
  failed_load(NULL, 4,
              TO_DOMAIN " alloc LockCreate alloc alloc alloc! " POOL
                        " free free LockDestroy free " BACK,
              in_cache, "Failed to allocate node rbtree\n");
  failed_load(NULL, 5,
              TO_DOMAIN " alloc LockCreate alloc alloc alloc alloc! free " POOL
                        " free free LockDestroy free " BACK,
              in_cache, "Failed to allocate node rbtree\n");
  failed_load(NULL, 6,
              TO_DOMAIN " alloc LockCreate alloc alloc alloc alloc alloc! free free " POOL
                        " free free LockDestroy free " BACK,
              in_cache, "Failed to allocate node rbtree\n");
  failed_load(&refuse.status_callback, 0,
              "LogInit " LOADED " " POOL " free free free free free LockDestroy free " BACK,
              in_cache, "Failed to register KARST status callback\n");
  void *instance = &instance;
  CHECK_EQ(create(&instance, 0, nobody, uuid_of(1), false), NOT_INITIALIZED);
  CHECK(instance == &instance);
  CHECK_EQ(create(&instance, 0, nobody, nobody, true), BAD_PARAM);
  CHECK_EQ(create(NULL, 0, uuid_of(1), uuid_of(1), false), BAD_PARAM);
  CALLS("");
}

/* ---- scenarios: enable and disable ----------------------------------------------------------- */

static void failed_enable(uint32_t *refusal, const char *calls, const char *report) {
  *refusal = REFUSED;
  status_fn(cache, 1);
  CALLS(calls);
  if (report != NULL) {
    LOGGED(2, "KARSTResolverCacheEnable", report);
  } else {
    CHECK_STR(logged.function, "KARSTResolverCacheEnable");
    CHECK(strstr(logged.text, "<0bad0777>") != NULL && logged.urgency == 2 && logged.count == 1);
    logged.count = 0;
  }
  CHECK_EQ(number_at(cache, 16, 1), 0);
  deliver();
  CHECK_EQ(cache_references(), 0);
  forget();
}
static void enables_and_disables(void) {
  begin("enable and disable");
  load();
  status_fn(cache, 0xfffffffe);
  CALLS("c( )c");
  for (int round = 0; round < 3; round++) {
    self_uuid = uuid_of(0xe + (unsigned)round);
    status_fn(cache, round == 1 ? 0xffffffff : 1);
    run_world();
    CALLS("c( )c Self c( )c WorldCreate Sub3 Sub6 preemptible c( pending? )c Wait");
    CHECK_EQ(number_at(cache, 16, 1), 1);
    CHECK_EQ(number_at(cache, 32, 4), world.id);
    CHECK_BYTES((uint8_t *)cache + 36, &self_uuid, 16);
    CHECK_EQ(cache_references(), 2);
    CHECK(world.data == cache);
    status_fn(cache, 0);
    CALLS("c( )c WorldDestroy Unsub6 Unsub3 c( )c");
    CHECK_EQ(number_at(cache, 16, 1), 0);
    CHECK_EQ(cache_references(), 2);
    deliver();
    CALLS("");
    CHECK_EQ(cache_references(), 0);
    CHECK_EQ(live_subs, 0);
    status_fn(cache, 2);
    CALLS("c( )c");
  }
  failed_enable(&refuse.world,
                "c( )c Self c( )c WorldCreate log c( )c WorldDestroy unsub6 unsub3 c( )c",
                "Failed to create world: <0bad0777>\n");
  failed_enable(&refuse.subscribe[NODE],
                "c( )c Self c( )c WorldCreate Sub3 log c( )c WorldDestroy preemptible c( pending? "
                ")c Wait unsub6 unsub3 c( )c",
                NULL);
  failed_enable(&refuse.subscribe[NETIF],
                "c( )c Self c( )c WorldCreate Sub3 Sub6 log c( )c WorldDestroy preemptible c( "
                "pending? )c Wait unsub6 Unsub3 c( )c",
                "Failed to install netif subscription: <0bad0777>\n");
  enable();
  CHECK_EQ(cache_references(), 2);
  cleanup_module();
  CALLS("Deregister c( )c WorldDestroy Unsub6 Unsub3 c( )c Sleep Sleep " GONE);
  nothing_left();
}

/* Disabling visits nodes in the tree's order and interfaces in the order of their creation. */
static void disable_empties_the_cache(void) {
  begin_enabled("a disable with a full cache");
  Uuid late = {{1, 0, 0, 0, 0, 0, 0, 9}};
  Uuid early = {{0xff, 0, 0, 0, 0, 0, 0, 8, 0xff}};
  Uuid earliest = {{0xff, 0, 0, 0, 0, 0, 0, 8, 0xfe}};
  Uuid order[] = {late, early, earliest};
  for (int i = 0; i < 3; i++) {
    put_node(order[i]);
    node_changed(order[i]);
  }
  healthy_node(1);
  put_ipv4_netif(uuid_of(9), early, 5);
  netif_changed(uuid_of(9), early);
  forget();
  CHECK_EQ(cache_references(), 3);
  status_fn(cache, 0);
  CALLS("c( )c WorldDestroy Unsub6 Unsub3 c( T14 T13 T14 T14 T13 T14 T9 T13 Unsub7 T9 T13 )c");
  TRACED(9, 195, traced_pointer(9, 0), LO(uuid_of(9)), HI(uuid_of(9)), LO(early), HI(early), 0);
  TRACED(14, 50, traced_pointer(14, 0), LO(uuid_of(1)), HI(uuid_of(1)), 0, 1, 0);
  CHECK_EQ(traced_pointer(13, 3), traced_pointer(12, 1)); /* earliest, then late */
  CHECK_EQ(traced_pointer(13, 2), traced_pointer(12, 3));
  put_node(uuid_of(2));
  deliver();
  CHECK_EQ(cache_references(), 0);
  unload();
}

/* ---- scenarios: nodes ------------------------------------------------------------------------ */

#define NODE_TEXT "10001213-1415-1617-1819-1a1b1c1d1e1f"
static void nodes_follow_their_entries(void) {
  begin_enabled("node entries");
  Uuid one = uuid_of(1);
  put_node_flags(one, 3, 4, 0);
  node_changed(one);
  CALLS("c( T12 T14 Wake Full3 decode3 free )c");
  void *node = (void *)traced_pointer(12, 0);
  CHECK_BYTES(node, "karstrn", 8);
  CHECK_EQ(number_at(node, 8, 4), 1);
  TRACED(12, 454, WORD(node), LO(one), HI(one), 0, 0, 0);
  TRACED(14, 50, WORD(node), LO(one), HI(one), 1, 0, 0);
  run_world();
  CALLS("c( pending? witness? T14 pending? )c Wait");
  TRACED(14, 578, WORD(node), LO(one), HI(one), 1, 0, 0);
  node_changed(one);
  CALLS("c( Full3 decode3 free )c");
  tell(NODE, one, one, 0x123);
  CALLS("");
  refuse.full[NODE] = REFUSED;
  node_changed(one);
  CALLS("c( Full3 log T14 Wake T13 )c");
  LOGGED(2, "KARSTResolverUpdateNodeVersionLocked",
         "Failed to find node entry " NODE_TEXT ": <0bad0777>\n");
  TRACED(13, 453, WORD(node), LO(one), HI(one), 0, 0, 0);
  CHECK_BYTES(node, "\x94\x9e\x8d\x8c\x8b\x8d\x91\xff", 8);
  run_world();
  CALLS("c( pending? )c Wait"); /* off the queue again */
  refuse.decode[NODE] = REFUSED;
  node_changed(one);
  CALLS("c( T12 T14 Wake Full3 decode3 free log T14 Wake T13 )c");
  CHECK_EQ(traced_pointer(12, 0), WORD(node)); /* the slot released last is used first */
  LOGGED(2, "KARSTResolverUpdateNodeVersionLocked",
         "Failed to unmarshal node entry " NODE_TEXT ": <0bad0777>\n");
  put_node(self_uuid);
  node_changed(self_uuid);
  TRACED(12, 454, WORD(node), LO(self_uuid), HI(self_uuid), 1, 0, 0);
  forget();
  tell(NODE, one, one, NOT_FOUND);
  CALLS("c( )c");
  tell(NODE, self_uuid, self_uuid, NOT_FOUND);
  CALLS("c( T14 Wake T13 )c");
  unload();
}

static void node_rescans(void) {
  begin_enabled("node rescans");
  for (unsigned n = 1; n <= 3; n++) {
    put_node(uuid_of(n));
    node_changed(uuid_of(n));
  }
  put_ipv4_netif(uuid_of(9), uuid_of(2), 5);
  netif_changed(uuid_of(9), uuid_of(2));
  run_world();
  drop(NODE, uuid_of(1));
  drop(NODE, uuid_of(2));
  put_node(uuid_of(4));
  forget();
  /* 3 stays, 4 is new; 1 leaves, 2 becomes unreachable and stays for its interface. */
  tell(NODE, nobody, nobody, SUB_RESYNC);
  forget();
  run_world();
  forget();
  announce(NODE, uuid_of(9), uuid_of(9), SUB_OVERFLOW);
  deliver();
  CALLS("T16 c( Find3 FullByHeader decode3 free Next3 FullByHeader decode3 free Next3 )c");
  TRACED(16, 230, 0, 0, 0, 0, 0, 0);
  TRACED(13, 453, traced_pointer(13, 0), LO(uuid_of(1)), HI(uuid_of(1)), 0, 0, 0);
  /* An entry that cannot be fetched makes its node unreachable, in the walk itself. */
  refuse.full[NODE] = REFUSED;
  tell(NODE, nobody, nobody, SUB_RESYNC);
  CALLS("T16 c( Find3 FullByHeader log T14 Wake T13 Next3 FullByHeader decode3 free Next3 )c");
  logged.count = 0;
  drop(NODE, uuid_of(3));
  drop(NODE, uuid_of(4));
  tell(NODE, nobody, nobody, SUB_RESYNC);
  CALLS("T16 c( Find3 T14 Wake T13 )c");
  put_node(uuid_of(2));
  tell(NODE, nobody, nobody, SUB_RESYNC);
  CALLS("T16 c( Find3 T14 Wake FullByHeader decode3 free Next3 )c");
  tell(NODE, nobody, nobody, SUB_RESYNC); /* no mark was left behind */
  CALLS("T16 c( Find3 FullByHeader decode3 free Next3 )c");
  drop(NODE, uuid_of(2));
  tell(NODE, nobody, nobody, SUB_RESYNC);
  CALLS("T16 c( Find3 T14 Wake )c");
  unload();
}

/* The record that the module hands to the directory and the marshaller works for them alone. */
static void allocator_serves_the_host(void) {
  begin_enabled("the allocator record");
  put_node(uuid_of(1));
  node_changed(uuid_of(1));
  void *const *functions = allocator;
  void (*give_back)(void *context, void *block);
  AllocFn alloc;
  memcpy(&give_back, &functions[2], sizeof give_back);
  for (int i = 0; i < 2; i++) {
    memcpy(&alloc, &functions[i], sizeof alloc);
    give_back(functions[3], allocate_entry(allocator, 7));
    refuse.allocation = 1;
    CHECK(alloc(functions[3], 7) == NULL);
    forget();
    give_back(functions[3], NULL);
    CALLS("");
  }
  unload();
}

static void pools_are_bounded(void) {
  begin_enabled("128 nodes and 512 interfaces");
  for (unsigned n = 1; n <= 128; n++) {
    put_node(uuid_of(n));
    node_changed(uuid_of(n));
    forget();
  }
  put_node(uuid_of(129));
  node_changed(uuid_of(129));
  CALLS("c( )c");
  netif_changed(uuid_of(600), uuid_of(129)); /* no node for it */
  CALLS("c( )c");
  void *none = NULL;
  CHECK_EQ(create(&none, 0, nobody, uuid_of(129), false), NOT_FOUND);
  CALLS(NOT_CREATED);
  for (unsigned n = 1; n <= 512; n++) {
    put_ipv4_netif(uuid_of(200 + n), uuid_of(1 + n % 128), n);
    netif_changed(uuid_of(200 + n), uuid_of(1 + n % 128));
    forget();
  }
  put_ipv4_netif(uuid_of(713), uuid_of(1), 5);
  netif_changed(uuid_of(713), uuid_of(1));
  CALLS("c( )c");
  run_world();
  CHECK_EQ(cache_references(), 2 + 512);
  journal_on = false;
  tell(NETIF, nobody, nobody, SUB_RESYNC);
  journal_on = true;
  tell(NETIF, uuid_of(201), uuid_of(2), NOT_FOUND); /* its slot is free after the last call */
  CHECK_EQ(cache_references(), 2 + 511);
  forget();
  netif_changed(uuid_of(713), uuid_of(1));
  CALLS("c( T8 Full7 T11 Wake Full6 decode6 free T10 Wake )c");
  journal_on = false;
  unload();
  journal_on = true;
}

/* ---- scenarios: interfaces ------------------------------------------------------------------- */

static void netifs_follow_their_entries(void) {
  begin_enabled("interface entries");
  Uuid one = uuid_of(1);
  Uuid nic = netif_of(1);
  put_node(one);
  node_changed(one);
  run_world();
  forget();
  put_health(nic, 0, 11);
  put_ipv4_netif(nic, one, 0x0101a8c0);
  netif_changed(nic, one);
  CALLS(NETIF_IN);
  uint8_t *netif = (uint8_t *)traced_pointer(8, 0);
  CHECK_BYTES(netif, "karstrni", 8);
  CHECK_EQ(number_at(netif, 8, 4), 1);
  CHECK_STR((const char *)netif + 64, "10021213-1415-1617-1819-1a1b1c1d1e1f");
  TRACED(8, 150, WORD(netif), LO(nic), HI(nic), LO(one), HI(one), 0);
  TRACED(10, 304, WORD(netif), LO(nic), HI(nic), LO(one), HI(one), 0);
  run_world();
  CALLS("c( Sub7 pending? witness? T14 pending? )c Wait");
  CHECK_EQ(number_at(netif, 8, 4), 2);
  CHECK_EQ(cache_references(), 3);
  netif_changed(nic, one); /* nothing new in it */
  CALLS("c( Full6 decode6 free )c");
  tell(NETIF, nic, one, 0x123);
  CALLS("c( )c");
  put_health(nic, 0, 12);
  health_changed(nic);
  CALLS("c( Full7 decode7 free )c");
  put_health(nic, 0x80000001, 13);
  health_changed(nic);
  CALLS("c( Full7 decode7 free T11 Wake )c");
  TRACED(11, 378, WORD(netif), LO(nic), HI(nic), 0, 0x80000001, 13);
  drop(HEALTH, nic);
  tell(HEALTH, nic, nobody, NOT_FOUND);
  CALLS("c( Full7 T11 Wake )c");
  TRACED(11, 378, WORD(netif), LO(nic), HI(nic), 0, 0xffffffff, UINT64_MAX);
  put_health(nic, 0, 14);
  refuse.decode[HEALTH] = REFUSED; /* whatever was decoded until then counts */
  tell(HEALTH, nic, nobody, SUB_OVERFLOW);
  CALLS("c( Full7 decode7 free log T11 Wake )c");
  LOGGED(2, "KARSTResolverUpdateNetIfHealth",
         "Failed to unmarshal health entry 10021213-1415-1617-1819-1a1b1c1d1e1f: <0bad0777>\n");
  TRACED(11, 378, WORD(netif), LO(nic), HI(nic), 1, 0, 14);
  run_world();
  forget();
  announce(HEALTH, nic, nobody, OK); /* still on its way when the interface goes */
  status_fn(cache, 2);               /* every node gone, the interface with them */
  CALLS("c( )c WorldDestroy Unsub6 Unsub3 c( T14 T9 T13 Unsub7 )c");
  CHECK_BYTES(netif, "karstrni", 8);
  CHECK_EQ(number_at(netif, 8, 4), 1);
  CHECK(deliver_one());
  CALLS("c( )c");
  CHECK(deliver_one() && deliver_one());
  CALLS("");
  CHECK(deliver_one() && !deliver_one());
  CALLS("c( )c");
  CHECK_BYTES(netif, "\x94\x9e\x8d\x8c\x8b\x8d\x91\x96", 8);
  unload();
}

static void netifs_leave(void) {
  begin_enabled("interfaces that leave");
  Uuid one = uuid_of(1);
  Uuid two = uuid_of(2);
  Uuid nic = netif_of(1);
  healthy_node(1);
  uint8_t *netif = (uint8_t *)traced_pointer(8, 0);
  refuse.full[NETIF] = REFUSED;
  netif_changed(nic, one);
  CALLS("c( Full6 T9 Wake Unsub7 )c c( )c");
  TRACED(9, 195, WORD(netif), LO(nic), HI(nic), LO(one), HI(one), 0);
  netif_changed(nic, one);
  CALLS(NETIF_IN);
  CHECK(traced_pointer(8, 0) != WORD(netif)); /* slots go back to the rear */
  refuse.decode[NETIF] = REFUSED;
  netif_changed(nic, one); /* not watched yet: the slot is free at once */
  CALLS("c( Full6 decode6 free log T9 Wake )c");
  LOGGED(2, "KARSTResolverUpdateNetIf",
         "Failed to unmarshal netif entry 10021213-1415-1617-1819-1a1b1c1d1e1f: <0bad0777>\n");
  CHECK_BYTES((void *)traced_pointer(8, 0), "\x94\x9e\x8d\x8c\x8b\x8d\x91\x96", 8);
  netif_changed(nic, one);
  forget();
  put_ipv4_netif(nic, two, 9); /* another owner */
  netif_changed(nic, one);
  CALLS("c( Full6 free log T9 Wake )c");
  LOGGED(2, "KARSTResolverUpdateNetIf",
         "Netif owner changed to 20002223-2425-2627-2829-2a2b2c2d2e2f\n");
  netif_changed(nic, two); /* its node is not known: it holds the node alone */
  CALLS("c( T12 T8 Full7 decode7 free Full6 decode6 free T10 Wake )c");
  put_ipv4_netif(nic, one, 9);
  netif_changed(nic, one); /* under both owners until the old pairing is reported gone */
  CALLS(NETIF_IN);
  tell(NETIF, nic, two, NOT_FOUND);
  CALLS("c( T9 Wake T13 )c");
  tell(NETIF, nic, two, NOT_FOUND);
  CALLS("c( )c");
  run_world();
  forget();
  /* A rescan removes what is no longer listed, and finds what is new. */
  put_ipv4_netif(uuid_of(9), one, 9);
  drop(NETIF, nic);
  tell(NETIF, nobody, nobody, SUB_OVERFLOW);
  CALLS("T15 c( Find6 T8 Full7 T11 Wake Full6 decode6 free T10 Wake Next6 T9 Wake Unsub7 )c c( )c");
  TRACED(15, 414, 0, 0, 0, 0, 0, 0);
  tell(NETIF, nobody, nobody, SUB_RESYNC);
  CALLS("T15 c( Find6 Full6 decode6 free Next6 )c");
  drop(NETIF, uuid_of(9)); /* no mark was left behind */
  tell(NETIF, nobody, nobody, SUB_RESYNC);
  CALLS("T15 c( Find6 T9 Wake )c");
  put_ipv4_netif(uuid_of(9), one, 9);
  netif_changed(uuid_of(9), one);
  forget();
  refuse.full[NETIF] = REFUSED;
  tell(NETIF, nobody, nobody, SUB_RESYNC);
  CALLS("T15 c( Find6 Full6 T9 Wake Next6 )c");
  unload();
}

/* ---- scenarios: locators --------------------------------------------------------------------- */

#define SET_SIZE(slots) (52 + (size_t)20 * (slots))
static uint8_t answer[SET_SIZE(8) + 16];
/* Reads an instance out, into bytes that are all 0xee before. */
static uint32_t read_out(void *instance, uint16_t capacity) {
  memset(answer, 0xee, sizeof answer);
  set_number(answer, 48, 2, capacity);
  return get_locators(instance, answer);
}
static void judge_slot(int slot, uint32_t type, const void *address, size_t size,
                       const char *where) {
  judge_number(number_at(answer, 52 + 20 * (size_t)slot, 4), type, where, "locator type");
  judge_bytes(answer + 56 + (size_t)20 * (size_t)slot, address, size, where, "locator address");
}
#define SLOT_V4(slot, ipv4) judge_slot((slot), 1, &(uint32_t){ipv4}, 4, HERE)
#define SLOT_V6(slot, address) judge_slot((slot), 2, (address), 16, HERE)

static void locators_are_chosen(void) {
  begin_enabled("locator generation");
  Uuid one = uuid_of(1);
  static const uint8_t v6[16] =
      "\xfe\x80"
      "GHIJKLMNOPQRST";
  healthy_node(1); /* the first interface */
  void *instance = node_instance(1);
  CHECK_EQ(read_out(instance, 8), OK);
  CHECK_EQ(number_at(answer, 50, 2), 1);
  SLOT_V4(0, 0x0200000a);
  for (unsigned n = 10; n < 16; n++) put_health(uuid_of(n), 0, 1);
  put_health(uuid_of(11), 1, 1);
  struct netif silent = {.type = 1};
  struct netif stranger = {.type = 2, .ipv4 = 5};
  struct netif mixed = {.type = 1, .ipv4 = 5, .addresses = 2};
  mixed.address[0][0] = 0x80;
  memcpy(mixed.address[0] + 4, v6, 16);
  memcpy(mixed.address[1], "\0xyz\x0b\0\0\x02rubbish", 15);
  put_netif(uuid_of(10), one, &silent);
  put_netif(uuid_of(11), one, &stranger); /* not healthy: not looked at */
  put_netif(uuid_of(12), one, &mixed);
  for (unsigned n = 10; n <= 12; n++) netif_changed(uuid_of(n), one);
  put_netif(uuid_of(13), one, &stranger);
  netif_changed(uuid_of(13), one);
  forget();
  run_world();
  LOGGED(1, "KARSTResolverGenerateNodeLocators",
         "Unknown network type 2 for interface d000d2d3-d4d5-d6d7-d8d9-dadbdcdddedf\n");
  CHECK_EQ(read_out(instance, 8), OK);
  CHECK_EQ(number_at(answer, 50, 2), 3);
  SLOT_V4(0, 0x0200000a);
  SLOT_V6(1, v6);
  SLOT_V4(2, 0x0200000b);
  TRACED(14, 578, traced_pointer(14, 0), LO(one), HI(one), 1, 3, 0);
  /* Four are enough: what comes after is not even looked at. */
  mixed.addresses = 7;
  mixed.ipv4 = 6;
  put_netif(uuid_of(12), one, &mixed);
  netif_changed(uuid_of(12), one);
  run_world();
  CHECK_EQ(logged.count, 0);
  CHECK_EQ(read_out(instance, 8), OK);
  CHECK_EQ(number_at(answer, 50, 2), 4);
  SLOT_V6(1, v6);
  SLOT_V4(3, 0);
  CHECK(all_bytes(answer + SET_SIZE(4), sizeof answer - SET_SIZE(4), 0xee));
  destroy(instance);
  unload();
}

static void traffic_types_are_kept_apart(void) {
  begin_enabled("traffic types");
  Uuid one = uuid_of(1);
  healthy_node(1); /* carries everything: its mask is 0 in the directory */
  struct netif data = {.type = 1, .ipv4 = 0x11, .traffic = 1};
  struct netif witness = {.type = 1, .ipv4 = 0x22, .traffic = 2};
  put_netif(uuid_of(10), one, &data);
  put_netif(uuid_of(11), one, &witness);
  for (unsigned n = 10; n <= 11; n++) {
    put_health(uuid_of(n), 0, 1);
    netif_changed(uuid_of(n), one);
  }
  run_world();
  void *instance = node_instance(1);
  for (int round = 0; round < 4; round++) {
    /* Neither witness, this host, the node, neither again. */
    host_is_witness = round == 1;
    put_node_flags(one, 3, (uint32_t)round, round == 2 ? 2 : 0xfffffffd);
    node_changed(one);
    put_ipv4_netif(uuid_of(12), one, 0x30 + (uint32_t)round);
    netif_changed(uuid_of(12), one);
    run_world();
    bool for_witness = round == 1 || round == 2;
    CHECK_EQ(read_out(instance, 8), OK);
    CHECK_EQ(number_at(answer, 20, 4), round);
    CHECK_EQ(number_at(answer, 40, 8), for_witness);
    CHECK_EQ(number_at(answer, 50, 2), 2);
    SLOT_V4(1, for_witness ? 0x22 : 0x11);
  }
  destroy(instance);
  unload();
}

static void readings_are_exact(void) {
  begin_enabled("read-outs");
  Uuid one = uuid_of(1);
  put_node_flags(one, 0x01020304, 0x05060708, 0);
  put_health(netif_of(1), 0, 1);
  struct netif three = {.type = 1, .addresses = 3};
  for (int i = 0; i < 3; i++) three.address[i][4] = (uint8_t)(0x40 + i);
  put_netif(netif_of(1), one, &three);
  node_changed(one);
  netif_changed(netif_of(1), one);
  run_world();
  void *instance = node_instance(1);
  for (uint16_t capacity = 0; capacity <= 5; capacity++) {
    unsigned count = capacity < 3 ? capacity : 3;
    forget();
    CHECK_EQ(read_out(instance, capacity), OK);
    CALLS("i( )i");
    CHECK_BYTES(answer, &one, 16);
    CHECK_EQ(number_at(answer, 16, 8), 0x0506070801020304);
    CHECK(all_bytes(answer + 24, 16, 0xee));
    CHECK_EQ(number_at(answer, 40, 8), 0);
    CHECK_EQ(number_at(answer, 48, 2), capacity);
    CHECK_EQ(number_at(answer, 50, 2), count);
    for (unsigned i = 0; i < count; i++) SLOT_V4((int)i, 0x40 + i);
    CHECK(all_bytes(answer + SET_SIZE(count), sizeof answer - SET_SIZE(count), 0xee));
  }
  put_node_flags(one, 7, 8, 0); /* a version alone wakes nobody, and counts from now on */
  node_changed(one);
  void *later = node_instance(1);
  CHECK_EQ(read_out(later, 3), OK);
  CHECK_EQ(number_at(answer, 16, 8), 0x0000000800000007);
  destroy(later);
  CHECK_EQ(read_out(instance, 3), OK);
  CHECK_EQ(number_at(answer, 16, 8), 0x0506070801020304);
  drop(HEALTH, netif_of(1));
  health_changed(netif_of(1));
  run_world();
  CHECK_EQ(read_out(instance, 3), NOT_FOUND);
  set_number(answer, 48, 2, 0xeeee);
  CHECK(all_bytes(answer, sizeof answer, 0xee));
  CHECK(all_bytes((uint8_t *)instance + 240, 136, 0));
  destroy(instance);
  unload();
}

static void this_host_is_local(void) {
  begin_enabled("the local locator");
  void *local = NULL;
  void *plain = NULL;
  /* Without entry, interface or address. */
  CHECK_EQ(create(&local, 0, nobody, self_uuid, true), OK);
  CALLS("alloc LockCreate c( )c T1 c( i( )i T12 T3 i( T6 )i )c i( )i i( )i");
  TRACED(12, 454, traced_pointer(12, 0), LO(self_uuid), HI(self_uuid), 1, 0, 0);
  TRACED(6, 120, WORD(local), 0, 0, LO(self_uuid), HI(self_uuid), 1);
  CHECK_EQ(create(&plain, 0, nobody, self_uuid, false), NOT_FOUND);
  CHECK(plain == NULL);
  CHECK_EQ(read_out(local, 4), OK);
  CHECK_EQ(number_at(answer, 50, 2), 1);
  CHECK_EQ(number_at(answer, 16, 8), 0);
  judge_slot(0, 3, (uint8_t[16]){0}, 16, HERE);
  CHECK_EQ(number_at(local, 240 + 48, 2), 0); /* only what a reading needs is written */
  host_is_witness = true;
  put_node_flags(self_uuid, 8, 9, 2);
  put_health(netif_of(2), 0, 1);
  put_ipv4_netif(netif_of(2), self_uuid, 7);
  node_changed(self_uuid);
  netif_changed(netif_of(2), self_uuid);
  run_world();
  CHECK_EQ(read_out(local, 4), OK);
  CHECK_EQ(number_at(answer, 16, 8), 0x0000000900000008);
  CHECK_EQ(number_at(answer, 40, 8), 0);
  judge_slot(0, 3, (uint8_t[16]){0}, 16, HERE);
  CHECK_EQ(create(&plain, 0, nobody, self_uuid, false), OK);
  CHECK_EQ(read_out(plain, 4), OK);
  SLOT_V4(0, 7);
  healthy_node(1);
  void *remote = NULL;
  CHECK_EQ(create(&remote, 0, nobody, uuid_of(1), true), OK);
  CHECK_EQ(read_out(remote, 4), OK);
  SLOT_V4(0, 0x0200000a);
  destroy(remote);
  destroy(local);
  destroy(plain);
  unload();
}

/* ---- scenarios: the cache world -------------------------------------------------------------- */

static void world_works_in_order(void) {
  begin_enabled("the world's order");
  put_node(uuid_of(1));
  put_node(uuid_of(2));
  put_ipv4_netif(netif_of(1), uuid_of(1), 1);
  node_changed(uuid_of(2));
  netif_changed(netif_of(1), uuid_of(1)); /* queues 1 behind 2 */
  node_changed(uuid_of(2));
  node_changed(uuid_of(1));
  forget();
  refuse.subscribe[HEALTH] = REFUSED;
  preemptions = 2;
  run_world();
  CALLS(
      "c( Sub7 pending? )c c( Sub7 pending? )c c( pending? witness? T14 pending? witness? T14 "
      "pending? )c Wait");
  TRACED(14, 578, traced_pointer(14, 0), LO(uuid_of(1)), HI(uuid_of(1)), 1, 0, 0);
  CHECK_EQ(cache_references(), 3);
  CHECK_EQ(logged.count, 0);
  put_ipv4_netif(netif_of(2), uuid_of(2), 1);
  netif_changed(netif_of(2), uuid_of(2));
  forget();
  refuse.subscribe[HEALTH] = REFUSED;
  run_world();
  CHECK_EQ(cache_references(), 3); /* tried in vain, both references given back */
  CHECK_EQ(number_at((void *)traced_pointer(8, 0), 8, 4), 1);
  CALLS("c( Sub7 pending? witness? T14 pending? )c Wait");
  /* What is queued when the world ends waits for the next one. */
  void *instance = NULL;
  CHECK_EQ(create(&instance, 0, nobody, self_uuid, true), OK);
  put_health(netif_of(1), 0, 2);
  health_changed(netif_of(1));
  put_node(self_uuid);
  node_changed(self_uuid);
  status_fn(cache, 0);
  forget();
  deliver();
  enable();
  TRACED(14, 578, traced_pointer(12, 0), LO(self_uuid), HI(self_uuid), 0, 0, 0);
  destroy(instance);
  unload();
}

static void *a, *b; /* two instances of node 1 */
#define WORK "c( pending? witness? T14 "
#define REFRESH(name) ")c c( i( T6 )i )c i( T7 " name "1 )i c( T18 "
static void touch_node_1(uint32_t ipv4) {
  put_ipv4_netif(netif_of(1), uuid_of(1), ipv4);
  netif_changed(netif_of(1), uuid_of(1));
  forget();
}
static void destroy_b(void) {
  destroy(b);
}
static void node_1_goes(void) {
  drop(NODE, uuid_of(1));
  drop(NETIF, netif_of(1));
  tell(NETIF, netif_of(1), uuid_of(1), NOT_FOUND);
  tell(NODE, uuid_of(1), uuid_of(1), NOT_FOUND);
  destroy(a);
}
static void world_refreshes_instances(void) {
  begin_enabled("refreshes by the world");
  healthy_node(1);
  a = node_instance(1);
  b = node_instance(1);
  set_callback(a, client, "a");
  set_callback(b, client, "b");
  touch_node_1(2);
  run_world(); /* the newest is in front, and each goes back to the front */
  CALLS(WORK REFRESH("b") REFRESH("a") "pending? )c Wait");
  touch_node_1(3);
  touch_node_1(4);
  run_world();
  CALLS(WORK REFRESH("a") REFRESH("b") "pending? )c Wait");
  /* Destroyed just before its refresh: no reading, no callback, freed by the world. */
  touch_node_1(5);
  at_cache_unlock = destroy_b;
  at_cache_unlock_in = 1;
  run_world();
  CALLS(WORK
        ")c T2 c( i( )i )c T18 c( )c c( T18 LockDestroy free " REFRESH("a") "pending? )c Wait");
  /* While its node goes as well, and is queued again: the world is the last to hold it. */
  void *node = (void *)traced_pointer(12, 0);
  touch_node_1(6);
  at_cache_unlock = node_1_goes;
  at_cache_unlock_in = 1;
  run_world();
  CALLS(WORK
        ")c c( T9 Wake Unsub7 )c c( )c c( T14 Wake )c T2 c( i( )i )c T18 c( )c "
        "c( T18 LockDestroy free T13 pending? )c Wait c( pending? )c Wait");
  CHECK_BYTES(node, "\x94\x9e\x8d\x8c\x8b\x8d\x91\xff", 8);
  unload();
}

/* ---- scenarios: instances -------------------------------------------------------------------- */

#define NODE_NAME "node:10001213-1415-1617-1819-1a1b1c1d1e1f"
#define OBJECT_NAME "object:50005253-5455-5657-5859-5a5b5c5d5e5f"
static void node_instances_live_and_die(void) {
  begin_enabled("a node's instance");
  Uuid one = uuid_of(1);
  healthy_node(1);
  void *instance = NULL;
  CHECK_EQ(create(&instance, 0x1234567, nobody, one, false), OK);
  CALLS("alloc LockCreate c( )c " TRACKED);
  struct block *block = find_block(instance);
  CHECK_EQ(block->size, 392);
  CHECK(in_module(block->asked_by) && block->asked_by != find_block(cache)->asked_by);
  CHECK_BYTES(instance, "karstri", 8);
  CHECK_EQ(references(instance), 1);
  CHECK_EQ(cache_references(), 4);
  CHECK_STR((const char *)instance + 32, NODE_NAME);
  CHECK(all_bytes((uint8_t *)instance + 96, 34, 0));
  CHECK_EQ(number_at(instance, 132, 4), 0x1234567);
  CHECK(all_bytes((uint8_t *)instance + 136, 72, 0));
  CHECK_EQ(number_at(instance, 208, 8), traced_pointer(12, 0));
  CHECK_EQ(state_of(instance), 1);
  CHECK_BYTES((uint8_t *)instance + 376, &one, 16);
  CHECK_EQ(number_at((void *)traced_pointer(12, 0), 8, 4), 3);
  TRACED(1, 485, WORD(instance), 0x1234567, 0, 0, LO(one), HI(one));
  TRACED(3, 220, WORD(instance), 0x1234567, 0, 0, LO(one), HI(one));
  TRACED(6, 120, WORD(instance), 0, 0, LO(one), HI(one), 1);
  char name[] = "x";
  set_callback(instance, client, name);
  CALLS("i( T17 )i i( T7 x1 )i");
  TRACED(17, 621, WORD(instance), WORD(client), WORD(name), 0, 0, 0);
  CHECK_EQ(number_at(instance, 192, 8), WORD(client));
  CHECK_EQ(number_at(instance, 200, 8), WORD(name));
  TRACED(7, 39, WORD(instance), 0x1234567, 0, 0, WORD(client), 1);
  set_callback(instance, client, "y");
  CALLS("i( T17 )i i( T7 y1 )i");
  drop(NODE, one);
  tell(NODE, one, one, NOT_FOUND);
  forget();
  run_world();
  CALLS("c( pending? witness? T14 )c c( i( T6 )i )c i( T7 y2 )i c( T18 pending? )c Wait");
  TRACED(6, 120, WORD(instance), 0, 0, 0, 0, 0);
  CHECK_EQ(state_of(instance), 2);
  put_node(one);
  node_changed(one);
  forget();
  run_world();
  CALLS("c( pending? witness? T14 )c c( i( T6 )i )c i( T7 y1 )i c( T18 pending? )c Wait");
  set_callback(instance, NULL, instance);
  CALLS("i( T17 )i i( )i");
  destroy(instance);
  CALLS("T2 c( i( )i )c T18 LockDestroy free");
  TRACED(2, 547, WORD(instance), 0x1234567, 0, 0, LO(one), HI(one));
  CHECK_EQ(cache_references(), 3);
  unload();
}

/* The words of ReleaseInstance: who releases, and the frames above. */
static void releases_are_traced(void) {
  begin_enabled("releases");
  healthy_node(1);
  a = node_instance(1);
  uint64_t released_by[2];
  for (int i = 0; i < 2; i++) {
    if (i == 0) {
      touch_node_1(9);
      run_world();
    } else {
      destroy(a);
    }
    released_by[i] = number_at(newest(18, 0), 32, 8);
    CHECK(in_module(released_by[i]));
    uint64_t expected[6] = {WORD(a), i == 0 ? 2 : 1, released_by[i], 0x1001, 0x1002, 0x1003};
    judge_event(18, 384, expected, HERE);
  }
  CHECK(released_by[0] != released_by[1]);
  unload();
}

static void creation_can_fail(void) {
  void *instance = &instance;
  begin("failed creations");
  load();
  CHECK_EQ(create(&instance, 0, nobody, uuid_of(1), false), NOT_FOUND); /* a disabled cache */
  CALLS(NOT_CREATED);
  TRACED(2, 547, traced_pointer(2, 0), 0, 0, 0, 0, 0);
  CHECK_EQ(create(&instance, 0, nobody, self_uuid, true), NOT_FOUND);
  forget();
  enable();
  CHECK_EQ(create(NULL, 0, nobody, uuid_of(1), false), BAD_PARAM);
  CHECK_EQ(create(&instance, 1, nobody, nobody, true), BAD_PARAM);
  CALLS("");
  refuse.allocation = 1;
  CHECK_EQ(create(&instance, 0, nobody, uuid_of(1), false), NO_MEMORY);
  CALLS("alloc!");
  refuse.lock = REFUSED;
  CHECK_EQ(create(&instance, 0, nobody, uuid_of(1), false), REFUSED);
  CALLS("alloc LockCreate log free");
  LOGGED(2, "KARSTResolver_Create", "Failed to create spinlock: <0bad0777>\n");
  /* A node made for this instance alone goes with it. */
  CHECK_EQ(create(&instance, 0, nobody, uuid_of(1), false), NOT_FOUND);
  CALLS(
      "alloc LockCreate c( )c T1 c( i( )i T12 T3 i( T6 )i )c i( )i i( )i T2 c( i( )i T13 )c T18 "
      "LockDestroy free");
  put_node(uuid_of(1)); /* reachable, but without an address */
  node_changed(uuid_of(1));
  run_world();
  forget();
  CHECK_EQ(create(&instance, 0, nobody, uuid_of(1), true), NOT_FOUND);
  CALLS(NOT_CREATED);
  CHECK_EQ(create(&instance, OBJECT, uuid_of(5), nobody, false), NOT_FOUND);
  CALLS("alloc LockCreate c( )c T1 Find9 T5 i( )i T2 c( i( )i )c T18 LockDestroy free");
  healthy_node(1);
  put(OBJECT, uuid_of(5), uuid_of(1), NULL, 0);
  refuse.subscribe[OBJECT] = REFUSED;
  CHECK_EQ(create(&instance, OBJECT, uuid_of(5), nobody, false), REFUSED);
  CALLS(
      "alloc LockCreate c( )c T1 Find9 T4 c( i( )i T3 i( T6 )i )c i( )i i( )i Sub9 log T18 T2 c( "
      "i( )i )c T18 LockDestroy free");
  LOGGED(1, "KARSTResolver_Create", "Failed to install object subscription: <0bad0777>\n");
  CHECK(instance == &instance);
  CHECK_EQ(cache_references(), 3);
  unload();
}

/* ---- scenarios: objects ---------------------------------------------------------------------- */

static void *object_instance(unsigned owner, Uuid hint) {
  void *instance = NULL;
  if (owner != 0) put(OBJECT, uuid_of(5), uuid_of(owner), NULL, 0);
  CHECK_EQ(create(&instance, OBJECT_AS_PASSED, uuid_of(5), hint, false), OK);
  set_callback(instance, client, "o");
  return instance;
}
static void object_says(unsigned owner, uint32_t status) {
  forget();
  tell(OBJECT, uuid_of(5), owner != 0 ? uuid_of(owner) : nobody, status);
}
static void objects_are_followed(void) {
  begin_enabled("an object's owner");
  Uuid object = uuid_of(5);
  Uuid one = uuid_of(1);
  healthy_node(1);
  healthy_node(2);
  void *o = object_instance(1, nobody);
  CALLS(
      "alloc LockCreate c( )c T1 Find9 T4 c( i( )i T3 i( T6 )i )c i( )i i( )i Sub9 i( T17 )i i( T7 "
      "o1 )i");
  CHECK_STR((const char *)o + 32, OBJECT_NAME);
  CHECK_EQ(references(o), 2);
  CHECK_BYTES((uint8_t *)o + 96, &object, 16);
  CHECK(all_bytes((uint8_t *)o + 112, 17, 0));
  CHECK(find_sub((uint8_t *)o + 136, subs[4].fn, o) != NULL);
  CHECK_EQ(number_at(o, 184, 1), 1);
  TRACED(1, 485, WORD(o), OBJECT_AS_PASSED, LO(object), HI(object), 0, 0);
  TRACED(4, 315, WORD(o), OBJECT_AS_PASSED, LO(object), HI(object), 0, 0);
  TRACED(3, 220, WORD(o), OBJECT_AS_PASSED, LO(object), HI(object), LO(one), HI(one));
  TRACED(7, 39, WORD(o), OBJECT_AS_PASSED, LO(object), HI(object), WORD(client), 1);
  object_says(1, OK); /* the owner that it has */
  CALLS("T4");
  TRACED(4, 315, WORD(o), OBJECT_AS_PASSED, LO(object), HI(object), LO(one), HI(one));
  object_says(2, SUB_RESYNC); /* the header does not count: it is looked up */
  CALLS("Find9 T4");
  object_says(0, OK); /* no owner: detached, not lost */
  CALLS("T4 c( i( )i T3 i( T6 )i )c i( T7 o2 )i");
  object_says(1, OK);
  CALLS("T4 c( i( )i T3 i( T6 )i )c i( T7 o1 )i");
  drop(OBJECT, object);
  object_says(1, NOT_FOUND);
  CALLS("Find9 T5 c( i( )i T3 i( T6 )i )c i( T7 o2 )i");
  TRACED(5, 330, WORD(o), OBJECT_AS_PASSED, LO(object), HI(object), LO(one), HI(one));
  TRACED(3, 220, WORD(o), OBJECT_AS_PASSED, LO(object), HI(object), 0, 0);
  CHECK_EQ(read_out(o, 4), NOT_FOUND);
  object_says(1, 0x123);
  CALLS("Find9 T5");
  object_says(1, OK);
  CALLS("T4 c( i( )i T3 i( T6 )i )c i( T7 o1 )i");
  CHECK_EQ(read_out(o, 4), OK);
  object_says(2, OK); /* another node: never again */
  CALLS("T4 c( i( )i T3 i( T6 )i )c i( T7 o2 )i");
  CHECK_EQ(number_at(o, 17, 1), 1);
  CHECK_BYTES((uint8_t *)o + 376, &one, 16);
  object_says(2, OK);
  CALLS("T4");
  object_says(1, OK);
  CALLS("T4");
  CHECK_EQ(read_out(o, 4), NOT_FOUND);
  CHECK_EQ(number_at((void *)traced_pointer(12, 1), 8, 4), 2);
  destroy(o);
  CALLS("i( )i T2 Unsub9 c( i( )i )c T18");
  TRACED(2, 547, WORD(o), OBJECT_AS_PASSED, LO(object), HI(object), 0, 0);
  CHECK_EQ(cache_references(), 4);
  set_callback(o, client, o); /* too late: nothing is installed, nobody called */
  CALLS("i( )i i( )i");
  CHECK(all_bytes((uint8_t *)o + 192, 16, 0));
  deliver();
  CALLS("T18 LockDestroy free");
  unload();
}

static void hints_hold_until_the_entry_is_found(void) {
  begin_enabled("a hint");
  healthy_node(1);
  healthy_node(2);
  void *o = object_instance(0, uuid_of(1));
  CALLS(
      "alloc LockCreate c( )c T1 Find9 c( i( )i T3 i( T6 )i )c i( )i i( )i Sub9 i( T17 )i i( T7 o1 "
      ")i");
  TRACED(1, 485, WORD(o), OBJECT_AS_PASSED, LO(uuid_of(5)), HI(uuid_of(5)), LO(uuid_of(1)),
         HI(uuid_of(1)));
  CHECK_EQ(number_at(o, 128, 1), 1);
  object_says(0, NOT_FOUND);
  CALLS("Find9");
  put(OBJECT, uuid_of(5), uuid_of(1), NULL, 0);
  object_says(1, OK);
  CALLS("T4");
  CHECK_EQ(number_at(o, 128, 1), 0);
  drop(OBJECT, uuid_of(5));
  object_says(0, NOT_FOUND);
  CALLS("Find9 T5 c( i( )i T3 i( T6 )i )c i( T7 o2 )i");
  announce(OBJECT, uuid_of(5), uuid_of(1), OK); /* still on its way when the instance goes */
  destroy(o);
  forget();
  deliver();
  CALLS("T18 LockDestroy free");
  o = object_instance(0, uuid_of(1)); /* the entry names another node than the hint */
  object_says(2, OK);
  CALLS("T4 c( i( )i T3 i( T6 )i )c i( T7 o2 )i");
  CHECK_EQ(number_at(o, 17, 1), 1);
  destroy(o);
  void *none = NULL;
  put(OBJECT, uuid_of(5), uuid_of(3), NULL, 0); /* an entry beats the hint at once */
  CHECK_EQ(create(&none, OBJECT, uuid_of(5), uuid_of(1), false), NOT_FOUND);
  CHECK(none == NULL);
  deliver();
  unload();
}

static Uuid moving;
static void object_moves(void) {
  tell(OBJECT, moving, uuid_of(2), OK);
}
static void objects_move_during_a_refresh(void) {
  begin_enabled("a move during a refresh");
  moving = uuid_of(5);
  healthy_node(1);
  healthy_node(2);
  void *o = object_instance(1, nobody);
  touch_node_1(7);
  at_cache_unlock = object_moves;
  at_cache_unlock_in = 1;
  run_world();
  CALLS(WORK ")c T4 c( i( )i T3 i( T6 )i )c i( T7 o2 )i c( )c c( T18 pending? )c Wait");
  touch_node_1(8);
  run_world();
  CALLS(WORK "pending? )c Wait");
  destroy(o);
  unload();
}

static void destroy_a_at_last(void) {
  CALLS(
      "Deregister c( )c WorldDestroy Unsub6 Unsub3 c( T14 T9 Unsub7 )c Sleep Sleep Sleep c( )c "
      "Sleep");
  CHECK_EQ(state_of(a), 1); /* nobody refreshes any more */
  destroy(a);
}
static void unload_waits_for_instances(void) {
  begin_enabled("unload with an instance alive");
  healthy_node(1);
  a = node_instance(1);
  at_sleep = destroy_a_at_last;
  forget();
  cleanup_module();
  CALLS("T2 c( i( )i T13 )c T18 LockDestroy free " GONE);
  nothing_left();
}

/* ---- scenarios: emission of trace records ---------------------------------------------------- */

static void *emitter;
/* One SetCallback event (17, class 37, level 2) whose payload ends in `mark`. */
static void emit(uint64_t mark, const char *steps, const char *where) {
  char expected[256];
  forget();
  set_callback(emitter, NULL, (void *)(uintptr_t)mark);
  snprintf(expected, sizeof expected, "i( level37%s%s )i i( )i", *steps ? " " : "", steps);
  judge_calls(expected, where);
}
#define EMIT(mark, steps) emit((mark), (steps), HERE)
static void judge_last(unsigned type, unsigned id, unsigned site, uint64_t first, uint64_t second,
                       uint64_t third, const char *where) {
  uint64_t payload[6] = {first, second, third};
  judge_record(records() - 1, type, id, site, payload, where);
}
#define LAST(...) judge_last(__VA_ARGS__, HERE)

static void emission_is_throttled(void) {
  begin_enabled("trace throttling");
  healthy_node(1);
  emitter = node_instance(1);
  trace_in_detail = true;
  uint64_t count = records();
  EMIT(1, "mini17 global0 cpu0");
  LAST(8, 17, 621, WORD(emitter), 0, 1);
  CHECK_EQ(records(), ++count);
  class_level[2] = 1;
  EMIT(2, "");
  class_level[2] = -1;
  EMIT(2, "");
  class_level[2] = 2;
  set_number(stream, FLAGS, 1, 0xfe);
  EMIT(3, "");
  set_number(stream, FLAGS, 1, 0xff);
  mini_grants = false;
  EMIT(4, "mini17");
  mini_out = 0;
  EMIT(4, "mini17");
  mini_grants = true;
  global_grants = false;
  EMIT(5, "mini17 time17 global0");
  mini_out = 1;
  EMIT(5, "mini17 global0");
  CHECK_EQ(records(), count);
  global_grants = true;
  mini_out = 0;
  EMIT(6, "mini17 time17 global0 cpu0");
  LAST(9, 901, 407, 7017, 17 * 64 + 8, 0);
  global_out = 0;
  EMIT(7, "mini17 time17 global0 time0 cpu0");
  LAST(9, 902, 430, 7000, 0, 0);
  mini_out = 9;
  EMIT(8, "mini17 global0 time0 cpu0");
  LAST(9, 902, 430, 7000, 0, 0);
  global_notice_id = 0xffffc005; /* ids have 14 bits */
  EMIT(8, "mini17 global0 time0 cpu0");
  LAST(9, 0x0005, 430, 7000, 0, 0);
  global_notice_id = 902;
  mini_grants = global_grants = false;
  mini_out = global_out = 0;
  set_number(stream, THROTTLING, 1, 0);
  EMIT(9, "cpu0");
  LAST(8, 17, 621, WORD(emitter), 0, 9);
  set_number(stream, THROTTLING, 1, 0x80);
  EMIT(9, "mini17");
  mini_grants = global_grants = true;
  mini_out = global_out = 1;
  trace_in_detail = false;
  /* The removal of a node shows at level 0, and not below. */
  for (int32_t level = 0; level >= -1; level--) {
    class_level[2] = level;
    put_node(uuid_of(3));
    node_changed(uuid_of(3));
    forget();
    tell(NODE, uuid_of(3), uuid_of(3), NOT_FOUND);
    CALLS(level == 0 ? "c( T14 Wake T13 )c" : "c( T14 Wake )c");
  }
  destroy(emitter);
  unload();
}

static void records_have_their_form(void) {
  begin_enabled("trace records");
  healthy_node(1);
  emitter = node_instance(1);
  trace_in_detail = true;
  set_number(stream, MASK, 8, 7);
  set_number(stream, NOTIFY, 8, 0x4e0717);
  static const struct {
    uint64_t sequence;
    const char *after;
  } rows[] = {{0, " wallclock notify"},
              {1, ""},
              {511, ""},
              {512, " notify"},
              {1024, " notify"},
              {2047, ""},
              {2048, " wallclock notify"},
              {0x1ffffff8, ""},
              {0x20000000, " wallclock notify"},
              {0x7fffffffffffffff, ""}};
  for (unsigned shift = 3; shift <= 14; shift += 11) {
    set_number(stream, LAP_SHIFT, 2, shift);
    for (size_t i = 0; i < sizeof rows / sizeof *rows; i++) {
      char steps[64];
      memset(stream + RING, i % 2 == 0 ? 0xff : 0, 64 * SLOTS); /* every bit must be written */
      set_number(stream, SEQUENCE, 8, rows[i].sequence);
      cpu = 0x1a5 + (uint32_t)i;
      cycles = UINT64_MAX / 3 - i * 1000;
      snprintf(steps, sizeof steps, "mini17 global0 cpu0%s", rows[i].after);
      EMIT(i, steps);
      CHECK_EQ(records(), rows[i].sequence + 1);
      LAST(8, 17, 621, WORD(emitter), 0, i);
      const uint8_t *slot = stream + RING + 64 * (rows[i].sequence & 7);
      if (strstr(rows[i].after, "wallclock") != NULL) CHECK_BYTES(wall_clock_record, slot, 64);
      for (uint64_t other = 0; other < 8; other++) { /* no other slot */
        const uint8_t *at = stream + RING + 64 * other;
        if (at != slot) CHECK(all_bytes(at, 64, i % 2 == 0 ? 0xff : 0));
      }
    }
  }
  set_number(stream, NOTIFY, 8, 0);
  set_number(stream, SEQUENCE, 8, 2048);
  EMIT(1, "mini17 global0 cpu0");
  trace_in_detail = false;
  cpu = 0x5a;
  cycles = 1000;
  destroy(emitter);
  unload();
}

/* The processor stops after each instruction; which of them changed the record? */
static const uint8_t *stepped_record;
static uint8_t stepped_copy[64];
static struct {
  int instructions, changes, of_phase;
  bool last_was_phase_alone;
} steps;
static void on_step(int signal) {
  (void)signal;
  steps.instructions++;
  if (memcmp(stepped_copy, stepped_record, 64) == 0) return;
  uint64_t changed = number_at(stepped_copy, 0, 8) ^ number_at(stepped_record, 0, 8);
  bool payload = memcmp(stepped_copy + 8, stepped_record + 8, 56) != 0;
  steps.changes++;
  steps.of_phase += (int)(changed & 1);
  steps.last_was_phase_alone = changed == 1 && !payload;
  memcpy(stepped_copy, stepped_record, 64);
}
static void phase_is_written_last(void) {
  enum { TRAP_FLAG = 0x100 };
  if (sanitized) return; /* their checks between the stores are no part of it */
  begin_enabled("the phase bit");
  healthy_node(1);
  emitter = node_instance(1);
  for (int phase = 0; phase < 2; phase++) {
    /* The record of this lap, over an old one whose bits are all the opposite. */
    set_number(stream, SEQUENCE, 8, phase == 0 ? 4096 + 7 : 7);
    memset(stream + RING, phase == 0 ? 0xff : 0, 64 * SLOTS);
    stepped_record = stream + RING + 64 * 7;
    memcpy(stepped_copy, stepped_record, 64);
    memset(&steps, 0, sizeof steps);
    void (*before)(int) = signal(SIGTRAP, on_step);
    __builtin_ia32_writeeflags_u64(__builtin_ia32_readeflags_u64() | TRAP_FLAG);
    set_callback(emitter, NULL, &steps);
    __builtin_ia32_writeeflags_u64(__builtin_ia32_readeflags_u64() & ~(uint64_t)TRAP_FLAG);
    signal(SIGTRAP, before);
    CHECK(steps.instructions > 0 && steps.changes > 2);
    CHECK_EQ(steps.of_phase, 1);
    CHECK(steps.last_was_phase_alone);
  }
  destroy(emitter);
  unload();
}

/* ---- the last scenario: everything at once --------------------------------------------------- */

static bool directory_ends;
static atomic_uint refreshes;

static void *deliver_for_ever(void *unused) {
  for (;;) {
    if (deliver_one()) continue;
    enter();
    while (events_in == events_out && !directory_ends) pthread_cond_wait(&work, &gate);
    bool end = events_in == events_out;
    leave();
    if (end) return unused;
  }
}
static void client_at_once(void *data, void *instance, uint32_t state) {
  atomic_bool *inside = data;
  HELD(INSTANCE_LOCK);
  CHECK(!atomic_exchange(inside, true)); /* never two at a time for one instance */
  CHECK(state == 1 || state == 2);
  CHECK_EQ(state_of(instance), state);
  atomic_store(inside, false);
  enter();
  atomic_fetch_add(&refreshes, 1);
  pthread_cond_broadcast(&work);
  leave();
}
static void *call_for_a_while(void *unused) {
  uint8_t set[SET_SIZE(4)];
  for (unsigned i = 0; i < 400; i++) {
    atomic_bool inside = false;
    void *instance = NULL;
    bool object = i % 3 == 0;
    uint32_t status =
        create(&instance, OBJECT, object ? uuid_of(5) : nobody, uuid_of(1 + i % 4), i % 2 == 0);
    CHECK(status == OK || status == NOT_FOUND);
    if (status != OK) continue;
    set_callback(instance, client_at_once, &inside);
    set_number(set, 48, 2, 4);
    status = get_locators(instance, set);
    CHECK(status == NOT_FOUND || (status == OK && number_at(set, 50, 2) <= 4));
    destroy(instance);
    CHECK(!inside); /* and none after its end */
  }
  return unused;
}
static void change_node(unsigned n, unsigned round) {
  Uuid node = uuid_of(n);
  Uuid netif = netif_of(n);
  bool gone = round % 7 == 3;
  if (gone) {
    drop(NODE, node);
    drop(NETIF, netif);
  } else {
    put_node(node);
    put_ipv4_netif(netif, uuid_of(round % 11 == 5 ? n % 4 + 1 : n), 1 + round);
    put_health(netif, round % 5 == 4, round);
  }
  announce(NODE, node, node, gone ? NOT_FOUND : OK);
  announce(NETIF, netif, node, gone ? NOT_FOUND : OK);
  announce(HEALTH, netif, nobody, OK);
  put(OBJECT, uuid_of(5), uuid_of(1 + round / 16 % 4), NULL, 0);
  announce(OBJECT, uuid_of(5), uuid_of(1 + round / 16 % 4), round % 2 ? OK : SUB_OVERFLOW);
  if (round % 13 == 0) announce(NETIF, nobody, nobody, SUB_RESYNC);
  if (round % 17 == 0) announce(NODE, nobody, nobody, SUB_OVERFLOW);
}
static void wait_until_delivered(void) {
  for (bool done = false; !done; sched_yield()) {
    enter();
    done = events_in == events_out;
    leave();
  }
}
static void wait_for_answer(void *instance, uint32_t ipv4) {
  for (;;) {
    unsigned seen = refreshes;
    if (read_out(instance, 4) == OK && number_at(answer, 56, 4) == ipv4) return;
    enter();
    while (refreshes == seen) pthread_cond_wait(&work, &gate);
    leave();
  }
}
static void everything_at_once(void) {
  begin("everything at once");
  pthread_t directory;
  pthread_t callers[2];
  static atomic_bool inside;
  journal_on = false;
  at_once = true;
  CHECK_EQ(init_module(), 0);
  start(&directory, deliver_for_ever);
  status_fn(cache, 1);
  for (unsigned n = 1; n <= 4; n++) change_node(n, 1);
  while (create(&a, 0, nobody, uuid_of(1), false) != OK) sched_yield();
  set_callback(a, client_at_once, &inside);
  for (int i = 0; i < 2; i++) start(&callers[i], call_for_a_while);
  for (unsigned round = 0; round < 400; round++) {
    change_node(1 + round % 4, round);
    if (round % 32 == 31) wait_until_delivered();
    if (round % 100 == 99) {
      status_fn(cache, 0);
      wait_until_delivered();
      status_fn(cache, 1);
    }
  }
  for (int i = 0; i < 2; i++) pthread_join(callers[i], NULL);
  entry_count = 0;
  put_node(uuid_of(1));
  put_health(netif_of(1), 0, 1);
  put_ipv4_netif(netif_of(1), uuid_of(1), 0xabcdef);
  announce(NODE, nobody, nobody, SUB_RESYNC);
  announce(NETIF, nobody, nobody, SUB_RESYNC);
  announce(HEALTH, netif_of(1), nobody, OK);
  wait_for_answer(a, 0xabcdef);
  destroy(a);
  cleanup_module();
  enter();
  directory_ends = true;
  pthread_cond_broadcast(&work);
  leave();
  pthread_join(directory, NULL);
  logged.count = 0; /* owners changed, entries went before they were read */
  nothing_left();
}

int main(int argc, char **argv) {
  if (argc != 2) {
    fprintf(stderr, "usage: contract_test karst_resolver.so\n");
    return 2;
  }
  pthread_mutexattr_t recursive;
  pthread_mutexattr_init(&recursive);
  pthread_mutexattr_settype(&recursive, PTHREAD_MUTEX_RECURSIVE);
  pthread_mutex_init(&gate, &recursive);
  map_module(argv[1]);

  declares_itself();
  links_to_nothing_else();
  loads_and_unloads();
  heap_is_sized();
  failed_loads_leave_nothing();
  enables_and_disables();
  disable_empties_the_cache();
  nodes_follow_their_entries();
  node_rescans();
  pools_are_bounded();
  allocator_serves_the_host();
  netifs_follow_their_entries();
  netifs_leave();
  locators_are_chosen();
  traffic_types_are_kept_apart();
  readings_are_exact();
  this_host_is_local();
  world_works_in_order();
  world_refreshes_instances();
  node_instances_live_and_die();
  releases_are_traced();
  creation_can_fail();
  objects_are_followed();
  hints_hold_until_the_entry_is_found();
  objects_move_during_a_refresh();
  unload_waits_for_instances();
  emission_is_throttled();
  records_have_their_form();
  phase_is_written_last();
  everything_at_once();

  free(image);
  printf("contract: %d checks, %d failed\n", checks, failures);
  return failures == 0 ? 0 : 1;
}
