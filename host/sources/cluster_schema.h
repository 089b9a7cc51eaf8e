/* The structure of a cluster file, and in words what is wrong with one that does not have it.
 * No lock: everything here is constant.
 */
#pragma once

#include <nlohmann/json.hpp>
#include <optional>
#include <string>

namespace host {

/* docs/cluster.schema.json, as it was when the program was built. */
extern const char clusterSchemaText[];

struct SchemaFault {
  nlohmann::json::json_pointer path; /* the place in the document */
  std::string rule;                  /* what is wrong there and what belongs there, one line */
};

/* The first breach of the schema in the document, if any. */
std::optional<SchemaFault> findSchemaFault(const nlohmann::json &document);

/* A value as a message shows it: its JSON text, shortened. */
std::string shown(const nlohmann::json &value);

}  // namespace host
