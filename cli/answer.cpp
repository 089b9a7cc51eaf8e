/* Answers as text and JSON. No lock. */
#include "cli/answer.h"

#include <arpa/inet.h>

namespace cli {
namespace {

using Json = nlohmann::ordered_json;

/* The named thing at the head of an object: its UUID and, where it has one, its name. */
void addIdentity(Json &object, const Names &names, const zel_UUID &uuid) {
  object["uuid"] = host::toString(uuid);
  const std::string name = nameOf(names, uuid);
  if (!name.empty()) object["name"] = name;
}

const char *typeName(const KARSTResolverNodeLocator &locator) {
  switch (locator.networkType) {
    case KARST_RESOLVER_LOCATOR_IPV4:
      return "ipv4";
    case KARST_RESOLVER_LOCATOR_IPV6:
      return "ipv6";
    case KARST_RESOLVER_LOCATOR_LOCAL:
      return "local";
    default:
      return "unknown";
  }
}

Json toJson(const KARSTResolverNodeLocator &locator) {
  Json object{{"type", typeName(locator)}};
  if (locator.networkType != KARST_RESOLVER_LOCATOR_LOCAL) object["address"] = toText(locator);
  return object;
}

}  // namespace

std::string nameOf(const Names &names, const zel_UUID &uuid) {
  const auto found = names.find(uuid);
  return found == names.end() ? std::string() : found->second;
}

std::string nameOrUUID(const Names &names, const zel_UUID &uuid) {
  const std::string name = nameOf(names, uuid);
  return name.empty() ? host::toString(uuid) : name;
}

std::string toText(const KARSTResolverNodeLocator &locator) {
  if (locator.networkType == KARST_RESOLVER_LOCATOR_LOCAL) return "this host";
  char text[INET6_ADDRSTRLEN] = "?";
  const int family = locator.networkType == KARST_RESOLVER_LOCATOR_IPV6 ? AF_INET6 : AF_INET;
  inet_ntop(family, locator.address, text, sizeof text);
  return text;
}

std::string locatorsText(const KARSTResolverNodeLocators &set) {
  std::string text;
  for (uint16_t i = 0; i < set.count; i++) {
    if (i > 0) text += ' ';
    text += toText(set.locators[i]);
  }
  return text;
}

Json toJson(const Answer &answer, const Names &names) {
  const Target &target = answer.target;
  Json object{{"kind", target.isObject ? "object" : "node"}};
  if (target.isObject) object["type"] = target.type;
  addIdentity(object, names, target.uuid);
  if (!host::isZero(target.hint)) object["hint"] = host::toString(target.hint);
  if (!answer.locators) {
    object["state"] = "unresolved";
    object["reason"] = answer.reason;
    return object;
  }
  const KARSTResolverNodeLocators &set = *answer.locators;
  object["state"] = "resolved";
  addIdentity(object["node"], names, set.nodeUUID);
  object["version"] = {{"major", set.majorVersion}, {"minor", set.minorVersion}};
  object["trafficType"] = set.trafficType;
  object["locators"] = Json::array();
  for (uint16_t i = 0; i < set.count; i++) object["locators"].push_back(toJson(set.locators[i]));
  return object;
}

std::string jsonLine(const Json &value) {
  return value.dump(-1, ' ', false, Json::error_handler_t::replace) + "\n";
}

}  // namespace cli
