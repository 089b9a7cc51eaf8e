/* UUIDs from the machine id and from names. No lock. */
#include "host/sources/machine_uuid.h"

#include <uuid/uuid.h>

#include <fstream>
#include <stdexcept>

namespace host {

zel_UUID machineUUID(const std::string &machineIdFile) {
  std::ifstream file(machineIdFile);
  std::string text;
  if (!std::getline(file, text)) {
    throw std::runtime_error(
        machineIdFile + ": cannot be read, so this host's UUID is unknown; give it with --self");
  }
  const auto uuid = parseUUID(text);
  if (!uuid || isZero(*uuid)) {
    throw std::runtime_error(machineIdFile + ": \"" + text.substr(0, 40) +
                             "\" is no machine id of 32 hexadecimal digits; give this host's UUID "
                             "with --self");
  }
  return *uuid;
}

zel_UUID namedUUID(const zel_UUID &owner, const std::string &name) {
  zel_UUID uuid;
  uuid_generate_sha1(uuid.bytes, owner.bytes, name.data(), name.size());
  return uuid;
}

}  // namespace host
