/* Any bytes as a cluster file: refused with one line that begins with the file's name, or read into
 * entries in order, each once. One thread, no lock.
 */
#include "host/sources/cluster_file.h"

#include <algorithm>
#include <set>

#include "host/sources/published_entries.h"
#include "tests/fuzz/target.h"

namespace {

void requireGoodRefusal(const std::string &message) {
  FUZZ_REQUIRE(message.starts_with("file.json:"));
  FUZZ_REQUIRE(message.find('\n') == std::string::npos);
  FUZZ_REQUIRE(message.size() < 1000);
}

void requireGoodContent(const host::ClusterContent &content) {
  const auto &entries = content.entries;
  FUZZ_REQUIRE(std::is_sorted(entries.begin(), entries.end(), host::comesBefore));
  std::set<zel_UUID> known;
  for (size_t i = 0; i < entries.size(); i++) {
    FUZZ_REQUIRE(i == 0 || host::comesBefore(entries[i - 1], entries[i]));
    FUZZ_REQUIRE(!host::isZero(entries[i].uuid) && !host::isZero(entries[i].owner));
    known.insert(entries[i].uuid);
  }
  for (const auto &[uuid, name] : content.names) FUZZ_REQUIRE(known.contains(uuid));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  try {
    const std::string text(reinterpret_cast<const char *>(data), size);
    requireGoodContent(host::parseClusterText(text, "file.json"));
  } catch (const host::ClusterFileError &error) {
    requireGoodRefusal(error.what());
  }
  return 0;
}
