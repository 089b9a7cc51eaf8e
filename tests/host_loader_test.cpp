/* The module loader: what a file says about itself, what is refused and why, load and unload. */
#include "host/kernel/module_loader.h"

#include <elf.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>

namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::Pair;

using Events = std::vector<std::pair<std::string, int64_t>>;
Events events; /* what the modules told, in order */

std::string modulePath(const std::string &name) {
  return TEST_MODULES "/" + name + ".so";
}

template <typename Action>
std::string errorOf(Action action) {
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

  std::string fileError(const std::filesystem::path &path) const {
    return errorOf([&] { host::ModuleFile{path}; });
  }
  /* A new file each time: some file systems flush one that is cut to nothing and written again. */
  std::string bytesError(const std::string &bytes) const {
    std::filesystem::remove(scratch);
    std::ofstream(scratch, std::ios::binary) << bytes;
    return fileError(scratch);
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
  const size_t section = header->e_shoff + sizeof(Elf64_Shdr), segment = header->e_phoff;
  const std::tuple<size_t, char, const char *> damages[] = {
      {offsetof(Elf64_Ehdr, e_machine), '\xb7', "built for another machine"},
      {offsetof(Elf64_Ehdr, e_type), ET_REL, "not a shared object"},
      {offsetof(Elf64_Ehdr, e_shoff) + 5, 1, "is cut short; build"},
      {section + offsetof(Elf64_Shdr, sh_offset) + 5, 1, "a section lies outside"},
      {segment + offsetof(Elf64_Phdr, p_offset) + 5, 1, "a segment lies outside"},
  };
  for (const auto &[place, byte, reason] : damages) {
    std::string bytes = good;
    bytes[place] = byte;
    EXPECT_THAT(bytesError(bytes), HasSubstr(reason));
  }
  for (size_t length = 0; length < good.size(); length += 61) {
    EXPECT_NE(bytesError(good.substr(0, length)), "no error") << length;
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
  const auto refused = [&](const std::string &given) { return loadError("provider", {given}); };
  EXPECT_THAT(refused("COUNTER=1"), HasSubstr("it has: COUNTER_START, COUNTER_FAIL, COUNTER_NAME"));
  EXPECT_THAT(refused("COUNTER_START"), HasSubstr("is no NAME=VALUE"));
  EXPECT_THAT(refused("COUNTER_NAME=x"), HasSubstr("is of type 2, which"));
  for (const std::string value : {"", "1x", " 1", "0x", "--1", "+1", "0x-1"}) {
    EXPECT_THAT(refused("COUNTER_START=" + value), HasSubstr("is an int, and"));
  }
  for (const std::string value : {"2147483648", "-2147483649", "99999999999999999999"}) {
    EXPECT_THAT(refused("COUNTER_START=" + value), HasSubstr("is outside -2147483648 to"));
  }
  EXPECT_THAT(loadError("provider", {"COUNTER_START=1", "COUNTER_START=2"}), HasSubstr("twice"));
  EXPECT_TRUE(events.empty());
  load("provider", {"COUNTER_START=-0x80000000"});
  EXPECT_THAT(events.front(), Pair("provider init", -2147483648LL));
}

TEST_F(Loader, LeavesNothingOfAModuleWhoseInitFails) {
  EXPECT_THAT(loadError("provider", {"COUNTER_FAIL=-1"}), HasSubstr("init_module failed with -1"));
  EXPECT_THAT(events.back(), Pair("quiesce", 0));
  EXPECT_NO_THROW(load("provider"));
  EXPECT_THAT(loadError("provider"), HasSubstr("is loaded already"));
  bytesError(good); /* a copy of it */
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
  const auto loadOnce = [&] {
    host::keepUnloadedModules();
    events.clear();
    host::Module &module = load("provider");
    auto *const next = module.function<int32_t()>("Counter_Next");
    next();
    loader.unload(module);
    return next;
  };
  const auto loadTwice = [&] {
    loadOnce();
    const Events first = std::exchange(events, {});
    loadOnce();
    events[1] = first[1]; /* the ID is another one */
    _exit(events == first && events[2] == Events::value_type("provider cleanup", 41) ? 0 : 1);
  };
  EXPECT_EXIT(loadTwice(), testing::ExitedWithCode(0), "");
  EXPECT_DEATH(loadOnce()(), "");
}

TEST_F(Loader, AModuleThatCannotLeaveIsFatal) {
  EXPECT_DEATH(loader.unload(load("stays")), "stays.so stays in the process after its unload");
}

}  // namespace

extern "C" void testRecord(const char *event, int64_t value) {
  events.push_back({event, value});
}
