#include "host/command_line.h"

#include <CLI/CLI.hpp>
#include <algorithm>
#include <sstream>
#include <string>
#include <string_view>
#include <vector>

#include "host/commands.h"

namespace appsync {

namespace {

// A place to parse into, for each command.
struct Everything {
  SyncOptions sync;
  RestoreOptions restore;
  BackupOptions backup;
  StatusOptions status;
  ClearOptions clear;
  SettingsOptions settings;
  SeedOptions seed;
  PlayOptions play;
  PlistOptions plist;
  SampleOptions sample;
};

bool areDigits(std::string_view text) {
  return !text.empty() && std::all_of(text.begin(), text.end(), [](char c) { return c >= '0' && c <= '9'; });
}

// CLI11 reads "-1" as a large unsigned number, and "010" as an octal one: these check a number, and take the zeros off
// its front.
std::string wholeNumber(std::string& text) {
  if (!areDigits(text)) return "\"" + text + "\" is no whole number";
  text.erase(0, std::min(text.find_first_not_of('0'), text.size() - 1));
  return "";
}

std::string integer(std::string& text) {
  const bool isNegative = text.starts_with('-');
  std::string digits = text.substr(isNegative ? 1 : 0);
  if (!wholeNumber(digits).empty()) return "\"" + text + "\" is no integer";
  text = (isNegative ? "-" : "") + digits;
  return "";
}

std::string isNamed(const std::string& text) {
  return text.empty() ? "an empty text names nothing" : "";
}

// The arguments as CLI11 takes them, the last one first. It reads "--option=" as an option whose value is the next
// argument; here that is an option with an empty value.
std::vector<std::string> argumentsToParse(int argumentCount, const char* const* arguments) {
  std::vector<std::string> all;
  bool areOptionsOver = false;
  for (int i = 1; i < argumentCount; ++i) {
    const std::string argument = arguments[i];
    areOptionsOver = areOptionsOver || argument == "--";
    const bool isEmptyValue =
        !areOptionsOver && argument.starts_with("--") && argument.find('=') == argument.size() - 1;
    all.push_back(isEmptyValue ? argument.substr(0, argument.size() - 1) : argument);
    if (isEmptyValue) all.emplace_back();
  }
  std::reverse(all.begin(), all.end());
  return all;
}

class Grammar {
 public:
  Grammar() : _app("Syncs applications to a device that lives in a directory.", "dovel") {
    _app.set_version_flag("--version", "dovel " APPSYNC_VERSION);
    _app.set_help_flag("-h,--help", "Print this help");
    _app.require_subcommand(1);
    _app.footer("\"dovel COMMAND --help\" tells more of a command.");
    addSync();
    addRestore();
    addDeviceCommands();
    addPlist();
    addSample();
    add("faults", "Print the names that --fault knows, one a line",
        [](Console& console) { return runFaults(console); });
  }

  Invocation parse(int argumentCount, const char* const* arguments) {
    Invocation invocation;
    try {
      _app.parse(argumentsToParse(argumentCount, arguments));
    } catch (const CLI::Success& asked) {
      std::ostringstream text;
      _app.exit(asked, text, text);
      invocation.text = text.str();
      return invocation;
    } catch (const CLI::ParseError& problem) {
      invocation.failure = failureFor(problem);
      return invocation;
    }
    if (const DeviceOptionsGiven* common = _chosenCommon()) {
      invocation.json = common->json;
      invocation.quiet = common->quiet;
      if (common->device.empty()) {
        invocation.failure = Failure{FailureCode::CommandLine, "--device names no directory", "give it a path"};
        return invocation;
      }
    }
    invocation.run = _run;
    return invocation;
  }

 private:
  CLI::App* add(const char* name, const char* what, std::function<int(Console&)> run,
                DeviceOptionsGiven* common = nullptr) {
    CLI::App* command = _app.add_subcommand(name, what);
    command->callback([this, run = std::move(run), common] {
      _run = run;
      _chosenCommon = [common] { return common; };
    });
    if (common != nullptr) addCommon(*command, *common);
    return command;
  }

  static void addCommon(CLI::App& command, DeviceOptionsGiven& common) {
    command.add_option("--device", common.device, "The device's directory; made when it is not there")
        ->required()
        ->type_name("DIR");
    command.add_flag("--json", common.json, "Print the result as one JSON object");
    command.add_flag("--quiet", common.quiet, "Print nothing unless something failed");
    command.add_option("--log", common.log, "Write the log to FILE (- is standard error)")->type_name("FILE");
    command.add_option("--trace", common.trace, "Write a trace of installs and transfers to FILE")->type_name("FILE");
    command.add_option("--plugin", common.plugin, "Load this plug-in")->check(isNamed)->type_name("FILE");
    repeatable(command.add_option("--fault", common.faults, "Make an operation fail: NAME[=ID][@N]"))
        ->type_name("SPEC");
  }

  // One value for each time the option is given.
  static CLI::Option* repeatable(CLI::Option* option) { return option->allow_extra_args(false)->take_all(); }

  void addSync() {
    SyncOptions& sync = _parsed.sync;
    CLI::App* command = add(
        "sync", "Sync a host directory to the device", [&sync](Console& console) { return runSync(sync, console); },
        &sync.common);
    command->add_option("HOST", sync.host, "The host directory")->required();
    command->add_option("--type", sync.type, "The type of the sync")
        ->transform(CLI::Validator(wholeNumber, ""))
        ->type_name("N");
    command->add_flag("--fail-phase", sync.failPhase, "End the transfer phase without success");
    command->add_flag("--report-installs", sync.reportInstalls, "Report each install's result to the client");
    command->add_option("--rate", sync.rate, "Bytes per second; 0 is as fast as possible")
        ->transform(CLI::Validator(wholeNumber, ""))
        ->type_name("N");
    repeatable(command->add_option("--cancel", sync.cancel, "Cancel this install while its package is half way"))
        ->type_name("ID");
    repeatable(command->add_option("--prioritize", sync.prioritize, "Ask for this application first"))->type_name("ID");
  }

  void addRestore() {
    RestoreOptions& restore = _parsed.restore;
    CLI::App* command = add(
        "restore", "Bring the applications of a backup back as placeholders",
        [&restore](Console& console) { return runRestore(restore, console); }, &restore.common);
    command->add_option("BACKUP", restore.backup, "The backup directory")->required();
    command->add_option("--type", restore.type, "The type of the restore (default 2)")
        ->transform(CLI::Validator(integer, ""))
        ->type_name("N");
    command
        ->add_option("--host-process", restore.hostProcess,
                     "The process that hosts the client (default com.zelk.datamigrator)")
        ->type_name("ID");
  }

  void addDeviceCommands() {
    Everything& all = _parsed;
    add(
        "backup", "Tidy store metadata before a backup; report the store accounts",
        [&all](Console& console) { return runBackup(all.backup, console); }, &all.backup.common);
    add(
        "status", "Show what is on the device", [&all](Console& console) { return runStatus(all.status, console); },
        &all.status.common);
    add(
        "clear", "Forget all sync state", [&all](Console& console) { return runClear(all.clear, console); },
        &all.clear.common);
    CLI::App* settings = add(
        "settings", "Show all settings, show one, or change one",
        [&all](Console& console) { return runSettings(all.settings, console); }, &all.settings.common);
    settings->add_option("KEY", all.settings.key, "The setting");
    settings->add_option("VALUE", all.settings.value, "Its new value");
    CLI::App* seed = add(
        "seed", "Put the device into a state", [&all](Console& console) { return runSeed(all.seed, console); },
        &all.seed.common);
    seed->add_option("FILE", all.seed.file, "The state: a property list or JSON")->required();
    CLI::App* play = add(
        "play", "Make single calls on the client", [&all](Console& console) { return runPlay(all.play, console); },
        &all.play.common);
    play->add_option("SCRIPT", all.play.script, "The calls: a JSON object")->required();
  }

  void addPlist() {
    PlistOptions& plist = _parsed.plist;
    CLI::App* command = add("plist", "Print or convert a property list",
                            [&plist](Console& console) { return runPlist(plist, console); });
    command->add_option("FILE", plist.file, "The property list, XML or binary")->required();
    command->add_option("--to", plist.to, "Convert it; without, print an outline")
        ->check(CLI::IsMember({"xml", "binary", "json"}));
    command->add_option("-o", plist.output, "Write to OUT instead of standard output")->type_name("OUT");
  }

  void addSample() {
    SampleOptions& sample = _parsed.sample;
    CLI::App* command = add("sample", "Write a host directory, or a backup, with sample applications",
                            [&sample](Console& console) { return runSample(sample, console); });
    command->add_option("DIR", sample.directory, "The directory to write; new, or empty")->required()->check(isNamed);
    command->add_flag("--backup", sample.backup, "Write a backup directory, for dovel restore");
    command->add_option("--apps", sample.applications, "How many applications (default 8)")
        ->transform(CLI::Validator(wholeNumber, ""))
        ->check(CLI::Range(0, 10000))
        ->type_name("N");
    command->add_option("--seed", sample.seed, "The same seed gives the same bytes (default 1)")
        ->transform(CLI::Validator(wholeNumber, ""))
        ->type_name("S");
  }

  Failure failureFor(const CLI::ParseError& problem) const {
    std::string what = problem.what();
    std::replace(what.begin(), what.end(), '\n', ' ');
    while (what.ends_with(' ') || what.ends_with('.')) what.pop_back();
    const auto chosen = _app.get_subcommands();
    const std::string name = chosen.empty() ? "dovel" : "dovel " + chosen.front()->get_name();
    if (chosen.empty() && dynamic_cast<const CLI::RequiredError*>(&problem) != nullptr) {
      const std::vector<std::string> others = _app.remaining();
      what = others.empty() ? "no command is given" : "there is no command \"" + others.front() + "\"";
    }
    return {FailureCode::CommandLine, what, "\"" + name + " --help\" tells what it takes"};
  }

  CLI::App _app;
  Everything _parsed;
  std::function<int(Console&)> _run;
  std::function<const DeviceOptionsGiven*()> _chosenCommon = [] { return nullptr; };
};

}  // namespace

Invocation parseCommandLine(int argumentCount, const char* const* arguments) {
  const auto grammar = std::make_shared<Grammar>();
  Invocation invocation = grammar->parse(argumentCount, arguments);
  if (invocation.run) {
    invocation.run = [grammar, run = invocation.run](Console& console) { return run(console); };
  }
  if (invocation.failure) {
    // The line could not be understood, but who asked for JSON is to get it.
    invocation.json = std::any_of(arguments, arguments + argumentCount,
                                  [](const char* argument) { return std::string_view(argument) == "--json"; });
  }
  return invocation;
}

}  // namespace appsync
