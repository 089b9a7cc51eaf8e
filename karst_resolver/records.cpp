/* Directory records: tables, queries, decoding; see records.h. No lock. */
#include "karst_resolver/records.h"

#include "karst_resolver/karst_resolver_util.h"

extern "C" {

#define FIELD(type, Record, name)                               \
  {                                                             \
    type, offsetof(Record, name), 0, #name, nullptr, nullptr, { \
      0, 0                                                      \
    }                                                           \
  }
#define NESTED_FIELD(Record, name, functions)                                  \
  {                                                                            \
    EXPR_MSH_NESTED, offsetof(Record, name), 0, #name, ExprMsh_Msh##functions, \
        ExprMsh_Umsh##functions, {                                             \
      0, 0                                                                     \
    }                                                                          \
  }
#define END_OF_TABLE                      \
  {                                       \
    0, 0, 0, nullptr, nullptr, nullptr, { \
      0, 0                                \
    }                                     \
  }

const ExprMshField KarstNodeEntryTbl[] = {
    FIELD(EXPR_MSH_U32, KarstNodeEntry, majorVersionNum),
    FIELD(EXPR_MSH_U32, KarstNodeEntry, minorVersionNum),
    FIELD(EXPR_MSH_U32, KarstNodeEntry, flags),
    FIELD(EXPR_MSH_U32, KarstNodeEntry, requiredTolmMajorVersion),
    FIELD(EXPR_MSH_U32, KarstNodeEntry, requiredTolmMinorVersion),
    END_OF_TABLE,
};

const ExprMshField KarstNetInterfaceEntryTbl[] = {
    NESTED_FIELD(KarstNetInterfaceEntry, networkType, NetInterfaceEntry),
    FIELD(EXPR_MSH_U32, KarstNetInterfaceEntry, agentGroupPort),
    FIELD(EXPR_MSH_U32, KarstNetInterfaceEntry, masterGroupPort),
    FIELD(EXPR_MSH_U32, KarstNetInterfaceEntry, multicastTTL),
    FIELD(EXPR_MSH_U64, KarstNetInterfaceEntry, bandwidth),
    FIELD(EXPR_MSH_MAC, KarstNetInterfaceEntry, macAddress),
    FIELD(EXPR_MSH_ADDRESS, KarstNetInterfaceEntry, agentV6Group),
    FIELD(EXPR_MSH_ADDRESS, KarstNetInterfaceEntry, masterV6Group),
    NESTED_FIELD(KarstNetInterfaceEntry, numIpAddresses, NetInterfaceEntryIpAddresses),
    FIELD(EXPR_MSH_U64, KarstNetInterfaceEntry, trafficTypeMask),
    END_OF_TABLE,
};

const ExprMshField KarstHealthStatusEntryTbl[] = {
    FIELD(EXPR_MSH_U32, KarstHealthStatusEntry, healthFlags),
    FIELD(EXPR_MSH_U64, KarstHealthStatusEntry, timestamp),
    FIELD(EXPR_MSH_U32, KarstHealthStatusEntry, healthReason),
    END_OF_TABLE,
};

void KARSTResolverFillQuery(KarstQuery *query, uint8_t type, uint8_t flags, const zel_UUID *uuid) {
  if (uuid != nullptr) query->uuid = *uuid;
  query->type = type;
  query->flags |= flags;
}

void KARSTResolverFreeEntry(KarstFullEntry *entry) {
  resolverMshAlloc.free(resolverMshAlloc.context, entry);
}

zel_Status KARSTResolverDecodeEntry(KarstFullEntry *entry, const ExprMshField *table,
                                    const char *name, void *record, uint32_t size) {
  __builtin_memset(record, 0, size);
  zel_Status status = ExprMsh_UmshSingleStructure(&resolverMshAlloc, table, entry + 1,
                                                  entry->header.dataLength, name, record);
  KARSTResolverFreeEntry(entry);
  return status;
}

} /* extern "C" */
