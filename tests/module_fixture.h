/* One fixture for the module's promises: a whole module in the simulator, driven step by step. */
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <array>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "host/directory/records.h"
#include "host/kernel/heap.h"
#include "host/kernel/log.h"
#include "karst_resolver/model.h"
#include "sim/simulation.h"
#include "tests/uuids.h"

/* The addresses of locators: "10.0.0.1", "fd00::1". */
std::vector<std::string> textsOf(const KARSTResolverNodeLocators &set);

/* A client: an instance and what its callback was told. */
struct Client {
  KARSTResolverInstance *instance = nullptr;
  std::vector<uint32_t> states; /* one a callback */
  std::vector<uint16_t> counts; /* locators of the instance at that moment */
};

class ModuleTest : public ::testing::Test {
 protected:
  ModuleTest() : ModuleTest(defaults()) {}
  explicit ModuleTest(const sim::Settings &settings);
  ~ModuleTest() override;

  static sim::Settings defaults(); /* two delivery threads, every trace class at level 2 */

  /* Loads the module (what() of the refusal, empty when it loaded) and unloads it. */
  std::string load(const std::vector<std::string> &parameters = {});
  void unload();

  /* Loaded, usable, self is node 1, everything taken in. */
  void start();

  /* ---- The directory ------------------------------------------------------------------------- */

  host::Directory &directory() { return sim.directory(); }
  void putNode(uint32_t node, uint32_t major = 7, uint32_t minor = 1, uint32_t flags = 0);
  void putNetIf(uint32_t netIf, uint32_t node, std::initializer_list<const char *> addresses,
                uint64_t trafficTypeMask = 0);
  void putNetIf(uint32_t netIf, uint32_t node, const KarstNetInterfaceEntry &record);
  void putHealth(uint32_t netIf, uint32_t healthFlags, uint64_t timestamp = 1);
  void putObject(uint32_t object, uint32_t node);
  void putRaw(uint8_t type, const zel_UUID &uuid, const zel_UUID &owner,
              std::vector<uint8_t> data = {0xff});
  static KarstNetInterfaceEntry netIfRecord(std::initializer_list<const char *> addresses);

  /* A node with one healthy interface of the same number, at 10.0.0.<number>. */
  void putSimpleNode(uint32_t number);

  /* ---- Clients ------------------------------------------------------------------------------- */

  zel_Status create(Client &client, const zel_UUID &object, const zel_UUID &node,
                    bool useLocalLocator = false, uint32_t entryType = objectType);
  zel_Status createForNode(Client &client, uint32_t node, bool useLocalLocator = false) {
    return create(client, noUUID, nodeUUID(node), useLocalLocator);
  }
  zel_Status createForObject(Client &client, uint32_t object, uint32_t hintNode = 0) {
    return create(client, objectUUID(object), hintNode == 0 ? noUUID : nodeUUID(hintNode));
  }
  void setCallback(Client &client);
  void removeCallback(Client &client);
  void destroy(Client &client);
  zel_Status read(const Client &client, KARSTResolverNodeLocators *set);

  /* ---- Inside -------------------------------------------------------------------------------- */

  host::Module &module() { return *module_; }
  KARSTResolverCache *cache();
  KARSTResolverNode *cachedNode(uint32_t number); /* null: not cached */
  std::vector<KARSTResolverNetIf *> cachedNetIfs();
  template <typename Function>
  Function *internal(const char *name) {
    return reinterpret_cast<Function *>(module_->anySymbol(name));
  }

  /* Events of the trace since the last call of this, in order. */
  std::vector<host::TracedRecord> traced();

  /* Those of the platform's calls, by name. */
  std::vector<std::string> calls(const std::vector<std::string> &which);

  std::vector<std::string> log; /* the module's lines, with line numbers cut out */
  /* What the host found alive at the end of the module's heap and lock domain. */
  std::vector<std::string> leftBehind;
  sim::Simulation sim;

  /* The module's own, once it is loaded. */
  decltype(KARSTResolver_Create) *create_ = nullptr;
  decltype(KARSTResolver_Destroy) *destroy_ = nullptr;
  decltype(KARSTResolver_SetCallback) *setCallback_ = nullptr;
  decltype(KARSTResolver_GetNodeLocators) *read_ = nullptr;

 private:
  host::Module *module_ = nullptr;
  uint64_t traceSeen_ = 0;
};
