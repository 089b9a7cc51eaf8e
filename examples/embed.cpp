/* Embeds the host kernel: loads the resolver, tells the directory of one node, resolves it, prints
 * where it can be reached. One thread; the kernel has its own.
 *
 *   embed karst_resolver.so [client_module.so]
 */
#include <arpa/inet.h>

#include <cstdio>

#include "host/directory/records.h"
#include "host/host_kernel.h"
#include "karst_resolver/karst_resolver.h"

namespace {

const zel_UUID nodeUUID = *host::parseUUID("5f0c1d2e-0001-4000-8000-000000000001");
const zel_UUID interfaceUUID = *host::parseUUID("5f0c1d2e-0002-4000-8000-000000000001");

/* A node is reachable through an interface that it owns and whose health says so. */
void describeCluster(host::Directory &directory) {
  const KarstNodeEntry node{.majorVersionNum = 1,
                            .minorVersionNum = 4,
                            .flags = 0,
                            .requiredTolmMajorVersion = 0,
                            .requiredTolmMinorVersion = 0};
  KarstNetInterfaceEntry interface {};
  interface.networkType = KARST_NETWORK_TYPE_IP;
  interface.numIpAddresses = 1;
  inet_pton(AF_INET, "192.0.2.17", interface.ipAddresses[0].address);
  const KarstHealthStatusEntry healthy{};

  directory.setSelf(nodeUUID);
  directory.put({KARST_TYPE_NODE, nodeUUID, nodeUUID, host::encode(node)});
  directory.put({KARST_TYPE_NET_INTERFACE, interfaceUUID, nodeUUID, host::encode(interface)});
  directory.put({KARST_TYPE_HEALTH_STATUS, interfaceUUID, nodeUUID, host::encode(healthy)});
  directory.setUsable(true);
}

void printLocators(const KARSTResolverNodeLocators &locators) {
  std::printf("node %s, version %u.%u\n", host::toString(locators.nodeUUID).c_str(),
              locators.majorVersion, locators.minorVersion);
  for (uint16_t i = 0; i < locators.count; i++) {
    const KARSTResolverNodeLocator &locator = locators.locators[i];
    const bool isIPv6 = locator.networkType == KARST_RESOLVER_LOCATOR_IPV6;
    char text[INET6_ADDRSTRLEN] = "";
    inet_ntop(isIPv6 ? AF_INET6 : AF_INET, locator.address, text, sizeof text);
    std::printf("  %s\n", text);
  }
}

int resolve(const host::Module &resolver) {
  auto *const create = resolver.function<decltype(KARSTResolver_Create)>("KARSTResolver_Create");
  auto *const read =
      resolver.function<decltype(KARSTResolver_GetNodeLocators)>("KARSTResolver_GetNodeLocators");
  auto *const destroy = resolver.function<decltype(KARSTResolver_Destroy)>("KARSTResolver_Destroy");

  KARSTResolverInstance *instance = nullptr;
  const zel_Status status = create(&instance, 0, zel_UUID{}, nodeUUID, false);
  if (status != ZEL_OK) {
    std::printf("not resolved: %s\n", zel_StatusToString(status));
    return 1;
  }
  KARSTResolverNodeLocators locators{};
  locators.capacity = KARST_RESOLVER_MAX_LOCATORS;
  if (read(instance, &locators) == ZEL_OK) printLocators(locators);
  destroy(instance);
  return 0;
}

}  // namespace

int main(int argc, char **argv) {
  if (argc < 2 || argc > 3) {
    std::fprintf(stderr, "usage: embed karst_resolver.so [client_module.so]\n");
    return 2;
  }
  try {
    host::Kernel kernel;
    const host::Module &resolver = kernel.modules().load(argv[1]);
    describeCluster(kernel.directory());
    kernel.settle(); /* the resolver has taken in what the directory was told */
    if (argc == 3) kernel.modules().load(argv[2]);
    const int result = resolve(resolver);
    kernel.settle();
    return result; /* the kernel unloads its modules, the last first */
  } catch (const host::ModuleError &error) {
    std::fprintf(stderr, "%s\n", error.what());
    return 2;
  }
}
