/* The one cache: made when the module loads, filled while the directory is usable, freed at unload.
 */
#ifndef KARST_RESOLVER_CACHE_H
#define KARST_RESOLVER_CACHE_H

#include "karst_resolver/model.h"

extern "C" {

/* Creates the cache and registers for the directory's status, whose calls may come before this
 * returns. Stores the cache, or null, through `result`. ZEL_OK; ZEL_NO_MEMORY; ZEL_FAILURE; the
 * status of the lock. */
zel_Status KARSTResolverCacheInit(KARSTResolverCache **result)
    KARST_EXCLUDES(karstResolverCacheLock);

/* Deregisters, disables, waits until nobody has a reference any more, frees. Blocks. */
void KARSTResolverCacheCleanup(KARSTResolverCache *cache) KARST_EXCLUDES(karstResolverCacheLock);

/* The directory's status callback; `data` is the cache. KARST_STATUS_USABLE set: enables; clear:
 * disables. */
void KARSTResolverCacheEnableDisable(void *data, uint32_t status)
    KARST_EXCLUDES(karstResolverCacheLock);

/* Stops the world, cancels the subscriptions, makes every node unreachable and destroys every
 * interface; nothing where the cache is disabled. Blocks until the world has ended. */
void KARSTResolverCacheDisable(KARSTResolverCache *cache) KARST_EXCLUDES(karstResolverCacheLock);

} /* extern "C" */

#endif
