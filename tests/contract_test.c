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
  called(INSTANCE_LOCK, "%s%u", (const char *)name, state);
}
static void nothing_left(void) {
  CHECK(live_blocks == 0 && live_locks == 0 && live_subs == 0);
  CHECK(status_fn == NULL && !world.alive && held == NO_LOCK);
}

/* ---- a node's life --------------------------------------------------------------------------- */

static void loads_and_enables(void) {
  open_stream();
  CHECK_EQ(init_module(), 0);
  CALLS("LogInit HeapCreate DomainCreate alloc LockCreate alloc alloc alloc alloc alloc Register");
  CHECK_EQ(bucket_count, EVENTS);
  CHECK(live_blocks == 6 && in_module(ASKER_OF_BLOCK(cache)));
  status_fn(cache, 1);
  run_world();
  CALLS("c( )c Self c( )c WorldCreate Sub3 Sub6 preemptible c( pending? )c Wait");
  CHECK(number_at(cache, 8, 8) == 2 && number_at(cache, 16, 1) == 1);
  CHECK_EQ(number_at(cache, 32, 4), WORLD_ID);
  CHECK_BYTES((uint8_t *)cache + 36, &self_uuid, 16);
}
static uint64_t node, netif; /* as the module traced them */

static void follows_the_directory(void) {
  put_node();
  put_interface(0xa1);
  tell(NODE, one, one, OK);
  CALLS("c( T12 T14 Wake Full3 alloc decode3 free )c");
  node = number_at(newest(12), 16, 8);
  CHECK_BYTES((void *)node, "karstrn", 8);
  TRACED(12, 454, node, UUID_WORDS(one), 0, 0, 0);
  TRACED(14, 50, node, UUID_WORDS(one), 1, 0, 0);
  tell(NETIF, nic, one, OK);
  CALLS("c( T8 Full7 alloc decode7 free Full6 alloc decode6 free T10 Wake )c");
  netif = number_at(newest(8), 16, 8);
  CHECK_BYTES((void *)netif, "karstrni", 8);
  CHECK_STR((const char *)netif + 64, "20212223-2425-2627-2829-2a2b2c2d2e2f");
  TRACED(8, 150, netif, UUID_WORDS(nic), UUID_WORDS(one), 0);
  TRACED(10, 304, netif, UUID_WORDS(nic), UUID_WORDS(one), 0);
  run_world();
  CALLS("c( Sub7 pending? witness? T14 pending? )c Wait");
  TRACED(14, 578, node, UUID_WORDS(one), 1, 1, 0);
  put(HEALTH, nic, nobody, "\1", 1); /* no record; what was decoded of it, all zero, counts */
  tell(HEALTH, nic, nobody, SUB_RESYNC);
  CALLS(
      "c( Full7 alloc decode7 free log2 KARSTResolverUpdateNetIfHealth: Failed to unmarshal "
      "health entry 20212223-2425-2627-2829-2a2b2c2d2e2f: <0bad0777>\n )c");
  tell(NODE, nobody, nobody, SUB_RESYNC);
  CALLS("T16 c( Find3 FullByHeader alloc decode3 free Next3 )c");
}

static uint8_t answer[52 + 20 * 4];
static uint32_t read_out(void *instance) {
  memset(answer, 0xee, sizeof answer);
  set_number(answer, 48, 2, 4);
  return get_locators(instance, answer);
}

static void answers_for_a_node(void) {
  enum { TYPE = 0x1234567 };
  void *instance = NULL;
  CHECK_EQ(create(&instance, TYPE, nobody, one, false), OK);
  CALLS("alloc LockCreate c( )c T1 c( i( )i T3 i( T6 )i )c i( )i i( )i");
  CHECK_EQ(SIZE_OF_BLOCK(instance), 392);
  CHECK(in_module(ASKER_OF_BLOCK(instance)));
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
  CALLS("c( Full6 alloc decode6 free T10 Wake )c");
  run_world();
  CALLS("c( pending? witness? T14 )c c( i( T6 )i )c i( T7 x1 )i c( T18 pending? )c Wait");
  const uint64_t released_by = number_at(newest(18), 32, 8);
  CHECK(in_module(released_by));
  TRACED(18, 384, WORD(instance), 2, released_by, 0x1001, 0x1002, 0x1003);
  destroy(instance);
  CALLS("T2 c( i( )i )c T18 LockDestroy free");
  TRACED(2, 547, WORD(instance), TYPE, 0, 0, UUID_WORDS(one));
  CHECK(number_at(newest(18), 32, 8) != released_by && in_module(number_at(newest(18), 32, 8)));
}

/* ---- an object's life, and the end ----------------------------------------------------------- */

static void answers_for_an_object(void) {
  enum { TYPE = 0x100 + OBJECT };
  void *o = NULL;
  put(OBJECT, object, one, NULL, 0);
  CHECK_EQ(create(&o, TYPE, object, nobody, false), OK);
  CALLS("alloc LockCreate c( )c T1 Find9 T4 c( i( )i T3 i( T6 )i )c i( )i i( )i Sub9");
  CHECK_STR((const char *)o + 32, "object:30313233-3435-3637-3839-3a3b3c3d3e3f");
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
  CHECK_EQ(read_out(o), NOT_FOUND);
  set_number(answer, 48, 2, 0xeeee);
  CHECK(all_bytes(answer, sizeof answer, 0xee));
  journal[0] = 0;
  destroy(o);
  CALLS("T2 Unsub9 c( i( )i )c T18");
  deliver();
  CALLS("T18 LockDestroy free");
}
static void disables_and_unloads(void) {
  status_fn(cache, 0);
  CALLS("c( )c WorldDestroy Unsub6 Unsub3 c( T14 T9 T13 Unsub7 )c");
  TRACED(9, 195, netif, UUID_WORDS(nic), UUID_WORDS(one), 0);
  TRACED(13, 453, node, UUID_WORDS(one), 0, 0, 0);
  CHECK_BYTES((void *)node, "\x94\x9e\x8d\x8c\x8b\x8d\x91\xff", 8);
  CHECK_BYTES((void *)netif, "karstrni", 8); /* its subscription's last call is due */
  cleanup_module();
  CALLS(
      "Deregister c( )c Sleep c( )c c( )c free free free free free LockDestroy free DomainDestroy "
      "HeapDestroy LogCleanup");
  nothing_left();
}

int main(int argc, char **argv) {
  if (argc != 2) give_up("usage: contract_test karst_resolver.so");
  map_module(argv[1]);
  declares_itself();
  links_to_nothing_else();
  loads_and_enables();
  follows_the_directory();
  answers_for_a_node();
  answers_for_an_object();
  disables_and_unloads();
  printf("contract: %d checks, %d failed\n", checks, failures);
  return failures == 0 ? 0 : 1;
}
