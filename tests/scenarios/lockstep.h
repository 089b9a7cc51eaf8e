/* Runs the sequential model beside the module: at the end of every critical section under the cache
 * lock the model takes the same step, with the answers that the platform gave to the module, and both
 * must hold the same. Whatever differs stops the system. One OS thread, no lock; called on the fiber
 * that runs inside the module, with no scheduling point in between.
 */
#pragma once

#include <deque>
#include <optional>

#include "karst_resolver/model.h"
#include "sim/observer.h"
#include "sim/simulation.h"
#include "tests/scenarios/model.h"

class Lockstep final : public sim::Observer {
 public:
  explicit Lockstep(sim::Simulation &simulation);

  /* Around a load and an unload, on the loader's fiber; what has failed to load is gone too. */
  void moduleComesOrGoes();
  void moduleIsThere();
  void moduleIsGone();

  /* Around the client's calls, on the fiber that makes them. The model's instances stay for ever. */
  model::Instance &creating(const zel_UUID &object, const zel_UUID &node, bool local);
  void created(zel_Status status, KARSTResolverInstance *real);
  void destroying(model::Instance &instance);
  void destroyed();

  /* Somebody saw this answer: it is one that the instance had, not before answers[from], or is just
   * about to have. Returns the earliest place that it can have in answers. */
  size_t saw(model::Instance &instance, size_t from, const model::Answer &answer);

  /* All is quiet: nothing is under way, and the module holds what the model holds, to the last
   * reference. */
  void atRest();

  const model::Resolver &resolver() const { return *model_; }
  KARSTResolverCache *cache() const { return cache_; }
  uint64_t checks() const { return checks_; }

  size_t alive() const { return alive_.size(); } /* instances */
  uint64_t answers() const { return answers_; }  /* that instances have had, but for the first */

  /* ---- sim::Observer ------------------------------------------------------------------------- */
  void unlocking(sim::Fiber &fiber, const sim::Spinlock &lock) override;
  void lookedUp(sim::Fiber &fiber, const sim::Lookup &lookup) override;
  void decoded(sim::Fiber &fiber, const char *name, zel_Status status, const void *record) override;
  void toldSelf(sim::Fiber &fiber, const zel_UUID &uuid) override;
  void subscribed(sim::Fiber &fiber, const KarstQuery &query, void *data, zel_Status) override;
  void subscriptionCalls(sim::Fiber &fiber, const sim::SubscriptionCall &call) override;
  void subscriptionReturned(sim::Fiber &fiber, const sim::SubscriptionCall &call) override;
  void statusRegistered(sim::Fiber &fiber, void *data, zel_Status status) override;
  void statusCalls(sim::Fiber &fiber, uint32_t status) override;
  void statusReturned(sim::Fiber &fiber, uint32_t status) override;
  void worldCreated(sim::Fiber &fiber, zel_Status status) override;
  void worldWaited(sim::Fiber &fiber, zel_Status status) override;
  void preemptionAnswered(sim::Fiber &fiber, bool yes) override;

 private:
  /* What a fiber does inside the module. */
  struct Activity {
    uint32_t fiber = 0;
    enum Kind { Nodes, NetIfs, Health, Object, Enable, Disable, World, Create, Destroy };
    Kind kind = Nodes;
    sim::SubscriptionCall call{};
    model::Instance *instance = nullptr;
    unsigned sections = 0; /* ended */
    model::Inputs inputs{};

    std::optional<zel_UUID> wanted{}; /* the node to track, once that is known */
    bool found = false;               /* the object's entry */
    bool tracked = false;
    bool mayStay = false; /* at some moment since, there was nothing to change */
    bool mayMove = false; /* at some moment since, there was */
    bool failed = false;  /* an enable: what follows is a disable */
    unsigned disabling = 0;
  };

  struct Known : model::Instance {
    KARSTResolverInstance *real = nullptr; /* once the module has shown it */
    std::vector<model::Answer> expected;   /* seen, and still to come */
    size_t answersCounted = 1;
  };

  /* Of the fiber that runs. */
  uint32_t fiber() const;
  Activity &begin(Activity::Kind kind);
  Activity &current();
  void end();
  void step(Activity &activity);
  void stepEnable(Activity &activity);
  void stepDisable(Activity &activity);
  void stepTracking(Activity &activity);
  void want(Activity &activity, const zel_UUID &node);
  void look(Activity &activity); /* at whether there is something to change */
  void objectReturned(Activity &activity);
  void answersGrew();

  void compare();
  static void compareNode(const model::Node &node, const KARSTResolverNode &real);
  static void compareNetIf(const model::NetIf &netIf, const KARSTResolverNetIf &real);
  static void compareInstance(model::Instance &instance, KARSTResolverInstance &real);
  model::Instance &instanceOf(const void *real);
  static Known &known(model::Instance &instance) { return static_cast<Known &>(instance); }
  void requireResolved(Known &made);

  sim::Simulation &simulation_;
  std::unique_ptr<model::Resolver> model_;
  KARSTResolverCache *cache_ = nullptr;
  std::vector<Activity> activities_; /* one a fiber */
  std::deque<Known> instances_;      /* all that there ever were */
  std::vector<Known *> alive_;
  size_t cacheSubscriptions_ = 0; /* of nodes and interfaces, whose last call has not returned */
  uint64_t checks_ = 0, answers_ = 0;
  size_t sectionsSinceCompared_ = 0;
};
