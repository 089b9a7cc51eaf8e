/*
 * Can somebody who has only the binary contract host the module? Scenarios on the host kernel of
 * contract_host.h, with every record, offset, number and text typed again: nothing here comes from
 * the module or its headers. One step at a time.
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

static void *symbol(void *library, const char *name) {
  void *at = dlsym(library, name);
  if (at == NULL) give_up(name);
  return at;
}
static void map_module(const char *path) {
  struct stat file;
  int fd = open(path, O_RDONLY);
  if (fd < 0 || fstat(fd, &file) != 0) give_up(path);
  image = mmap(NULL, (size_t)file.st_size, PROT_READ, MAP_PRIVATE, fd, 0);
  void *library = dlopen(path, RTLD_NOW | RTLD_LOCAL);
  if (image == MAP_FAILED || library == NULL) give_up(path);
  *(void **)&init_module = symbol(library, "init_module");
  *(void **)&cleanup_module = symbol(library, "cleanup_module");
  *(void **)&create = symbol(library, "KARSTResolver_Create");
  *(void **)&destroy = symbol(library, "KARSTResolver_Destroy");
  *(void **)&set_callback = symbol(library, "KARSTResolver_SetCallback");
  *(void **)&get_locators = symbol(library, "KARSTResolver_GetNodeLocators");
  Dl_info found = {0};
  dladdr(*(void **)&create, &found);
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
  CHECK_BYTES(loaded_section(".karst.modinfo", sizeof strings), strings, sizeof strings);
  CHECK_BYTES(loaded_section(".karst.required", sizeof required), required, sizeof required);
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
/* ---- a cluster as the directory tells it ----------------------------------------------------- */

static const Uuid nobody;
static const Uuid one = {{16, 17, 18, 19, 20, 21, 22, 23, 24, 25, 26, 27, 28, 29, 30, 31}};
static const Uuid nic = {{32, 33, 34, 35, 36, 37, 38, 39, 40, 41, 42, 43, 44, 45, 46, 47}};
static const Uuid object = {{48, 49, 50, 51, 52, 53, 54, 55, 56, 57, 58, 59, 60, 61, 62, 63}};

static void put_node(void) {
  const uint32_t record[5] = {0x01020304, 0x05060708, 0, 77, 78};
  put(NODE, one, one, record, sizeof record);
}
/* Its healthy interface at this IPv4 address. */
static void put_interface(uint32_t ipv4) {
  const uint32_t record[70] = {[0] = 1, [1] = ipv4};
  const uint32_t health[6] = {0};
  put(HEALTH, nic, nobody, health, sizeof health);
  put(NETIF, nic, one, record, sizeof record);
}
static void client(void *name, void *instance, uint32_t state) {
  CHECK_BYTES(instance, "karstri", 8);
  called("%s%u", (const char *)name, state);
}

/* ---- a node's life --------------------------------------------------------------------------- */

static void loads_and_enables(void) {
  CHECK_EQ(init_module(), 0);
  CALLS(
      "LogInit:KARSTResolver:4b52:2:0 HeapCreate:0:KARSTResolver:4b52:40000:a00000:0 "
      "DomainCreate:4b52:7ea9:KARSTResolver alloc LockCreate:KARSTResolverCache:1 alloc alloc "
      "alloc alloc alloc Register");
  CHECK_EQ(bucket_count, EVENTS);
  CHECK(in_module(block_of(cache)->asker));
  status_fn(cache, 1);
  run_world();
  CALLS(
      "c( )c Self c( )c WorldCreate:KARSTResolverCache:4b52:1:7ea9 Sub3:b* Sub6:b* preemptible c( "
      "pending? )c Wait:KARSTResolverCacheWorld");
  CHECK(number_at(cache, 8, 8) == 2 && number_at(cache, 16, 1) == 1);
  CHECK_EQ(number_at(cache, 32, 4), WORLD_ID);
  CHECK_BYTES((uint8_t *)cache + 36, &self_uuid, 16);
}
static uint64_t node, netif; /* as the module traced them */

static void follows_the_directory(void) {
  put_node();
  put_interface(0xa1);
  tell(NODE, one, one, OK);
  CALLS("c( T12 T14 Wake:71 Full3:5 alloc decode3 free )c");
  node = newest(12)[2];
  CHECK_BYTES((void *)node, "karstrn", 8);
  TRACED(12, 454, node, UUID_WORDS(one), 0, 0, 0);
  TRACED(14, 50, node, UUID_WORDS(one), 1, 0, 0);
  tell(NETIF, nic, one, OK);
  CALLS("c( T8 Full7:9 alloc decode7 free Full6:9 alloc decode6 free T10 Wake:71 )c");
  netif = newest(8)[2];
  CHECK_BYTES((void *)netif, "karstrni", 8);
  CHECK_STR((const char *)netif + 64, "20212223-2425-2627-2829-2a2b2c2d2e2f");
  TRACED(8, 150, netif, UUID_WORDS(nic), UUID_WORDS(one), 0);
  TRACED(10, 304, netif, UUID_WORDS(nic), UUID_WORDS(one), 0);
  run_world();
  CALLS("c( Sub7:9 pending? witness? T14 pending? )c Wait:KARSTResolverCacheWorld");
  TRACED(14, 578, node, UUID_WORDS(one), 1, 1, 0);
  put(HEALTH, nic, nobody, "\1", 1); /* no record; what was decoded of it, all zero, counts */
  tell(HEALTH, nic, nobody, SUB_RESYNC);
  CALLS(
      "c( Full7:9 alloc decode7 free log2 KARSTResolver log: KARSTResolverUpdateNetIfHealth: "
      "Failed to unmarshal health entry 20212223-2425-2627-2829-2a2b2c2d2e2f: REFUSED\n )c");
  tell(NODE, nobody, nobody, SUB_RESYNC);
  CALLS("T16 c( Find3:b* FullByHeader:0:1 alloc decode3 free Next3:b* )c");
}

static uint8_t answer[52 + 20 * 4];
static uint32_t read_out(void *instance) {
  memset(answer, 0xee, sizeof answer);
  memcpy(answer + 48, "\4", 2);
  return get_locators(instance, answer);
}

static void answers_for_a_node(void) {
  enum { TYPE = 0x1234567 };
  void *instance = NULL;
  CHECK_EQ(create(&instance, TYPE, nobody, one, false), OK);
  CALLS("alloc LockCreate:KARSTResolverInstance:2 c( )c T1 c( i( )i T3 i( T6 )i )c i( )i i( )i");
  CHECK_EQ(block_of(instance)->size, 392);
  CHECK(in_module(block_of(instance)->asker));
  CHECK_BYTES(instance, "karstri", 8);
  CHECK_EQ(number_at(instance, 8, 8), 1);
  CHECK_STR((const char *)instance + 32, "node:10111213-1415-1617-1819-1a1b1c1d1e1f");
  CHECK(all_bytes((uint8_t *)instance + 96, 34, 0));
  CHECK_EQ(number_at(instance, 132, 4), TYPE);
  CHECK(all_bytes((uint8_t *)instance + 136, 72, 0));
  CHECK_EQ(number_at(instance, 208, 8), node);
  CHECK_EQ(number_at(instance, 232, 4), 1);
  CHECK_BYTES((uint8_t *)instance + 376, &one, 16);
  TRACED(1, 485, WORD(instance), TYPE, 0, 0, UUID_WORDS(one));
  TRACED(3, 220, WORD(instance), TYPE, 0, 0, UUID_WORDS(one));
  TRACED(6, 120, WORD(instance), 0, 0, UUID_WORDS(one), 1);

  CHECK_EQ(read_out(instance), OK);
  CALLS("i( )i");
  CHECK_BYTES(answer, &one, 16);
  CHECK_EQ(number_at(answer, 16, 8), 0x0506070801020304);
  CHECK(all_bytes(answer + 24, 16, 0xee) && number_at(answer, 40, 8) == 0);
  CHECK_EQ(number_at(answer, 48, 4), 4 | 1 << 16);
  CHECK_BYTES(answer + 52, "\1\0\0\0\xa1\0\0\0", 8);
  CHECK(all_bytes(answer + 72, sizeof answer - 72, 0xee));

  set_callback(instance, client, "x");
  CALLS("i( T17 )i i( T7 x1 )i");
  TRACED(17, 621, WORD(instance), WORD(client), WORD("x"), 0, 0, 0);
  TRACED(7, 39, WORD(instance), TYPE, 0, 0, WORD(client), 1);
  CHECK_EQ(number_at(instance, 192, 8), WORD(client));
  put_interface(0xb1);
  tell(NETIF, nic, one, OK);
  CALLS("c( Full6:9 alloc decode6 free T10 Wake:71 )c");
  run_world();
  CALLS(
      "c( pending? witness? T14 )c c( i( T6 )i )c i( T7 x1 )i c( T18 pending? )c "
      "Wait:KARSTResolverCacheWorld");
  const uint64_t released_by = newest(18)[4];
  CHECK(in_module(released_by));
  TRACED(18, 384, WORD(instance), 2, released_by, 0x1001, 0x1002, 0x1003);
  destroy(instance);
  CALLS("T2 c( i( )i )c T18 LockDestroy free");
  TRACED(2, 547, WORD(instance), TYPE, 0, 0, UUID_WORDS(one));
  CHECK(newest(18)[4] != released_by && in_module(newest(18)[4]));
}

/* ---- an object's life, and the end ----------------------------------------------------------- */

static void answers_for_an_object(void) {
  enum { TYPE = 0x100 + OBJECT };
  void *o = NULL;
  put(OBJECT, object, one, NULL, 0);
  CHECK_EQ(create(&o, TYPE, object, nobody, false), OK);
  CALLS(
      "alloc LockCreate:KARSTResolverInstance:2 c( )c T1 Find9:9 T4 c( i( )i T3 i( T6 )i )c i( )i "
      "i( )i Sub9:9");
  CHECK_STR((const char *)o + 32, "object:30313233-3435-3637-3839-3a3b3c3d3e3f");
  CHECK_EQ(number_at(o, 8, 8), 2);
  CHECK_BYTES((uint8_t *)o + 96, &object, 16);
  CHECK_EQ(number_at(o, 136 + 40, 1), OBJECT);
  TRACED(4, 315, WORD(o), TYPE, UUID_WORDS(object), 0, 0);
  set_callback(o, client, "o");
  journal[0] = 0;
  entry_count--; /* the object is the newest entry */
  tell(OBJECT, object, one, NOT_FOUND);
  CALLS("Find9:9 T5 c( i( )i T3 i( T6 )i )c i( T7 o2 )i");
  TRACED(5, 330, WORD(o), TYPE, UUID_WORDS(object), UUID_WORDS(one));
  CHECK_EQ(read_out(o), NOT_FOUND);
  memset(answer + 48, 0xee, 2);
  CHECK(all_bytes(answer, sizeof answer, 0xee));
  journal[0] = 0;
  destroy(o);
  CALLS("T2 Unsub9:9 c( i( )i )c T18");
  deliver();
  CALLS("T18 LockDestroy free");
}
static void disables_and_unloads(void) {
  status_fn(cache, 0);
  CALLS("c( )c WorldDestroy:71 Unsub6:b* Unsub3:b* c( T14 T9 T13 Unsub7:9 )c");
  TRACED(9, 195, netif, UUID_WORDS(nic), UUID_WORDS(one), 0);
  TRACED(13, 453, node, UUID_WORDS(one), 0, 0, 0);
  CHECK_BYTES((void *)node, "\x94\x9e\x8d\x8c\x8b\x8d\x91\xff", 8);
  CHECK_BYTES((void *)netif, "karstrni", 8); /* its subscription's last call is due */
  cleanup_module();
  CALLS(
      "Deregister:1 c( )c Sleep:100000 c( )c c( )c free free free free free LockDestroy free "
      "DomainDestroy:10c4 HeapDestroy:7ea9 LogCleanup:1");
  CHECK_EQ(alive, 0);
}

int main(int argc, char **argv) {
  if (argc != 2) give_up("usage: contract_test karst_resolver.so");
  map_module(argv[1]);
  declares_itself();
  loads_and_enables();
  follows_the_directory();
  answers_for_a_node();
  answers_for_an_object();
  disables_and_unloads();
  printf("contract: %d checks, %d failed\n", checks, failures);
  return failures == 0 ? 0 : 1;
}
