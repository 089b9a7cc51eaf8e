/* Network interfaces of the cache: found, created, read from their entries, destroyed. All of it
 * under the cache lock, which the two callbacks take themselves. */
#ifndef KARST_RESOLVER_NETIF_H
#define KARST_RESOLVER_NETIF_H

#include "karst_resolver/model.h"

extern "C" {

/* The interface of a UUID below the node of a UUID, or null. Time: O(log nodes + the node's
 * interfaces). */
KARSTResolverNetIf *KARSTResolverFindNetIf(KARSTResolverCache *cache, zel_UUID nodeUUID,
                                           zel_UUID netIfUUID)
    KARST_REQUIRES(karstResolverCacheLock);

/* The same, and where there is none a new interface with its health read; its record is all zero
 * until KARSTResolverUpdateNetIf. Null when the cache is disabled or has no free slot. */
KARSTResolverNetIf *KARSTResolverFindOrCreateNetIf(KARSTResolverCache *cache, zel_UUID nodeUUID,
                                                   zel_UUID netIfUUID)
    KARST_REQUIRES(karstResolverCacheLock);

/* Reads the interface's record; marks its node dirty where any byte of it changed. ZEL_FAILURE: the
 * entry is gone, belongs to another node or cannot be read, and the interface must be destroyed. */
zel_Status KARSTResolverUpdateNetIf(KARSTResolverCache *cache, KARSTResolverNetIf *netIf)
    KARST_REQUIRES(karstResolverCacheLock);

/* Reads the interface's health; marks its node dirty where the health flags changed. */
void KARSTResolverUpdateNetIfHealth(KARSTResolverCache *cache, KARSTResolverNetIf *netIf)
    KARST_REQUIRES(karstResolverCacheLock);

/* Takes the interface out of the cache and cancels its health subscription; its slot is free once
 * that subscription's last call has come. */
void KARSTResolverDestroyNetIf(KARSTResolverCache *cache, KARSTResolverNetIf *netIf)
    KARST_REQUIRES(karstResolverCacheLock);

/* Gives one reference back; with the last one the slot is free. */
void KARSTResolverReleaseNetIf(KARSTResolverCache *cache, KARSTResolverNetIf *netIf)
    KARST_REQUIRES(karstResolverCacheLock);

/* Callback of the subscription to all interface entries; `data` is the cache. */
zel_Status KARSTResolverNetIfSubCbk(void *data, const KarstEntryHeader *header, void *argument,
                                    zel_Status status) KARST_EXCLUDES(karstResolverCacheLock);

/* Callback of an interface's health subscription; `data` is the interface. */
zel_Status KARSTResolverNetIfHealthSubCbk(void *data, const KarstEntryHeader *header,
                                          void *argument, zel_Status status)
    KARST_EXCLUDES(karstResolverCacheLock);

} /* extern "C" */

#endif
