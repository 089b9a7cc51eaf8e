/* How an instance finds its node, and how an object's instance follows the object's entry. Called
 * without any lock; for one instance the calls never overlap: Create makes the first one, the
 * object's subscription all others. */
#ifndef KARST_RESOLVER_TRACKING_H
#define KARST_RESOLVER_TRACKING_H

#include "karst_resolver/model.h"

extern "C" {

/* Attaches the instance to the node of this UUID, all zero: to none, computes its answer and calls
 * the client. An instance is bound to the first node that it attaches to; asked for another one it
 * lets go for good. Time: O(log nodes). */
void KARSTResolverTrackNode(KARSTResolverInstance *instance, zel_UUID nodeUUID)
    KARST_EXCLUDES(karstResolverCacheLock, instance->lock);

/* Tracks the owner of the instance's object, by the object's entry or, without one, by looking it
 * up. */
void KARSTResolverUpdateObject(KARSTResolverInstance *instance, const KarstEntryHeader *entry)
    KARST_EXCLUDES(karstResolverCacheLock, instance->lock);

/* Callback of an object's subscription; `callbackData` is the instance. */
zel_Status KARSTResolverObjectSubCbk(void *callbackData, const KarstEntryHeader *entry,
                                     void *argument, zel_Status status)
    KARST_EXCLUDES(karstResolverCacheLock);

} /* extern "C" */

#endif
