/* The cache world: the thread that turns dirty nodes into answers. */
#ifndef KARST_RESOLVER_WORLD_H
#define KARST_RESOLVER_WORLD_H

#include "karst_resolver/model.h"

extern "C" {

/* The world's body; `data` is the cache. Returns 0 when the world is being stopped. */
uint32_t KARSTResolverCacheWorldMain(void *data) KARST_EXCLUDES(karstResolverCacheLock);

} /* extern "C" */

#endif
