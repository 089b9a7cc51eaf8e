/* The karst command, run as people and programs run it: its text, its JSON, its exit status. Each
 * run is a process of its own; files live in a folder that goes with the test.
 */
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

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
using testing::ElementsAre;
using testing::EndsWith;
using testing::HasSubstr;
using testing::StartsWith;

/* Milliseconds after which a command that is silent and should not be has failed. */
constexpr int kPatience = 60'000;

using Arguments = std::vector<std::string>;

/* A run of the command. Its two outputs come through pipes. */
class Command {
 public:
  explicit Command(const Arguments &arguments) {
    std::array<int, 2> out{};
    std::array<int, 2> err{};
    EXPECT_EQ(0, pipe2(out.data(), O_CLOEXEC));
    EXPECT_EQ(0, pipe2(err.data(), O_CLOEXEC));
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, out[1], STDOUT_FILENO);
    posix_spawn_file_actions_adddup2(&actions, err[1], STDERR_FILENO);
    std::vector<char *> argv{const_cast<char *>(KARST_COMMAND)};
    for (const std::string &argument : arguments) {
      argv.push_back(const_cast<char *>(argument.c_str()));
    }
    argv.push_back(nullptr);
    EXPECT_EQ(0, posix_spawn(&pid_, KARST_COMMAND, &actions, nullptr, argv.data(), environ));
    posix_spawn_file_actions_destroy(&actions);
    close(out[1]);
    close(err[1]);
    out_ = out[0];
    err_ = err[0];
  }
  ~Command() {
    if (out_ >= 0) close(out_);
    close(err_);
    if (!ended_) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
    }
  }
  Command(const Command &) = delete;
  Command &operator=(const Command &) = delete;

  /* The next line of standard output, without its newline; empty at the end. */
  std::string line() {
    size_t end = 0;
    while ((end = pending_.find('\n')) == std::string::npos && readMore(out_, &pending_)) {
    }
    if (end == std::string::npos) return std::exchange(pending_, "");
    std::string text = pending_.substr(0, end);
    pending_.erase(0, end + 1);
    return text;
  }

  /* Reads lines up to the first that has the text, and returns that; fails at the end. */
  std::string lineWith(const std::string &text) {
    for (;;) {
      std::string next = line();
      if (next.find(text) != std::string::npos) return next;
      if (next.empty() && atEnd_) {
        ADD_FAILURE() << "no line with \"" << text << "\"";
        return "";
      }
    }
  }

  void signal(int number) { kill(pid_, number); }
  void closeOutput() { close(std::exchange(out_, -1)); }

  /* What is left of an output, to its end. */
  std::string rest() {
    while (readMore(out_, &pending_)) {
    }
    return std::exchange(pending_, "");
  }
  std::string errors() {
    while (readMore(err_, &errors_)) {
    }
    return errors_;
  }
  std::string errorLine() {
    while (errors_.find('\n') == std::string::npos && readMore(err_, &errors_)) {
    }
    return errors_.substr(0, errors_.find('\n'));
  }

  /* The exit status; -1 when a signal ended it. */
  int status() {
    int status = 0;
    EXPECT_EQ(pid_, waitpid(pid_, &status, 0));
    ended_ = true;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

 private:
  bool readMore(int fd, std::string *text) {
    std::array<char, 4096> buffer{};
    pollfd wait{fd, POLLIN, 0};
    if (poll(&wait, 1, kPatience) == 0) {
      ADD_FAILURE() << "the command neither says anything more nor ends";
      kill(pid_, SIGKILL);
    }
    const ssize_t count = read(fd, buffer.data(), buffer.size());
    if (count <= 0) {
      atEnd_ = true;
      return false;
    }
    text->append(buffer.data(), static_cast<size_t>(count));
    return true;
  }

  pid_t pid_ = -1;
  int out_ = -1;
  int err_ = -1;
  bool ended_ = false;
  bool atEnd_ = false;
  std::string pending_;
  std::string errors_;
};

struct Result {
  int status;
  std::string out;
  std::string err;
};

Result runToEnd(const Arguments &arguments) {
  Command run(arguments);
  Result result{};
  result.out = run.rest();
  result.err = run.errors();
  result.status = run.status();
  return result;
}

std::vector<json> parseLines(const std::string &text) {
  std::vector<json> values;
  std::istringstream lines(text);
  for (std::string line; std::getline(lines, line);) values.push_back(json::parse(line));
  return values;
}

std::string uuid(char kind, unsigned number) {
  std::array<char, 40> text{};
  snprintf(text.data(), text.size(), "%c0000000-0000-4000-8000-%012x", kind, number);
  return text.data();
}
std::string node(unsigned number) {
  return uuid('a', number);
}
std::string interface(unsigned number) {
  return uuid('b', number);
}
std::string object(unsigned number) {
  return uuid('c', number);
}

json interfaceJson(unsigned number, const json &more) {
  json value{{"uuid", interface(number)}};
  value.update(more);
  return value;
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

  Arguments with(const char *command, const Arguments &more) const {
    Arguments arguments{command, "--directory", file_.string()};
    arguments.insert(arguments.end(), more.begin(), more.end());
    return arguments;
  }

  /* One node with these interfaces, and what `resolve` says of it as JSON. */
  json resolveNode(const std::vector<json> &interfaces, const Arguments &more = {}) {
    write({{"nodes", {{{"uuid", node(1)}, {"interfaces", json(interfaces)}}}}});
    return resolveOne(more);
  }
  json resolveOne(const Arguments &more, const Arguments &target = {"node", node(1)}) {
    Arguments arguments = with("resolve", {"--json", "--log", "off"});
    arguments.insert(arguments.end(), more.begin(), more.end());
    arguments.insert(arguments.end(), target.begin(), target.end());
    const Result result = runToEnd(arguments);
    EXPECT_EQ("", result.err);
    json answer = json::parse(result.out);
    EXPECT_EQ(answer.at("state") == "resolved" ? 0 : 1, result.status);
    return answer;
  }
  std::string reason(const json &answer) { return answer.value("reason", "(resolved)"); }

  /* Two nodes, alder and birch, and an object that one of them owns. */
  static json pair(unsigned owner) {
    return {{"nodes",
             {{{"uuid", node(1)},
               {"name", "alder"},
               {"version", {{"major", 7}, {"minor", 2}}},
               {"interfaces", {interfaceJson(1, {{"addresses", {"192.0.2.1", "2001:db8::1"}}})}}},
              {{"uuid", node(2)},
               {"name", "birch"},
               {"interfaces", {interfaceJson(2, {{"addresses", {"192.0.2.2"}}})}}}}},
            {"objects",
             {{{"type", 9}, {"uuid", object(1)}, {"name", "disk"}, {"owner", node(owner)}}}}};
  }

  std::filesystem::path folder_;
  std::filesystem::path file_;
};

/* ---- Help and usage -------------------------------------------------------------------------- */

TEST_F(Cli, HelpTeachesByExampleOnStandardOutput) {
  const Result whole = runToEnd({"--help"});
  EXPECT_EQ(0, whole.status);
  EXPECT_EQ("", whole.err);
  for (const char *command : {"resolve", "watch", "modinfo"}) {
    EXPECT_THAT(whole.out, HasSubstr(std::string("  karst ") + command));
    const Result page = runToEnd({command, "--help"});
    EXPECT_EQ(0, page.status);
    EXPECT_EQ("", page.err);
    EXPECT_THAT(page.out, AllOf(HasSubstr("Examples:\n  karst " + std::string(command) + " "),
                                HasSubstr("Exit status")));
  }
}

TEST_F(Cli, TellsItsVersion) {
  const Result result = runToEnd({"--version"});
  EXPECT_EQ(0, result.status);
  EXPECT_EQ("karst " KARST_VERSION "\n", result.out);
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
      {{"resolve", "--all"}, "where is the directory? Give --directory FILE"},
      {{"watch", "--all"}, "\nkarst watch --help shows how"},
      {{"resolve", "--frob"}, "--frob"},
      {{"resolve", "--directory", file, "--all", "node", node(1)}, "either --all or targets"},
      {{"resolve", "--directory", file, "node"}, "\"node\" wants a UUID"},
      {{"resolve", "--directory", file, "node", "12"}, "node wants a UUID, not \"12\""},
      {{"resolve", "--directory", file, "node", "00000000-0000-0000-0000-000000000000"},
       "the all-zero UUID stands for none"},
      {{"resolve", "--directory", file, "disk", node(1)}, "\"disk\" begins no target"},
      {{"resolve", "--directory", file, "object", "256", object(1)}, "\"256\" is no type"},
      {{"resolve", "--directory", file, "object", "0x", object(1)}, "\"0x\" is no type"},
      {{"resolve", "--directory", file, "object", "9"}, "\"object\" wants a UUID"},
      {{"resolve", "--directory", file, "node", node(1), "--hint", node(2)}, "--hint stands right"},
      {{"resolve", "--directory", file, "--all", "--self", "me"}, "--self wants a UUID"},
      {{"resolve", "--directory", file, "--all", "--log", "loud"}, "--log"},
      {{"resolve", "--directory", file, "--all", "--param", "X=1"}, "no parameter X"},
      {{"resolve", "--directory", file, "--all", "--module", file}, "not an ELF file"},
      {{"resolve", "--directory", file + ".gone", "--all"}, "cannot be opened"},
      {{"resolve", "--directory", broken, "--all"}, "/nodes/0/uuid"},
      {{"watch", "--directory", broken, "--all"}, "/nodes/0/uuid"},
      {{"modinfo"}, "file is required"},
      {{"modinfo", file}, "not an ELF file"},
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

TEST_F(Cli, LongAnswersContinueBelowTheirColumn) {
  const json addresses{"2001:db8:1111:2222:3333:4444:5555:1", "2001:db8:1111:2222:3333:4444:5555:2",
                       "2001:db8:1111:2222:3333:4444:5555:3"};
  write({{"nodes",
          {{{"uuid", node(1)}, {"interfaces", {interfaceJson(1, {{"addresses", addresses}})}}}}}});
  const Result result = runToEnd(with("resolve", {"--all"}));
  std::istringstream lines(result.out);
  std::string heading;
  std::getline(lines, heading);
  const size_t column = heading.find("LOCATORS");
  std::vector<std::string> flow;
  for (std::string line; std::getline(lines, line);) {
    EXPECT_LE(line.size(), 150u);
    flow.push_back(line.substr(column));
  }
  EXPECT_THAT(flow, ElementsAre(addresses[0], addresses[1], addresses[2]));
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

TEST_F(Cli, AllResolvedIsStatusZero) {
  write(pair(2));
  EXPECT_EQ(0, runToEnd(with("resolve", {"--all"})).status);
}

TEST_F(Cli, JsonHasALineForEachTargetInTheOrderOfTheCommandLine) {
  write(pair(2));
  const Result result =
      runToEnd(with("resolve", {"object", "0x9", object(1), "--json", "node", node(1), "object",
                                "8", object(1), "--hint", node(2), "node", node(3)}));
  EXPECT_EQ(1, result.status);
  EXPECT_THAT(
      parseLines(result.out),
      ElementsAre(json{{"kind", "object"},
                       {"type", 9},
                       {"uuid", object(1)},
                       {"name", "disk"},
                       {"state", "resolved"},
                       {"node", {{"uuid", node(2)}, {"name", "birch"}}},
                       {"version", {{"major", 0}, {"minor", 0}}},
                       {"trafficType", 0},
                       {"locators", json::array({{{"type", "ipv4"}, {"address", "192.0.2.2"}}})}},
                  json{{"kind", "node"},
                       {"uuid", node(1)},
                       {"name", "alder"},
                       {"state", "resolved"},
                       {"node", {{"uuid", node(1)}, {"name", "alder"}}},
                       {"version", {{"major", 7}, {"minor", 2}}},
                       {"trafficType", 0},
                       {"locators",
                        {{{"type", "ipv4"}, {"address", "192.0.2.1"}},
                         {{"type", "ipv6"}, {"address", "2001:db8::1"}}}}},
                  json{{"kind", "object"},
                       {"type", 8},
                       {"uuid", object(1)},
                       {"name", "disk"},
                       {"hint", node(2)},
                       {"state", "resolved"},
                       {"node", {{"uuid", node(2)}, {"name", "birch"}}},
                       {"version", {{"major", 0}, {"minor", 0}}},
                       {"trafficType", 0},
                       {"locators", json::array({{{"type", "ipv4"}, {"address", "192.0.2.2"}}})}},
                  json{{"kind", "node"},
                       {"uuid", node(3)},
                       {"state", "unresolved"},
                       {"reason", "no entry for the node"}}));
}

TEST_F(Cli, ThisHostAnswersItselfWhenAsked) {
  write(pair(2));
  const Arguments self{"--self", node(2), "--local"};
  EXPECT_EQ(json::array({{{"type", "local"}}}), resolveOne(self, {"node", node(2)}).at("locators"));
  EXPECT_EQ("ipv4", resolveOne(self, {"node", node(1)}).at("locators").at(0).at("type"));
  EXPECT_THAT(runToEnd(with("resolve", {"--self", node(2), "--local", "node", node(2)})).out,
              HasSubstr("this host\n"));
}

TEST_F(Cli, OwnInterfacesAreThoseOfThisHostsNodeWhichTheFileMayName) {
  json content = pair(2);
  content["self"] = node(1);
  write(content);
  const Result both = runToEnd(with("resolve", {"--own-interfaces", "--all", "--json"}));
  const std::vector<json> answers = parseLines(both.out);
  ASSERT_EQ(3u, answers.size());
  /* The file's version and name stand, the file's interface stays. */
  EXPECT_EQ("alder", answers[0].at("name"));
  EXPECT_EQ(7, answers[0].at("version").at("major"));
  EXPECT_THAT(answers[0].at("locators").dump(), HasSubstr("192.0.2.1"));

  const Result alone =
      runToEnd({"resolve", "--own-interfaces", "--self", node(9), "--all", "--json"});
  const json own = json::parse(alone.out);
  EXPECT_EQ(node(9), own.at("uuid"));
  EXPECT_EQ("this host", own.at("name"));
}

/* ---- Why not --------------------------------------------------------------------------------- */

TEST_F(Cli, SaysWhatInterfacesLack) {
  const json address{"192.0.2.1"};
  EXPECT_EQ("the node has no interface", reason(resolveNode({})));
  EXPECT_EQ("no healthy interface (2 unhealthy, 1 without health entry)",
            reason(resolveNode({interfaceJson(1, {{"addresses", address}, {"healthy", false}}),
                                interfaceJson(2, {{"addresses", address}, {"healthy", nullptr}}),
                                interfaceJson(3, {{"addresses", address}, {"healthy", false}})})));
  EXPECT_EQ(
      "no healthy interface carries traffic type 0 (1 unhealthy, 1 for other traffic)",
      reason(resolveNode({interfaceJson(1, {{"addresses", address}, {"healthy", false}}),
                          interfaceJson(2, {{"addresses", address}, {"trafficTypes", {1, 5}}})})));
  EXPECT_EQ("no healthy interface carries traffic type 1 (1 for other traffic)",
            reason(resolveNode({interfaceJson(1, {{"addresses", address}, {"trafficTypes", {0}}})},
                               {"--witness"})));
  EXPECT_EQ("no healthy interface of a known network type (1 of unknown network type 9)",
            reason(resolveNode({interfaceJson(1, {{"networkType", 9}})})));
  EXPECT_EQ("no healthy interface with an address (1 without an address)",
            reason(resolveNode({interfaceJson(1, json::object())})));
  EXPECT_EQ("no interface whose entry can be decoded (1 undecodable (EXPR_MSH_TRUNCATED))",
            reason(resolveNode({interfaceJson(1, {{"rawRecord", "a1"}})})));
  EXPECT_EQ("(resolved)", reason(resolveNode({interfaceJson(1, {{"ipv4", "192.0.2.1"}})})));
}

TEST_F(Cli, AWitnessNodeIsReachedByItsOwnTraffic) {
  write({{"nodes",
          {{{"uuid", node(1)},
            {"witness", true},
            {"interfaces",
             {interfaceJson(1, {{"addresses", {"192.0.2.1"}}, {"trafficTypes", {0}}})}}}}}});
  EXPECT_EQ("no healthy interface carries traffic type 1 (1 for other traffic)",
            reason(resolveOne({})));
}

TEST_F(Cli, SaysWhichEntryIsMissingOrBroken) {
  json content = pair(2);
  content["nodes"][1].erase("interfaces");
  content["nodes"].push_back({{"uuid", node(4)}, {"name", "elm"}, {"rawRecord", "00"}});
  content["self"] = node(3);
  content["objects"].push_back({{"type", 9}, {"uuid", object(3)}, {"owner", node(3)}});
  write(content);
  EXPECT_EQ("no entry for the node", reason(resolveOne({}, {"node", node(3)})));
  EXPECT_EQ("the node's entry cannot be decoded (EXPR_MSH_MALFORMED)",
            reason(resolveOne({}, {"node", node(4)})));
  EXPECT_EQ("no entry for the object", reason(resolveOne({}, {"object", "8", object(1)})));
  EXPECT_EQ("owner birch: the node has no interface",
            reason(resolveOne({}, {"object", "9", object(1)})));
  EXPECT_EQ("owner " + node(3) + ": no entry for the node",
            reason(resolveOne({}, {"object", "9", object(3)})));
  EXPECT_EQ(
      "no entry for the object; hinted node elm: the node's entry cannot be decoded "
      "(EXPR_MSH_MALFORMED)",
      reason(resolveOne({}, {"object", "8", object(1), "--hint", node(4)})));
}

json crowd(unsigned nodes, unsigned interfacesEach) {
  json content{{"nodes", json::array()}};
  for (unsigned n = 1; n <= nodes; n++) {
    json entry{{"uuid", node(n)}, {"interfaces", json::array()}};
    for (unsigned i = 0; i < interfacesEach; i++) {
      const std::string address = "10." + std::to_string(n) + "." + std::to_string(i / 200) + "." +
                                  std::to_string(i % 200 + 1);
      entry["interfaces"].push_back(interfaceJson(n * 1000 + i, {{"addresses", {address}}}));
    }
    content["nodes"].push_back(entry);
  }
  return content;
}

TEST_F(Cli, AFullResolverAnswersForAllThatItHasRoomFor) {
  write(crowd(128, 4));
  const Result result = runToEnd(with("resolve", {"--all", "--json"}));
  EXPECT_EQ(0, result.status);
  const std::vector<json> answers = parseLines(result.out);
  ASSERT_EQ(128u, answers.size());
  for (unsigned n = 1; n <= 128; n++) {
    const json &answer = answers[n - 1];
    ASSERT_EQ(node(n), answer.at("uuid"));
    ASSERT_EQ(4u, answer.at("locators").size());
    for (const json &locator : answer.at("locators")) {
      ASSERT_THAT(locator.at("address").get<std::string>(),
                  StartsWith("10." + std::to_string(n) + ".0."));
    }
  }
}

TEST_F(Cli, SaysThatTheResolverIsFull) {
  write(crowd(129, 1));
  const Result nodes = runToEnd(with("resolve", {"--all"}));
  EXPECT_EQ(1, nodes.status);
  EXPECT_THAT(nodes.out,
              HasSubstr("the resolver is full: it knows 128 nodes, the directory has 129"));
  json content = crowd(1, 512);
  content["nodes"].push_back(crowd(2, 1)["nodes"][1]);
  write(content);
  EXPECT_EQ("(resolved)", reason(resolveOne({})));
  EXPECT_EQ("the resolver is full: it knows 512 interfaces, the directory has 513",
            reason(resolveOne({}, {"node", node(2)})));
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

  write(pair(2));
  std::vector<std::string> disk;
  for (bool moved = false; !moved;) {
    disk.push_back(run.lineWith("object 9 disk"));
    moved = disk.back().find("  resolved") != std::string::npos || disk.back().empty();
  }
  EXPECT_THAT(disk.front(), EndsWith("unresolved  its owner changed from alder to birch"));
  EXPECT_THAT(disk.back(), EndsWith("resolved  birch 0.0, traffic type 0: 192.0.2.2"));

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
  content["nodes"][2]["interfaces"] = {interfaceJson(3, {{"addresses", {"192.0.2.3"}}})};
  write(content);
  const json callback = json::parse(run.line());
  EXPECT_EQ("callback", callback.at("event"));
  EXPECT_EQ(node(3), callback.at("uuid"));
  EXPECT_EQ("192.0.2.3", callback.at("locators").at(0).at("address"));

  run.signal(SIGTERM);
  EXPECT_EQ("{\"event\":\"end\"}\n", run.rest());
  EXPECT_EQ(0, run.status());
}

TEST_F(Cli, WatchTakesInNodesThatCome) {
  write(pair(1));
  Command run(with("watch", {"--all"}));
  run.lineWith("object 9");
  json content = pair(1);
  content["nodes"].push_back(
      {{"uuid", node(3)}, {"interfaces", {interfaceJson(3, {{"addresses", {"192.0.2.3"}}})}}});
  write(content);
  EXPECT_THAT(run.lineWith("node " + node(3)), EndsWith("traffic type 0: 192.0.2.3"));
  write(pair(1));
  EXPECT_THAT(run.lineWith("node " + node(3)), EndsWith("unresolved  no entry for the node"));
}

TEST_F(Cli, ARefusedFileLeavesTheAnswerAsItWas) {
  write(pair(1));
  Command run(with("watch", {"--all"}));
  run.lineWith("object 9");
  writeText(R"({"nodes": [], "nod": 1})");
  EXPECT_THAT(run.errorLine(), AllOf(HasSubstr("cluster.json"), HasSubstr("nod")));
  /* What comes next on standard output is the next change and nothing before it. */
  EXPECT_EQ("", run.line());
  json content = pair(1);
  content["nodes"][1]["interfaces"][0]["addresses"] = {"192.0.2.22"};
  write(content);
  EXPECT_THAT(run.line(), EndsWith("node birch  resolved  birch 0.0, traffic type 0: 192.0.2.22"));
  run.signal(SIGINT);
  EXPECT_EQ(0, (run.rest(), run.status()));
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
  const Result text = runToEnd({"modinfo", KARST_MODULE});
  EXPECT_EQ(0, text.status);
  EXPECT_THAT(text.out,
              AllOf(HasSubstr("\nprovides     com.tarvik.karst.resolver#0.0.0.1\n"),
                    HasSubstr("parameters   KARST_RESOLVER_LEAST_MAX_HEAP (int, default 10485760): "
                              "Min heap size in bytes (default: 10MB)\n"),
                    HasSubstr("\n             KARSTResolver_Create\n")));
  const json info = json::parse(runToEnd({"modinfo", "--json", KARST_MODULE}).out);
  EXPECT_EQ(7u, info.at("requires").size());
  EXPECT_EQ((json{{"name", "com.tarvik.tolmapi"}, {"version", "0.0.0.2"}}),
            info.at("requires").at(4));
  EXPECT_EQ((json{{"name", "KARST_RESOLVER_LEAST_MAX_HEAP"},
                  {"type", "int"},
                  {"default", 10485760},
                  {"description", "Min heap size in bytes (default: 10MB)"}}),
            info.at("parameters").at(0));
  EXPECT_EQ((json{"KARSTResolver_GetNodeLocators", "KARSTResolver_SetCallback",
                  "KARSTResolver_Destroy", "KARSTResolver_Create"}),
            info.at("exports"));
  EXPECT_EQ("not implemented", info.at("assertions").at(0).at("kind"));
  EXPECT_EQ("param_KARST_RESOLVER_LEAST_MAX_HEAP:int", info.at("declaration").at(0));
}

}  // namespace
