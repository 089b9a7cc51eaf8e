/* What a source has told the directory, and the difference to what it has to tell now. Not locked:
 * each source guards its own.
 */
#pragma once

#include <vector>

#include "host/directory/directory.h"

namespace host {

/* The order of a source's entries: ascending type, then UUID. */
bool comesBefore(const Entry &a, const Entry &b);

/* What leads from one set of entries to another, in the order in which a directory is told. */
struct Difference {
  std::vector<Entry> removed; /* as they were */
  std::vector<Entry> changed; /* added, or with another owner or record */
  bool empty() const { return removed.empty() && changed.empty(); }
};

/* Both in the order of comesBefore, without two entries of one type and UUID. */
Difference difference(const std::vector<Entry> &before, const std::vector<Entry> &now);

class PublishedEntries {
 public:
  explicit PublishedEntries(Directory &directory) : directory_(directory) {}

  /* Makes `now`, in the order of comesBefore, what this source says: the directory is told the
   * difference and nothing else. Never blocks on delivery. */
  Difference replace(std::vector<Entry> now);

 private:
  Directory &directory_;
  std::vector<Entry> entries_;
};

}  // namespace host
