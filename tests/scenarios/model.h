/* The resolver as a sequential program: one thing after another, standard containers, no locks, no
 * slots, no worlds. It is told what the module was told (calls, answers of the directory, what the
 * world was asked) in the order in which the module's critical sections end, and must then hold what
 * the module holds. It knows nothing of the module's code. One OS thread, no lock.
 */
#pragma once

#include <array>
#include <cstring>
#include <deque>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "host/kernel/uuid.h"
#include "karst_resolver/karst_resolver.h"
#include "platform/karst_directory.h"

namespace model {

/* In the order of the module's tree: two little-endian halves. */
struct UUIDOrder {
  bool operator()(const zel_UUID &left, const zel_UUID &right) const {
    uint64_t l[2], r[2];
    std::memcpy(l, left.bytes, sizeof l);
    std::memcpy(r, right.bytes, sizeof r);
    return l[0] != r[0] ? l[0] < r[0] : l[1] < r[1];
  }
};

/* What a client can see of a node or an instance. */
struct Answer {
  uint32_t state = KARST_RESOLVER_STATE_INIT;
  zel_UUID node{};
  uint32_t major = 0, minor = 0;
  uint64_t trafficType = 0;
  struct Locator {
    uint32_t type = 0;
    std::array<uint8_t, 16> address{}; /* zeros behind the bytes that have a meaning */
    bool operator==(const Locator &) const = default;
  };
  size_t count = 0;
  std::array<Locator, KARST_RESOLVER_MAX_LOCATORS> locators{};

  void add(uint32_t type, const uint8_t *address); /* as long as there is room */
  static Answer of(uint32_t state, const KARSTResolverNodeLocators &set);
  bool operator==(const Answer &) const = default;
  std::string text() const;
};

struct Node;

struct NetIf {
  zel_UUID uuid{};
  Node *node = nullptr; /* null once it is gone */
  KarstNetInterfaceEntry info{};
  KarstHealthStatusEntry health{};
  bool healthy = false;
  bool watched = false;
  bool seen = false;
  unsigned references = 1;
};

struct Instance {
  zel_UUID object{}, hint{}, bound{};
  bool useHint = false, local = false, changed = false, destroyed = false;
  Node *node = nullptr;
  std::vector<Answer> answers{Answer{}}; /* all that could ever be read, oldest first */
  const Answer &answer() const { return answers.back(); } /* what a client reads now */
};

struct Node {
  zel_UUID uuid{};
  bool self = false, witness = false, seen = false, reachable = false, dirty = false;
  bool news = false; /* a new version or witness flag, which waits for the next change */
  uint32_t major = 0, minor = 0;
  unsigned references = 0;
  std::vector<NetIf *> netIfs;
  std::vector<Instance *> instances;
  Answer set; /* its locators; the state is not used */
};

/* What the module learnt while it worked: answers of the platform, in order. */
struct Input {
  enum Kind { Find, FindWhole, Decoded, Subscribed, Preemption, Self } kind;
  uint8_t type = 0;           /* of the entry asked for; 0: by a header */
  zel_UUID uuid{};            /* asked for */
  zel_Status status = ZEL_OK; /* Preemption: 1 for yes */
  KarstEntryHeader header{};  /* Self: its UUID */
  std::vector<uint8_t> record{};
  const void *data = nullptr; /* Subscribed */
};

class Inputs {
 public:
  void add(Input input) { queue_.push_back(std::move(input)); }
  bool empty() const { return taken_ == queue_.size(); }
  Input take(Input::Kind kind, uint8_t type,
             const zel_UUID &uuid); /* another one: stops the system */

 private:
  std::vector<Input> queue_;
  size_t taken_ = 0;
};

class Resolver {
 public:
  static constexpr size_t mostNodes = 128, mostNetIfs = 512;

  explicit Resolver(bool witness) : witness_(witness) {}

  /* ---- Sections under the cache lock, each at its end. --------------------------------------- */

  void learnSelf(Inputs &inputs);
  void forgetEntries(); /* the second half of a disable */

  void nodeCall(const KarstEntryHeader &header, zel_Status status, Inputs &inputs);
  void netIfCall(const KarstEntryHeader &header, zel_Status status, Inputs &inputs);
  void healthCall(const void *data, zel_Status status, Inputs &inputs);

  /* One critical section of the world, wherever it stands. */
  void worldSection(Inputs &inputs);
  void worldEnds(); /* it may only do so between two cycles */

  void track(Instance &instance, const zel_UUID &uuid);
  void destroy(Instance &instance);

  /* Would tracking this node change nothing? */
  static bool tracksAlready(const Instance &instance, const zel_UUID &uuid);

  /* ---- What it holds. ------------------------------------------------------------------------ */

  bool enabled = false;
  bool refused = false; /* for want of a slot, now or before */
  zel_UUID self{};
  std::map<zel_UUID, std::unique_ptr<Node>, UUIDOrder> nodes;
  std::vector<NetIf *> netIfs; /* live ones, oldest first */
  std::deque<Node *> dirty;
  std::map<NetIf *, std::unique_ptr<NetIf>> slots; /* live ones, and whose last call is due */
  std::map<const void *, NetIf *> followed;        /* by a health subscription, to its last call */
  std::vector<Instance *> pending;                 /* that the world has moved aside, front first */
  Node *refreshing = nullptr;

 private:
  enum class Stage { Cycle, Refresh, Resume };

  Node *find(const zel_UUID &uuid);
  Node *findOrCreate(const zel_UUID &uuid);
  void setReachable(Node &node, bool reachable);
  bool updateVersion(Node &node, const KarstEntryHeader *header, Inputs &inputs);
  void nodeFound(Node &node, const KarstEntryHeader *header, Inputs &inputs);
  void rescanNodes(Inputs &inputs);
  void mark(Node &node);
  void release(Node *node);

  NetIf *findNetIf(const zel_UUID &owner, const zel_UUID &uuid);
  NetIf *findOrCreateNetIf(const zel_UUID &owner, const zel_UUID &uuid, Inputs &inputs);
  bool updateNetIf(NetIf &netIf, Inputs &inputs);
  void updateHealth(NetIf &netIf, Inputs &inputs);
  void destroyNetIf(NetIf &netIf);
  void releaseNetIf(NetIf &netIf);
  void rescanNetIfs(Inputs &inputs);

  void generate(Node &node);
  void installHealth(Inputs &inputs);
  void workOff(Inputs &inputs); /* dirty nodes, until a refresh or the end of the section */
  void updateAnswer(Instance &instance);
  void leave(Instance &instance);

  const bool witness_;
  Stage stage_ = Stage::Cycle;
  Instance *current_ = nullptr; /* that the world refreshes */
};

}  // namespace model
