/* The module loader: what a file says about itself, what is refused and why, load and unload. */
#include "host/kernel/module_loader.h"

#include <elf.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
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
  Loader() {
    events.clear();
    std::ifstream file(modulePath("provider"), std::ios::binary);
    good.assign(std::istreambuf_iterator<char>(file), {});
  }
  ~Loader() override { std::filesystem::remove(scratch); }

  static std::string fileError(const std::string &path) {
    return errorOf([&] { host::ModuleFile{path}; });
  }
  /* A new file each time: some file systems flush one that is cut to nothing and written again. */
  void writeScratch(const std::string &bytes) const {
    std::filesystem::remove(scratch);
    std::ofstream(scratch, std::ios::binary) << bytes;
  }
  host::Module &load(const std::string &name, const std::vector<std::string> &parameters = {}) {
    return loader.load(modulePath(name), parameters);
  }
  std::string loadError(const std::string &name, const std::vector<std::string> &parameters = {}) {
    return errorOf([&] { load(name, parameters); });
  }

  const std::string scratch = testing::TempDir() + "loader" + std::to_string(getpid()) + ".so";
  std::string good; /* the provider's bytes */
  host::ModuleLoader loader{{{"com.example.host", "7"}}, [] { events.push_back({"quiesce", 0}); }};
};

/* ---- The file -------------------------------------------------------------------------------- */

TEST_F(Loader, RefusesEachFaultOfAFileByNameAndEveryCut) {
  const char *const faults[] = {"no error",
                                "has no section .karst.modinfo",
                                "has no section .karst.required",
                                "the last string of .karst.modinfo does not end",
                                "\"com.example.host\" is no namespace",
                                "size of .karst.params is no multiple of 40",
                                "a string lies outside of it, at 0x7fffffffffff",
                                "variable of parameter VARIABLE cannot be written",
                                "exports Missing_Export, which it does not define",
                                "does not define init_module"};
  for (size_t fault = 0; fault < std::size(faults); fault++) {
    EXPECT_THAT(fileError(modulePath("broken" + std::to_string(fault))), HasSubstr(faults[fault]));
  }
  const auto *header = reinterpret_cast<const Elf64_Ehdr *>(good.data());
  const std::tuple<size_t, char, const char *> damages[] = {
      {offsetof(Elf64_Ehdr, e_machine), '\xb7', "built for another machine"},
      {offsetof(Elf64_Ehdr, e_type), ET_REL, "not a shared object"},
      {header->e_shoff + sizeof(Elf64_Shdr) + offsetof(Elf64_Shdr, sh_offset) + 5, 1, "outside"},
      {header->e_phoff + offsetof(Elf64_Phdr, p_offset) + 5, 1, "outside"},
  };
  for (const auto &[place, byte, reason] : damages) {
    std::string damaged = good;
    damaged[place] = byte;
    writeScratch(damaged);
    EXPECT_THAT(fileError(scratch), HasSubstr(reason));
  }
  for (size_t length = 0; length < good.size(); length += 61) {
    writeScratch(good.substr(0, length));
    EXPECT_NE(fileError(scratch), "no error") << length;
  }
}

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

TEST_F(Loader, ChecksParametersAndSetsThemBeforeInit) {
  const std::pair<std::vector<std::string>, const char *> refusals[] = {
      {{"COUNTER=1"}, "it has: COUNTER_START, COUNTER_FAIL, COUNTER_NAME"},
      {{"COUNTER_START"}, "is no NAME=VALUE"},
      {{"COUNTER_NAME=x"}, "is of type 2, which"},
      {{"COUNTER_START="}, "is an int, and"},
      {{"COUNTER_START=1x"}, "is an int, and"},
      {{"COUNTER_START=+1"}, "is an int, and"},
      {{"COUNTER_START=0x-1"}, "is an int, and"},
      {{"COUNTER_START=2147483648"}, "is outside -2147483648 to"},
      {{"COUNTER_START=-2147483649"}, "is outside -2147483648 to"},
      {{"COUNTER_START=99999999999999999999"}, "is outside -2147483648 to"},
      {{"COUNTER_START=1", "COUNTER_START=2"}, "twice"},
  };
  for (const auto &[parameters, reason] : refusals) {
    EXPECT_THAT(loadError("provider", parameters), HasSubstr(reason));
  }
  EXPECT_TRUE(events.empty());
  load("provider", {"COUNTER_START=-0x80000000"});
  EXPECT_THAT(events.front(), Pair("provider init", -2147483648LL));
}

TEST_F(Loader, LeavesNothingOfAModuleWhoseInitFails) {
  EXPECT_THAT(loadError("provider", {"COUNTER_FAIL=-1"}), HasSubstr("init_module failed with -1"));
  EXPECT_THAT(events.back(), Pair("quiesce", 0));
  EXPECT_NO_THROW(load("provider"));
  EXPECT_THAT(loadError("provider"), HasSubstr("is loaded already"));
  writeScratch(good);
  EXPECT_THAT(errorOf([&] { loader.load(scratch); }),
              HasSubstr("provides com.example.counter, as provider.so does already"));
}

/* ---- Modules that use each other ------------------------------------------------------------- */

TEST_F(Loader, RefusesAUserByWhatItMisses) {
  EXPECT_THAT(loadError("user"), HasSubstr("user.so: requires com.example.counter#1.2"));
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
