/* Intrusive circular doubly linked lists. No lock of their own: each list names the lock that
 * guards it. A head points to itself when empty; a link on no list is all zero. */
#ifndef KARST_RESOLVER_LIST_H
#define KARST_RESOLVER_LIST_H

#include <stddef.h>
#include <stdint.h>

#include "karst_resolver/karst_resolver_util.h"

struct KARSTResolverLink {
  KARSTResolverLink *previous;
  KARSTResolverLink *next;
};

/* The structure that embeds a link (or another member) at `pointer`. */
#define KARST_RESOLVER_CONTAINER(pointer, Type, member) \
  ((Type *)((uint8_t *)(pointer)-offsetof(Type, member)))

static inline void KARSTResolverListInit(KARSTResolverLink *head) {
  head->previous = head;
  head->next = head;
}

static inline bool KARSTResolverListIsEmpty(const KARSTResolverLink *head) {
  return head->next == head;
}

static inline bool KARSTResolverLinkIsOnList(const KARSTResolverLink *link) {
  return link->previous != nullptr || link->next != nullptr;
}

/* Right behind `place`: the front of the list where that is the head. */
static inline void KARSTResolverListInsertAfter(KARSTResolverLink *place, KARSTResolverLink *link) {
  KARST_RESOLVER_CHECK(!KARSTResolverLinkIsOnList(link));
  link->previous = place;
  link->next = place->next;
  place->next->previous = link;
  place->next = link;
}

static inline void KARSTResolverListPushFront(KARSTResolverLink *head, KARSTResolverLink *link) {
  KARSTResolverListInsertAfter(head, link);
}

static inline void KARSTResolverListAppend(KARSTResolverLink *head, KARSTResolverLink *link) {
  KARSTResolverListInsertAfter(head->previous, link);
}

/* Takes the link off whichever list it is on, and zeroes it. */
static inline void KARSTResolverListUnlink(KARSTResolverLink *link) {
  KARST_RESOLVER_CHECK(KARSTResolverLinkIsOnList(link));
  link->previous->next = link->next;
  link->next->previous = link->previous;
  link->previous = nullptr;
  link->next = nullptr;
}

/* Takes the first link off; the list is not empty. */
static inline KARSTResolverLink *KARSTResolverListPopFront(KARSTResolverLink *head) {
  KARSTResolverLink *link = head->next;
  KARST_RESOLVER_CHECK(link != head);
  KARSTResolverListUnlink(link);
  return link;
}

/* Moves every link, in order, onto `to`, which need not be initialised; `from` is empty afterwards.
 */
static inline void KARSTResolverListMoveAll(KARSTResolverLink *from, KARSTResolverLink *to) {
  KARSTResolverListInit(to);
  if (KARSTResolverListIsEmpty(from)) return;
  to->next = from->next;
  to->previous = from->previous;
  to->next->previous = to;
  to->previous->next = to;
  KARSTResolverListInit(from);
}

#endif
