/* The cluster directory: typed entries, each named by a UUID, owned by a node and carrying a
 * marshalled record. Modules look entries up and subscribe to their changes.
 *
 * Remarks as in zel.h: does the call block, may a spinlock be held.
 */
#ifndef PLATFORM_KARST_DIRECTORY_H
#define PLATFORM_KARST_DIRECTORY_H

#include "platform/expr_msh.h"
#include "platform/zel.h"

#ifdef __cplusplus
extern "C" {
#endif

/* ---- Entries --------------------------------------------------------------------------------- */

/* Types of entries that carry a record known here. An object's type is its user's. */
#define KARST_TYPE_NODE 3u          /* KarstNodeEntry; UUID: the node's */
#define KARST_TYPE_NET_INTERFACE 6u /* KarstNetInterfaceEntry; UUID: its own, owner: its node */
#define KARST_TYPE_HEALTH_STATUS 7u /* KarstHealthStatusEntry; UUID: the interface's */

typedef struct KarstEntryHeader {
  zel_UUID uuid;
  zel_UUID owner;        /* the node that owns the entry */
  uint8_t directory[28]; /* the directory's own */
  uint32_t dataLength;   /* bytes of marshalled data behind the header in a whole entry */
} KarstEntryHeader;
ZEL_STATIC_ASSERT(sizeof(KarstEntryHeader) == 64, "layout of an entry header");
ZEL_STATIC_ASSERT(offsetof(KarstEntryHeader, owner) == 16, "layout of an entry header");
ZEL_STATIC_ASSERT(offsetof(KarstEntryHeader, dataLength) == 60, "layout of an entry header");

/* A whole entry: the header; dataLength bytes of data follow it. */
typedef struct KarstFullEntry {
  KarstEntryHeader header;
} KarstFullEntry;
ZEL_STATIC_ASSERT(sizeof(KarstFullEntry) == 64, "the data follow the header");

/* ---- Queries --------------------------------------------------------------------------------- */

/* What to look up or to subscribe to: the entries of one type, all of them or the one of a UUID.
 * Every byte that is not named here is zero. */
typedef struct KarstQuery {
  uint8_t reserved[16];
  zel_UUID uuid; /* all zero: every entry of the type */
  uint64_t reserved2;
  uint8_t type;
  uint8_t flags; /* KARST_QUERY_... */
  uint8_t reserved3[6];
} KarstQuery;
ZEL_STATIC_ASSERT(sizeof(KarstQuery) == 48, "layout of a query");
ZEL_STATIC_ASSERT(offsetof(KarstQuery, uuid) == 16, "layout of a query");
ZEL_STATIC_ASSERT(offsetof(KarstQuery, type) == 40, "layout of a query");
ZEL_STATIC_ASSERT(offsetof(KarstQuery, flags) == 41, "layout of a query");

#define KARST_QUERY_BY_TYPE 0x01u /* the type must match; always set */
#define KARST_QUERY_ALL 0x02u     /* every entry of the type; the UUID is zero */
#define KARST_QUERY_LATEST 0x04u  /* one entry, as the directory has it now */
#define KARST_QUERY_REPLICA 0x08u /* answered from the local replica */

/* ---- Records --------------------------------------------------------------------------------- */

/* The layouts below are those of decoded records; offsets are asserted. */

#define KARST_NODE_FLAG_WITNESS 0x2u /* in KarstNodeEntry.flags */

typedef struct KarstNodeEntry {
  uint32_t majorVersionNum;
  uint32_t minorVersionNum;
  uint32_t flags;
  uint32_t requiredTolmMajorVersion;
  uint32_t requiredTolmMinorVersion;
} KarstNodeEntry;
ZEL_STATIC_ASSERT(sizeof(KarstNodeEntry) == 20, "layout of a node record");

#define KARST_NET_INTERFACE_MAX_ADDRESSES 7u
#define KARST_NETWORK_TYPE_IP 1u

typedef struct KarstIpAddress {
  uint8_t isIPv6; /* non-zero: IPv6 */
  uint8_t reserved[3];
  uint8_t address[16]; /* IPv6: all; IPv4: the first 4 */
} KarstIpAddress;
ZEL_STATIC_ASSERT(sizeof(KarstIpAddress) == 20, "layout of an address");

typedef struct KarstNetInterfaceEntry {
  uint32_t networkType;    /* KARST_NETWORK_TYPE_IP, or one that this release does not know */
  uint8_t ipv4Address[4];  /* for type IP: the address of an interface that lists none below */
  uint8_t networkPart[60]; /* the rest of the network type's own part */
  uint32_t agentGroupPort;
  uint32_t masterGroupPort;
  uint32_t multicastTTL;
  uint64_t bandwidth;
  uint8_t macAddress[6];
  uint8_t agentV6Group[16];
  uint8_t masterV6Group[16];
  uint8_t padding[2];
  uint32_t numIpAddresses; /* 0 to 7 */
  KarstIpAddress ipAddresses[KARST_NET_INTERFACE_MAX_ADDRESSES];
  uint64_t trafficTypeMask; /* bit t: carries traffic of type t; 0 counts as all */
} KarstNetInterfaceEntry;
ZEL_STATIC_ASSERT(sizeof(KarstNetInterfaceEntry) == 280, "layout of an interface record");
ZEL_STATIC_ASSERT(offsetof(KarstNetInterfaceEntry, ipv4Address) == 4, "interface record");
ZEL_STATIC_ASSERT(offsetof(KarstNetInterfaceEntry, agentGroupPort) == 68, "interface record");
ZEL_STATIC_ASSERT(offsetof(KarstNetInterfaceEntry, masterGroupPort) == 72, "interface record");
ZEL_STATIC_ASSERT(offsetof(KarstNetInterfaceEntry, multicastTTL) == 76, "interface record");
ZEL_STATIC_ASSERT(offsetof(KarstNetInterfaceEntry, bandwidth) == 80, "interface record");
ZEL_STATIC_ASSERT(offsetof(KarstNetInterfaceEntry, macAddress) == 88, "interface record");
ZEL_STATIC_ASSERT(offsetof(KarstNetInterfaceEntry, agentV6Group) == 94, "interface record");
ZEL_STATIC_ASSERT(offsetof(KarstNetInterfaceEntry, masterV6Group) == 110, "interface record");
ZEL_STATIC_ASSERT(offsetof(KarstNetInterfaceEntry, numIpAddresses) == 128, "interface record");
ZEL_STATIC_ASSERT(offsetof(KarstNetInterfaceEntry, ipAddresses) == 132, "interface record");
ZEL_STATIC_ASSERT(offsetof(KarstNetInterfaceEntry, trafficTypeMask) == 272, "interface record");

typedef struct KarstHealthStatusEntry {
  uint32_t healthFlags; /* 0: healthy */
  uint32_t padding;
  uint64_t timestamp;
  uint32_t healthReason;
  uint32_t padding2;
} KarstHealthStatusEntry;
ZEL_STATIC_ASSERT(sizeof(KarstHealthStatusEntry) == 24, "layout of a health record");
ZEL_STATIC_ASSERT(offsetof(KarstHealthStatusEntry, timestamp) == 8, "layout of a health record");
ZEL_STATIC_ASSERT(offsetof(KarstHealthStatusEntry, healthReason) == 16, "health record");

/* ---- Status of the directory ----------------------------------------------------------------- */

#define KARST_STATUS_USABLE 0x1u

/* Called on the directory's own threads with KARST_STATUS_USABLE set when the directory becomes
 * usable and clear when it stops being so; calls of one registration never overlap, and usable and
 * unusable alternate. A directory that is usable already says so to a new registration. */
typedef void (*KarstStatusFn)(void *data, uint32_t status);

/* An interruption lasts from the moment at which a usable directory becomes unusable until it is
 * usable again, every status call has returned, and so has every other call that ran then. Whoever
 * follows the directory only while it is usable misses what happens meanwhile, and learns it so:
 *
 * - A subscription to all entries of a type that starts during an interruption is told first of each
 *   entry that is gone, if not every subscriber had been told so when the interruption began:
 *   ZEL_OK, then ZEL_NOT_FOUND. Lookups do not find it.
 * - At the end of the interruption every subscription is told ZEL_SUB_RESYNC. */

/* ZEL_OK or ZEL_NO_MEMORY. Calls may come before this returns. Blocks: yes. Under a spinlock: no.
 */
zel_Status KARST_RegisterStatusCallback(KarstStatusFn fn, void *data);

/* No call of the pair runs, or will run, after this returned. A pair that was never registered is
 * accepted. Blocks: yes, until a running call has returned. Under a spinlock: no. */
void KARST_DeregisterStatusCallback(KarstStatusFn fn, void *data);

/* Stores this host's node UUID. Blocks: no. Under a spinlock: yes. */
void KARST_GetSelfUUID(zel_UUID *uuid);

/* ---- Subscriptions --------------------------------------------------------------------------- */

/* A subscriber's callback, called on the directory's own threads, never from inside KARST_Subscribe
 * or KARST_Unsubscribe. Calls of one subscription never overlap and come in the order of the
 * changes: first ZEL_OK for each entry that matches already (during an interruption there is more,
 * see above), or ZEL_NOT_FOUND where one entry was asked for and is not there, then every change. So
 * what was looked up before the subscription began is not stale for longer than until then.
 *
 *   ZEL_OK             the entry of `header` was added or changed
 *   ZEL_NOT_FOUND      the entry of `header` was removed, or left the owner that `header` names
 *   ZEL_SUB_OVERFLOW   changes were lost: what the directory holds from now on was not told
 *   ZEL_SUB_RESYNC     likewise, after the directory itself has started over, or an interruption
 *   ZEL_SUB_CANCELLED  the last call of a subscription that was cancelled
 *
 * `header` is meaningful with the first two. `argument` has no meaning. The result is ignored. */
typedef zel_Status (*KarstSubscriptionFn)(void *data, const KarstEntryHeader *header,
                                          void *argument, zel_Status status);

/* Starts a subscription. `query` stays in place and unchanged until the last call. ZEL_OK;
 * ZEL_BAD_PARAM (KARST_QUERY_BY_TYPE not set); ZEL_NO_MEMORY. Blocks: no. Under a spinlock: yes. */
zel_Status KARST_Subscribe(const KarstQuery *query, KarstSubscriptionFn fn, void *data);

/* Cancels it. Calls that are due are dropped, one that runs is not waited for, and the last call,
 * with ZEL_SUB_CANCELLED, comes later. A triple that is not installed is ignored. Blocks: no. Under
 * a spinlock: yes. */
void KARST_Unsubscribe(const KarstQuery *query, KarstSubscriptionFn fn, void *data);

/* ---- Lookups --------------------------------------------------------------------------------- */

/* Walks the entries that match, in ascending order of UUID. `next` 0 gives the first; `next` 1 the
 * one after the entry that `header` still names from the call before, whatever was added or removed
 * meanwhile. `size` is the size of the header, 64. ZEL_OK; ZEL_NOT_FOUND when no further entry
 * matches; ZEL_BAD_PARAM. Blocks: no. Under a spinlock: yes. */
zel_Status KARST_FindEntry(const KarstQuery *query, uint32_t next, KarstEntryHeader *header,
                           uint32_t size);

/* The first entry that matches, whole, in a block from the allocator that the caller frees. `flags`
 * is 0. ZEL_OK; ZEL_NOT_FOUND; ZEL_NO_MEMORY; ZEL_BAD_PARAM; no block unless ZEL_OK. Blocks: no.
 * Under a spinlock: yes. */
zel_Status KARST_FindFullEntryByQuery(const KarstQuery *query, uint32_t flags,
                                      const ExprMshAllocator *allocator, KarstFullEntry **entry);

/* The same for the entry of a header that KARST_FindEntry gave: its present content, even where the
 * entry has changed since. `flags` is 0, `present` is 1. */
zel_Status KARST_FindFullEntryByHeader(const KarstEntryHeader *header, uint32_t flags,
                                       const ExprMshAllocator *allocator, uint32_t present,
                                       KarstFullEntry **entry);

#ifdef __cplusplus
}
#endif

#endif
