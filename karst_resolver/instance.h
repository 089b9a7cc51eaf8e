/* What happens to an instance once it exists: its locators computed anew, its callback called, its
 * references given back. */
#ifndef KARST_RESOLVER_INSTANCE_H
#define KARST_RESOLVER_INSTANCE_H

#include "karst_resolver/model.h"

extern "C" {

/* Computes locators and state from the node that the instance is attached to, if any. Time: O(1).
 */
void KARSTResolverUpdateAddressesLocked(KARSTResolverInstance *instance)
    KARST_REQUIRES(karstResolverCacheLock, instance->lock);

/* Calls the client, if it wants to be called, under the instance's lock. */
void KARSTResolverInvokeCallback(KARSTResolverInstance *instance)
    KARST_EXCLUDES(karstResolverCacheLock, instance->lock);

/* Brings an instance up to date with a node whose locators are new, and calls the client; nothing
 * where the instance is no longer attached to this node. The caller has a reference on both. */
void KARSTResolverRefreshNodeLocation(KARSTResolverInstance *instance, KARSTResolverNode *node)
    KARST_EXCLUDES(karstResolverCacheLock, instance->lock);

/* Gives one reference back; with the last one the instance is freed. Records where it is called
 * from: not to be inlined. The cache lock may be held. */
KARST_RESOLVER_RECORDS_CALLER void KARSTResolverReleaseInstance(KARSTResolverInstance *instance)
    KARST_EXCLUDES(instance->lock);

/* The instance's state at this moment. */
uint32_t KARSTResolverReadState(KARSTResolverInstance *instance) KARST_EXCLUDES(instance->lock);

/* Looks without a lock, for quick exits and for traces; see "Reads without a lock" in model.h. */
bool KARSTResolverIsDestroyed(const KARSTResolverInstance *instance);
bool KARSTResolverIsNodeChanged(const KARSTResolverInstance *instance);
bool KARSTResolverIsAttached(const KARSTResolverInstance *instance);

/* UUID of the node that the instance is attached to, all zero where there is none. Without a lock.
 */
zel_UUID KARSTResolverTrackedNodeUUID(const KARSTResolverInstance *instance);

/* Attaches to a node, whose newest instance this one becomes, or detaches from it. */
void KARSTResolverAttach(KARSTResolverInstance *instance, KARSTResolverNode *node)
    KARST_REQUIRES(karstResolverCacheLock);
void KARSTResolverDetach(KARSTResolverCache *cache, KARSTResolverInstance *instance)
    KARST_REQUIRES(karstResolverCacheLock);

} /* extern "C" */

#endif
