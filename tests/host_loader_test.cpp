/* The module loader: load and unload, and modules that use each other. What is refused by its file or
 * its parameters: transcripts/modules.txt. */
#include "host/kernel/module_loader.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <functional>

namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::Pair;

using Events = std::vector<std::pair<std::string, int64_t>>;
Events events; /* what the modules told, in order */

std::string modulePath(const std::string &name) {
  return TEST_MODULES "/" + name + ".so";
}

std::string errorOf(const std::function<void()> &action) {
  try {
    action();
  } catch (const host::ModuleError &error) {
    return error.what();
  }
  return "no error";
}

class Loader : public testing::Test {
 protected:
  Loader() { events.clear(); }
  ~Loader() override { std::filesystem::remove(scratch); }

  host::Module &load(const std::string &name, const std::vector<std::string> &parameters = {}) {
    return loader.load(modulePath(name), parameters);
  }
  std::string loadError(const std::string &name, const std::vector<std::string> &parameters = {}) {
    return errorOf([&] { load(name, parameters); });
  }

  const std::string scratch = testing::TempDir() + "loader" + std::to_string(getpid()) + ".so";
  host::ModuleLoader loader{{{"com.example.host", "7"}}, [] { events.push_back({"quiesce", 0}); }};
};

/* ---- Load ------------------------------------------------------------------------------------ */

TEST_F(Loader, CallsInitThenCleanupAndQuiesceBeforeUnmapping) {
  host::Module &module = load("provider");
  const zel_ModuleID first = module.id();
  EXPECT_THAT(events, ElementsAre(Pair("provider init", 40), Pair("provider id", first)));
  EXPECT_EQ(module.function<int32_t()>("Counter_Next")(), 41);
  EXPECT_EQ(module.exported("Counter_Internal"), nullptr);
  const char *const hidden = static_cast<char *>(module.anySymbol("counterHidden"));
  EXPECT_EQ(host::symbolize(hidden + 5), "counterHidden+0x5 in provider.so");
  EXPECT_EQ(host::symbolize(reinterpret_cast<const void *>(0x10)), "0x10");

  events.clear();
  loader.unload(module);
  EXPECT_THAT(events, ElementsAre(Pair("provider cleanup", 41), Pair("quiesce", 0)));
  EXPECT_THAT(host::symbolize(hidden), testing::Not(HasSubstr("provider.so")));
  events.clear();
  EXPECT_NE(load("provider").id(), first);
  EXPECT_EQ(events[0].second, 40) << "variables are fresh";
}

TEST_F(Loader, SetsParametersBeforeInit) {
  EXPECT_THAT(loadError("provider", {"COUNTER_NAME=x"}), HasSubstr("is of type 2, which"));
  EXPECT_TRUE(events.empty());
  load("provider", {"COUNTER_START=-0x80000000"});
  EXPECT_THAT(events.front(), Pair("provider init", -2147483648LL));
}

TEST_F(Loader, LeavesNothingOfAModuleWhoseInitFails) {
  EXPECT_THAT(loadError("provider", {"COUNTER_FAIL=-1"}), HasSubstr("init_module failed with -1"));
  EXPECT_THAT(events.back(), Pair("quiesce", 0));
  EXPECT_NO_THROW(load("provider"));
  EXPECT_THAT(loadError("provider"), HasSubstr("is loaded already"));
  std::filesystem::copy_file(modulePath("provider"), scratch);
  EXPECT_THAT(errorOf([&] { loader.load(scratch); }),
              HasSubstr("provides com.example.counter, as provider.so does already"));
}

/* ---- Modules that use each other ------------------------------------------------------------- */

TEST_F(Loader, RefusesAUserByWhatItMisses) {
  EXPECT_THAT(loadError("user_undeclared"), HasSubstr("has: Counter_Next;"));
  load("provider");
  EXPECT_THAT(loadError("user_of_other_version"), HasSubstr("Provided are: com.example.host#7, "));
  EXPECT_THAT(loadError("user_of_internal"), HasSubstr("has: Counter_Internal;"));
}

TEST_F(Loader, KeepsAProviderWhileAnythingUsesIt) {
  host::Module &provider = load("provider");
  host::Module &undeclared = load("user_undeclared");
  load("user");
  EXPECT_THAT(events.back(), Pair("user init", 42));
  EXPECT_THAT(errorOf([&] { loader.unload(provider); }),
              HasSubstr("is in use by user_undeclared.so, user.so"));
  loader.unload(undeclared);
  EXPECT_THAT(errorOf([&] { loader.unload(provider); }), HasSubstr("in use by user.so;"));
}

/* In children, since what is kept is kept for good. */
TEST_F(Loader, AKeptModuleBeginsAfreshAndIsOutOfReachMeanwhile) {
  const auto countOnce = [&] { /* returns the function that did, in the module that has gone */
                               host::Module &module = load("provider");
                               auto *const next = module.function<int32_t()>("Counter_Next");
                               EXPECT_EQ(next(), 41);
                               loader.unload(module);
                               return next;
  };
  EXPECT_EXIT((host::keepUnloadedModules(), countOnce(), countOnce(), _exit(HasFailure())),
              testing::ExitedWithCode(0), "");
  EXPECT_DEATH((host::keepUnloadedModules(), countOnce()()), "");
}

TEST_F(Loader, AModuleThatCannotLeaveIsFatal) {
  EXPECT_DEATH(loader.unload(load("stays")), "stays.so stays in the process after its unload");
}

}  // namespace

extern "C" void testRecord(const char *event, int64_t value) {
  events.push_back({event, value});
}
