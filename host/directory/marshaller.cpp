/* The table-driven marshaller: a record's map, its names and its plain fields. No lock. */
#include "host/directory/marshaller.h"

#include <cstring>
#include <limits>
#include <optional>
#include <string_view>

#include "host/directory/cbor.h"
#include "host/kernel/log.h"

namespace host {
namespace {

constexpr size_t kUsualSize = 256; /* of an encoded record, in bytes; most are smaller */

constexpr size_t addressSize = 16;
constexpr size_t macSize = 6;
constexpr size_t maxRows = 64; /* one bit each says which names were seen */

bool isUsable(const ExprMshField &row) {
  switch (row.type) {
    case EXPR_MSH_U64:
    case EXPR_MSH_U32:
    case EXPR_MSH_ADDRESS:
    case EXPR_MSH_MAC:
      return true;
    case EXPR_MSH_NESTED:
      return row.encode != nullptr && row.decode != nullptr;
    default:
      return false;
  }
}

/* The rows of a table; none for one that has no end in reach, or a row that cannot be used. */
std::optional<size_t> usableRows(const ExprMshField *table) {
  for (size_t rows = 0; rows <= maxRows; ++rows) {
    if (table[rows].name == nullptr) return rows;
    if (!isUsable(table[rows])) break;
  }
  return std::nullopt;
}

template <typename Number>
zel_Status decodeNumber(ExprMshReader &reader, uint8_t *field) {
  uint64_t value = 0;
  const zel_Status status = readUnsigned(reader, std::numeric_limits<Number>::max(), &value);
  if (status != ZEL_OK) return status;
  const Number number = static_cast<Number>(value);
  std::memcpy(field, &number, sizeof number);
  return ZEL_OK;
}

template <size_t Size>
zel_Status decodeBytes(ExprMshReader &reader, uint8_t *field) {
  uint8_t bytes[Size];
  size_t length = 0;
  const zel_Status status = readBytes(reader, Size, bytes, &length);
  if (status != ZEL_OK) return status;
  if (length != Size) return EXPR_MSH_OUT_OF_RANGE;
  std::memcpy(field, bytes, Size);
  return ZEL_OK;
}

zel_Status decodeField(ExprMshReader &reader, const ExprMshField &row, void *record) {
  uint8_t *field = static_cast<uint8_t *>(record) + row.offset;
  switch (row.type) {
    case EXPR_MSH_U64:
      return decodeNumber<uint64_t>(reader, field);
    case EXPR_MSH_U32:
      return decodeNumber<uint32_t>(reader, field);
    case EXPR_MSH_ADDRESS:
      return decodeBytes<addressSize>(reader, field);
    case EXPR_MSH_MAC:
      return decodeBytes<macSize>(reader, field);
    default:
      return row.decode(&reader, field);
  }
}

template <typename Number>
void encodeNumber(ExprMshWriter &writer, const uint8_t *field) {
  Number number;
  std::memcpy(&number, field, sizeof number);
  writeUnsigned(writer, number);
}

zel_Status encodeField(ExprMshWriter &writer, const ExprMshField &row, const void *record) {
  const uint8_t *field = static_cast<const uint8_t *>(record) + row.offset;
  switch (row.type) {
    case EXPR_MSH_U64:
      encodeNumber<uint64_t>(writer, field);
      return ZEL_OK;
    case EXPR_MSH_U32:
      encodeNumber<uint32_t>(writer, field);
      return ZEL_OK;
    case EXPR_MSH_ADDRESS:
      writeBytes(writer, field, addressSize);
      return ZEL_OK;
    case EXPR_MSH_MAC:
      writeBytes(writer, field, macSize);
      return ZEL_OK;
    default:
      return row.encode(&writer, field);
  }
}

/* The row of the next pair's name, or null. Most writers keep to the order of the table: `expected`,
 * the row behind the last one found, is looked at first. */
zel_Status readRow(ExprMshReader &reader, const ExprMshField *table, const ExprMshField *expected,
                   const ExprMshField **row) {
  *row = expected;
  if (expected->name != nullptr && skipName(reader, expected->name)) return ZEL_OK;
  std::string_view name;
  const zel_Status status = readName(reader, &name);
  if (status != ZEL_OK) return status;
  for (*row = table; (*row)->name != nullptr; ++*row) {
    if (name == (*row)->name) return ZEL_OK;
  }
  *row = nullptr;
  return ZEL_OK;
}

zel_Status decodePair(ExprMshReader &reader, const ExprMshField *table, void *record,
                      const ExprMshField **next, uint64_t *seen) {
  const ExprMshField *row;
  const zel_Status status = readRow(reader, table, *next, &row);
  if (status != ZEL_OK) return status;
  if (row == nullptr) return skipValue(reader);
  *next = row + 1;
  const uint64_t bit = uint64_t{1} << (row - table);
  if ((*seen & bit) != 0) return EXPR_MSH_MALFORMED;
  *seen |= bit;
  return decodeField(reader, *row, record);
}

zel_Status decodeRecord(ExprMshReader &reader, const ExprMshField *table, void *record) {
  if (!usableRows(table)) return ZEL_BAD_PARAM;
  CborContainer map;
  zel_Status status = openMap(reader, &map);
  if (status == EXPR_MSH_BAD_TYPE) return EXPR_MSH_MALFORMED;
  const ExprMshField *next = table;
  uint64_t seen = 0;
  bool more = true;
  while (status == ZEL_OK) {
    status = nextElement(reader, &map, &more);
    if (status != ZEL_OK || !more) break;
    status = decodePair(reader, table, record, &next, &seen);
  }
  if (status == ZEL_OK && reader.position != reader.length) return EXPR_MSH_TRAILING;
  return status;
}

}  // namespace

zel_Status marshal(const ExprMshField *table, const void *record, std::vector<uint8_t> *out) {
  const std::optional<size_t> rows = usableRows(table);
  if (!rows) return ZEL_BAD_PARAM;
  const size_t before = out->size();
  out->reserve(before + kUsualSize);
  ExprMshWriter writer{out};
  writeMapStart(writer, *rows);
  for (const ExprMshField *row = table; row->name != nullptr; ++row) {
    writeName(writer, row->name);
    const zel_Status status = encodeField(writer, *row, record);
    if (status != ZEL_OK) {
      out->resize(before);
      return status;
    }
  }
  return ZEL_OK;
}

zel_Status unmarshal(const ExprMshField *table, const void *data, uint32_t length, void *record) {
  ExprMshReader reader{static_cast<const uint8_t *>(data), length, 0, 0};
  return decodeRecord(reader, table, record);
}

}  // namespace host

zel_Status ExprMsh_UmshSingleStructure(const ExprMshAllocator *, const ExprMshField *table,
                                       const void *data, uint32_t length, const char *name,
                                       void *record) {
  ExprMshReader reader{static_cast<const uint8_t *>(data), length, 0, 0};
  const zel_Status status = host::decodeRecord(reader, table, record);
  if (status != ZEL_OK) {
    host::logWarning("A %s record of %u bytes is refused at byte %zu: status 0x%x", name, length,
                     reader.position, status);
  }
  return status;
}
