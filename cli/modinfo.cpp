/* A module file's declaration, printed. No lock. */
#include "cli/modinfo.h"

#include <nlohmann/json.hpp>
#include <optional>

#include "cli/answer.h"
#include "cli/table.h"
#include "host/kernel/elf_image.h"
#include "host/kernel/module_file.h"

namespace cli {
namespace {

using Json = nlohmann::ordered_json;

constexpr uint64_t kVariableOffset = 16; /* of the variable's address in a parameter's record */

/* What the variable of a parameter holds before anybody sets it. */
std::optional<int32_t> defaultOf(const host::ElfImage &image,
                                 const host::ModuleParameter &parameter) {
  if (parameter.type != host::kParameterInt) return {};
  try {
    const uint64_t variable = image.wordAt(parameter.record + kVariableOffset);
    return static_cast<int32_t>(static_cast<uint32_t>(image.wordAt(variable)));
  } catch (const host::ModuleError &) {
    return {}; /* its bytes do not stand in the file as a whole word */
  }
}

std::string typeText(const host::ModuleParameter &parameter) {
  if (parameter.type == host::kParameterInt) return "int";
  return "type " + std::to_string(parameter.type);
}

std::string kindText(const host::ModuleAssertion &assertion) {
  if (assertion.kind == 1) return "not implemented";
  return "kind " + std::to_string(assertion.kind);
}

Json toJson(const host::ModuleFile &module, const host::ElfImage &image) {
  Json object{{"file", module.path.string()},     {"provides", Json::array()},
              {"requires", Json::array()},        {"parameters", Json::array()},
              {"exports", module.exports},        {"assertions", Json::array()},
              {"declaration", module.declaration}};
  for (const auto &space : module.provides) {
    object["provides"].push_back({{"name", space.name}, {"version", space.version}});
  }
  for (const auto &space : module.required) {
    object["requires"].push_back({{"name", space.name}, {"version", space.version}});
  }
  for (const auto &parameter : module.parameters) {
    Json entry{{"name", parameter.name}, {"type", typeText(parameter)}};
    if (const auto value = defaultOf(image, parameter)) entry["default"] = *value;
    if (!parameter.description.empty()) entry["description"] = parameter.description;
    object["parameters"].push_back(entry);
  }
  for (const auto &assertion : module.assertions) {
    object["assertions"].push_back(
        {{"kind", kindText(assertion)}, {"source", assertion.source}, {"line", assertion.line}});
  }
  return object;
}

/* The lines of one chapter, the first behind its title. */
std::string chapter(const std::string &title, const std::vector<std::string> &lines) {
  std::string text = title + std::string(13 - title.size(), ' ');
  if (lines.empty()) return text + "none\n";
  for (size_t i = 0; i < lines.size(); i++) {
    if (i > 0) text += std::string(13, ' ');
    text += printable(lines[i]) + "\n";
  }
  return text;
}

std::string parameterText(const host::ModuleParameter &parameter, const host::ElfImage &image) {
  std::string text = parameter.name + " (" + typeText(parameter);
  if (const auto value = defaultOf(image, parameter)) text += ", default " + std::to_string(*value);
  text += ")";
  return parameter.description.empty() ? text : text + ": " + parameter.description;
}

std::string toText(const host::ModuleFile &module, const host::ElfImage &image) {
  std::vector<std::string> provides;
  std::vector<std::string> required;
  std::vector<std::string> parameters;
  std::vector<std::string> assertions;
  for (const auto &space : module.provides) provides.push_back(host::toString(space));
  for (const auto &space : module.required) required.push_back(host::toString(space));
  for (const auto &parameter : module.parameters) {
    parameters.push_back(parameterText(parameter, image));
  }
  for (const auto &assertion : module.assertions) {
    assertions.push_back(assertion.source + ":" + std::to_string(assertion.line) + " (" +
                         kindText(assertion) + ")");
  }
  return chapter("file", {module.path.string()}) + chapter("provides", provides) +
         chapter("requires", required) + chapter("parameters", parameters) +
         chapter("exports", module.exports) + chapter("assertions", assertions) +
         chapter("declaration", module.declaration);
}

}  // namespace

int modinfo(const std::filesystem::path &file, Format format, Output &output) {
  const host::ModuleFile module(file);
  const host::ElfImage image(file);
  output.write(format == Format::Json ? jsonLine(toJson(module, image)) : toText(module, image));
  return kResolved;
}

}  // namespace cli
