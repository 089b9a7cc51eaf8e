/* Items of CBOR (RFC 8949) read and written one at a time, over libcbor's stateless streaming
 * decoder and encoders. Reading allocates nothing and may be done under a spinlock. No lock here.
 */
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string_view>
#include <vector>

#include "platform/expr_msh.h"

/* A record that is being read: `position` bytes of `data` are behind. */
struct ExprMshReader {
  const uint8_t *data;
  size_t length;
  size_t position;
  unsigned depth; /* maps and arrays that are open */
};

/* A record that is being written. */
struct ExprMshWriter {
  std::vector<uint8_t> *out;
};

namespace host {

/* Deepest nesting that is read, the record's own map included; deeper is EXPR_MSH_MALFORMED, so
 * that a hostile record cannot exhaust the stack. */
inline constexpr unsigned maxCborDepth = 16;

/* A map or an array that is being read. */
struct CborContainer {
  bool indefinite;
  uint64_t left; /* elements (of a map: pairs) still to come; not for an indefinite one */
};

/* Every reading function returns ZEL_OK, or EXPR_MSH_TRUNCATED when the data ends first, or
 * EXPR_MSH_MALFORMED, or EXPR_MSH_BAD_TYPE when the next item is of another type; some also
 * EXPR_MSH_OUT_OF_RANGE. After anything but ZEL_OK the reader is of no further use. */

zel_Status openMap(ExprMshReader &reader, CborContainer *map);
zel_Status openArray(ExprMshReader &reader, CborContainer *array);

/* Says whether another element, of a map another pair, follows; closes the container when none
 * does. */
inline zel_Status nextElement(ExprMshReader &reader, CborContainer *container, bool *more) {
  constexpr uint8_t breakByte = 0xff;
  if (container->indefinite) {
    if (reader.position >= reader.length) return EXPR_MSH_TRUNCATED;
    *more = reader.data[reader.position] != breakByte;
    if (!*more) ++reader.position;
  } else {
    *more = container->left != 0;
    if (*more) --container->left;
  }
  if (!*more) --reader.depth;
  return ZEL_OK;
}

/* Passes over the name in front of a map's value if it is this one; else the reader stays where it
 * is, for readName. Compared as it would be written, which costs far less than reading a name; a
 * long one, or one that is written at greater length than it needs, is left to readName. */
inline bool skipName(ExprMshReader &reader, std::string_view name) {
  constexpr uint8_t textHead = 0x60; /* and the length, if that is below 24: RFC 8949, 3.1 */
  constexpr size_t longest = 23;
  const uint8_t *at = reader.data + reader.position;
  if (name.size() > longest || reader.length - reader.position <= name.size()) return false;
  if (at[0] != textHead + name.size() || std::memcmp(at + 1, name.data(), name.size()) != 0) {
    return false;
  }
  reader.position += 1 + name.size();
  return true;
}

/* The name in front of a map's value, where it stands in the data. Only text in one piece is a
 * name: anything else, text in chunks too, is EXPR_MSH_MALFORMED. */
zel_Status readName(ExprMshReader &reader, std::string_view *name);

/* EXPR_MSH_OUT_OF_RANGE above `maximum`. */
zel_Status readUnsigned(ExprMshReader &reader, uint64_t maximum, uint64_t *value);

/* A byte string, in one piece or in chunks, of at most `capacity` bytes: EXPR_MSH_OUT_OF_RANGE when
 * it is longer. */
zel_Status readBytes(ExprMshReader &reader, size_t capacity, uint8_t *bytes, size_t *length);

/* Passes over one well-formed value of any type. */
zel_Status skipValue(ExprMshReader &reader);

void writeMapStart(ExprMshWriter &writer, uint64_t pairs);
void writeArrayStart(ExprMshWriter &writer, uint64_t elements);
void writeName(ExprMshWriter &writer, std::string_view name);
void writeUnsigned(ExprMshWriter &writer, uint64_t value);
void writeBytes(ExprMshWriter &writer, const uint8_t *bytes, size_t length);

}  // namespace host
