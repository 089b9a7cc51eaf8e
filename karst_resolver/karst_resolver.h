/* The KARST resolver, as its clients see it. Plain C; the only header that a client module needs.
 *
 * The question: at which network addresses can a cluster node be reached, or the node that owns a
 * storage object, now and as it changes?
 *
 *   KARSTResolverInstance *instance;
 *   if (KARSTResolver_Create(&instance, 0, noObject, nodeUUID, false) == ZEL_OK) {
 *     KARSTResolver_SetCallback(instance, addressesChanged, myData);   // called once at once
 *     ...
 *     KARSTResolver_Destroy(instance);                                 // no call after this
 *   }
 *
 * The functions may be called from any thread that holds no spinlock. An instance is given to the
 * three others only between the Create that made it and its Destroy; that is not checked.
 */
#ifndef KARST_RESOLVER_KARST_RESOLVER_H
#define KARST_RESOLVER_KARST_RESOLVER_H

#include "platform/zel.h"

#ifdef __cplusplus
extern "C" {
#endif

/* ---- Locators -------------------------------------------------------------------------------- */

#define KARST_RESOLVER_LOCATOR_IPV4 1u  /* the first 4 bytes of the address count */
#define KARST_RESOLVER_LOCATOR_IPV6 2u  /* all 16 bytes */
#define KARST_RESOLVER_LOCATOR_LOCAL 3u /* this host itself; the address is not filled */

#define KARST_RESOLVER_MAX_LOCATORS 4u /* a node never has more */

typedef struct KARSTResolverNodeLocator {
  uint32_t networkType; /* KARST_RESOLVER_LOCATOR_... */
  uint8_t address[16];  /* in network byte order */
} KARSTResolverNodeLocator;
ZEL_STATIC_ASSERT(sizeof(KARSTResolverNodeLocator) == 20, "layout of a locator");

/* Where a node can be reached. A caller may bring a set with room for fewer or more locators than
 * this one: it spans KARSTResolverNodeLocatorsSize(capacity) bytes. */
typedef struct KARSTResolverNodeLocators {
  zel_UUID nodeUUID;
  uint32_t majorVersion;
  uint32_t minorVersion;
  uint8_t reserved[16]; /* left as the caller had it */
  uint64_t trafficType; /* that the locators were chosen for: 0, or 1 where a witness takes part */
  uint16_t capacity;    /* in: slots that follow */
  uint16_t count;       /* out: slots that are filled, at most capacity */
  KARSTResolverNodeLocator locators[KARST_RESOLVER_MAX_LOCATORS];
} KARSTResolverNodeLocators;
ZEL_STATIC_ASSERT(sizeof(KARSTResolverNodeLocators) == 136, "layout of a locator set");
ZEL_STATIC_ASSERT(offsetof(KARSTResolverNodeLocators, majorVersion) == 16, "locator set");
ZEL_STATIC_ASSERT(offsetof(KARSTResolverNodeLocators, minorVersion) == 20, "locator set");
ZEL_STATIC_ASSERT(offsetof(KARSTResolverNodeLocators, reserved) == 24, "locator set");
ZEL_STATIC_ASSERT(offsetof(KARSTResolverNodeLocators, trafficType) == 40, "locator set");
ZEL_STATIC_ASSERT(offsetof(KARSTResolverNodeLocators, capacity) == 48, "locator set");
ZEL_STATIC_ASSERT(offsetof(KARSTResolverNodeLocators, count) == 50, "locator set");
ZEL_STATIC_ASSERT(offsetof(KARSTResolverNodeLocators, locators) == 52, "locator set");

/* Bytes of a set with room for `capacity` locators. */
static inline size_t KARSTResolverNodeLocatorsSize(uint16_t capacity) {
  return offsetof(KARSTResolverNodeLocators, locators) +
         (size_t)capacity * sizeof(KARSTResolverNodeLocator);
}

/* ---- Instances ------------------------------------------------------------------------------- */

typedef struct KARSTResolverInstance KARSTResolverInstance;

#define KARST_RESOLVER_STATE_INIT 0u     /* never computed; no client sees it */
#define KARST_RESOLVER_STATE_RESOLVED 1u /* GetNodeLocators succeeds */
#define KARST_RESOLVER_STATE_UNRESOLVED 2u

/* Called at once when it is installed, and then each time the instance's answer was computed anew,
 * also when it came out the same. `state` is that of this moment.
 *
 * It may come on the resolver's own thread, on a directory thread, or on the thread that calls
 * SetCallback; calls of one instance never overlap. It runs under the instance's spinlock, so it
 * must be short, must not sleep, and must call none of the four functions, for this instance (it
 * would lock against itself) or any other (locks of equal or lower rank would be taken under it).
 * Note that something changed, wake a thread of your own and read the locators there.
 *
 * After a change of a node, its instances are called one after the other: time O(interfaces of the
 * node + its instances), plus what the callbacks take. */
typedef void (*KARSTResolverCallback)(void *callbackData, KARSTResolverInstance *instance,
                                      uint32_t state);

/* Makes an instance for the node `nodeUUID` or, where `objectUUID` is not all zero, for the owner
 * of that object, whose directory entry has the type `entryType`. With an object, `nodeUUID` may
 * name a node to resolve to until the object's entry is first found. An instance stays with its
 * first node: when the object moves to another owner it becomes unresolved for good; create another
 * one then. `useLocalLocator`: where the node is this host, answer one locator of type LOCAL.
 *
 * ZEL_OK, and the instance is resolved; ZEL_BAD_PARAM (no place for the instance, no UUID);
 * ZEL_NOT_INITIALIZED (the resolver is not loaded wholly); ZEL_NO_MEMORY; ZEL_NOT_FOUND (it cannot
 * be resolved at this time); the status of a spinlock or a subscription that could not be made. On
 * a failure nothing is stored and nothing remains. Time: O(log nodes), however many instances there
 * are; with an object, plus what the directory takes for a lookup and a subscription. */
zel_Status KARSTResolver_Create(KARSTResolverInstance **instance, uint32_t entryType,
                                zel_UUID objectUUID, zel_UUID nodeUUID, bool useLocalLocator);

/* Ends the instance. A callback that runs on another thread is waited for, and none begins after
 * this returned. Time: O(1), plus O(log nodes) when the node goes with its last user, plus what the
 * directory takes to end an object's subscription. */
void KARSTResolver_Destroy(KARSTResolverInstance *instance);

/* Installs or replaces the callback (null: removes it), then calls it once. Time: O(1), plus what the
 * callback takes. */
void KARSTResolver_SetCallback(KARSTResolverInstance *instance, KARSTResolverCallback callback,
                               void *callbackData);

/* Copies the locators out; the caller has set `capacity`. ZEL_OK; ZEL_NOT_FOUND, and the set is
 * left alone, when the instance is not resolved. Takes the instance's lock only. Time: O(capacity),
 * at most four slots. */
zel_Status KARSTResolver_GetNodeLocators(KARSTResolverInstance *instance,
                                         KARSTResolverNodeLocators *nodeLocators);

#ifdef __cplusplus
}
#endif

#endif
