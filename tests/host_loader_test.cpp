/* The module loader: what a file says about itself, what is refused and why, load and unload. */
#include "host/kernel/module_loader.h"

#include <dlfcn.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>
#include <random>

#include "host/kernel/log.h"

namespace {

using testing::AllOf;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::Pair;
using testing::StartsWith;

using Events = std::vector<std::pair<std::string, int64_t>>;
Events events; /* what the modules told, in order */

std::filesystem::path modulePath(const std::string &name) {
  return std::filesystem::path(TEST_MODULES) / (name + ".so");
}

int64_t told(const std::string &event) {
  for (const auto &[name, value] : events) {
    if (name == event) return value;
  }
  ADD_FAILURE() << "no module told " << event;
  return -1;
}

bool isMapped(const std::string &name) {
  void *const handle = dlopen(modulePath(name).c_str(), RTLD_LAZY | RTLD_NOLOAD);
  if (handle != nullptr) dlclose(handle);
  return handle != nullptr;
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

std::string readBytes(const std::filesystem::path &path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()};
}

/* A file of the test's own, gone with it. */
class ScratchFile {
 public:
  ScratchFile()
      : path_(std::filesystem::path(testing::TempDir()) /
              (std::string("karst_loader_") + std::to_string(getpid()) + ".so")) {}
  ~ScratchFile() { std::filesystem::remove(path_); }
  const std::filesystem::path &write(const std::string &bytes) {
    /* A new file each time: some file systems flush one that is cut to nothing and written again.
     */
    std::filesystem::remove(path_);
    std::ofstream(path_, std::ios::binary) << bytes;
    return path_;
  }

 private:
  std::filesystem::path path_;
};

class Loader : public testing::Test {
 protected:
  Loader() { events.clear(); }

  host::ModuleLoader loader{{{"com.example.host", "7"}}, [] { events.push_back({"quiesce", 0}); }};

  std::string loadError(const std::string &name, const std::vector<std::string> &parameters = {}) {
    const std::string error = errorOf([&] { loader.load(modulePath(name), parameters); });
    EXPECT_THAT(error, StartsWith(modulePath(name).string() + ": "));
    return error.substr(std::min(error.size(), modulePath(name).string().size() + 2));
  }
};

/* ---- The file -------------------------------------------------------------------------------- */

TEST(ModuleFile, TellsItsDeclaration) {
  const host::ModuleFile file(modulePath("provider"));
  EXPECT_THAT(
      file.declaration,
      ElementsAre("param_COUNTER_START:int", "param_desc_COUNTER_START=Where counting starts",
                  "param_COUNTER_FAIL:int", "nsProvides=com.example.counter#1.2"));
  EXPECT_THAT(file.provides, ElementsAre(host::Namespace{"com.example.counter", "1.2"}));
  EXPECT_THAT(file.required, ElementsAre(host::Namespace{"com.example.host", "7"}));
  EXPECT_THAT(file.exports, ElementsAre("Counter_Next"));
  EXPECT_THAT(file.undefinedSymbols, testing::IsSupersetOf({"testRecord", "zel_ModuleCurrentID"}));
}

TEST(ModuleFile, TellsParametersAndAssertionsThroughTheirRelocatedPointers) {
  const host::ModuleFile file(modulePath("provider"));
  ASSERT_EQ(file.parameters.size(), 3u);
  EXPECT_EQ(file.parameters[0].name, "COUNTER_START");
  EXPECT_EQ(file.parameters[0].type, host::kParameterInt);
  EXPECT_EQ(file.parameters[0].description, "Where counting starts");
  EXPECT_EQ(file.parameters[1].description, "");
  EXPECT_EQ(file.parameters[2].type, 2u);
  ASSERT_EQ(file.assertions.size(), 2u);
  EXPECT_EQ(file.assertions[1].kind, 1u);
  EXPECT_EQ(file.assertions[1].source, "counter/wrap");
  EXPECT_EQ(file.assertions[1].line, 99u);
}

TEST(ModuleFile, IsRefusedForEachFaultByName) {
  const auto errorOfFault = [](int fault) {
    return errorOf([=] { host::ModuleFile{modulePath("broken" + std::to_string(fault))}; });
  };
  EXPECT_EQ(errorOfFault(0), "no error");
  EXPECT_THAT(errorOfFault(1), HasSubstr("has no section .karst.modinfo"));
  EXPECT_THAT(errorOfFault(2), HasSubstr("has no section .karst.required"));
  EXPECT_THAT(errorOfFault(3), HasSubstr("the last string of .karst.modinfo does not end"));
  EXPECT_THAT(errorOfFault(4), HasSubstr("\"com.example.host\" is no namespace"));
  EXPECT_THAT(errorOfFault(5), HasSubstr("size of .karst.params is no multiple of 40"));
  EXPECT_THAT(errorOfFault(6), HasSubstr("a string lies outside of it, at 0x7fffffffffff"));
  EXPECT_THAT(errorOfFault(7), HasSubstr("variable of parameter VARIABLE cannot be written"));
  EXPECT_THAT(errorOfFault(8), HasSubstr("exports Missing_Export, which it does not define"));
  EXPECT_THAT(errorOfFault(9), HasSubstr("does not define init_module"));
}

TEST(ModuleFile, IsRefusedWhenItIsNoModuleOfThisMachine) {
  ScratchFile scratch;
  const auto errorOfBytes = [&](const std::string &bytes) {
    return errorOf([&] { host::ModuleFile{scratch.write(bytes)}; });
  };
  EXPECT_THAT(errorOf([] { host::ModuleFile{"/nowhere/at/all.so"}; }), HasSubstr("no such file"));
  EXPECT_THAT(errorOf([] { host::ModuleFile{"/"}; }), HasSubstr("is not a file"));
  EXPECT_THAT(errorOfBytes(""), HasSubstr("is not an ELF file"));
  EXPECT_THAT(errorOfBytes("#!/bin/sh\n"), HasSubstr("is not an ELF file"));

  const std::string good = readBytes(modulePath("provider"));
  std::string bytes = good;
  bytes[18] = '\xb7'; /* e_machine: another processor */
  EXPECT_THAT(errorOfBytes(bytes), HasSubstr("built for another machine"));
  bytes = good;
  bytes[16] = 1; /* e_type: an object file */
  EXPECT_THAT(errorOfBytes(bytes), HasSubstr("not a shared object"));
  EXPECT_THAT(errorOf([] { host::ModuleFile{"/proc/self/exe"}; }), HasSubstr("no section .karst"));
}

TEST(ModuleFile, IsRefusedAtEveryLengthThatIsCutShort) {
  ScratchFile scratch;
  const std::string good = readBytes(modulePath("provider"));
  for (size_t length = 0; length < good.size(); length += 61) {
    EXPECT_NE(errorOf([&] { host::ModuleFile{scratch.write(good.substr(0, length))}; }), "no error")
        << length << " of " << good.size() << " bytes";
  }
}

TEST(ModuleFile, MangledBytesAreReadOrRefusedButDoNoHarm) {
  ScratchFile scratch;
  const std::string good = readBytes(modulePath("provider"));
  /* The tables that pointers and sizes come from: both ends of the file, and the middle at large.
   */
  constexpr size_t kEnds = 4096;
  std::mt19937 random(20240607);
  size_t refused = 0;
  for (int round = 0; round < 3000; round++) {
    std::string bytes = good;
    const unsigned changes = 1 + random() % 8;
    for (unsigned change = 0; change < changes; change++) {
      size_t place = random() % bytes.size();
      if (round % 3 == 0) place = random() % std::min(kEnds, bytes.size());
      if (round % 3 == 1) place = bytes.size() - 1 - random() % std::min(kEnds, bytes.size());
      bytes[place] = static_cast<char>(random() % 4 == 0 ? 0xff : random());
    }
    const std::string error = errorOf([&] { host::ModuleFile{scratch.write(bytes)}; });
    if (error != "no error") refused++;
  }
  EXPECT_GT(refused, 300u); /* the mangling reaches what is read */
}

/* ---- Load ------------------------------------------------------------------------------------ */

TEST_F(Loader, CallsInitWithAnIDOfItsOwnThenCleanupAndQuiesceBeforeUnmapping) {
  host::Module &module = loader.load(modulePath("provider"));
  EXPECT_EQ(module.name(), "provider.so");
  EXPECT_EQ(told("provider init"), 40);
  EXPECT_EQ(told("provider id"), module.id());
  EXPECT_TRUE(isMapped("provider"));
  const zel_ModuleID firstID = module.id();

  events.clear();
  loader.unload(module);
  EXPECT_THAT(events, ElementsAre(Pair("provider cleanup", 40), Pair("quiesce", 0)));
  EXPECT_FALSE(isMapped("provider"));
  EXPECT_THAT(loader.modules(), IsEmpty());
  EXPECT_NE(loader.load(modulePath("provider")).id(), firstID);
}

TEST_F(Loader, StartsEachLoadWithFreshVariables) {
  for (int round = 0; round < 50; round++) {
    host::Module &module = loader.load(modulePath("provider"));
    ASSERT_EQ(module.function<int32_t()>("Counter_Next")(), 41);
    loader.unload(module);
  }
}

TEST_F(Loader, GivesExportsOnlyToClientsAndEverySymbolToReports) {
  host::Module &module = loader.load(modulePath("provider"));
  EXPECT_NE(module.exported("Counter_Next"), nullptr);
  EXPECT_EQ(module.exported("Counter_Internal"), nullptr);
  EXPECT_EQ(module.exported("counterHidden"), nullptr);
  EXPECT_EQ(*static_cast<int64_t *>(module.anySymbol("counterHidden")), 0x1234);
  EXPECT_EQ(module.anySymbol("Counter_Next"), module.exported("Counter_Next"));
  EXPECT_EQ(module.anySymbol("counterNever"), nullptr);
}

TEST_F(Loader, SetsParametersBeforeInit) {
  loader.load(modulePath("provider"), {"COUNTER_START=-2147483648"});
  EXPECT_EQ(told("provider init"), -2147483648LL);
}

TEST_F(Loader, TakesDecimalAndHexadecimalInts) {
  const std::pair<const char *, int64_t> values[] = {
      {"0", 0}, {"2147483647", 2147483647}, {"0xa00000", 0xa00000}, {"-0x10", -16}, {"-1", -1}};
  for (const auto &[text, value] : values) {
    events.clear();
    loader.unload(loader.load(modulePath("provider"), {std::string("COUNTER_START=") + text}));
    EXPECT_EQ(told("provider init"), value) << text;
  }
}

TEST_F(Loader, RefusesParametersThatAreNotTheModules) {
  const auto refused = [&](const char *assignment) { return loadError("provider", {assignment}); };
  EXPECT_THAT(refused("COUNTER=1"),
              AllOf(HasSubstr("has no parameter COUNTER;"),
                    HasSubstr("it has: COUNTER_START, COUNTER_FAIL, COUNTER_NAME")));
  EXPECT_THAT(refused("COUNTER_START"), HasSubstr("is no NAME=VALUE"));
  for (const char *value : {"", "1x", " 1", "1 ", "0x", "-", "--1", "+1", "0x-1", "1.5", "ten"}) {
    EXPECT_THAT(refused((std::string("COUNTER_START=") + value).c_str()), HasSubstr("is an int"))
        << value;
  }
  for (const char *value :
       {"2147483648", "-2147483649", "0xffffffff", "99999999999999999999", "-0x8000000000000000"}) {
    EXPECT_THAT(refused((std::string("COUNTER_START=") + value).c_str()),
                HasSubstr("is outside -2147483648 to 2147483647"))
        << value;
  }
  EXPECT_THAT(refused("COUNTER_NAME=x"), HasSubstr("is of type 2, which this host does not know"));
  EXPECT_THAT(loadError("provider", {"COUNTER_START=1", "COUNTER_START=2"}),
              HasSubstr("given twice"));
  EXPECT_THAT(events, IsEmpty());
}

TEST_F(Loader, LeavesNothingOfAModuleWhoseInitFails) {
  EXPECT_THAT(loadError("provider", {"COUNTER_FAIL=-1"}), HasSubstr("init_module failed with -1"));
  EXPECT_EQ(events.back(), std::make_pair(std::string("quiesce"), int64_t{0}));
  EXPECT_FALSE(isMapped("provider"));
  EXPECT_THAT(loader.modules(), IsEmpty());
  EXPECT_NO_THROW(loader.load(modulePath("provider")));
}

TEST_F(Loader, RefusesWhatIsLoadedAlready) {
  loader.load(modulePath("provider"));
  EXPECT_THAT(loadError("provider"), HasSubstr("is loaded already"));

  ScratchFile copy;
  const auto &path = copy.write(readBytes(modulePath("provider")));
  EXPECT_THAT(errorOf([&] { loader.load(path); }),
              HasSubstr("provides com.example.counter, as provider.so does already"));
  EXPECT_EQ(loader.modules().size(), 1u);
}

/* ---- Modules that use each other ------------------------------------------------------------- */

TEST_F(Loader, BindsAUserToItsProvider) {
  loader.load(modulePath("provider"));
  loader.load(modulePath("user"));
  EXPECT_EQ(told("user init"), 41);
}

TEST_F(Loader, RefusesAUserWhoseNamespaceIsMissingOrOfAnotherVersion) {
  EXPECT_THAT(loadError("user"), AllOf(HasSubstr("requires com.example.counter#1.2"),
                                       HasSubstr("Provided are: com.example.host#7")));
  loader.load(modulePath("provider"));
  EXPECT_THAT(loadError("user_of_other_version"),
              AllOf(HasSubstr("requires com.example.counter#1.3, which nobody provides"),
                    HasSubstr("Provided are: com.example.host#7, com.example.counter#1.2")));
  EXPECT_THAT(loadError("user_of_nobody"), HasSubstr("requires com.example.nobody#1.2"));
  EXPECT_EQ(loader.modules().size(), 1u);
}

TEST_F(Loader, RefusesAUserOfSymbolsThatNobodyExports) {
  EXPECT_THAT(loadError("user_undeclared"), HasSubstr("has: Counter_Next;"));
  loader.load(modulePath("provider"));
  EXPECT_THAT(loadError("user_of_missing"), HasSubstr("has: Counter_Missing;"));
  EXPECT_THAT(loadError("user_of_internal"), HasSubstr("has: Counter_Internal;"));
}

TEST_F(Loader, KeepsAProviderWhileAnythingUsesIt) {
  host::Module &provider = loader.load(modulePath("provider"));
  host::Module &user = loader.load(modulePath("user"));
  host::Module &undeclared = loader.load(modulePath("user_undeclared"));
  EXPECT_THAT(errorOf([&] { loader.unload(provider); }),
              HasSubstr("is in use by user.so, user_undeclared.so"));
  loader.unload(user);
  EXPECT_THAT(errorOf([&] { loader.unload(provider); }), HasSubstr("by user_undeclared.so;"));
  loader.unload(undeclared);
  loader.unload(provider);
  EXPECT_FALSE(isMapped("provider"));
}

TEST(LoaderEnd, UnloadsTheLastFirst) {
  events.clear();
  {
    host::ModuleLoader loader({{"com.example.host", "7"}}, [] {});
    loader.load(modulePath("provider"));
    loader.load(modulePath("user"));
    events.clear();
  }
  EXPECT_THAT(events, ElementsAre(Pair("user cleanup", 42), Pair("provider cleanup", 42)));
  EXPECT_FALSE(isMapped("provider"));
}

TEST(LoaderDeathTest, AModuleThatCannotLeaveIsFatal) {
  EXPECT_DEATH(
      {
        host::ModuleLoader loader({{"com.example.host", "7"}}, [] {});
        loader.unload(loader.load(modulePath("stays")));
      },
      "stays.so stays in the process after its unload");
}

/* ---- Symbols --------------------------------------------------------------------------------- */

TEST_F(Loader, NamesAddressesOfModulesWhileTheyAreLoaded) {
  host::Module &module = loader.load(modulePath("provider"));
  const auto *const hidden = static_cast<const char *>(module.anySymbol("counterHidden"));
  EXPECT_EQ(host::symbolize(hidden + 5), "counterHidden+0x5 in provider.so");
  const auto *const init = reinterpret_cast<const void *>(told("provider address"));
  EXPECT_THAT(host::symbolize(init), AllOf(StartsWith("init_module+0x"), HasSubstr("provider.so")));
  loader.unload(module);
  EXPECT_THAT(host::symbolize(hidden), testing::Not(HasSubstr("provider.so")));
}

TEST(Symbols, NamesTheProgramsOwnAndStrangers) {
  const auto *const own = reinterpret_cast<const char *>(&host::setLogThreshold);
  EXPECT_THAT(host::symbolize(own + 1),
              StartsWith("host::setLogThreshold(host::LogThreshold)+0x1 in "));
  EXPECT_EQ(host::symbolize(reinterpret_cast<const void *>(0x10)), "0x10");
}

}  // namespace

extern "C" void testRecord(const char *event, int64_t value) {
  events.push_back({event, value});
}
