/* Theory of operation, and the module's data.
 *
 * The question. A client asks at which addresses a node, or the node that owns a storage object,
 * can be reached, and wants to be told when the answer changes. The cluster directory knows all of
 * it: node entries, network-interface entries, health entries of interfaces, object entries with
 * their owners. The module keeps the part that matters, works the answer out once a node, on a
 * thread of its own, and hands every client a copy.
 *
 *     directory threads                 cache world                     client threads
 *     -----------------                 -----------                     --------------
 *     NodeSubCbk   NetIfSubCbk          takes dirty nodes,              Create, SetCallback,
 *     HealthSubCbk ObjectSubCbk         regenerates locators,           GetNodeLocators, Destroy
 *          |            |               refreshes instances                  |
 *          v            v                    |                               v
 *     +-------------------- KARSTResolverCache (one) ------------------+  KARSTResolverInstance
 *     | nodeTree: nodes by UUID        freeNodes   (128 slots)         |  (heap, one a Create)
 *     | netIfs: every live interface   freeNetIfs  (512 slots)         |     |
 *     | dirtyNodes: nodes to work on, first in first out               |     |
 *     +----|-----------------------------------------------------------+     |
 *          v                                                                 |
 *     KARSTResolverNode  -- instanceList: instances that track it  <---------+ node
 *          |  ^  locators: the node's answer            each has its own copy of the locators
 *          v  | node
 *     netIfList: KARSTResolverNetIf  (decoded record, health)
 *
 * Who owns, who references.
 *   cache->refCount     one for each directory subscription with the cache behind it (nodes,
 *                       interfaces, one a health subscription) until its last call; one for each
 *                       instance from Create to Destroy. Unload waits for zero.
 *   node->refCount      one while the node is reachable; one for each interface; one for each
 *                       instance that tracks it; one while the world refreshes its instances. At
 *                       zero the slot goes back (KARSTResolverReleaseNodeLocked).
 *   netIf->refCount     one for its place in the cache; one for its health subscription, until the
 *                       last call. At zero the slot goes back (KARSTResolverReleaseNetIf).
 *   instance->refCount  one for its creator; one for its object subscription, until the last call;
 *                       one while the world refreshes it. At zero the memory goes back
 *                       (KARSTResolverReleaseInstance).
 * A subscription's reference is taken before KARST_Subscribe and given back by its last call, with
 * ZEL_SUB_CANCELLED; KARST_Unsubscribe does not wait for that call.
 *
 * The life of an event. An interface changes its addresses: KARSTResolverNetIfSubCbk, on a
 * directory thread, takes the cache lock, finds the interface, fetches and decodes its record, and
 * marks the node dirty, which queues it and wakes the world. The world takes the node off the
 * queue, rebuilds its locators from its healthy interfaces, moves its instance list aside and, for
 * each instance, drops the cache lock and refreshes it: copy the node's locators under both locks,
 * then call the client under the instance's lock alone.
 *
 * Locks.
 *   rank 1  cache lock      the cache's lists, tree and flags; every field of nodes and interfaces;
 *                           which node an instance is attached to. Held across directory lookups,
 *                           trace emission, zel_WorldForceWakeup, and the subscription and
 *                           cancellation of health subscriptions, none of which may block. Never
 *                           held across a client's callback.
 *   rank 2  instance lock   the instance's state, locators, callback and destroyed flag. Locators and
 *                           state are written under both locks and read under this one alone. Held
 *                           across the client's callback.
 * The reference counts of the cache and of instances are atomic, those of nodes and interfaces plain.
 *
 * Read without a lock:
 *   instance->node          quick looks in tracking, and in its traces; atomic. What gets past them
 *   instance->nodeChanged   is decided again under the lock. The node itself is never read so.
 *   instance->destroyed
 *   instance->boundNodeUUID written once, by the first tracking inside Create, before any other
 *                           thread can track the instance; it is the UUID of whichever node the
 *                           instance is attached to
 *   cache->world            atomic; the host stores it before the world first runs
 *   cache->nodeSub, netIfSub, netIf->healthSub   constant from before the subscription on
 */
#ifndef KARST_RESOLVER_MODEL_H
#define KARST_RESOLVER_MODEL_H

#include "karst/karst_rbtree.h"
#include "karst_resolver/karst_resolver.h"
#include "karst_resolver/list.h"
#include "karst_resolver/lock.h"
#include "platform/karst_directory.h"

#define KARST_RESOLVER_NODE_POOL_SIZE 128u
#define KARST_RESOLVER_NETIF_POOL_SIZE 512u

#define KARST_RESOLVER_TAG_CACHE "karstrc"
#define KARST_RESOLVER_TAG_NODE "karstrn"
#define KARST_RESOLVER_TAG_NETIF "karstrni"
#define KARST_RESOLVER_TAG_INSTANCE "karstri"

/* Flag bytes of the queries. */
#define KARST_RESOLVER_QUERY_ALL (KARST_QUERY_BY_TYPE | KARST_QUERY_ALL | KARST_QUERY_REPLICA)
#define KARST_RESOLVER_QUERY_ONE (KARST_QUERY_BY_TYPE | KARST_QUERY_REPLICA)
#define KARST_RESOLVER_QUERY_VERSION (KARST_QUERY_BY_TYPE | KARST_QUERY_LATEST)
static_assert(KARST_RESOLVER_QUERY_ALL == 0x0b, "flags of a subscription to all entries");
static_assert(KARST_RESOLVER_QUERY_ONE == 0x09, "flags of a query for one entry");
static_assert(KARST_RESOLVER_QUERY_VERSION == 0x05, "flags of a version refresh");

struct KARSTResolverCache;

/* ---- Node ------------------------------------------------------------------------------------ */

struct KARSTResolverNode {
  char tag[8]; /* complemented while the slot is free */
  uint32_t refCount KARST_GUARDED_BY(karstResolverCacheLock);
  KARSTResolverLink freeLinks KARST_GUARDED_BY(karstResolverCacheLock);
  KARSTResolverLink dirtyLinks KARST_GUARDED_BY(karstResolverCacheLock); /* zero: not queued */
  KARSTRBTreeNode treeElem KARST_GUARDED_BY(karstResolverCacheLock);
  KARSTRBTreeKey key KARST_GUARDED_BY(karstResolverCacheLock); /* points at `uuid` below */
  zel_UUID uuid KARST_GUARDED_BY(karstResolverCacheLock);
  uint8_t isSelf KARST_GUARDED_BY(karstResolverCacheLock);     /* this host */
  uint8_t isWitness KARST_GUARDED_BY(karstResolverCacheLock);  /* 0 or 1, from its entry */
  uint8_t rescanSeen KARST_GUARDED_BY(karstResolverCacheLock); /* within a rescan only */
  uint8_t reachable KARST_GUARDED_BY(karstResolverCacheLock);  /* its entry exists; one reference */
  uint32_t majorVersion KARST_GUARDED_BY(karstResolverCacheLock);
  uint32_t minorVersion KARST_GUARDED_BY(karstResolverCacheLock);
  KARSTResolverLink netIfList KARST_GUARDED_BY(karstResolverCacheLock); /* in order of creation */
  KARSTResolverLink instanceList KARST_GUARDED_BY(karstResolverCacheLock); /* newest first */
  KARSTResolverNodeLocators locators KARST_GUARDED_BY(karstResolverCacheLock);
};

/* ---- Network interface ----------------------------------------------------------------------- */

struct KARSTResolverNetIf {
  char tag[8]; /* complemented while the slot is free */
  uint32_t refCount KARST_GUARDED_BY(karstResolverCacheLock);
  KARSTResolverLink cacheLinks KARST_GUARDED_BY(karstResolverCacheLock);
  KARSTResolverLink freeLinks KARST_GUARDED_BY(karstResolverCacheLock);
  KARSTResolverLink nodeLinks KARST_GUARDED_BY(karstResolverCacheLock);
  char uuidString[64] KARST_GUARDED_BY(karstResolverCacheLock);
  zel_UUID uuid KARST_GUARDED_BY(karstResolverCacheLock);
  KARSTResolverNode *node KARST_GUARDED_BY(karstResolverCacheLock); /* null once destroyed */
  KARSTResolverCache *cache; /* constant from before the health subscription to its last call */
  KarstQuery healthSub;      /* likewise */
  uint8_t healthSubInstalled KARST_GUARDED_BY(karstResolverCacheLock);
  uint8_t healthy KARST_GUARDED_BY(karstResolverCacheLock);    /* health.healthFlags is 0 */
  uint8_t rescanSeen KARST_GUARDED_BY(karstResolverCacheLock); /* within a rescan only */
  KarstNetInterfaceEntry info KARST_GUARDED_BY(karstResolverCacheLock);   /* zero: never read yet */
  KarstHealthStatusEntry health KARST_GUARDED_BY(karstResolverCacheLock); /* all ones: no entry */
};

/* ---- Cache ----------------------------------------------------------------------------------- */

struct KARSTResolverCache {
  char tag[8];
  uint64_t refCount; /* atomic */
  uint8_t enabled KARST_GUARDED_BY(karstResolverCacheLock);
  KARSTResolverLock lock; /* karstResolverCacheLock in attributes */
  zel_WorldID world;      /* atomic */
  zel_UUID selfUUID KARST_GUARDED_BY(karstResolverCacheLock);
  KarstQuery nodeSub;  /* filled by the first enable, constant from then on */
  KarstQuery netIfSub; /* likewise */
  KARSTResolverNode *nodePool;
  KARSTResolverNetIf *netIfPool;
  KARSTResolverLink freeNodes KARST_GUARDED_BY(karstResolverCacheLock);  /* last in, first out */
  KARSTResolverLink freeNetIfs KARST_GUARDED_BY(karstResolverCacheLock); /* first in, first out */
  KARSTRBTree *nodeTree KARST_POINTS_TO_GUARDED_BY(karstResolverCacheLock);
  KARSTResolverLink netIfs KARST_GUARDED_BY(karstResolverCacheLock); /* in order of creation */
  KARSTResolverLink dirtyNodes KARST_GUARDED_BY(karstResolverCacheLock);
  uint32_t unwatchedNetIfs KARST_GUARDED_BY(karstResolverCacheLock); /* in `netIfs`, no healthSub */
};

/* ---- Instance -------------------------------------------------------------------------------- */

struct KARSTResolverInstance {
  char tag[8];
  uint64_t refCount; /* atomic */
  uint8_t destroyed KARST_GUARDED_BY(lock);
  uint8_t nodeChanged KARST_GUARDED_BY(karstResolverCacheLock); /* asked for another node; final */
  KARSTResolverLock lock;
  char name[64];
  zel_UUID objectUUID;     /* all zero for a node's instance */
  zel_UUID hintNodeUUID;   /* to resolve to until the object's entry is found */
  uint8_t useHintNode;     /* written by tracking, whose calls for an instance never overlap */
  uint8_t useLocalLocator; /* constant */
  uint32_t entryType;      /* of the object's entry; constant */
  KarstQuery objectQuery;  /* constant */
  uint8_t subscribed;      /* the creator's own */
  KARSTResolverCallback callback KARST_GUARDED_BY(lock);
  void *callbackData KARST_GUARDED_BY(lock);
  KARSTResolverNode *node KARST_GUARDED_BY(karstResolverCacheLock); /* stored atomically */
  KARSTResolverLink nodeLinks KARST_GUARDED_BY(karstResolverCacheLock);
  uint32_t state KARST_GUARDED_BY(lock);
  KARSTResolverNodeLocators locators KARST_GUARDED_BY(lock);
  zel_UUID boundNodeUUID; /* of the first node attached to; see "Reads without a lock" above */
};
static_assert(sizeof(KARSTResolverInstance) == 392, "the heap is sized for this many bytes");

/* ---- Module ---------------------------------------------------------------------------------- */

extern "C" {

extern KARSTResolverCache *karstResolverCache; /* null while there is none */

/* Instances whose memory is not back on the heap yet, and calls of KARSTResolver_Destroy that have
 * not ended. A destroyed instance may still wait for the last call of its object's subscription; and
 * where that call gives up the last reference, the client's thread may still be on its way out. No
 * reference on the cache is left to say so: unload waits for this count as well. Atomic. */
extern uint64_t karstResolverInstancesAlive;

} /* extern "C" */

/* ---- Locking --------------------------------------------------------------------------------- */

static inline void KARSTResolverLockCache(KARSTResolverCache *cache)
    KARST_ACQUIRES(karstResolverCacheLock) KARST_UNCHECKED {
  zel_SpinlockLock(cache->lock.handle);
}

static inline void KARSTResolverUnlockCache(KARSTResolverCache *cache)
    KARST_RELEASES(karstResolverCacheLock) KARST_UNCHECKED {
  zel_SpinlockUnlock(cache->lock.handle);
}

static inline void KARSTResolverLockInstance(KARSTResolverInstance *instance)
    KARST_ACQUIRES(instance->lock) KARST_UNCHECKED {
  zel_SpinlockLock(instance->lock.handle);
}

static inline void KARSTResolverUnlockInstance(KARSTResolverInstance *instance)
    KARST_RELEASES(instance->lock) KARST_UNCHECKED {
  zel_SpinlockUnlock(instance->lock.handle);
}

/* ---- Atomic counts --------------------------------------------------------------------------- */

/* A reference is taken where another one, or the cache lock, keeps the object alive. */
static inline void KARSTResolverCountUp(uint64_t *count) {
  __atomic_fetch_add(count, 1, __ATOMIC_RELAXED);
}

/* Returns the count before. What was done with the reference is visible to whoever finds the count
 * at zero. */
static inline uint64_t KARSTResolverCountDown(uint64_t *count) {
  uint64_t before = __atomic_fetch_sub(count, 1, __ATOMIC_ACQ_REL);
  KARST_RESOLVER_CHECK(before != 0);
  return before;
}

#endif
