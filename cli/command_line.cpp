/* Options and help pages. No lock. */
#include "cli/command_line.h"

#include <CLI/CLI.hpp>
#include <map>

namespace cli {
namespace {

constexpr const char *kExitStatus =
    "Exit status:\n"
    "  0  every target is resolved (watch: an orderly end)\n"
    "  1  some target is not resolved; the table says why\n"
    "  2  the command line or an input is wrong; the message on standard error says what to do\n";

constexpr const char *kTargets =
    "Targets, any number, mixed:\n"
    "  node UUID                       a node\n"
    "  object TYPE UUID [--hint UUID]  the node that owns the object; TYPE is its entry's type, 0 "
    "to\n"
    "                                  255. Until the object's entry is found, the node of --hint\n"
    "                                  stands in for its owner.\n\n";

constexpr const char *kResolveExamples =
    "Examples:\n"
    "  karst resolve --directory cluster.json --all\n"
    "      a table of every node and object of the file\n"
    "  karst resolve --directory cluster.json node a0000000-0000-4000-8000-000000000001\n"
    "      one node\n"
    "  karst resolve --directory cluster.json object 2 c0000000-0000-4000-8000-000000000001 \\\n"
    "      --hint a0000000-0000-4000-8000-000000000007\n"
    "      the owner of an object of type 2\n"
    "  karst resolve --own-interfaces --all\n"
    "      this machine alone, as its own network interfaces are now\n"
    "  karst resolve --directory cluster.json --all --json | jq -r "
    "'select(.state==\"resolved\").uuid'\n"
    "      for programs: a JSON object a line\n\n";

constexpr const char *kWatchExamples =
    "Examples:\n"
    "  karst watch --directory cluster.json --all\n"
    "      the table, then a line whenever an answer is refreshed; edit the file and see. Ctrl-C "
    "ends.\n"
    "  karst watch --directory cluster.json object 2 c0000000-0000-4000-8000-000000000001\n"
    "      follows an object from owner to owner\n"
    "  karst watch --own-interfaces --all\n"
    "      pull a cable\n"
    "  karst watch --directory cluster.json --all --json\n"
    "      a JSON object a line; \"event\" is start, callback, retry or end\n\n"
    "A target that is not resolved is tried again whenever the directory changes. A change of the "
    "file\n"
    "that breaks one of its rules is refused with a line on standard error, and the answer "
    "stays.\n\n";

constexpr const char *kModinfoExamples =
    "Examples:\n"
    "  karst modinfo build/release/karst_resolver.so\n"
    "  karst modinfo --json build/release/karst_resolver.so | jq '.requires[].name'\n\n"
    "Exit status: 0, or 2 when the file is no module; the message on standard error says why.\n";

/* What resolve and watch have in common. */
struct QuestionOptions {
  CLI::App *app = nullptr;
  CLI::Option *targetWords = nullptr;
  CLI::Option *hints = nullptr;
  std::vector<std::string> words;
  std::vector<std::string> hintWords;
  std::string self;
  std::string module;
  std::string log = "warning";
  bool json = false;
};

const std::map<std::string, host::LogThreshold> &logLevels() {
  static const std::map<std::string, host::LogThreshold> levels{
      {"info", host::LogThreshold::Info},
      {"warning", host::LogThreshold::Warning},
      {"off", host::LogThreshold::Off}};
  return levels;
}

void addQuestion(CLI::App &app, QuestionOptions &options, CommandLine &line) {
  options.app = &app;
  const auto bytesOfOne = [](CLI::Option *option, const char *value) {
    return option->type_name(value)->allow_extra_args(false);
  };
  options.targetWords =
      app.add_option("targets", options.words, "What to resolve; see below")->type_name("TARGET");
  options.hints = bytesOfOne(
      app.add_option("--hint", options.hintWords,
                     "Behind an object: the node that stands in for its owner; see below"),
      "UUID");
  app.add_flag("--all", line.question.all, "Every node and every object of the directory");
  app.add_option("--directory", line.session.directoryFile,
                 "Cluster file (JSON): what the directory holds")
      ->type_name("FILE");
  app.add_flag("--own-interfaces", line.session.ownInterfaces,
               "Add this machine's network interfaces, as those of this host's node");
  app.add_option("--self", options.self,
                 "This host's node; otherwise the file's \"self\", or else the machine's id")
      ->type_name("UUID");
  app.add_flag("--local", line.session.useLocalLocator,
               "Answer \"this host\" instead of addresses where the node is this host");
  app.add_flag("--witness", line.session.witness,
               "This host is a witness: its traffic is of type 1 with every node");
  app.add_flag("--json", options.json, "Print a JSON object a line");
  app.add_option("--module", options.module,
                 "The resolver's file; otherwise karst_resolver.so beside this command")
      ->type_name("FILE");
  bytesOfOne(app.add_option("--param", line.session.parameters,
                            "Set a parameter of the module (karst modinfo lists them)"),
             "NAME=VALUE");
  std::vector<std::string> levels;
  for (const auto &[name, unused] : logLevels()) levels.push_back(name);
  app.add_option("--log", options.log,
                 "What to log on standard error: info, warning (the default) or off")
      ->type_name("LEVEL")
      ->check(CLI::IsMember(levels));
}

/* The words in the order in which they were given, plain ones and hints. */
std::vector<TargetWord> wordsInOrder(const QuestionOptions &options) {
  std::vector<TargetWord> words;
  auto word = options.words.begin();
  auto hint = options.hintWords.begin();
  for (const CLI::Option *option : options.app->parse_order()) {
    if (option == options.targetWords) words.push_back({false, *word++});
    if (option == options.hints) words.push_back({true, *hint++});
  }
  return words;
}

/* Beside the command, as it is built; else where it is installed. */
std::filesystem::path defaultModule() {
  const std::filesystem::path folder =
      std::filesystem::read_symlink("/proc/self/exe").parent_path();
  const auto beside = folder / "karst_resolver.so";
  const auto installed = folder.parent_path() / "lib" / "karst" / "karst_resolver.so";
  return !std::filesystem::exists(beside) && std::filesystem::exists(installed) ? installed
                                                                                : beside;
}

void completeQuestion(const QuestionOptions &options, CommandLine &line) {
  line.question.targets = parseTargets(wordsInOrder(options));
  if (line.question.all && !line.question.targets.empty()) {
    throw UsageError("--all leaves nothing to name; give either --all or targets");
  }
  if (!line.question.all && line.question.targets.empty()) {
    throw UsageError("what to resolve? Give --all, node UUID or object TYPE UUID");
  }
  if (line.session.directoryFile.empty() && !line.session.ownInterfaces) {
    throw UsageError("where is the directory? Give --directory FILE, --own-interfaces or both");
  }
  if (!options.self.empty()) line.session.self = parseUUIDFor("--self", options.self);
  line.session.module =
      options.module.empty() ? defaultModule() : std::filesystem::path(options.module);
  line.log = logLevels().at(options.log);
  line.format = options.json ? Format::Json : Format::Text;
}

/* The commands of `karst`, and what their options are read into. */
struct Commands {
  CommandLine line;
  CLI::App app{
      "Says at which network addresses the nodes of a cluster, and the owners of its storage\n"
      "objects, can be reached, now and as it changes."};
  QuestionOptions resolve;
  QuestionOptions watch;
  CLI::App *modinfo = nullptr;
  bool modinfoJson = false;

  Commands();
};

Commands::Commands() {
  app.name("karst");
  app.set_version_flag("--version", "karst " KARST_VERSION);
  app.require_subcommand(1);
  app.footer(std::string("Examples:\n") +
             "  karst resolve --directory cluster.json --all    where everything can be reached\n"
             "  karst watch --directory cluster.json --all      and what changes, until Ctrl-C\n"
             "  karst modinfo karst_resolver.so                 what a module file declares\n"
             "  karst resolve --help                            all about one command\n\n" +
             kExitStatus);

  auto *const resolveApp =
      app.add_subcommand("resolve", "Prints where nodes and the owners of objects can be reached");
  addQuestion(*resolveApp, resolve, line);
  resolveApp->footer(std::string(kTargets) + kResolveExamples + kExitStatus);

  auto *const watchApp =
      app.add_subcommand("watch", "Prints the same, then every change until Ctrl-C");
  addQuestion(*watchApp, watch, line);
  watchApp->footer(std::string(kTargets) + kWatchExamples + kExitStatus);

  modinfo = app.add_subcommand("modinfo", "Prints what a module file declares");
  modinfo->add_option("file", line.moduleFile, "The module file")->type_name("FILE")->required();
  modinfo->add_flag("--json", modinfoJson, "Print a JSON object");
  modinfo->footer(kModinfoExamples);
}

void complete(Commands &commands) {
  CommandLine &line = commands.line;
  if (commands.modinfo->parsed()) {
    line.command = Command::Modinfo;
    line.format = commands.modinfoJson ? Format::Json : Format::Text;
    return;
  }
  const bool watches = commands.watch.app->parsed();
  line.command = watches ? Command::Watch : Command::Resolve;
  completeQuestion(watches ? commands.watch : commands.resolve, line);
}

/* "karst resolve", as far as the command line got. */
std::string invoked(const CLI::App &app) {
  const auto commands = app.get_subcommands();
  return commands.empty() ? "karst" : "karst " + commands.front()->get_name();
}

}  // namespace

std::optional<CommandLine> parseCommandLine(int argc, char **argv) {
  Commands commands;
  const auto refuse = [&commands](const std::string &why) {
    const std::string name = invoked(commands.app);
    throw UsageError(name + ": " + why + "\n" + name + " --help shows how");
  };
  try {
    commands.app.parse(argc, argv);
    complete(commands);
  } catch (const CLI::Success &asked) {
    commands.app.exit(asked);
    return {};
  } catch (const CLI::RequiredError &error) {
    const bool commandMissing = commands.app.get_subcommands().empty();
    refuse(commandMissing ? "give a command: resolve, watch or modinfo" : error.what());
  } catch (const CLI::ParseError &error) {
    refuse(error.what());
  } catch (const UsageError &error) {
    refuse(error.what());
  }
  return commands.line;
}

}  // namespace cli
