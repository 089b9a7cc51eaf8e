/* Any bytes as a directory record, the first of them saying of which kind: decoded as the module does
 * it, with the module's own tables, and as the host does it, with the host's. One thread, no lock.
 */
#include "karst_resolver/records.h"

#include <cstring>
#include <vector>

#include "host/directory/marshaller.h"
#include "host/directory/records.h"
#include "host/kernel/heap.h"
#include "host/kernel/log.h"
#include "karst_resolver/karst_resolver_util.h"
#include "tests/fuzz/target.h"

namespace {

struct Kind {
  const ExprMshField *moduleTable;
  const ExprMshField *hostTable;
  uint32_t size;
};

const Kind kinds[] = {
    {KarstNodeEntryTbl, host::nodeRecordTable, sizeof(KarstNodeEntry)},
    {KarstNetInterfaceEntryTbl, host::netInterfaceRecordTable, sizeof(KarstNetInterfaceEntry)},
    {KarstHealthStatusEntryTbl, host::healthRecordTable, sizeof(KarstHealthStatusEntry)},
};

using Bytes = std::vector<uint8_t>;

void prepareOnce() {
  if (karstResolverHeapID != ZEL_NO_HEAP) return;
  host::setLogThreshold(host::LogThreshold::Off);
  zel_HeapProps props{};
  props.maximumSize = 1u << 20;
  FUZZ_REQUIRE(host::heapCreate(props, &karstResolverHeapID) == ZEL_OK);
}

/* As the module fetches and decodes: the entry stands in a block of just its length. */
zel_Status decodeInModule(const Kind &kind, const Bytes &data, Bytes *record) {
  auto *entry = static_cast<KarstFullEntry *>(
      KARSTResolverAlloc(static_cast<uint32_t>(sizeof(KarstFullEntry) + data.size())));
  FUZZ_REQUIRE(entry != nullptr);
  entry->header.dataLength = static_cast<uint32_t>(data.size());
  if (!data.empty()) std::memcpy(entry + 1, data.data(), data.size());
  record->assign(kind.size, 0xee);
  const zel_Status status =
      KARSTResolverDecodeEntry(entry, kind.moduleTable, "fuzzed", record->data(), kind.size);
  FUZZ_REQUIRE(host::heapState(karstResolverHeapID).blocks.empty());
  return status;
}

zel_Status decodeInHost(const Kind &kind, const Bytes &data, Bytes *record) {
  record->assign(kind.size, 0);
  return host::unmarshal(kind.hostTable, data.data(), static_cast<uint32_t>(data.size()),
                         record->data());
}

/* What was decoded can be encoded, and comes back the same from then on. (Not from the first
 * encoding on: some of what a record may hold does not travel.) */
void requireStable(const Kind &kind, const Bytes &record) {
  Bytes encoded, again, decoded;
  FUZZ_REQUIRE(host::marshal(kind.hostTable, record.data(), &encoded) == ZEL_OK);
  FUZZ_REQUIRE(decodeInHost(kind, encoded, &decoded) == ZEL_OK);
  FUZZ_REQUIRE(host::marshal(kind.hostTable, decoded.data(), &again) == ZEL_OK);
  FUZZ_REQUIRE(encoded == again);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  constexpr size_t longest = 4096;
  if (size == 0 || size > longest) return 0;
  prepareOnce();
  const Kind &kind = kinds[data[0] % std::size(kinds)];
  const Bytes bytes(data + 1, data + size);
  Bytes inModule, inHost;
  const zel_Status status = decodeInModule(kind, bytes, &inModule);
  FUZZ_REQUIRE(decodeInHost(kind, bytes, &inHost) == status);
  FUZZ_REQUIRE(inModule == inHost);
  if (status == ZEL_OK) requireStable(kind, inHost);
  return 0;
}
