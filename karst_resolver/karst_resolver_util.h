/* The module's memory, all of it from the module heap, and its UUID helpers. No lock; may be used
 * under any.
 *
 * Every block is zero-filled and carries the address of the code that asked for it: the caller of
 * the entry point, never the entry point. So no entry point may be inlined, folded into its twin or
 * call its way out by a jump.
 */
#ifndef KARST_RESOLVER_KARST_RESOLVER_UTIL_H
#define KARST_RESOLVER_KARST_RESOLVER_UTIL_H

#include "karst/karst_rbtree.h"
#include "platform/expr_msh.h"
#include "platform/zel.h"

#if __has_attribute(no_icf)
#define KARST_RESOLVER_RECORDS_CALLER __attribute__((noinline, no_icf))
#else
#define KARST_RESOLVER_RECORDS_CALLER __attribute__((noinline))
#endif

extern "C" {

extern zel_ModuleID karstResolverModuleID; /* ZEL_NO_MODULE while unloaded */
extern zel_HeapID karstResolverHeapID;     /* ZEL_NO_HEAP while there is none */

/* `size` zeroed bytes or null; recorded as asked for by `returnAddress`, or by the caller. */
void *KARSTResolverAllocWithRA(uint32_t size, void *returnAddress);
KARST_RESOLVER_RECORDS_CALLER void *KARSTResolverAlloc(uint32_t size);

/* Gives a block back; null goes to the heap as it is. */
void KARSTResolverFree(void *block);

/* The same memory for the ordered map, and for what the directory and the marshaller return. */
extern const KARSTMemPool karstResolverMemPool;
extern const ExprMshAllocator resolverMshAlloc;

} /* extern "C" */

/* ---- UUIDs ----------------------------------------------------------------------------------- */

/* The text form, 36 characters; its arguments are the 16 bytes in order. */
#define KARST_RESOLVER_UUID_FORMAT                                   \
  "%02hhx%02hhx%02hhx%02hhx-%02hhx%02hhx-%02hhx%02hhx-%02hhx%02hhx-" \
  "%02hhx%02hhx%02hhx%02hhx%02hhx%02hhx"
#define KARST_RESOLVER_UUID_BYTES(u)                                                        \
  (u).bytes[0], (u).bytes[1], (u).bytes[2], (u).bytes[3], (u).bytes[4], (u).bytes[5],       \
      (u).bytes[6], (u).bytes[7], (u).bytes[8], (u).bytes[9], (u).bytes[10], (u).bytes[11], \
      (u).bytes[12], (u).bytes[13], (u).bytes[14], (u).bytes[15]

/* A UUID as two numbers: bytes 0-7 and 8-15, little-endian. */
static inline uint64_t KARSTResolverUUIDLow(const zel_UUID *uuid) {
  return KARSTRBTreeWord(uuid->bytes);
}
static inline uint64_t KARSTResolverUUIDHigh(const zel_UUID *uuid) {
  return KARSTRBTreeWord(uuid->bytes + 8);
}

static inline bool KARSTResolverUUIDEqual(const zel_UUID *a, const zel_UUID *b) {
  return KARSTResolverUUIDLow(a) == KARSTResolverUUIDLow(b) &&
         KARSTResolverUUIDHigh(a) == KARSTResolverUUIDHigh(b);
}

/* All zero stands for "none". */
static inline bool KARSTResolverUUIDIsPresent(const zel_UUID *uuid) {
  return (KARSTResolverUUIDLow(uuid) | KARSTResolverUUIDHigh(uuid)) != 0;
}

/* ---- Tags ------------------------------------------------------------------------------------ */

/* The first 8 bytes of the cache, of nodes, interfaces and instances: readable in a memory dump,
 * and complemented once the structure is free. */
static inline void KARSTResolverTagInUse(char *tag, const char *text) {
  __builtin_memcpy(tag, text, 8);
}
static inline void KARSTResolverTagFree(char *tag, const char *text) {
  for (int i = 0; i < 8; i++) tag[i] = (char)~text[i];
}

/* ---- Debug build ----------------------------------------------------------------------------- */

/* What must hold if the module is right. Checked in debug builds, where a breach stops the system.
 */
#ifdef KARST_RESOLVER_DEBUG
#define KARST_RESOLVER_CHECK(condition)                                                           \
  do {                                                                                            \
    if (!(condition)) {                                                                           \
      zel_PanicWithModuleID(zel_ModuleCurrentID, "Check failed at %s:%d: %s", __FILE__, __LINE__, \
                            #condition);                                                          \
    }                                                                                             \
  } while (0)
#else
#define KARST_RESOLVER_CHECK(condition) ((void)0)
#endif

#endif
