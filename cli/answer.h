/* An answer of the resolver, as text and as JSON. No lock. */
#pragma once

#include <cstdint>
#include <map>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <vector>

#include "cli/targets.h"
#include "karst_resolver/karst_resolver.h"

namespace cli {

/* What people call nodes and objects. */
using Names = std::map<zel_UUID, std::string>;

/* The name, or the empty string. */
std::string nameOf(const Names &names, const zel_UUID &uuid);

/* The name, or else the UUID. */
std::string nameOrUUID(const Names &names, const zel_UUID &uuid);

struct Answer {
  Target target;
  std::optional<KARSTResolverNodeLocators> locators; /* when it is resolved */
  std::string reason;                                /* when it is not */
};

/* "192.0.2.1", "2001:db8::1", "this host" */
std::string toText(const KARSTResolverNodeLocator &locator);

/* The answer's locators, several separated by spaces. */
std::string locatorsText(const KARSTResolverNodeLocators &set);

nlohmann::ordered_json toJson(const Answer &answer, const Names &names);

/* One line with its newline; bytes that are no UTF-8 are replaced. */
std::string jsonLine(const nlohmann::ordered_json &value);

}  // namespace cli
