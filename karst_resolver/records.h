/* What the module asks of the directory: the field tables of the three records, queries, and
 * fetching with decoding. No lock of its own: lookups and decoding are made under
 * the cache lock, a query is filled while nobody else knows it. */
#ifndef KARST_RESOLVER_RECORDS_H
#define KARST_RESOLVER_RECORDS_H

#include "platform/karst_directory.h"

extern "C" {

extern const ExprMshField KarstNodeEntryTbl[];
extern const ExprMshField KarstNetInterfaceEntryTbl[];
extern const ExprMshField KarstHealthStatusEntryTbl[];

/* Sets up a query in a zeroed record; `uuid` null or zero asks for every entry of the type. */
void KARSTResolverFillQuery(KarstQuery *query, uint8_t type, uint8_t flags, const zel_UUID *uuid);

/* Gives back an entry that a lookup returned. */
void KARSTResolverFreeEntry(KarstFullEntry *entry);

/* Zeroes `record`, of `size` bytes, decodes the entry's data into it and gives the entry back,
 * whatever came of it. The marshaller's status; where that is not ZEL_OK, the record holds what was
 * read before the fault. */
zel_Status KARSTResolverDecodeEntry(KarstFullEntry *entry, const ExprMshField *table,
                                    const char *name, void *record, uint32_t size);

} /* extern "C" */

#endif
