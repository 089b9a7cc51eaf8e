/* The karst command, run as people and programs run it: its text, its JSON, its exit status. Each
 * run is a process of its own; files live in a folder that goes with the test.
 */
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

namespace {

using nlohmann::json;
using testing::AllOf;
using testing::EndsWith;
using testing::HasSubstr;
using testing::StartsWith;

/* Seconds after which a command that has not ended, and should have, is killed. */
constexpr unsigned kPatience = 120;

using Arguments = std::vector<std::string>;

/* A run of the command. Its two outputs come through pipes. */
class Command {
 public:
  explicit Command(const Arguments &arguments) {
    std::array<int, 2> out{};
    std::array<int, 2> err{};
    EXPECT_EQ(0, pipe2(out.data(), O_CLOEXEC) + pipe2(err.data(), O_CLOEXEC));
    std::vector<char *> argv{const_cast<char *>(KARST_COMMAND)};
    for (const auto &argument : arguments) argv.push_back(const_cast<char *>(argument.c_str()));
    argv.push_back(nullptr);
    pid_ = fork();
    if (pid_ == 0) {
      dup2(out[1], STDOUT_FILENO);
      dup2(err[1], STDERR_FILENO);
      alarm(kPatience);
      execv(KARST_COMMAND, argv.data());
      _exit(127);
    }
    close(out[1]);
    close(err[1]);
    out_ = fdopen(out[0], "r");
    err_ = fdopen(err[0], "r");
  }
  ~Command() {
    closeOutput();
    fclose(err_);
    if (pid_ > 0) kill(pid_, SIGKILL);
    if (pid_ > 0) waitpid(pid_, nullptr, 0);
  }

  /* The next line, without its newline, or all that is left; empty at the end. */
  std::string line() { return readTo('\n', out_); }
  std::string errorLine() { return readTo('\n', err_); }
  std::string rest() { return readTo(EOF, out_); }
  std::string errors() { return readTo(EOF, err_); }

  /* Reads lines up to the first that has the text, and returns that; empty without one. */
  std::string lineWith(const std::string &text) {
    std::string next = line();
    while (next.find(text) == std::string::npos && feof(out_) == 0) next = line();
    return next;
  }

  void signal(int number) { kill(pid_, number); }
  void closeOutput() {
    if (out_ != nullptr) fclose(std::exchange(out_, nullptr));
  }

  /* The exit status; -1 when a signal ended it. */
  int status() {
    int status = 0;
    waitpid(std::exchange(pid_, -1), &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

 private:
  static std::string readTo(int end, FILE *stream) {
    std::string text;
    int next = 0;
    while ((next = getc(stream)) != end && next != EOF) text.push_back(static_cast<char>(next));
    return text;
  }

  pid_t pid_ = -1;
  FILE *out_ = nullptr;
  FILE *err_ = nullptr;
};

struct Result {
  int status;
  std::string out;
  std::string err;
};

Result runToEnd(const Arguments &arguments) {
  Command run(arguments);
  const std::string out = run.rest();
  const std::string err = run.errors();
  return {run.status(), out, err};
}

std::string uuid(char kind, unsigned number) {
  std::array<char, 40> text{};
  snprintf(text.data(), text.size(), "%c0000000-0000-4000-8000-%012x", kind, number);
  return text.data();
}
const auto node = [](unsigned number) { return uuid('a', number); };
const auto object = [](unsigned number) { return uuid('c', number); };

json interface(unsigned number, const json &more) {
  json value{{"uuid", uuid('b', number)}};
  value.update(more);
  return value;
}
json interfaceAt(unsigned number, const json &addresses) {
  return interface(number, {{"addresses", addresses}});
}

/* Nodes with an interface each, or several. */
json crowd(unsigned nodes, unsigned interfacesEach) {
  json content{{"nodes", json::array()}};
  for (unsigned n = 1; n <= nodes; n++) {
    json interfaces;
    for (unsigned i = 0; i < interfacesEach; i++) {
      const std::string address =
          std::to_string(n) + "." + std::to_string(i / 200) + "." + std::to_string(i % 200 + 1);
      interfaces.push_back(interfaceAt(n * 1000 + i, {"10." + address}));
    }
    content["nodes"].push_back({{"uuid", node(n)}, {"interfaces", interfaces}});
  }
  return content;
}

class Cli : public testing::Test {
 protected:
  Cli() {
    std::string pattern = testing::TempDir() + "karst_cli_XXXXXX";
    folder_ = mkdtemp(pattern.data());
    file_ = folder_ / "cluster.json";
  }
  ~Cli() override { std::filesystem::remove_all(folder_); }

  /* Puts a whole new file into the old one's place. */
  void writeText(const std::string &text) {
    const std::filesystem::path fresh = folder_ / "fresh.json";
    std::ofstream(fresh) << text;
    std::filesystem::rename(fresh, file_);
  }
  void write(const json &content) { writeText(content.dump()); }

  Arguments with(const char *command, const Arguments &targets, const Arguments &more = {}) const {
    Arguments arguments{command, "--directory", file_.string()};
    arguments.insert(arguments.end(), more.begin(), more.end());
    arguments.insert(arguments.end(), targets.begin(), targets.end());
    return arguments;
  }

  /* What `resolve` says of one target as JSON. */
  json resolveOne(const Arguments &target) const {
    const Result result = runToEnd(with("resolve", target, {"--json", "--log", "off"}));
    const json answer = json::parse(result.out);
    EXPECT_EQ("", result.err);
    EXPECT_EQ(answer.at("state") == "resolved" ? 0 : 1, result.status);
    return answer;
  }
  std::string reason(const Arguments &target) const {
    return resolveOne(target).value("reason", "(resolved)");
  }

  /* Two nodes, alder and birch, and an object that one of them owns. */
  static json pair(unsigned owner) {
    return {
        {"nodes",
         {{{"uuid", node(1)},
           {"name", "alder"},
           {"version", {{"major", 7}, {"minor", 2}}},
           {"interfaces", {interfaceAt(1, {"192.0.2.1", "2001:db8::1"})}}},
          {{"uuid", node(2)}, {"name", "birch"}, {"interfaces", {interfaceAt(2, {"192.0.2.2"})}}}}},
        {"objects",
         {{{"type", 9}, {"uuid", object(1)}, {"name", "disk"}, {"owner", node(owner)}}}}};
  }

  std::filesystem::path folder_;
  std::filesystem::path file_;
};

/* ---- Help and usage -------------------------------------------------------------------------- */

TEST_F(Cli, HelpTeachesByExampleOnStandardOutput) {
  for (const char *command : {"resolve", "watch", "modinfo"}) {
    const Result page = runToEnd({command, "--help"});
    EXPECT_EQ(0, page.status);
    EXPECT_EQ("", page.err);
    EXPECT_THAT(page.out, AllOf(HasSubstr("Examples:\n  karst " + std::string(command) + " "),
                                HasSubstr("Exit status")));
    EXPECT_THAT(runToEnd({"--help"}).out, HasSubstr(std::string("  karst ") + command));
  }
  EXPECT_EQ("karst " KARST_VERSION "\n", runToEnd({"--version"}).out);
}

TEST_F(Cli, BadUsageIsStatusTwoWithWhatToDoAndNothingOnStandardOutput) {
  write(pair(1));
  const std::string file = file_.string();
  const std::string broken = (folder_ / "broken.json").string();
  std::ofstream(broken) << R"({"nodes": [{"uuid": "12"}]})";
  struct Row {
    Arguments arguments;
    const char *message;
  };
  const std::vector<Row> rows{
      {{}, "give a command: resolve, watch or modinfo\nkarst --help shows how"},
      {{"resolve"}, "what to resolve? Give --all, node UUID or object TYPE UUID"},
      {{"resolve", "--directory", file, "--all", "node", node(1)}, "either --all or targets"},
      {{"resolve", "--directory", file, "node", "12"}, "node wants a UUID, not \"12\""},
      {{"resolve", "--directory", file, "node", "00000000-0000-0000-0000-000000000000"},
       "the all-zero UUID stands for none"},
      {{"resolve", "--directory", file, "disk", node(1)}, "\"disk\" begins no target"},
      {{"resolve", "--directory", file, "object", "256", object(1)}, "\"256\" is no type"},
      {{"resolve", "--directory", file, "node", node(1), "--hint", node(2)}, "--hint stands right"},
      {{"resolve", "--directory", file, "--all", "--self", "me"}, "--self wants a UUID"},
      {{"resolve", "--directory", file, "--all", "--param", "X=1"}, "no parameter X"},
      {{"resolve", "--directory", file, "--all", "--module", file}, "not an ELF file"},
      {{"resolve", "--directory", file + ".gone", "--all"}, "cannot be opened"},
      {{"resolve", "--directory", broken, "--all"}, "/nodes/0/uuid"},
      {{"modinfo", file + ".gone"}, "there is no such file"},
  };
  for (const Row &row : rows) {
    const Result result = runToEnd(row.arguments);
    SCOPED_TRACE(testing::PrintToString(row.arguments));
    EXPECT_EQ(2, result.status);
    EXPECT_EQ("", result.out);
    EXPECT_THAT(result.err, AllOf(StartsWith("karst"), HasSubstr(row.message), EndsWith("\n")));
  }
}

/* ---- resolve --------------------------------------------------------------------------------- */

TEST_F(Cli, TableIsAlignedAndSorted) {
  json content = pair(2);
  content["nodes"][1]["interfaces"][0]["healthy"] = false;
  content["objects"].push_back({{"type", 2}, {"uuid", object(2)}, {"owner", node(1)}});
  write(content);
  const Result result = runToEnd(with("resolve", {"--all"}));
  EXPECT_EQ(1, result.status);
  EXPECT_EQ("", result.err);
  EXPECT_EQ(
      "TARGET                                         NAME   STATE       NODE   VERSION  TRAFFIC  "
      "LOCATORS\n"
      "node a0000000-0000-4000-8000-000000000001      alder  resolved    alder  7.2      0        "
      "192.0.2.1 2001:db8::1\n"
      "node a0000000-0000-4000-8000-000000000002      birch  unresolved  no healthy interface (1 "
      "unhealthy)\n"
      "object 2 c0000000-0000-4000-8000-000000000002         resolved    alder  7.2      0        "
      "192.0.2.1 2001:db8::1\n"
      "object 9 c0000000-0000-4000-8000-000000000001  disk   unresolved  owner birch: no healthy "
      "interface (1 unhealthy)\n",
      result.out);
}

TEST_F(Cli, NamesAreShownShortAndWithoutTheirControlCharacters) {
  json content = pair(1);
  content["nodes"][0]["name"] = "a\x1b[31mb\u009bc";
  content["nodes"][1]["name"] = "\u00fcber and beyond the table";
  write(content);
  const std::string table = runToEnd(with("resolve", {"node", node(1), "node", node(2)})).out;
  EXPECT_THAT(table, AllOf(HasSubstr("  a?[31mb?c         resolved  "),
                           HasSubstr("  \u00fcber and beyond…  resolved  ")));
}

TEST_F(Cli, JsonHasALineForEachTargetInTheOrderOfTheCommandLine) {
  write(pair(1));
  Command run(
      with("resolve", {"object", "0x8", object(1), "--hint", node(1), "--json", "node", node(3)}));
  EXPECT_EQ(json::parse(R"({
    "kind": "object", "type": 8, "uuid": "c0000000-0000-4000-8000-000000000001", "name": "disk",
    "hint": "a0000000-0000-4000-8000-000000000001", "state": "resolved",
    "node": {"uuid": "a0000000-0000-4000-8000-000000000001", "name": "alder"},
    "version": {"major": 7, "minor": 2}, "trafficType": 0,
    "locators": [{"type": "ipv4", "address": "192.0.2.1"},
                 {"type": "ipv6", "address": "2001:db8::1"}]})"),
            json::parse(run.line()));
  EXPECT_EQ(json::parse(R"({
    "kind": "node", "uuid": "a0000000-0000-4000-8000-000000000003",
    "state": "unresolved", "reason": "no entry for the node"})"),
            json::parse(run.line()));
}

TEST_F(Cli, ThisHostAnswersItselfWhenAsked) {
  write(pair(2));
  const json own = resolveOne({"--self", node(2), "--local", "node", node(2)});
  EXPECT_EQ(json::array({{{"type", "local"}}}), own.at("locators"));
  const json other = resolveOne({"--self", node(2), "--local", "node", node(1)});
  EXPECT_EQ("ipv4", other.at("locators").at(0).at("type"));
  EXPECT_THAT(runToEnd(with("resolve", {"--self", node(2), "--local", "node", node(2)})).out,
              HasSubstr("this host\n"));
}

TEST_F(Cli, OwnInterfacesAreThoseOfThisHostsNodeWhichTheFileMayName) {
  write(pair(2));
  const json both = resolveOne({"--own-interfaces", "--self", node(1), "node", node(1)});
  EXPECT_EQ("alder", both.at("name"));
  EXPECT_THAT(both.at("locators").dump(), HasSubstr("192.0.2.1"));
  const json alone = json::parse(
      runToEnd({"resolve", "--own-interfaces", "--self", node(9), "--all", "--json"}).out);
  EXPECT_EQ(node(9), alone.at("uuid"));
  EXPECT_EQ("this host", alone.at("name"));
}

/* ---- Why not --------------------------------------------------------------------------------- */

TEST_F(Cli, SaysWhatInterfacesLack) {
  const json sick{{"ipv4", "192.0.2.1"}, {"healthy", false}};
  const json unknown{{"ipv4", "192.0.2.1"}, {"healthy", nullptr}};
  const json other{{"ipv4", "192.0.2.1"}, {"trafficTypes", {5}}};
  const struct {
    std::vector<json> interfaces;
    bool witness;
    const char *reason;
  } rows[] = {
      {{}, false, "the node has no interface"},
      {{sick, unknown, sick}, false, "no healthy interface (2 unhealthy, 1 without health entry)"},
      {{sick, other},
       false,
       "no healthy interface carries traffic type 0 (1 unhealthy, 1 for other traffic)"},
      {{other}, true, "no healthy interface carries traffic type 1 (1 for other traffic)"},
      {{{{"networkType", 9}}},
       false,
       "no healthy interface of a known network type (1 of unknown network type 9)"},
      {{json::object()}, false, "no healthy interface with an address (1 without an address)"},
      {{{{"rawRecord", "a1"}}},
       false,
       "no interface whose entry can be decoded (1 undecodable (EXPR_MSH_TRUNCATED))"},
  };
  for (const auto &row : rows) {
    json interfaces = json::array();
    for (const json &more : row.interfaces) {
      interfaces.push_back(interface(static_cast<unsigned>(interfaces.size()), more));
    }
    write({{"nodes", {{{"uuid", node(1)}, {"witness", row.witness}, {"interfaces", interfaces}}}}});
    EXPECT_EQ(row.reason, reason({"node", node(1)}));
  }
}

TEST_F(Cli, SaysWhichEntryIsMissingOrBroken) {
  json content = pair(2);
  content["nodes"][1].erase("interfaces");
  content["nodes"].push_back({{"uuid", node(4)}, {"name", "elm"}, {"rawRecord", "00"}});
  content["self"] = node(3);
  content["objects"].push_back({{"type", 9}, {"uuid", object(3)}, {"owner", node(3)}});
  write(content);
  EXPECT_EQ("no entry for the node", reason({"node", node(3)}));
  EXPECT_EQ("the node's entry cannot be decoded (EXPR_MSH_MALFORMED)", reason({"node", node(4)}));
  EXPECT_EQ("no entry for the object", reason({"object", "8", object(1)}));
  EXPECT_EQ("owner birch: the node has no interface", reason({"object", "9", object(1)}));
  EXPECT_EQ("owner " + node(3) + ": no entry for the node", reason({"object", "9", object(3)}));
  EXPECT_EQ(
      "no entry for the object; hinted node elm: the node's entry cannot be decoded "
      "(EXPR_MSH_MALFORMED)",
      reason({"object", "8", object(1), "--hint", node(4)}));
}

TEST_F(Cli, AFullResolverAnswersForAllThatItHasRoomForAndSaysThatItIsFull) {
  write(crowd(128, 4));
  const Result result = runToEnd(with("resolve", {"--all", "--json"}));
  EXPECT_EQ(0, result.status);
  EXPECT_EQ(128, std::count(result.out.begin(), result.out.end(), '\n'));
  write(crowd(129, 1));
  EXPECT_THAT(runToEnd(with("resolve", {"--all"})).out,
              HasSubstr("the resolver is full: it knows 128 nodes, the directory has 129"));
  json content = crowd(1, 512);
  content["nodes"].push_back(crowd(2, 1)["nodes"][1]);
  write(content);
  EXPECT_EQ("the resolver is full: it knows 512 interfaces, the directory has 513",
            reason({"node", node(2)}));
}

/* ---- watch ----------------------------------------------------------------------------------- */

TEST_F(Cli, WatchFollowsChangesUntilInterrupted) {
  write(pair(1));
  Command run(with("watch", {"--all"}));
  EXPECT_THAT(run.lineWith("object 9"), HasSubstr("alder  7.2"));

  json content = pair(1);
  content["nodes"][1]["interfaces"][0]["healthy"] = false;
  write(content);
  EXPECT_THAT(run.lineWith("node birch"),
              EndsWith("  node birch  unresolved  no healthy interface (1 unhealthy)"));

  /* A refused file leaves the answer as it was: the next line is of the next change. */
  writeText(R"({"nodes": [], "nod": 1})");
  EXPECT_THAT(run.errorLine(), AllOf(HasSubstr("cluster.json"), HasSubstr("nod")));
  write(pair(2));
  EXPECT_THAT(run.lineWith("object 9 disk"), EndsWith("its owner changed from alder to birch"));
  EXPECT_THAT(run.lineWith("object 9 disk  resolved"),
              EndsWith("resolved  birch 0.0, traffic type 0: 192.0.2.2"));

  content["nodes"].push_back({{"uuid", node(3)}});
  write(content);
  EXPECT_THAT(run.lineWith("node " + node(3)), EndsWith("unresolved  the node has no interface"));

  run.signal(SIGINT);
  EXPECT_THAT(run.rest(), EndsWith("\nstopped: instances destroyed, module unloaded, nothing left "
                                   "behind\n"));
  EXPECT_EQ("", run.errors());
  EXPECT_EQ(0, run.status());
}

TEST_F(Cli, WatchInJsonTellsStartCallbacksRetriesAndEnd) {
  write(pair(1));
  Command run(with("watch", {"--json", "node", node(1), "node", node(3)}));
  const json first = json::parse(run.line());
  EXPECT_EQ("start", first.at("event"));
  EXPECT_EQ("resolved", first.at("state"));
  EXPECT_THAT(first.at("time").get<std::string>(),
              testing::MatchesRegex("20..-..-..T..:..:...[0-9]+[-+][0-9]+"));
  EXPECT_EQ("no entry for the node", json::parse(run.line()).at("reason"));

  /* A target that was unknown at the start is tried again; why it is not resolved may change. */
  json content = pair(1);
  content["nodes"].push_back({{"uuid", node(3)}});
  write(content);
  const json retry = json::parse(run.line());
  EXPECT_EQ("retry", retry.at("event"));
  EXPECT_EQ("the node has no interface", retry.at("reason"));
  content["nodes"][2]["interfaces"] = {interfaceAt(3, {"192.0.2.3"})};
  write(content);
  const json callback = json::parse(run.line());
  EXPECT_EQ("callback", callback.at("event"));
  EXPECT_EQ(node(3), callback.at("uuid"));
  EXPECT_EQ("192.0.2.3", callback.at("locators").at(0).at("address"));

  run.signal(SIGTERM);
  EXPECT_EQ("{\"event\":\"end\"}\n", run.rest());
  EXPECT_EQ(0, run.status());
}

TEST_F(Cli, WatchEndsInGoodOrderWhenItsReaderGoes) {
  write(pair(1));
  Command run(with("watch", {"--all"}));
  run.lineWith("object 9");
  run.closeOutput();
  EXPECT_EQ("", run.errors());
  EXPECT_EQ(0, run.status());
}

/* ---- modinfo --------------------------------------------------------------------------------- */

TEST_F(Cli, ModinfoTellsWhatTheResolverDeclares) {
  EXPECT_THAT(runToEnd({"modinfo", KARST_MODULE}).out,
              AllOf(HasSubstr("\nprovides     com.tarvik.karst.resolver#0.0.0.1\n"),
                    HasSubstr("parameters   KARST_RESOLVER_LEAST_MAX_HEAP (int, default 10485760): "
                              "Min heap size in bytes (default: 10MB)\n")));
  const json info = json::parse(runToEnd({"modinfo", "--json", KARST_MODULE}).out);
  EXPECT_EQ((json{{"name", "com.tarvik.tolmapi"}, {"version", "0.0.0.2"}}),
            info.at("requires").at(4));
  EXPECT_EQ((json{"KARSTResolver_GetNodeLocators", "KARSTResolver_SetCallback",
                  "KARSTResolver_Destroy", "KARSTResolver_Create"}),
            info.at("exports"));
  EXPECT_EQ("not implemented", info.at("assertions").at(0).at("kind"));
  EXPECT_EQ("param_KARST_RESOLVER_LEAST_MAX_HEAP:int", info.at("declaration").at(0));
}

}  // namespace
