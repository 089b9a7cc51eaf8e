/* Table-driven encoding and decoding of records as CBOR maps; behind the ExprMsh_ functions. No
 * lock; both may be called by any thread.
 */
#pragma once

#include <cstdint>
#include <vector>

#include "platform/expr_msh.h"

namespace host {

/* Appends the record, as the table says, to `out`: a map of as many pairs as the table has rows, in
 * their order. ZEL_OK; ZEL_BAD_PARAM for a table that is no table (an unknown type, a nested row
 * without its pair, more than 64 rows); what a nested row's function returned. `out` is as it was
 * unless ZEL_OK. Allocates. */
zel_Status marshal(const ExprMshField *table, const void *record, std::vector<uint8_t> *out);

/* Decodes without allocating; `record` is zero-filled by the caller. Maps, arrays and byte strings
 * may be of definite or indefinite length. A name that stands twice in a map, where it names a
 * field, makes the record EXPR_MSH_MALFORMED, and so does a name that is not text in one piece;
 * values of names that no row has are passed over as long as they are well-formed CBOR, nested not
 * deeper than 16. ZEL_OK; ZEL_BAD_PARAM as above; EXPR_MSH_... Blocks: no. Under a spinlock: yes. */
zel_Status unmarshal(const ExprMshField *table, const void *data, uint32_t length, void *record);

}  // namespace host
