/* The answer for a node: its locators, from its interfaces. Under the cache lock. */
#ifndef KARST_RESOLVER_LOCATORS_H
#define KARST_RESOLVER_LOCATORS_H

#include "karst_resolver/model.h"

extern "C" {

/* Rewrites the node's locator set in place. Time: O(the node's interfaces), and no look beyond the
 * fourth locator. */
void KARSTResolverGenerateNodeLocators(KARSTResolverCache *cache, KARSTResolverNode *node)
    KARST_REQUIRES(karstResolverCacheLock);

} /* extern "C" */

#endif
