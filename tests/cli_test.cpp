/* The karst command, run as people and programs run it: its text, its JSON, its exit status. Each
 * run is a process of its own; files live in a folder that goes with the test.
 */
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>

#include <array>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <nlohmann/json.hpp>
#include <regex>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

namespace {

using nlohmann::json;
using nlohmann::literals::operator""_json_pointer;
using testing::AllOf;
using testing::EndsWith;
using testing::HasSubstr;
using testing::StartsWith;

/* "@a12" stands for the UUID of node 12, b for interfaces, c for objects. */
std::string expanded(std::string text) {
  static const std::regex shorthand("@([a-c])(\\d+)");
  for (std::smatch found; std::regex_search(text, found, shorthand);) {
    std::array<char, 40> uuid{};
    snprintf(uuid.data(), uuid.size(), "%c0000000-0000-4000-8000-%012x", *found[1].first,
             std::stoi(found[2]));
    text = found.prefix().str() + uuid.data() + found.suffix().str();
  }
  return text;
}
json content(const std::string &text) {
  return json::parse(expanded(text));
}

/* A run of the command under a shell, which says first which process it has become. */
class Command {
 public:
  explicit Command(const std::string &arguments)
      : out_(popen(("echo $$; exec " KARST_COMMAND " " + expanded(arguments)).c_str(), "r")),
        process_(std::stoi(line())) {}
  ~Command() {
    if (out_ == nullptr) return;
    signal(SIGKILL);
    pclose(out_);
  }
  Command(const Command &) = delete;
  Command &operator=(const Command &) = delete;

  /* Up to the next newline, or all that is left; empty at the end. */
  std::string line(int end = '\n') {
    std::string text;
    int next = 0;
    while ((next = getc(out_)) != end && next != EOF) text.push_back(static_cast<char>(next));
    return text;
  }
  std::string rest() { return line(EOF); }
  /* Reads lines up to the first that has the text, and returns that; empty without one. */
  std::string lineWith(const std::string &text) {
    std::string next = line();
    while (next.find(text) == std::string::npos && feof(out_) == 0) next = line();
    return next;
  }
  void signal(int number) const { kill(process_, number); }
  /* Closes its output and waits for its end: the exit status, or -1 when a signal ended it. */
  int status() {
    const int status = pclose(std::exchange(out_, nullptr));
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

 private:
  FILE *out_;
  const pid_t process_;
};

/* Nodes 1, 2, 3 ... with so many interfaces each. */
json crowd(unsigned nodes, unsigned interfacesEach) {
  json crowd = {{"nodes", json::array()}};
  for (unsigned n = 1; n <= nodes; n++) {
    json node = {{"uuid", expanded("@a" + std::to_string(n))}};
    for (unsigned i = 0; i < interfacesEach; i++) {
      const std::string uuid = expanded("@b" + std::to_string(n * 1000 + i));
      node["interfaces"].push_back({{"uuid", uuid}, {"ipv4", "192.0.2.1"}});
    }
    crowd["nodes"].push_back(node);
  }
  return crowd;
}

/* Two nodes, alder and birch, and an object that one of them owns. */
json pair(const std::string &owner) {
  return content(R"({"nodes": [
      {"uuid": "@a1", "name": "alder", "version": {"major": 7, "minor": 2},
       "interfaces": [{"uuid": "@b1", "addresses": ["192.0.2.1", "2001:db8::1"]}]},
      {"uuid": "@a2", "name": "birch", "interfaces": [{"uuid": "@b2", "ipv4": "192.0.2.2"}]}],
    "objects": [{"uuid": "@c1", "type": 9, "name": "disk", "owner": ")" +
                 owner + R"("}]})");
}

class Cli : public testing::Test {
 protected:
  Cli() {
    std::string pattern = testing::TempDir() + "karst_cli_XXXXXX";
    folder_ = mkdtemp(pattern.data());
  }
  ~Cli() override { std::filesystem::remove_all(folder_); }

  struct Result {
    int status;
    std::string out, err;
  };
  Result run(const std::string &arguments) const {
    Command command(arguments + " 2>" + (folder_ / "errors").string());
    const std::string out = command.rest();
    const int status = command.status();
    std::ifstream err(folder_ / "errors");
    return {status, out, std::string(std::istreambuf_iterator<char>(err), {})};
  }
  /* The file with what was written last. */
  std::string from() const { return " --directory " + (folder_ / "cluster.json").string() + " "; }
  Result resolve(const std::string &rest) const { return run("resolve" + from() + rest); }
  /* What it says as JSON, line by line. */
  std::vector<json> answers(const std::string &rest) const {
    std::istringstream lines(resolve("--json " + rest).out);
    std::vector<json> result;
    for (std::string line; std::getline(lines, line);) result.push_back(json::parse(line));
    return result;
  }
  /* Puts a whole new file into the old one's place. */
  void write(const json &written) const {
    std::ofstream(folder_ / "fresh.json") << written;
    std::filesystem::rename(folder_ / "fresh.json", folder_ / "cluster.json");
  }

  std::filesystem::path folder_;
};

/* ---- Help and usage -------------------------------------------------------------------------- */

TEST_F(Cli, HelpTeachesByExampleOnStandardOutput) {
  for (const std::string command : {"resolve", "watch", "modinfo"}) {
    const Result page = run(command + " --help");
    EXPECT_EQ(0, page.status);
    EXPECT_EQ("", page.err);
    EXPECT_THAT(page.out,
                AllOf(HasSubstr("Examples:\n  karst " + command + " "), HasSubstr("Exit status")));
    EXPECT_THAT(run("--help").out, HasSubstr("  karst " + command));
  }
  EXPECT_EQ("karst " KARST_VERSION "\n", run("--version").out);
}

TEST_F(Cli, BadUsageIsStatusTwoWithWhatToDoAndNothingOnStandardOutput) {
  write(pair("@a1"));
  const std::string good = "resolve" + from(), gone = (folder_ / "gone").string();
  const std::string broken = (folder_ / "broken.json").string();
  std::ofstream(broken) << R"({"nodes": [{"uuid": "12"}]})";
  const std::pair<std::string, const char *> rows[]{
      {"", "give a command: resolve, watch or modinfo\nkarst --help shows how"},
      {"resolve", "what to resolve? Give --all, node UUID or object TYPE UUID"},
      {"resolve --all", "where is the directory? Give --directory FILE, --own-interfaces or both"},
      {good + "--all node @a1", "either --all or targets"},
      {good + "node 12", "node wants a UUID, not \"12\""},
      {good + "node 00000000-0000-0000-0000-000000000000", "the all-zero UUID stands for none"},
      {good + "disk @a1", "\"disk\" begins no target"},
      {good + "object 256 @c1", "\"256\" is no type"},
      {good + "node @a1 --hint @a2", "--hint stands right"},
      {good + "--all --self me", "--self wants a UUID"},
      {good + "--all --param X=1", "no parameter X"},
      {good + "--all --module " + broken, "not an ELF file"},
      {"resolve --all --directory " + gone, "cannot be opened"},
      {"resolve --all --directory " + broken, "/nodes/0/uuid"},
      {"modinfo " + gone, "there is no such file"},
  };
  for (const auto &[arguments, message] : rows) {
    const Result result = run(arguments);
    EXPECT_EQ(2, result.status) << arguments;
    EXPECT_EQ("", result.out) << arguments;
    EXPECT_THAT(result.err, AllOf(StartsWith("karst"), HasSubstr(message), EndsWith("\n")));
  }
}

/* ---- resolve --------------------------------------------------------------------------------- */

TEST_F(Cli, TableIsAlignedAndSortedAndItsNamesShortAndHarmless) {
  json cluster = pair("@a2");
  cluster["nodes"][1]["interfaces"][0]["healthy"] = false;
  cluster["nodes"].push_back(content(R"({"uuid": "@a3", "name": "a\u001b[31mb\u009bc",
      "interfaces": [{"uuid": "@b3", "ipv4": "192.0.2.3"}]})"));
  cluster["objects"].push_back(content(
      R"({"uuid": "@c2", "type": 2, "owner": "@a1", "name": "\u00fcber and beyond the table"})"));
  write(cluster);
  const Result result = resolve("--all");
  EXPECT_EQ(1, result.status);
  EXPECT_EQ("", result.err);
  EXPECT_EQ(
      "TARGET                                         NAME              STATE       NODE       "
      "VERSION  TRAFFIC  LOCATORS\n"
      "node a0000000-0000-4000-8000-000000000001      alder             resolved    alder      "
      "7.2      0        192.0.2.1 2001:db8::1\n"
      "node a0000000-0000-4000-8000-000000000002      birch             unresolved  "
      "no healthy interface (1 unhealthy)\n"
      "node a0000000-0000-4000-8000-000000000003      a?[31mb?c         resolved    a?[31mb?c  "
      "0.0      0        192.0.2.3\n"
      "object 2 c0000000-0000-4000-8000-000000000002  \u00fcber and beyond…  resolved    alder     "
      " "
      "7.2      0        192.0.2.1 2001:db8::1\n"
      "object 9 c0000000-0000-4000-8000-000000000001  disk              unresolved  "
      "owner birch: no healthy interface (1 unhealthy)\n",
      result.out);
}

TEST_F(Cli, JsonHasALineForEachTargetInTheOrderOfTheCommandLine) {
  write(pair("@a1"));
  const std::vector<json> said = answers("object 0x8 @c1 --hint @a1 node @a3");
  EXPECT_EQ(said, (std::vector<json>{content(R"({
    "kind": "object", "type": 8, "uuid": "@c1", "name": "disk", "hint": "@a1",
    "state": "resolved", "node": {"uuid": "@a1", "name": "alder"},
    "version": {"major": 7, "minor": 2}, "trafficType": 0,
    "locators": [{"type": "ipv4", "address": "192.0.2.1"},
                 {"type": "ipv6", "address": "2001:db8::1"}]})"),
                                     content(R"({"kind": "node", "uuid": "@a3",
    "state": "unresolved", "reason": "no entry for the node"})")}));
}

TEST_F(Cli, ThisHostAnswersItselfWhenAskedAndHasItsOwnInterfacesUnderTheFilesName) {
  json cluster = pair("@a2");
  cluster["self"] = expanded("@a2");
  write(cluster);
  EXPECT_THAT(resolve("--local node @a2").out, EndsWith("this host\n"));
  const std::vector<json> both = answers("--local node @a2 node @a1");
  EXPECT_EQ(both.at(0).at("locators").dump(), R"([{"type":"local"}])");
  EXPECT_EQ(both.at(1).at("locators").at(0).at("type"), "ipv4");

  const json named = answers("--own-interfaces --self @a1 node @a1").at(0);
  EXPECT_EQ("alder", named.at("name"));
  EXPECT_THAT(named.at("locators").dump(), HasSubstr("192.0.2.1"));
  const json alone = json::parse(run("resolve --own-interfaces --self @a9 --all --json").out);
  EXPECT_EQ(expanded("@a9"), alone.at("uuid"));
  EXPECT_EQ("this host", alone.at("name"));
}

/* ---- Why not --------------------------------------------------------------------------------- */

TEST_F(Cli, SaysWhyATargetIsNotResolved) {
  write(content(R"({"self": "@a90", "nodes": [
      {"uuid": "@a1", "name": "birch"},
      {"uuid": "@a2", "interfaces": [{"uuid": "@b1", "ipv4": "192.0.2.1", "healthy": false},
                                   {"uuid": "@b2", "ipv4": "192.0.2.1", "healthy": null},
                                   {"uuid": "@b3", "ipv4": "192.0.2.1", "healthy": false}]},
      {"uuid": "@a3", "interfaces": [{"uuid": "@b4", "ipv4": "192.0.2.1", "trafficTypes": [5]},
                                   {"uuid": "@b5", "ipv4": "192.0.2.1", "healthy": false}]},
      {"uuid": "@a4", "interfaces": [{"uuid": "@b6", "networkType": 9}]},
      {"uuid": "@a5", "interfaces": [{"uuid": "@b7"}]},
      {"uuid": "@a6", "interfaces": [{"uuid": "@b8", "rawRecord": "a1"}]},
      {"uuid": "@a7", "interfaces": [{"uuid": "@b9", "ipv4": "192.0.2.1", "trafficTypes": [5]}],
       "witness": true},
      {"uuid": "@a8", "name": "elm", "rawRecord": "00"}],
    "objects": [{"uuid": "@c1", "type": 9, "owner": "@a1"},
                {"uuid": "@c3", "type": 9, "owner": "@a90"}]
  })"));
  const std::pair<std::string, const char *> rows[] = {
      {"node @a1", "the node has no interface"},
      {"node @a2", "no healthy interface (2 unhealthy, 1 without health entry)"},
      {"node @a3",
       "no healthy interface carries traffic type 0 (1 for other traffic, 1 unhealthy)"},
      {"node @a4", "no healthy interface of a known network type (1 of unknown network type 9)"},
      {"node @a5", "no healthy interface with an address (1 without an address)"},
      {"node @a6", "no interface whose entry can be decoded (1 undecodable (EXPR_MSH_TRUNCATED))"},
      {"node @a7", "no healthy interface carries traffic type 1 (1 for other traffic)"},
      {"node @a8", "the node's entry cannot be decoded (EXPR_MSH_MALFORMED)"},
      {"node @a90", "no entry for the node"},
      {"object 8 @c1", "no entry for the object"},
      {"object 9 @c1", "owner birch: the node has no interface"},
      {"object 9 @c3", "owner @a90: no entry for the node"},
      {"object 8 @c1 --hint @a8",
       "no entry for the object; hinted node elm: the node's entry cannot be decoded "
       "(EXPR_MSH_MALFORMED)"},
  };
  for (const auto &[target, reason] : rows) {
    EXPECT_EQ(answers(target).at(0).value("reason", ""), expanded(reason)) << target;
  }
}

TEST_F(Cli, AFullResolverAnswersForAllThatItHasRoomForAndSaysThatItIsFull) {
  write(crowd(128, 4));
  EXPECT_EQ(0, resolve("--all").status);
  write(crowd(129, 1));
  EXPECT_THAT(resolve("--all").out,
              HasSubstr("the resolver is full: it knows 128 nodes, the directory has 129"));
  json cluster = crowd(1, 512);
  cluster["nodes"].push_back(crowd(2, 1)["nodes"][1]);
  write(cluster);
  EXPECT_EQ(answers("node @a2").at(0).at("reason"),
            "the resolver is full: it knows 512 interfaces, the directory has 513");
}

/* ---- watch ----------------------------------------------------------------------------------- */

TEST_F(Cli, WatchFollowsChangesUntilInterrupted) {
  write(pair("@a1"));
  Command run("watch --all" + from() + "2>&1");
  EXPECT_THAT(run.lineWith("object 9"), HasSubstr("alder  7.2"));

  json cluster = pair("@a1");
  cluster["nodes"][1]["interfaces"][0]["healthy"] = false;
  write(cluster);
  EXPECT_THAT(run.lineWith("node birch"),
              EndsWith("  node birch  unresolved  no healthy interface (1 unhealthy)"));

  /* A refused file leaves the answer as it was: the next line is of the next change. */
  write(content(R"({"nodes": [], "nod": 1})"));
  EXPECT_THAT(run.lineWith("cluster.json"), HasSubstr("nod"));
  write(pair("@a2"));
  EXPECT_THAT(run.lineWith("object 9 disk"), EndsWith("its owner changed from alder to birch"));
  EXPECT_THAT(run.lineWith("object 9 disk  resolved"),
              EndsWith("resolved  birch 0.0, traffic type 0: 192.0.2.2"));

  cluster["nodes"].push_back(content(R"({"uuid": "@a3"})"));
  write(cluster);
  EXPECT_THAT(run.lineWith(expanded("node @a3")),
              EndsWith("unresolved  the node has no interface"));

  run.signal(SIGINT);
  EXPECT_THAT(run.rest(), EndsWith("\nstopped: instances destroyed, module unloaded, nothing left "
                                   "behind\n"));
  EXPECT_EQ(0, run.status());
}

TEST_F(Cli, WatchInJsonTellsStartCallbacksRetriesAndEnd) {
  write(pair("@a1"));
  Command run("watch --json node @a1 node @a3" + from());
  const auto next = [&run] {
    const json line = json::parse(run.line());
    EXPECT_THAT(line.at("time").get<std::string>(),
                testing::MatchesRegex("20..-..-..T..:..:...[0-9]+[-+][0-9]+"));
    return line.at("event").get<std::string>() + ": " + line.value("reason", "") +
           line.value("/locators/0/address"_json_pointer, "");
  };
  EXPECT_EQ(next(), "start: 192.0.2.1");
  EXPECT_EQ(next(), "start: no entry for the node");
  /* A target that was unknown at the start is tried again; why it is not resolved may change. */
  json cluster = pair("@a1");
  cluster["nodes"].push_back(content(R"({"uuid": "@a3"})"));
  write(cluster);
  EXPECT_EQ(next(), "retry: the node has no interface");
  cluster["objects"].clear(); /* nothing to say of that */
  write(cluster);
  cluster["nodes"][2]["interfaces"] = {content(R"({"uuid": "@b3", "ipv4": "192.0.2.3"})")};
  write(cluster);
  EXPECT_EQ(next(), "callback: 192.0.2.3");

  run.signal(SIGTERM);
  EXPECT_EQ("{\"event\":\"end\"}\n", run.rest());
  EXPECT_EQ(0, run.status());
}

TEST_F(Cli, WatchEndsInGoodOrderWhenItsReaderGoes) {
  write(pair("@a1"));
  Command run("watch --all" + from() + "2>&1");
  run.lineWith("object 9");
  EXPECT_EQ(0, run.status());
}

/* ---- modinfo --------------------------------------------------------------------------------- */

TEST_F(Cli, ModinfoTellsWhatTheResolverDeclares) {
  EXPECT_THAT(run("modinfo " KARST_MODULE).out,
              AllOf(HasSubstr("\nprovides     com.tarvik.karst.resolver#0.0.0.1\n"),
                    HasSubstr("parameters   KARST_RESOLVER_LEAST_MAX_HEAP (int, default 10485760): "
                              "Min heap size in bytes (default: 10MB)\n")));
  const json info = json::parse(run("modinfo --json " KARST_MODULE).out);
  EXPECT_EQ((json{{"name", "com.tarvik.tolmapi"}, {"version", "0.0.0.2"}}),
            info.at("requires").at(4));
  EXPECT_EQ((json{"KARSTResolver_GetNodeLocators", "KARSTResolver_SetCallback",
                  "KARSTResolver_Destroy", "KARSTResolver_Create"}),
            info.at("exports"));
  EXPECT_EQ("not implemented", info.at("assertions").at(0).at("kind"));
  EXPECT_EQ("param_KARST_RESOLVER_LEAST_MAX_HEAP:int", info.at("declaration").at(0));
}

}  // namespace
