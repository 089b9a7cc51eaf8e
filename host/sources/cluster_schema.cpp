/* Checks a document against the schema, and turns the validator's report, which speaks of
 * constraints, into a line that speaks of the file. The words for what belongs somewhere are the
 * schema's own descriptions. No lock.
 */
#include "host/sources/cluster_schema.h"

#include <valijson/adapters/nlohmann_json_adapter.hpp>
#include <valijson/schema.hpp>
#include <valijson/schema_parser.hpp>
#include <valijson/validation_results.hpp>
#include <valijson/validator.hpp>
#include <vector>

namespace host {
namespace {

using json = nlohmann::json;
using Path = json::json_pointer;
using Adapter = valijson::adapters::NlohmannJsonAdapter;

const json &schemaDocument() {
  static const json document = json::parse(clusterSchemaText);
  return document;
}

const valijson::Schema &compiledSchema() {
  static const valijson::Schema *const schema = [] {
    auto *made = new valijson::Schema;
    valijson::SchemaParser().populateSchema(Adapter(schemaDocument()), *made);
    return made;
  }();
  return *schema;
}

/* The definition that a "$ref" names, or the schema itself. */
const json &resolved(const json &schema) {
  if (!schema.contains("$ref")) return schema;
  return schemaDocument().at(Path(schema.at("$ref").get<std::string>().substr(1)));
}

/* The part of the schema that speaks about a place in the document, its "$ref" not yet followed. */
const json &schemaAt(const Path &path) {
  const json *schema = &schemaDocument();
  std::vector<std::string> steps;
  for (Path rest = path; !rest.empty(); rest.pop_back()) steps.push_back(rest.back());
  for (auto step = steps.rbegin(); step != steps.rend(); ++step) {
    const json &here = resolved(*schema);
    schema = here.contains("items") ? &here.at("items") : &here.at("properties").at(*step);
  }
  return *schema;
}

std::string description(const json &schema) {
  const json &source = schema.contains("description") ? schema : resolved(schema);
  return source.at("description").get<std::string>();
}

std::string fieldNames(const json &objectSchema) {
  std::string names;
  for (const auto &[name, unused] : objectSchema.at("properties").items()) {
    names += (names.empty() ? "" : ", ") + name;
  }
  return names;
}

/* The text between the first and the last of a quotation mark, behind `start`. */
std::string quotedPart(const std::string &text, char mark, size_t start = 0) {
  const size_t first = text.find(mark, start);
  const size_t last = text.rfind(mark);
  return first == last ? text : text.substr(first + 1, last - first - 1);
}

bool begins(const std::string &text, const char *with) {
  return text.rfind(with, 0) == 0;
}

/* `place` is what the fault was found in, `report` the validator's text. */
std::string inWords(const json &place, const json &schema, const std::string &report) {
  if (begins(report, "Object contains a property that could not be validated")) {
    const std::string field = quotedPart(report, '\'', report.find("constraints: "));
    return "unknown field " + shown(field) + "; known here: " + fieldNames(resolved(schema));
  }
  if (begins(report, "Missing required property")) {
    const std::string field = quotedPart(report, '\'');
    return "missing field \"" + field +
           "\"; expected: " + description(resolved(schema).at("properties").at(field));
  }
  std::string what = shown(place) + " is refused";
  if (begins(report, "Value type not permitted")) {
    what = std::string("wrong type (") + place.type_name() + ")";
  } else if (begins(report, "Array should contain no more than")) {
    what = "too many items (" + std::to_string(place.size()) + ")";
  } else if (begins(report, "Array should contain no fewer than")) {
    what = "too few items (" + std::to_string(place.size()) + ")";
  } else if (begins(report, "String should be no more than")) {
    what = "too long (" + shown(place) + ")";
  }
  return what + "; expected: " + description(schema);
}

/* The validator's "<root>", "[nodes]", "[0]" as a path. */
Path pathOf(const std::vector<std::string> &context) {
  Path path;
  for (size_t i = 1; i < context.size(); i++) {
    path.push_back(context[i].substr(1, context[i].size() - 2));
  }
  return path;
}

}  // namespace

std::optional<SchemaFault> findSchemaFault(const json &document) {
  valijson::Validator validator(valijson::Validator::kStrongTypes);
  valijson::ValidationResults results;
  if (validator.validate(compiledSchema(), Adapter(document), &results)) return std::nullopt;

  /* The innermost breach comes first; the ones after it follow from it, or are others. */
  valijson::ValidationResults::Error error;
  results.popError(error);
  const Path path = pathOf(error.context);
  return SchemaFault{path, inWords(document.at(path), schemaAt(path), error.description)};
}

std::string shown(const json &value) {
  constexpr size_t longest = 60;
  std::string text = value.dump(-1, ' ', true);
  if (text.size() > longest) text = text.substr(0, longest) + "...";
  return text;
}

}  // namespace host
