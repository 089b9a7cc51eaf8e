/* Locator generation; see locators.h. Under the cache lock. */
#include "karst_resolver/locators.h"

#include "karst_resolver/log.h"
#include "karst_resolver/trace.h"
#include "platform/tolm.h"

extern "C" {

/* Interfaces in the order of their creation, addresses in the order of the record; the first four
 * win, nothing is sorted, compared or de-duplicated. */

/* Fills the next slot; true when it was the last one. Of an IPv4 locator only the first four
 * address bytes are written: the other twelve mean nothing. */
static bool KARSTResolverAddLocator(KARSTResolverNodeLocators *set, uint16_t *count,
                                    uint32_t networkType, const uint8_t *address) {
  KARSTResolverNodeLocator *slot = &set->locators[*count];
  slot->networkType = networkType;
  if (networkType == KARST_RESOLVER_LOCATOR_IPV6) {
    __builtin_memcpy(slot->address, address, 16);
  } else {
    __builtin_memcpy(slot->address, address, 4);
  }
  *count += 1;
  return *count == set->capacity;
}

/* Adds what one interface yields: its address list or, where that is empty, its one IPv4 address.
 * True when the set is full. */
static bool KARSTResolverAddNetIfLocators(KARSTResolverNodeLocators *set, uint16_t *count,
                                          const KarstNetInterfaceEntry *info) {
  if (info->numIpAddresses == 0) {
    uint32_t single;
    __builtin_memcpy(&single, info->ipv4Address, sizeof single);
    return single != 0 &&
           KARSTResolverAddLocator(set, count, KARST_RESOLVER_LOCATOR_IPV4, info->ipv4Address);
  }
  /* Whatever the number says, the array ends after seven. */
  uint32_t addresses = info->numIpAddresses < KARST_NET_INTERFACE_MAX_ADDRESSES
                           ? info->numIpAddresses
                           : KARST_NET_INTERFACE_MAX_ADDRESSES;
  for (uint32_t i = 0; i < addresses; i++) {
    const KarstIpAddress *address = &info->ipAddresses[i];
    uint32_t networkType =
        address->isIPv6 ? KARST_RESOLVER_LOCATOR_IPV6 : KARST_RESOLVER_LOCATOR_IPV4;
    if (KARSTResolverAddLocator(set, count, networkType, address->address)) return true;
  }
  return false;
}

void KARSTResolverGenerateNodeLocators(KARSTResolverCache *, KARSTResolverNode *node) {
  KARSTResolverNodeLocators *set = &node->locators;
  set->nodeUUID = node->uuid;
  set->majorVersion = node->majorVersion;
  set->minorVersion = node->minorVersion;
  /* Where a witness takes part, on either side, the traffic is of type 1. */
  uint64_t trafficType = TOLM_IsWitnessNode() || node->isWitness ? 1 : 0;
  set->trafficType = trafficType;

  uint16_t count = 0;
  for (KARSTResolverLink *link = node->netIfList.next; link != &node->netIfList;
       link = link->next) {
    KARSTResolverNetIf *netIf = KARST_RESOLVER_CONTAINER(link, KARSTResolverNetIf, nodeLinks);
    if (!netIf->healthy || !(netIf->info.trafficTypeMask & (1ull << trafficType))) continue;
    if (netIf->info.networkType != KARST_NETWORK_TYPE_IP) {
      KARST_RESOLVER_NOTE("Unknown network type %u for interface %s\n", netIf->info.networkType,
                          netIf->uuidString);
      continue;
    }
    if (KARSTResolverAddNetIfLocators(set, &count, &netIf->info)) break;
  }
  set->count = count;
  KARST_RESOLVER_TRACE(UpdateNodeReachability, 578, KARST_RESOLVER_TRACE_POINTER(node),
                       KARST_RESOLVER_TRACE_UUID(&node->uuid),
                       KARST_RESOLVER_TRACE_FLAG(node->reachable), set->count);
}

} /* extern "C" */
