/* The directory's own records as bytes and back, through the marshaller. No lock. */
#pragma once

#include <cstdint>
#include <vector>

#include "platform/karst_directory.h"

namespace host {

/* The same tables as every reader's; each ends with an all-zero row. */
extern const ExprMshField nodeRecordTable[];
extern const ExprMshField netInterfaceRecordTable[];
extern const ExprMshField healthRecordTable[];

/* What does not travel: the interface record's padding and networkPart, the bytes of an IPv4
 * address behind its fourth, and the ipv4Address of a network type other than IP. An interface
 * record with more than 7 addresses is nobody's to encode and stops the host. */
std::vector<uint8_t> encode(const KarstNodeEntry &record);
std::vector<uint8_t> encode(const KarstNetInterfaceEntry &record);
std::vector<uint8_t> encode(const KarstHealthStatusEntry &record);

/* ZEL_OK, or why the bytes were refused (expr_msh.h). `record` is overwritten. */
zel_Status decode(const std::vector<uint8_t> &data, KarstNodeEntry *record);
zel_Status decode(const std::vector<uint8_t> &data, KarstNetInterfaceEntry *record);
zel_Status decode(const std::vector<uint8_t> &data, KarstHealthStatusEntry *record);

}  // namespace host
