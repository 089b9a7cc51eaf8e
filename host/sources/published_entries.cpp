/* The difference between two sets of entries, and its order. Not locked. */
#include "host/sources/published_entries.h"

#include <algorithm>
#include <iterator>
#include <tuple>
#include <utility>

namespace host {
namespace {

/* How far a kind of entry builds on others: objects on nodes, nodes on what makes them reachable,
 * interfaces on their health. Entries come from the ground up, so that whoever learns of a node
 * finds its interfaces and their health there; they go from the top down. */
int floorOf(const Entry &entry) {
  switch (entry.type) {
    case KARST_TYPE_HEALTH_STATUS:
      return 0;
    case KARST_TYPE_NET_INTERFACE:
      return 1;
    case KARST_TYPE_NODE:
      return 2;
    default:
      return 3;
  }
}

}  // namespace

bool comesBefore(const Entry &a, const Entry &b) {
  return std::tie(a.type, a.uuid) < std::tie(b.type, b.uuid);
}

Difference difference(const std::vector<Entry> &before, const std::vector<Entry> &now) {
  Difference result;
  std::set_difference(before.begin(), before.end(), now.begin(), now.end(),
                      std::back_inserter(result.removed), comesBefore);
  auto old = before.begin();
  for (const Entry &entry : now) {
    old = std::lower_bound(old, before.end(), entry, comesBefore);
    if (old == before.end() || *old != entry) result.changed.push_back(entry);
  }
  const auto fromTheTop = [](const Entry &a, const Entry &b) { return floorOf(a) > floorOf(b); };
  const auto fromTheGround = [](const Entry &a, const Entry &b) { return floorOf(a) < floorOf(b); };
  std::stable_sort(result.removed.begin(), result.removed.end(), fromTheTop);
  std::stable_sort(result.changed.begin(), result.changed.end(), fromTheGround);
  return result;
}

Difference PublishedEntries::replace(std::vector<Entry> now) {
  Difference result = difference(entries_, now);
  /* Removals first: a reader with room for so many nodes and no more has it free again when the new
   * ones come, and would not ask again for those that it had to leave out. */
  for (const Entry &entry : result.removed) directory_.remove(entry.type, entry.uuid);
  for (const Entry &entry : result.changed) directory_.put(entry);
  entries_ = std::move(now);
  return result;
}

}  // namespace host
