/* Reads a cluster file: JSON that says what the directory holds. docs/cluster-file.md is its
 * reference. No lock: functions of their arguments.
 */
#pragma once

#include <map>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

#include "host/directory/directory.h"

namespace host {

/* Why a file was refused: "FILE:LINE:COLUMN: ..." where it is no JSON, else "FILE: PATH: ..." with
 * the place as a JSON pointer, such as /nodes/2/interfaces/0. One line that also says what would
 * be accepted. */
class ClusterFileError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

struct ClusterContent {
  std::optional<zel_UUID> self;          /* which node this host is, where the file says so */
  std::vector<Entry> entries;            /* in ascending order of type and UUID */
  std::map<zel_UUID, std::string> names; /* of nodes, interfaces and objects, for people */
};

/* Both throw ClusterFileError. `fileName` is what messages call the text. */
ClusterContent parseClusterText(const std::string &text, const std::string &fileName);
ClusterContent parseClusterFile(const std::string &path); /* blocks: reads the file */

}  // namespace host
