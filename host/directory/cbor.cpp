/* CBOR items over libcbor: what its stateless decoder reports through callbacks becomes one item at
 * a time here. No lock, no allocation while reading.
 */
#include "host/directory/cbor.h"

#include <cbor.h>

#include <cstring>

namespace host {
namespace {

enum class CborKind {
  Unsigned,
  Bytes,
  Text,
  ChunkedBytes,
  ChunkedText,
  Array,
  Map,
  Tag,
  Break,
  Other
};

struct CborItem {
  CborKind kind = CborKind::Other; /* what no field asks for: negative, float, simple */
  uint64_t number = 0;             /* value, length or count */
  const uint8_t *bytes = nullptr;  /* of a string in one piece */
  bool indefinite = false;         /* of a map or an array */
};

void setItem(void *context, CborKind kind, uint64_t number = 0) {
  CborItem &item = *static_cast<CborItem *>(context);
  item.kind = kind;
  item.number = number;
  item.indefinite = false;
}

void setString(void *context, CborKind kind, cbor_data bytes, size_t length) {
  setItem(context, kind, length);
  static_cast<CborItem *>(context)->bytes = bytes;
}

void setIndefinite(void *context, CborKind kind) {
  setItem(context, kind);
  static_cast<CborItem *>(context)->indefinite = true;
}

template <typename Number>
void setUnsigned(void *context, Number value) {
  setItem(context, CborKind::Unsigned, value);
}

const cbor_callbacks itemCallbacks = [] {
  cbor_callbacks callbacks = cbor_empty_callbacks;
  callbacks.uint8 = setUnsigned<uint8_t>;
  callbacks.uint16 = setUnsigned<uint16_t>;
  callbacks.uint32 = setUnsigned<uint32_t>;
  callbacks.uint64 = setUnsigned<uint64_t>;
  callbacks.byte_string = [](void *context, cbor_data bytes, size_t length) {
    setString(context, CborKind::Bytes, bytes, length);
  };
  callbacks.string = [](void *context, cbor_data bytes, size_t length) {
    setString(context, CborKind::Text, bytes, length);
  };
  callbacks.byte_string_start = [](void *context) { setItem(context, CborKind::ChunkedBytes); };
  callbacks.string_start = [](void *context) { setItem(context, CborKind::ChunkedText); };
  callbacks.array_start = [](void *context, size_t count) {
    setItem(context, CborKind::Array, count);
  };
  callbacks.indef_array_start = [](void *context) { setIndefinite(context, CborKind::Array); };
  callbacks.map_start = [](void *context, size_t count) { setItem(context, CborKind::Map, count); };
  callbacks.indef_map_start = [](void *context) { setIndefinite(context, CborKind::Map); };
  callbacks.tag = [](void *context, uint64_t) { setItem(context, CborKind::Tag); };
  callbacks.indef_break = [](void *context) { setItem(context, CborKind::Break); };
  return callbacks;
}();

/* Tags and simple values that nobody has assigned are well-formed, yet libcbor refuses them. Reads the
 * refused item if it is such a one. */
zel_Status readUnassigned(ExprMshReader &reader, CborItem *item) {
  constexpr uint8_t firstTag = 0xc6, lastTag = 0xd4, firstSimple = 0xe0, lastSimple = 0xf3;
  constexpr uint8_t simpleInNextByte = 0xf8, leastInNextByte = 32;
  const uint8_t *at = reader.data + reader.position;
  if (*at >= firstTag && *at <= lastTag) {
    item->kind = CborKind::Tag;
    reader.position += 1;
    return ZEL_OK;
  }
  if (*at >= firstSimple && *at <= lastSimple) {
    reader.position += 1;
    return ZEL_OK;
  }
  if (*at != simpleInNextByte) return EXPR_MSH_MALFORMED;
  if (reader.length - reader.position < 2) return EXPR_MSH_TRUNCATED;
  if (at[1] < leastInNextByte) return EXPR_MSH_MALFORMED;
  reader.position += 2;
  return ZEL_OK;
}

/* In line: some twenty times for each record. */
[[gnu::always_inline]] inline zel_Status readItem(ExprMshReader &reader, CborItem *item) {
  item->kind = CborKind::Other; /* it may have been read into before */
  if (reader.position >= reader.length) return EXPR_MSH_TRUNCATED;
  const cbor_decoder_result result = cbor_stream_decode(
      reader.data + reader.position, reader.length - reader.position, &itemCallbacks, item);
  if (result.status == CBOR_DECODER_NEDATA) return EXPR_MSH_TRUNCATED;
  if (result.status != CBOR_DECODER_FINISHED) return readUnassigned(reader, item);
  reader.position += result.read;
  return ZEL_OK;
}

zel_Status readValueOf(ExprMshReader &reader, CborKind kind, CborItem *item) {
  const zel_Status status = readItem(reader, item);
  if (status != ZEL_OK || item->kind == kind) return status;
  return item->kind == CborKind::Break ? EXPR_MSH_MALFORMED : EXPR_MSH_BAD_TYPE;
}

zel_Status enter(ExprMshReader &reader, const CborItem &item, CborContainer *container) {
  if (reader.depth == maxCborDepth) return EXPR_MSH_MALFORMED;
  ++reader.depth;
  *container = {item.indefinite, item.number};
  return ZEL_OK;
}

zel_Status open(ExprMshReader &reader, CborKind kind, CborContainer *container) {
  CborItem item;
  const zel_Status status = readValueOf(reader, kind, &item);
  return status == ZEL_OK ? enter(reader, item, container) : status;
}

/* The next chunk of a string in chunks of `kind`; the break behind the last one leaves it null. */
zel_Status readChunk(ExprMshReader &reader, CborKind kind, CborItem *chunk) {
  const zel_Status status = readItem(reader, chunk);
  if (status != ZEL_OK) return status;
  return chunk->kind == kind || chunk->kind == CborKind::Break ? ZEL_OK : EXPR_MSH_MALFORMED;
}

zel_Status readChunks(ExprMshReader &reader, size_t capacity, uint8_t *bytes, size_t *length) {
  CborItem chunk;
  for (size_t used = 0;; used += chunk.number) {
    const zel_Status status = readChunk(reader, CborKind::Bytes, &chunk);
    if (status != ZEL_OK) return status;
    if (chunk.kind == CborKind::Break) {
      *length = used;
      return ZEL_OK;
    }
    if (chunk.number > capacity - used) return EXPR_MSH_OUT_OF_RANGE;
    if (chunk.number != 0) std::memcpy(bytes + used, chunk.bytes, chunk.number);
  }
}

zel_Status skipChunks(ExprMshReader &reader, CborKind kind) {
  CborItem chunk;
  zel_Status status;
  do {
    status = readChunk(reader, kind, &chunk);
  } while (status == ZEL_OK && chunk.kind != CborKind::Break);
  return status;
}

/* Recursion ends at maxCborDepth. */
zel_Status skipElements(ExprMshReader &reader, const CborItem &item) {
  CborContainer container;
  zel_Status status = enter(reader, item, &container);
  bool more = true;
  while (status == ZEL_OK) {
    status = nextElement(reader, &container, &more);
    if (status != ZEL_OK || !more) break;
    status = skipValue(reader);
    if (status == ZEL_OK && item.kind == CborKind::Map) status = skipValue(reader);
  }
  return status;
}

using HeadEncoder = size_t (*)(size_t number, unsigned char *buffer, size_t size);

void append(ExprMshWriter &writer, HeadEncoder encodeHead, uint64_t number,
            const void *content = nullptr, size_t length = 0) {
  uint8_t head[9]; /* the longest head: one byte and a 64-bit number */
  const size_t headLength = encodeHead(number, head, sizeof head);
  writer.out->insert(writer.out->end(), head, head + headLength);
  const uint8_t *bytes = static_cast<const uint8_t *>(content);
  if (length != 0) writer.out->insert(writer.out->end(), bytes, bytes + length);
}

}  // namespace

zel_Status openMap(ExprMshReader &reader, CborContainer *map) {
  return open(reader, CborKind::Map, map);
}

zel_Status openArray(ExprMshReader &reader, CborContainer *array) {
  return open(reader, CborKind::Array, array);
}

zel_Status readName(ExprMshReader &reader, std::string_view *name) {
  CborItem item;
  const zel_Status status = readItem(reader, &item);
  if (status != ZEL_OK) return status;
  if (item.kind != CborKind::Text) return EXPR_MSH_MALFORMED;
  *name = {reinterpret_cast<const char *>(item.bytes), item.number};
  return ZEL_OK;
}

zel_Status readUnsigned(ExprMshReader &reader, uint64_t maximum, uint64_t *value) {
  CborItem item;
  const zel_Status status = readValueOf(reader, CborKind::Unsigned, &item);
  if (status != ZEL_OK) return status;
  if (item.number > maximum) return EXPR_MSH_OUT_OF_RANGE;
  *value = item.number;
  return ZEL_OK;
}

zel_Status readBytes(ExprMshReader &reader, size_t capacity, uint8_t *bytes, size_t *length) {
  CborItem item;
  const zel_Status status = readValueOf(reader, CborKind::Bytes, &item);
  if (status == EXPR_MSH_BAD_TYPE && item.kind == CborKind::ChunkedBytes) {
    return readChunks(reader, capacity, bytes, length);
  }
  if (status != ZEL_OK) return status;
  if (item.number > capacity) return EXPR_MSH_OUT_OF_RANGE;
  if (item.number != 0) std::memcpy(bytes, item.bytes, item.number);
  *length = item.number;
  return ZEL_OK;
}

zel_Status skipValue(ExprMshReader &reader) {
  CborItem item;
  zel_Status status;
  do {
    status = readItem(reader, &item);
  } while (status == ZEL_OK && item.kind == CborKind::Tag);
  if (status != ZEL_OK) return status;
  switch (item.kind) {
    case CborKind::Break:
      return EXPR_MSH_MALFORMED;
    case CborKind::ChunkedBytes:
      return skipChunks(reader, CborKind::Bytes);
    case CborKind::ChunkedText:
      return skipChunks(reader, CborKind::Text);
    case CborKind::Array:
    case CborKind::Map:
      return skipElements(reader, item);
    default:
      return ZEL_OK;
  }
}

void writeMapStart(ExprMshWriter &writer, uint64_t pairs) {
  append(writer, cbor_encode_map_start, pairs);
}

void writeArrayStart(ExprMshWriter &writer, uint64_t elements) {
  append(writer, cbor_encode_array_start, elements);
}

void writeName(ExprMshWriter &writer, std::string_view name) {
  append(writer, cbor_encode_string_start, name.size(), name.data(), name.size());
}

void writeUnsigned(ExprMshWriter &writer, uint64_t value) {
  append(writer, cbor_encode_uint, value);
}

void writeBytes(ExprMshWriter &writer, const uint8_t *bytes, size_t length) {
  append(writer, cbor_encode_bytestring_start, length, bytes, length);
}

}  // namespace host
