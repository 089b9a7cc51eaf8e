/* Memory of the module; see karst_resolver_util.h. No lock: the heap serialises its callers. */
#include "karst_resolver/karst_resolver_util.h"

extern "C" {

zel_HeapID karstResolverHeapID = ZEL_NO_HEAP;

void *KARSTResolverAllocWithRA(uint32_t size, void *returnAddress) {
  void *block = zel_HeapAllocWithRA(karstResolverHeapID, size, returnAddress);
  if (block != nullptr) __builtin_memset(block, 0, size);
  return block;
}

KARST_RESOLVER_RECORDS_CALLER void *KARSTResolverAlloc(uint32_t size) {
  return KARSTResolverAllocWithRA(size, __builtin_return_address(0));
}

void KARSTResolverFree(void *block) {
  zel_HeapFree(karstResolverHeapID, block);
}

/* ---- For the ordered map --------------------------------------------------------------------- */

static KARST_RESOLVER_RECORDS_CALLER void *KARSTResolverMemPoolAlloc(void *, uint64_t size) {
  return KARSTResolverAllocWithRA((uint32_t)size, __builtin_return_address(0));
}

/* A product that does not fit is refused: a block shorter than asked for would be overrun. */
static KARST_RESOLVER_RECORDS_CALLER void *KARSTResolverMemPoolCalloc(void *, uint32_t count,
                                                                      uint32_t size) {
  uint32_t bytes;
  if (__builtin_mul_overflow(count, size, &bytes)) return nullptr;
  return KARSTResolverAllocWithRA(bytes, __builtin_return_address(0));
}

/* Nothing calls it; it must not be reached. */
static void *KARSTResolverMemPoolRealloc(void *, void *, uint64_t) {
  zel_PanicWithModuleID(zel_ModuleCurrentID, "Failed at %s:%d -- NOT REACHED",
                        "karst_resolver/karst_resolver_util", __LINE__);
}

static void KARSTResolverMemPoolFree(void *, void *block) {
  zel_HeapFree(karstResolverHeapID, block);
}

const KARSTMemPool karstResolverMemPool = {
    KARSTResolverMemPoolAlloc,
    KARSTResolverMemPoolCalloc,
    KARSTResolverMemPoolRealloc,
    KARSTResolverMemPoolFree,
    0, /* links are plain addresses */
};

/* ---- For the directory and the marshaller ---------------------------------------------------- */

static KARST_RESOLVER_RECORDS_CALLER void *KARSTResolverExprAllocFunc(void *, uint64_t size) {
  return KARSTResolverAllocWithRA((uint32_t)size, __builtin_return_address(0));
}

static KARST_RESOLVER_RECORDS_CALLER void *KARSTResolverExprZeroedAllocFunc(void *, uint64_t size) {
  return KARSTResolverAllocWithRA((uint32_t)size, __builtin_return_address(0));
}

static void KARSTResolverExprFreeFunc(void *, void *block) {
  if (block != nullptr) zel_HeapFree(karstResolverHeapID, block);
}

const ExprMshAllocator resolverMshAlloc = {
    KARSTResolverExprAllocFunc,
    KARSTResolverExprZeroedAllocFunc,
    KARSTResolverExprFreeFunc,
    nullptr,
};

} /* extern "C" */
