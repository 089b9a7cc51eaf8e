/* Table-driven encoding and decoding of records as CBOR maps; behind the ExprMsh_ functions. */
#pragma once

#include <cstdint>
#include <vector>

#include "platform/expr_msh.h"

namespace host {

/* Appends the record, as the table says, to `out`. */
zel_Status marshal(const ExprMshField *table, const void *record, std::vector<uint8_t> *out);

/* Decodes without allocating; `record` is zero-filled by the caller. */
zel_Status unmarshal(const ExprMshField *table, const void *data, uint32_t length, void *record);

}  // namespace host
