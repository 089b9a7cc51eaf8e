/* A simulated host on which actors play operations: the directory, the module, clients with their
 * callbacks, the model beside the module, and what must hold. One at a time; one OS thread, no lock.
 */
#pragma once

#include <deque>
#include <vector>

#include "karst_resolver/karst_resolver.h"
#include "sim/access/access.h"
#include "sim/explore/scenario.h"
#include "sim/simulation.h"
#include "tests/scenarios/lockstep.h"

class Cluster {
 public:
  static constexpr size_t places = 6; /* of clients */

  Cluster(const sim::Settings &settings, std::filesystem::path module, unsigned callbackWork);
  ~Cluster();
  Cluster(const Cluster &) = delete;
  Cluster &operator=(const Cluster &) = delete;

  /* One operation, on the fiber of its actor. One that makes no sense now does nothing. */
  void perform(const sim::Operation &operation);

  /* From outside every fiber. Runs until all is quiet, and checks everything that holds then; where
   * the same course has been checked before, that is left out. */
  void rest(bool checked = false);

  /* Destroys what is there, unloads, and lets nothing be left. */
  void close();

  sim::Simulation &simulation() { return simulation_; }
  const Lockstep &lockstep() const { return lockstep_; }
  uint64_t performed() const { return performed_; }

 private:
  /* An instance from its creation on; stays when it is destroyed. */
  struct Client {
    Cluster *cluster = nullptr;
    model::Instance *model = nullptr;
    KARSTResolverInstance *instance = nullptr;
    unsigned users = 0;       /* fibers inside a call with this instance */
    sim::HandOver made, used; /* from its maker to its users, and from these to its end */
    bool destroyed = false;
    bool hasCallback = false;
    uint64_t callbacks = 0;
    size_t lastTold = 0; /* in the model's answers */
    unsigned work = 0;   /* scheduling points that a callback takes */
  };

  static void callback(void *data, KARSTResolverInstance *instance, uint32_t state);

  void putNode(uint32_t node, uint32_t flags);
  void putNetIf(uint32_t netIf, uint32_t node, uint32_t record);
  void putHealth(uint32_t netIf, uint32_t flags);
  void garble(uint32_t which, uint32_t kind);
  void flood(uint32_t groups, uint32_t from, bool put);

  void load();
  void unload();
  void create(uint8_t number, uint8_t target, uint8_t options);
  Client *enter(uint8_t number, bool alone); /* null: that makes no sense now */
  void leave(Client &client);
  void setCallback(uint8_t number, uint8_t kind);
  void read(uint8_t number, uint8_t kind);
  void destroy(size_t slot);
  void destroyAll();

  void recover(); /* after faults: makes the module take in what it has missed */
  void resync();
  void touchNews();
  void requireQuiet(); /* and that the model and clients hold what they should then */
  void requireEnabled();
  void requireDirectoryTaken();
  void requireTraces();

  sim::Simulation simulation_;
  Lockstep lockstep_;
  const std::filesystem::path path_;
  const unsigned callbackWork_;
  host::Module *module_ = nullptr;
  sim::HandOver loaded_, used_, gone_; /* from load to clients, from these to unload, and on */
  bool moving_ = false;                /* it is loaded or unloaded */
  bool usable_ = false;
  uint64_t faultsSeen_ = 0; /* and recovered from */
  unsigned creating_ = 0;
  std::deque<Client> clients_; /* all that there ever were */
  Client *slots_[places] = {};
  uint32_t stamp_ = 0; /* of what is put; versions only rise */
  uint64_t performed_ = 0;
  uint64_t callbacks_ = 0;
  uint64_t traceSeen_ = 0;
  uint64_t traced_[32] = {}; /* by id */
  uint64_t freedInstances_ = 0;
};
