/* Spinlocks and what the compiler checks about them.
 *
 * Two capabilities exist. The lock of the one cache is named karstResolverCacheLock, a name that
 * stands for that lock in attributes and is no object: nodes, interfaces and lists have no pointer
 * to their cache that an attribute could follow. The lock of an instance is instance->lock. Clang's
 * thread-safety analysis (-Wthread-safety) checks every annotated access; the ranks, cache 1 before
 * instance 2, are checked at run time by whoever provides the spinlocks.
 */
#ifndef KARST_RESOLVER_LOCK_H
#define KARST_RESOLVER_LOCK_H

#include "platform/zel.h"

#if defined(__clang__)
#define KARST_RESOLVER_ATTRIBUTE(x) __attribute__((x))
#else
#define KARST_RESOLVER_ATTRIBUTE(x)
#endif

#define KARST_GUARDED_BY(lock) KARST_RESOLVER_ATTRIBUTE(guarded_by(lock))
#define KARST_POINTS_TO_GUARDED_BY(lock) KARST_RESOLVER_ATTRIBUTE(pt_guarded_by(lock))
#define KARST_REQUIRES(...) KARST_RESOLVER_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define KARST_EXCLUDES(...) KARST_RESOLVER_ATTRIBUTE(locks_excluded(__VA_ARGS__))
#define KARST_ACQUIRES(...) KARST_RESOLVER_ATTRIBUTE(acquire_capability(__VA_ARGS__))
#define KARST_RELEASES(...) KARST_RESOLVER_ATTRIBUTE(release_capability(__VA_ARGS__))
/* For a function that is right without the lock; a comment says why. */
#define KARST_UNCHECKED KARST_RESOLVER_ATTRIBUTE(no_thread_safety_analysis)

/* A platform spinlock, with the type that the analysis asks for. */
struct KARST_RESOLVER_ATTRIBUTE(capability("spinlock")) KARSTResolverLock {
  zel_SpinlockHandle handle; /* ZEL_NO_SPINLOCK while it does not exist */
};
static_assert(sizeof(KARSTResolverLock) == sizeof(zel_SpinlockHandle), "nothing but the handle");

extern KARSTResolverLock karstResolverCacheLock; /* declared for attributes, defined nowhere */

enum {
  KARST_RESOLVER_RANK_CACHE = 1,
  KARST_RESOLVER_RANK_INSTANCE = 2,
};

extern "C" {

extern zel_LockDomainID karstResolverLockDomain; /* ZEL_NO_LOCK_DOMAIN while there is none */

/* Creates a lock of the module's domain and heap; any lock may be held. */
zel_Status KARSTResolverLockCreate(KARSTResolverLock *lock, const char *name, uint16_t rank);

} /* extern "C" */

#endif
