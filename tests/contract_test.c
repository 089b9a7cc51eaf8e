/*
 * Can somebody who has only the binary contract host the module? Scenarios on the host kernel of
 * contract_host.h, with every record, offset, number and text typed again: nothing here comes from
 * the module or its headers. One step at a time; the last scenario runs all at once.
 */
#include "contract_host.h"

#include <elf.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>

static uint8_t *image; /* the module's file */
static int (*init_module)(void);
static void (*cleanup_module)(void);
static uint32_t (*create)(void **, uint32_t, Uuid, Uuid, bool);
static void (*destroy)(void *);
static void (*set_callback)(void *, ClientFn, void *);
static uint32_t (*get_locators)(void *, void *);

/* ---- the module's file ----------------------------------------------------------------------- */

static void map_module(const char *path) {
  static const char *const names[] = {"init_module",
                                      "cleanup_module",
                                      "KARSTResolver_Create",
                                      "KARSTResolver_Destroy",
                                      "KARSTResolver_SetCallback",
                                      "KARSTResolver_GetNodeLocators"};
  void *functions[] = {&init_module, &cleanup_module, &create,
                       &destroy,     &set_callback,   &get_locators};
  struct stat file;
  int fd = open(path, O_RDONLY);
  if (fd < 0 || fstat(fd, &file) != 0) give_up(path);
  image = mmap(NULL, (size_t)file.st_size, PROT_READ, MAP_PRIVATE, fd, 0);
  void *library = dlopen(path, RTLD_NOW | RTLD_LOCAL);
  if (image == MAP_FAILED || library == NULL) give_up(path);
  Dl_info found = {0};
  for (int i = 0; i < 6; i++) {
    void *at = dlsym(library, names[i]);
    if (at == NULL || dladdr(at, &found) == 0) give_up(names[i]);
    memcpy(functions[i], &at, sizeof at);
  }
  base = found.dli_fbase;
}
static const Elf64_Shdr *section(const char *name) {
  const Elf64_Ehdr *header = (const Elf64_Ehdr *)image;
  const Elf64_Shdr *sections = (const Elf64_Shdr *)(image + header->e_shoff);
  const char *names = (const char *)image + sections[header->e_shstrndx].sh_offset;
  int i = 0;
  while (i < header->e_shnum && strcmp(names + sections[i].sh_name, name) != 0) i++;
  return i < header->e_shnum ? &sections[i] : NULL;
}
/* Where a section lies in memory, relocated; it must have this size. */
static const uint8_t *loaded_section(const char *name, size_t size) {
  const Elf64_Shdr *found = section(name);
  if (found == NULL) give_up(name);
  CHECK_EQ(found->sh_size, size);
  return base + found->sh_addr;
}
static void judge_strings(const char *name, const char *content, size_t size) {
  const Elf64_Shdr *found = section(name);
  if (found == NULL || found->sh_size != size) give_up(name);
  CHECK_BYTES(image + found->sh_offset, content, size);
}
static const char *text_at(const uint8_t *record, size_t offset) {
  return (const char *)(uintptr_t)number_at(record, offset, 8);
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
  judge_strings(".karst.modinfo", strings, sizeof strings);
  judge_strings(".karst.required", required, sizeof required);
  const uint8_t *parameter = loaded_section(".karst.params", 40);
  CHECK_STR(text_at(parameter, 0), "KARST_RESOLVER_LEAST_MAX_HEAP");
  CHECK_EQ(number_at(parameter, 8, 8), 1);
  CHECK_EQ(number_at(text_at(parameter, 16), 0, 4), 0xa00000);
  CHECK(all_bytes(parameter + 24, 16, 0));
  const uint8_t *exported = loaded_section(".karst.exports", 64);
  for (int i = 0; i < 4; i++, exported += 16) {
    CHECK_STR(text_at(exported, 0), exports[i]);
    CHECK_EQ(number_at(exported, 8, 8), 0);
  }
  const uint8_t *assertion = loaded_section(".karst.asserts", 24);
  CHECK_EQ(number_at(assertion, 0, 8), 1);
  CHECK_STR(text_at(assertion, 8), "karst/karst_rbtree_impl");
  CHECK(number_at(assertion, 16, 8) > 0);
}
/* Every undefined symbol is one that this program defines, or a memory function. */
static void links_to_nothing_else(void) {
  const Elf64_Shdr *table = section(".dynsym");
  const char *names = (const char *)image + section(".dynstr")->sh_offset;
  const Elf64_Sym *symbols = (const Elf64_Sym *)(image + table->sh_offset);
  Dl_info own, found;
  int exported = 0;
  dladdr((void *)(uintptr_t)zel_HeapCreate, &own);
  for (size_t i = 1; i < table->sh_size / sizeof *symbols; i++) {
    const char *name = names + symbols[i].st_name;
    if (strstr(name, "san_") != NULL) return; /* instrumented, with symbols of that */
    bool undefined = symbols[i].st_shndx == SHN_UNDEF;
    bool ours = dladdr(dlsym(RTLD_DEFAULT, name), &found) != 0 && found.dli_fbase == own.dli_fbase;
    bool memory = strstr("memcpy memmove memset memcmp bcmp", name) != NULL;
    judge(!undefined || ours || memory, __LINE__, "undefined symbol", "of the contract", name);
    exported += !undefined;
  }
  CHECK_EQ(exported, 6);
}

/* ---- load and unload ------------------------------------------------------------------------- */

#define TO_DOMAIN "LogInit HeapCreate DomainCreate"
#define TO_LOCK TO_DOMAIN " alloc LockCreate"
#define GONE "LockDestroy free DomainDestroy HeapDestroy LogCleanup"
#define BACK "DomainDestroy HeapDestroy LogCleanup"
#define NO_POOL " Deregister c( )c c( )c "
#define IN_CACHE " log2 KARSTResolverCacheInit: "

static void nothing_left(void) {
  CHECK(live_blocks == 0 && live_locks == 0 && live_subs == 0);
  CHECK(status_fn == NULL && !world.alive && held == NO_LOCK);
}
static void loads_and_unloads(void) {
  load_block_count = 0;
  bucket_count = 0;
  CHECK_EQ(init_module(), 0);
  CALLS(TO_LOCK " alloc alloc alloc alloc alloc Register");
  CHECK_EQ(bucket_count, EVENTS);
  CHECK_EQ(load_block_count, 6);
  CHECK(load_blocks[1][0] % 128 == 0 && load_blocks[2][0] % 512 == 0);
  for (int i = 0; i < 6; i++) {
    CHECK(in_module(load_blocks[i][1]));
    for (int j = 0; j < i; j++) CHECK(load_blocks[i][1] != load_blocks[j][1]);
  }
  cleanup_module();
  CALLS("Deregister c( )c c( )c free free free free free " GONE);
  nothing_left();
}
static void failed_loads_leave_nothing(void) {
  static const struct {
    const char *refused;
    int after;
    const char *calls;
  } rows[] = {
      {"LogInit", 0, "LogInit"},
      {"HeapCreate", 0,
       "LogInit HeapCreate log2 KARSTResolverInit: Failed to create heap: <0bad0777>\n LogCleanup"},
      {"DomainCreate", 0,
       TO_DOMAIN " log2 KARSTResolverInit: Failed to create lock domain: <0bad0777>\n "
                 "HeapDestroy LogCleanup"},
      {"alloc", 0, TO_DOMAIN " alloc " BACK},
      {"LockCreate", 0,
       TO_LOCK IN_CACHE "Failed to create spinlock: <0bad0777>\n Deregister free " BACK},
      {"alloc", 1, TO_LOCK " alloc" IN_CACHE "Failed to allocate node pool\n" NO_POOL GONE},
      {"alloc", 2,
       TO_LOCK " alloc alloc" IN_CACHE "Failed to allocate netif pool\n" NO_POOL "free " GONE},
      {"alloc", 5,
       TO_LOCK " alloc alloc alloc alloc alloc free free" IN_CACHE
               "Failed to allocate node rbtree\n" NO_POOL "free free " GONE},
      {"Register", 0,
       TO_LOCK " alloc alloc alloc alloc alloc Register" IN_CACHE
               "Failed to register KARST status callback\n" NO_POOL
               "free free free free free " GONE},
  };
  for (size_t i = 0; i < sizeof rows / sizeof *rows; i++) {
    refused = rows[i].refused;
    refuse_after = rows[i].after;
    CHECK_EQ(init_module(), -1);
    CALLS(rows[i].calls);
    status_fn = NULL;
    nothing_left();
  }
}

/* ---- a cluster as the directory tells it ----------------------------------------------------- */

static const Uuid nobody;
static Uuid uuid_of(unsigned n) {
  Uuid uuid;
  for (unsigned i = 0; i < 16; i++) uuid.b[i] = (uint8_t)(n * 16 + i);
  return uuid;
}
/* Node n, with one healthy interface (n + 8) of this IPv4 address. */
static void put_cluster_node(unsigned n, uint32_t ipv4) {
  uint32_t node[5] = {0x01020304, 0x05060708, 0, 77, 78};
  uint32_t netif[70] = {[0] = 1, [1] = ipv4};
  uint32_t health[6] = {0};
  put(NODE, uuid_of(n), uuid_of(n), node, sizeof node);
  put(HEALTH, uuid_of(n + 8), nobody, health, sizeof health);
  put(NETIF, uuid_of(n + 8), uuid_of(n), netif, sizeof netif);
}
static void healthy_node(unsigned n) {
  put_cluster_node(n, 0xa0 + n);
  tell(NODE, uuid_of(n), uuid_of(n), OK);
  tell(NETIF, uuid_of(n + 8), uuid_of(n), OK);
  run_world();
  journal[0] = 0;
}
static void begin_enabled(void) {
  open_stream();
  entry_count = 0;
  self_uuid = uuid_of(7);
  CHECK_EQ(init_module(), 0);
  status_fn(cache, 1);
  run_world();
  journal[0] = 0;
}
static void unload(void) {
  cleanup_module();
  nothing_left();
  journal[0] = 0;
}
static void client(void *name, void *instance, uint32_t state) {
  CHECK_BYTES(instance, "karstri", 8);
  called(INSTANCE_LOCK, "%s%u", (const char *)name, state);
}

/* Enable, a node, its interface, a refresh, rescans, disable: every call in its order. */
static void cache_follows_the_directory(void) {
  Uuid one = uuid_of(1);
  Uuid nic = uuid_of(9);
  void *instance = NULL;
  begin_enabled();
  status_fn(cache, 0);
  CALLS("c( )c WorldDestroy Unsub6 Unsub3 c( )c");
  deliver();
  status_fn(cache, 1);
  run_world();
  CALLS("c( )c Self c( )c WorldCreate Sub3 Sub6 preemptible c( pending? )c Wait");
  CHECK(number_at(cache, 8, 8) == 2 && number_at(cache, 16, 1) == 1);
  CHECK_EQ(number_at(cache, 32, 4), WORLD_ID);
  CHECK_BYTES((uint8_t *)cache + 36, &self_uuid, 16);

  put_cluster_node(1, 0xa1);
  tell(NODE, one, one, OK);
  CALLS("c( T12 T14 Wake Full3 alloc decode3 free )c");
  uint64_t node = number_at(newest(12), 16, 8);
  CHECK_BYTES((void *)node, "karstrn", 8);
  TRACED(12, 454, node, UUID_WORDS(one), 0, 0, 0);
  TRACED(14, 50, node, UUID_WORDS(one), 1, 0, 0);
  tell(NETIF, nic, one, OK);
  CALLS("c( T8 Full7 alloc decode7 free Full6 alloc decode6 free T10 Wake )c");
  uint64_t netif = number_at(newest(8), 16, 8);
  CHECK_BYTES((void *)netif, "karstrni", 8);
  CHECK_STR((const char *)netif + 64, "90919293-9495-9697-9899-9a9b9c9d9e9f");
  TRACED(8, 150, netif, UUID_WORDS(nic), UUID_WORDS(one), 0);
  TRACED(10, 304, netif, UUID_WORDS(nic), UUID_WORDS(one), 0);
  run_world();
  CALLS("c( Sub7 pending? witness? T14 pending? )c Wait");
  TRACED(14, 578, node, UUID_WORDS(one), 1, 1, 0);

  CHECK_EQ(create(&instance, 0, nobody, one, false), OK);
  set_callback(instance, client, "client");
  journal[0] = 0;
  refused = "decode7"; /* all zero is what was decoded until then */
  tell(HEALTH, nic, nobody, SUB_RESYNC);
  CALLS(
      "c( Full7 alloc decode7 free log2 KARSTResolverUpdateNetIfHealth: Failed to unmarshal "
      "health entry 90919293-9495-9697-9899-9a9b9c9d9e9f: <0bad0777>\n )c");
  put_cluster_node(1, 0xb1);
  tell(NETIF, nobody, nobody, SUB_RESYNC);
  CALLS("T15 c( Find6 Full6 alloc decode6 free T10 Wake Next6 )c");
  TRACED(15, 414, 0, 0, 0, 0, 0, 0);
  run_world();
  CALLS("c( pending? witness? T14 )c c( i( T6 )i )c i( T7 client1 )i c( T18 pending? )c Wait");
  uint64_t released_by = number_at(newest(18), 32, 8);
  CHECK(in_module(released_by));
  TRACED(18, 384, WORD(instance), 2, released_by, 0x1001, 0x1002, 0x1003);
  destroy(instance);
  CALLS("T2 c( i( )i )c T18 LockDestroy free");
  CHECK(number_at(newest(18), 32, 8) != released_by && in_module(number_at(newest(18), 32, 8)));

  tell(NODE, nobody, nobody, SUB_RESYNC);
  CALLS("T16 c( Find3 FullByHeader alloc decode3 free Next3 )c");
  refused = "Full6";
  tell(NETIF, nic, one, OK);
  CALLS("c( Full6 T9 Wake Unsub7 )c c( )c");
  TRACED(9, 195, netif, UUID_WORDS(nic), UUID_WORDS(one), 0);
  CHECK_BYTES((void *)netif, "\x94\x9e\x8d\x8c\x8b\x8d\x91\x96", 8);
  tell(NETIF, nic, one, OK);
  journal[0] = 0;
  status_fn(cache, 0);
  CALLS("c( )c WorldDestroy Unsub6 Unsub3 c( T14 T9 T13 )c");
  CHECK_BYTES((void *)node, "\x94\x9e\x8d\x8c\x8b\x8d\x91\xff", 8);
  TRACED(13, 453, node, UUID_WORDS(one), 0, 0, 0);
  cleanup_module();
  CALLS("Deregister c( )c Sleep c( )c free free free free free " GONE);
  nothing_left();
}

/* ---- instances ------------------------------------------------------------------------------- */

#define FOUND "T1 c( i( )i T3 i( T6 )i )c i( )i i( )i"
static uint8_t answer[52 + 20 * 4];
static uint32_t read_out(void *instance, uint16_t capacity) {
  memset(answer, 0xee, sizeof answer);
  set_number(answer, 48, 2, capacity);
  return get_locators(instance, answer);
}
static void node_instances_answer(void) {
  Uuid one = uuid_of(1);
  void *instance = &one;
  begin_enabled();
  healthy_node(1);
  CHECK_EQ(create(&instance, 0x1234567, nobody, one, false), OK);
  CALLS("alloc LockCreate c( )c " FOUND);
  CHECK_EQ(SIZE_OF_BLOCK(instance), 392);
  CHECK(in_module(ASKER_OF_BLOCK(instance)));
  CHECK_BYTES(instance, "karstri", 8);
  CHECK_EQ(number_at(instance, 8, 8), 1);
  CHECK_STR((const char *)instance + 32, "node:10111213-1415-1617-1819-1a1b1c1d1e1f");
  CHECK(all_bytes((uint8_t *)instance + 96, 34, 0));
  CHECK_EQ(number_at(instance, 132, 4), 0x1234567);
  CHECK(all_bytes((uint8_t *)instance + 136, 72, 0));
  CHECK_EQ(number_at(instance, 208, 8), number_at(newest(12), 16, 8));
  CHECK_EQ(number_at(instance, 232, 4), 1);
  CHECK_BYTES((uint8_t *)instance + 376, &one, 16);
  TRACED(1, 485, WORD(instance), 0x1234567, 0, 0, UUID_WORDS(one));
  TRACED(3, 220, WORD(instance), 0x1234567, 0, 0, UUID_WORDS(one));
  TRACED(6, 120, WORD(instance), 0, 0, UUID_WORDS(one), 1);
  set_callback(instance, client, "x");
  CALLS("i( T17 )i i( T7 x1 )i");
  TRACED(17, 621, WORD(instance), WORD(client), WORD("x"), 0, 0, 0);
  TRACED(7, 39, WORD(instance), 0x1234567, 0, 0, WORD(client), 1);
  CHECK_EQ(number_at(instance, 192, 8), WORD(client));
  for (uint16_t capacity = 0; capacity <= 2; capacity++) {
    size_t size = capacity == 0 ? 52 : 72;
    CHECK_EQ(read_out(instance, capacity), OK);
    CALLS("i( )i");
    CHECK_BYTES(answer, &one, 16);
    CHECK_EQ(number_at(answer, 16, 8), 0x0506070801020304);
    CHECK(all_bytes(answer + 24, 16, 0xee) && number_at(answer, 40, 8) == 0);
    CHECK_EQ(number_at(answer, 48, 4), capacity | (capacity == 0 ? 0 : 1) << 16);
    if (capacity > 0) CHECK_BYTES(answer + 52, "\1\0\0\0\xa1\0\0\0", 8);
    CHECK(all_bytes(answer + size, sizeof answer - size, 0xee));
  }
  destroy(instance);
  CALLS("T2 c( i( )i )c T18 LockDestroy free");
  TRACED(2, 547, WORD(instance), 0x1234567, 0, 0, UUID_WORDS(one));

  instance = &one;
  CHECK_EQ(create(&instance, 0, nobody, uuid_of(2), false), NOT_FOUND);
  CALLS(
      "alloc LockCreate c( )c T1 c( i( )i T12 T3 i( T6 )i )c i( )i i( )i T2 c( i( )i T13 )c T18 "
      "LockDestroy free");
  CHECK(instance == &one);
  unload();
}
static void object_instances_follow_the_owner(void) {
  enum { TYPE = 0x100 + OBJECT };
  Uuid one = uuid_of(1);
  Uuid object = uuid_of(5);
  void *o = NULL;
  begin_enabled();
  healthy_node(1);
  put(OBJECT, object, one, NULL, 0);
  CHECK_EQ(create(&o, TYPE, object, nobody, false), OK);
  CALLS("alloc LockCreate c( )c T1 Find9 T4 c( i( )i T3 i( T6 )i )c i( )i i( )i Sub9");
  CHECK_STR((const char *)o + 32, "object:50515253-5455-5657-5859-5a5b5c5d5e5f");
  CHECK_EQ(number_at(o, 8, 8), 2);
  CHECK_BYTES((uint8_t *)o + 96, &object, 16);
  CHECK_EQ(number_at(o, 136 + 40, 1), OBJECT);
  TRACED(4, 315, WORD(o), TYPE, UUID_WORDS(object), 0, 0);
  set_callback(o, client, "o");
  journal[0] = 0;
  entry_count--; /* the object is the newest entry */
  tell(OBJECT, object, one, NOT_FOUND);
  CALLS("Find9 T5 c( i( )i T3 i( T6 )i )c i( T7 o2 )i");
  TRACED(5, 330, WORD(o), TYPE, UUID_WORDS(object), UUID_WORDS(one));
  CHECK_EQ(read_out(o, 4), NOT_FOUND);
  set_number(answer, 48, 2, 0xeeee);
  CHECK(all_bytes(answer, sizeof answer, 0xee));
  journal[0] = 0;
  tell(OBJECT, object, one, OK);
  CALLS("T4 c( i( )i T3 i( T6 )i )c i( T7 o1 )i");
  destroy(o);
  CALLS("T2 Unsub9 c( i( )i )c T18");
  deliver();
  CALLS("T18 LockDestroy free");
  unload();
}

/* ---- the last scenario: everything at once --------------------------------------------------- */

static void *call_for_a_while(void *unused) {
  uint8_t set[52 + 20 * 4];
  for (unsigned i = 0; i < 300; i++) {
    void *instance = NULL;
    Uuid object = i % 3 == 0 ? uuid_of(5) : nobody;
    uint32_t status = create(&instance, OBJECT, object, uuid_of(1 + i % 4), i % 2 == 0);
    CHECK(status == OK || status == NOT_FOUND);
    if (status != OK) continue;
    set_callback(instance, client, NULL);
    set_number(set, 48, 2, 4);
    status = get_locators(instance, set);
    CHECK(status == NOT_FOUND || (status == OK && number_at(set, 50, 2) <= 4));
    destroy(instance);
  }
  return unused;
}
static void everything_at_once(void) {
  pthread_t callers[2];
  void *instance = NULL;
  begin_enabled();
  healthy_node(1);
  CHECK_EQ(create(&instance, 0, nobody, uuid_of(1), false), OK);
  set_callback(instance, client, NULL);
  at_once = true;
  for (int i = 0; i < 2; i++) pthread_create(&callers[i], NULL, call_for_a_while, NULL);
  for (unsigned round = 0; round < 400; round++) {
    unsigned n = 1 + round % 4;
    put_cluster_node(n, round);
    put(OBJECT, uuid_of(5), uuid_of(n), NULL, 0);
    tell(NODE, uuid_of(n), uuid_of(n), round % 7 == 3 ? NOT_FOUND : OK);
    tell(NETIF, uuid_of(n + 8), uuid_of(n), round % 7 == 3 ? NOT_FOUND : OK);
    tell(HEALTH, uuid_of(n + 8), nobody, OK);
    tell(OBJECT, uuid_of(5), uuid_of(n), OK);
    if (round % 13 == 0) tell(NETIF, nobody, nobody, SUB_RESYNC);
    if (round % 100 == 99) {
      status_fn(cache, 0);
      deliver();
      status_fn(cache, 1);
    }
  }
  for (int i = 0; i < 2; i++) pthread_join(callers[i], NULL);
  put_cluster_node(1, 0xabcdef);
  tell(NODE, nobody, nobody, SUB_RESYNC);
  tell(NETIF, nobody, nobody, SUB_RESYNC);
  run_world();
  CHECK_EQ(read_out(instance, 4), OK);
  CHECK_EQ(number_at(answer, 56, 4), 0xabcdef);
  destroy(instance);
  unload();
}

int main(int argc, char **argv) {
  if (argc != 2) give_up("usage: contract_test karst_resolver.so");
  map_module(argv[1]);
  declares_itself();
  links_to_nothing_else();
  failed_loads_leave_nothing();
  loads_and_unloads();
  cache_follows_the_directory();
  node_instances_answer();
  object_instances_follow_the_owner();
  everything_at_once();
  printf("contract: %d checks, %d failed\n", checks, failures);
  return failures == 0 ? 0 : 1;
}
