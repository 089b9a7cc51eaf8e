/* UUIDs that stay the same without being stored: this machine's, and those of its parts. No lock.
 */
#pragma once

#include <string>

#include "host/kernel/uuid.h"

namespace host {

/* The machine's own: the 32 hexadecimal digits of its machine id. Throws std::runtime_error, with a
 * word on what to do instead, where the file is missing or holds anything else. Blocks: reads a
 * file. */
zel_UUID machineUUID(const std::string &machineIdFile = "/etc/machine-id");

/* The UUID of a thing that belongs to `owner` and has this name: always the same for the same two
 * (RFC 9562, version 5, with the owner as the name space). */
zel_UUID namedUUID(const zel_UUID &owner, const std::string &name);

}  // namespace host
