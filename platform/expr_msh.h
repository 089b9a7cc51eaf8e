/* The marshaller: turns directory records into bytes and back, as a field table says.
 *
 * On the wire a record is one CBOR map (RFC 8949) from field name (text string) to value:
 *
 *   type code                      value
 *   EXPR_MSH_U64, EXPR_MSH_U32     unsigned integer
 *   EXPR_MSH_ADDRESS               byte string of 16
 *   EXPR_MSH_MAC                   byte string of 6
 *   EXPR_MSH_NESTED                what the row's own pair of functions writes and reads
 *
 * A reader skips names that it does not know, and leaves the field of a missing name alone.
 */
#ifndef PLATFORM_EXPR_MSH_H
#define PLATFORM_EXPR_MSH_H

#include "platform/zel.h"

#ifdef __cplusplus
extern "C" {
#endif

/* How the directory and the marshaller allocate what they hand to a module. */
typedef struct ExprMshAllocator {
  void *(*alloc)(void *context, uint64_t size);       /* block or null */
  void *(*zeroedAlloc)(void *context, uint64_t size); /* zero-filled block or null */
  void (*free)(void *context, void *block);           /* null is accepted */
  void *context;                                      /* first argument of the three */
} ExprMshAllocator;
ZEL_STATIC_ASSERT(sizeof(ExprMshAllocator) == 32, "layout of the allocator record");

#define EXPR_MSH_U64 0u      /* unsigned 64-bit integer */
#define EXPR_MSH_U32 1u      /* unsigned 32-bit integer */
#define EXPR_MSH_ADDRESS 10u /* 16-byte address */
#define EXPR_MSH_MAC 12u     /* 6-byte MAC address */
#define EXPR_MSH_NESTED 28u  /* a field, or a run of fields, coded by the row's own pair */

/* Why a record was refused, besides ZEL_NO_MEMORY. */
#define EXPR_MSH_TRUNCATED 0x0bad0201u    /* the data ends inside the record */
#define EXPR_MSH_TRAILING 0x0bad0202u     /* bytes follow the record */
#define EXPR_MSH_BAD_TYPE 0x0bad0203u     /* a value is not of the field's type */
#define EXPR_MSH_OUT_OF_RANGE 0x0bad0204u /* a number, length or count does not fit the field */
/* Not well-formed CBOR, no map, nested too deep, a field that stands twice, or a name that is not
 * text in one piece. */
#define EXPR_MSH_MALFORMED 0x0bad0205u

/* Writers and readers of records in progress; the marshaller's own. */
typedef struct ExprMshWriter ExprMshWriter;
typedef struct ExprMshReader ExprMshReader;

/* The pair of a nested row: encodes from, and decodes to, the field's place in the record. A status
 * other than ZEL_OK ends the whole record with that status. */
typedef zel_Status (*ExprMshEncodeFn)(ExprMshWriter *writer, const void *field);
typedef zel_Status (*ExprMshDecodeFn)(ExprMshReader *reader, void *field);

/* One row of a field table; a table ends with an all-zero row. */
typedef struct ExprMshField {
  uint64_t type;   /* EXPR_MSH_... */
  uint64_t offset; /* of the field in the decoded record, bytes */
  uint64_t reserved;
  const char *name;
  ExprMshEncodeFn encode; /* EXPR_MSH_NESTED only */
  ExprMshDecodeFn decode; /* EXPR_MSH_NESTED only */
  uint64_t reserved2[2];
} ExprMshField;
ZEL_STATIC_ASSERT(sizeof(ExprMshField) == 64, "layout of a field table's row");
ZEL_STATIC_ASSERT(offsetof(ExprMshField, name) == 24, "layout of a field table's row");
ZEL_STATIC_ASSERT(offsetof(ExprMshField, encode) == 32, "layout of a field table's row");
ZEL_STATIC_ASSERT(offsetof(ExprMshField, decode) == 40, "layout of a field table's row");

/* Decodes `length` bytes into `record`, which the caller has zero-filled. `allocator` serves field
 * kinds that need memory of their own; no kind above does. `name` names the record in reports.
 * ZEL_OK or why it was refused; then the record holds what was read before that point. Blocks: no.
 * Under a spinlock: yes. */
zel_Status ExprMsh_UmshSingleStructure(const ExprMshAllocator *allocator, const ExprMshField *table,
                                       const void *data, uint32_t length, const char *name,
                                       void *record);

/* The network part of an interface record, 68 bytes from the field networkType on (see
 * KarstNetInterfaceEntry). On the wire a map: "type" (unsigned), for type 1 "ipv4" (byte string of
 * 4, absent when zero). Blocks: no. Under a spinlock: yes. */
zel_Status ExprMsh_MshNetInterfaceEntry(ExprMshWriter *writer, const void *field);
zel_Status ExprMsh_UmshNetInterfaceEntry(ExprMshReader *reader, void *field);

/* The addresses of an interface record: numIpAddresses and the array behind it. On the wire an
 * array of at most 7 byte strings, each 4 (IPv4) or 16 (IPv6) long. Blocks: no. Under a spinlock:
 * yes. */
zel_Status ExprMsh_MshNetInterfaceEntryIpAddresses(ExprMshWriter *writer, const void *field);
zel_Status ExprMsh_UmshNetInterfaceEntryIpAddresses(ExprMshReader *reader, void *field);

#ifdef __cplusplus
}
#endif

#endif
