// What the program shows and writes: tables, documents, conversions, files, standard streams.
#include <sys/stat.h>
#include <unistd.h>

#include <regex>

#include "tests/support/program.h"

namespace appsync {
namespace {

using namespace test;

using OutputTest = ProgramTest;

// A command line of the shell, in which "dovel" is the program.
Outcome shell(const std::string& line) {
  return runProgram("/bin/sh", {"-c", "dovel() { " + kProgram + " \"$@\"; }; " + line});
}

constexpr char kState[] = R"({
  "installed": [{"identifier": "org.a", "version": "1.2", "name": "Ä 🎈", "type": "System", "size": 70000},
                {"identifier": "org.with.an.identifier.that.fits.into.no.column.of.48", "name": "B", "size": 500}],
  "placeholders": [{"identifier": "org.p", "name": "P", "installType": 2, "version": "3", "launchProhibited": true}],
  "coordinators": [{"identifier": "org.p", "kind": "restoring", "creator": 3, "responsibleClient": 1,
                    "installOptions": true, "initialAssetPromises": true, "assetPromise": "open",
                    "placeholderPromise": true, "userDataPromise": true},
                   {"identifier": "org.d", "kind": "initiating", "creator": 1, "error": "gone\nfor good"}],
  "todo": [{"identifier": "org.a", "operation": "install"}, {"identifier": 7, "operation": "remove"}],
  "homeScreen": ["org.p", "org.a"], "uninstalled": ["org.u\t"], "syncing": true,
  "settings": {"AppRemovalAllowed": 2, "CreateAppPlaceholders": false}})";

TEST_F(OutputTest, StatusIsATableForAPersonAndADocumentForAProgram) {
  seed(kState);
  const Arguments status{"status", "--device", at("device")};
  const Outcome shown = dovel(status);
  EXPECT_EQ(shown.status, 0);
  EXPECT_EQ(shown.out, R"(installed (2)
  identifier                                       version name type   size  container
  org.a                                            1.2     Ä 🎈 System 70000 var/mobile/Containers/1
  org.with.an.identifier.that.fits.into.no.column… -       B    User   500   var/mobile/Containers/3
placeholders (1)
  identifier name installType version launchProhibited type
  org.p      P    restore (2) 3       true             User
coordinators (2)
  identifier kind       creator error         responsibleClient
  org.d      initiating 1       gone�for good -
  org.p      restoring  3       -             1
todo (2)
  identifier operation
  org.a      install
  -          remove
homeScreen (3)
  org.p
  org.a
  org.with.an.identifier.that.fits.into.no.column.of.48
uninstalled (1)
  org.u�
syncing: yes
settings
  AppInstallationAllowed 0
  AppRemovalAllowed 2
  CreateAppPlaceholders false
)");
  Json document = this->status();
  const Json coordinators = document["coordinators"];
  document.erase("coordinators");
  EXPECT_EQ(document, Json::parse(R"({"schema": 1, "ok": true,
    "installed": [{"identifier": "org.a", "version": "1.2", "name": "Ä 🎈", "type": "System", "size": 70000,
                   "container": "var/mobile/Containers/1"},
                  {"identifier": "org.with.an.identifier.that.fits.into.no.column.of.48", "version": null, "name": "B",
                   "type": "User", "size": 500, "container": "var/mobile/Containers/3"}],
    "placeholders": [{"identifier": "org.p", "name": "P", "installType": 2, "version": "3", "launchProhibited": true,
                      "type": "User"}],
    "todo": [{"identifier": "org.a", "operation": "install"}, {"identifier": null, "operation": "remove"}],
    "homeScreen": ["org.p", "org.a", "org.with.an.identifier.that.fits.into.no.column.of.48"],
    "uninstalled": ["org.u\t"], "syncing": true,
    "settings": {"AppInstallationAllowed": 0, "AppRemovalAllowed": 2, "CreateAppPlaceholders": false}})"))
      << document.dump(1);
  EXPECT_EQ(coordinators[0]["error"], "gone\nfor good");
  EXPECT_EQ(coordinators[1], Json::parse(R"({"identifier": "org.p", "kind": "restoring", "creator": 3, "error": null,
    "responsibleClient": 1, "installOptions": true, "initialAssetPromises": true, "assetPromise": "open",
    "placeholderPromise": true, "userDataPromise": true})"));
  EXPECT_EQ(dovel({"status", "--device", at("device"), "--quiet"}).out, "");

  seed("{}", "new");
  EXPECT_EQ(dovel({"status", "--device", at("new")}).out,
            "installed (0)\nplaceholders (0)\ncoordinators (0)\ntodo (0)\nhomeScreen (0)\nuninstalled (0)\n"
            "syncing: no\nsettings\n  AppInstallationAllowed 0\n  AppRemovalAllowed 0\n  CreateAppPlaceholders true\n");
}

TEST_F(OutputTest, SettingsAreShownAndChangedOneAtATime) {
  struct Case {
    Arguments arguments;
    int status;
    std::string out;
    std::string json;  // its "settings"
  };
  const Case cases[] = {
      {{},
       0,
       "AppInstallationAllowed 0\nAppRemovalAllowed 0\nCreateAppPlaceholders yes\n",
       R"({"AppInstallationAllowed": 0, "AppRemovalAllowed": 0, "CreateAppPlaceholders": true})"},
      {{"AppRemovalAllowed", "2"}, 0, "AppRemovalAllowed 2\n", R"({"AppRemovalAllowed": 2})"},
      {{"AppRemovalAllowed"}, 0, "AppRemovalAllowed 2\n", R"({"AppRemovalAllowed": 2})"},
      {{"CreateAppPlaceholders", "no"}, 0, "CreateAppPlaceholders no\n", R"({"CreateAppPlaceholders": false})"},
      {{"CreateAppPlaceholders", "2"}, 2, "", "null"},
      {{},
       0,
       "AppInstallationAllowed 0\nAppRemovalAllowed 2\nCreateAppPlaceholders no\n",
       R"({"AppInstallationAllowed": 0, "AppRemovalAllowed": 2, "CreateAppPlaceholders": false})"}};
  for (const auto& [arguments, status, out, json] : cases) {
    SCOPED_TRACE(testing::PrintToString(arguments));
    Arguments line{"settings", "--device", at("device")};
    line.insert(line.end(), arguments.begin(), arguments.end());
    const Outcome run = dovel(line);
    EXPECT_EQ(run.status, status) << run.err;
    EXPECT_EQ(run.out, out);
    line.emplace_back("--json");
    const Json document = dovel(line).json();
    EXPECT_EQ(document["ok"], status == 0);
    EXPECT_EQ(document.value("settings", Json()), Json::parse(json));
  }
}

TEST_F(OutputTest, AnOutlineAndADocumentShowAPropertyList) {
  write(
      at("a.plist"),
      "<plist><dict><key>k\xc2\x9b</key><string>te\"xt\n</string><key>data</key><data>AAEC/w==</data><key>one</key>"
      "<data>AA==</data><key>date</key><date>2026-01-31T12:00:00Z</date><key>list</key><array><integer>-3</integer>"
      "<real>2</real><true/><array/></array><key>d</key><dict><key>k</key><integer>1</integer></dict></dict></plist>");
  EXPECT_EQ(dovel({"plist", at("a.plist")}).out,
            "dictionary, 6 members\n  k�: \"te\"xt�\"\n  data: data, 4 bytes\n  one: data, 1 byte\n"
            "  date: date 2026-01-31T12:00:00Z\n  list: array, 4 elements\n    0: -3\n    1: 2\n    2: true\n"
            "    3: array, 0 elements\n  d: dictionary, 1 member\n    k: 1\n");
  EXPECT_EQ(dovel({"plist", at("a.plist"), "--to", "json"}).out,
            "{\n  \"k\xc2\x9b\": \"te\\\"xt\\n\",\n  \"data\": {\"$data\":\"AAEC/w==\"},\n"
            "  \"one\": {\"$data\":\"AA==\"},\n  \"date\": {\"$date\":\"2026-01-31T12:00:00Z\"},\n"
            "  \"list\": [\n    -3,\n    2.0,\n    true,\n    []\n  ],\n  \"d\": {\n    \"k\": 1\n  }\n}\n");
  write(at("uid.plist"), bytesOf(PropertyList::array({PropertyList::uid(5)}), PropertyListFormat::Binary));
  EXPECT_EQ(dovel({"plist", at("uid.plist")}).out, "array, 1 element\n  0: uid 5\n");
  write(at("control.plist"), bytesOf(PropertyList("\x01"), PropertyListFormat::Binary));
  const Outcome refused = dovel({"plist", at("control.plist"), "--to", "xml", "-o", at("none")});
  EXPECT_EQ(refused.status, 3);
  EXPECT_NE(refused.err.find("control.plist\" cannot be written as xml"), std::string::npos) << refused.err;
  EXPECT_FALSE(fs::exists(at("none")));
}

// More than a buffer holds, so that it goes out in several pieces, and deeper than lines are indented.
TEST_F(OutputTest, LargeAndDeepListsComeOutWhole) {
  PropertyList list = PropertyList::array();
  for (int i = 0; i < 30000; ++i) list.append("element " + std::to_string(i));
  for (int i = 0; i < 40; ++i) list = PropertyList::array({list});
  write(at("large.plist"), bytesOf(list, PropertyListFormat::Binary));
  for (const char* format : {"xml", "binary", "json"}) {
    const Outcome shown = dovel({"plist", at("large.plist"), "--to", format});
    ASSERT_EQ(dovel({"plist", at("large.plist"), "--to", format, "-o", at("out")}).status, 0);
    EXPECT_TRUE(shown.out == contentOf(at("out"))) << format;
    EXPECT_GT(shown.out.size(), 200000U);
  }
  Json json = Json::parse(contentOf(at("out")));
  for (int i = 0; i < 40; ++i) json = Json(json[0]);
  EXPECT_EQ(json.size(), 30000U);
  EXPECT_EQ(json[29999], "element 29999");
}

// What JSON says beyond JSON goes into a property list and comes back; what only looks like it stays as it is.
TEST_F(OutputTest, EveryFormOfAValueInJSON) {
  const std::pair<const char*, const char*> cases[] = {
      // the second empty: comes back as it was
      {R"({"$data":"AAEC/w=="})", ""},
      {R"({"$data":"AAE="})", ""},
      {R"({"$data":"AA=="})", ""},
      {R"({"$data":""})", ""},
      {R"({"$data":"AAECAw"})", R"({"$data":"AAECAw=="})"},
      {R"({"$data":"A"})", ""},
      {R"({"$data":"@@@@"})", ""},
      {R"({"$data":5})", ""},
      {R"({"$date":"2026-01-31T12:00:00Z"})", ""},
      {R"({"$date":"2026-02-28T23:59:59.25Z"})", ""},
      {R"({"$date":"2024-03-01T00:00:00Z"})", ""},
      {R"({"$date":0})", R"({"$date":"2001-01-01T00:00:00Z"})"},
      {R"({"$date":"1969-12-31T23:59:59Z"})", ""},
      {R"({"$date":"1600-02-29T00:00:00Z"})", ""},
      {R"({"$date":"0001-01-01T00:00:00Z"})", ""},
      {R"({"$date":"9999-12-31T23:59:59Z"})", ""},
      {R"({"$date":"2026-12-31T23:59:60Z"})", R"({"$date":"2027-01-01T00:00:00Z"})"},
      {R"({"$date":"2026-13-01T00:00:00Z"})", ""},
      {R"({"$date":"2026-00-01T00:00:00Z"})", ""},
      {R"({"$date":"2026-01-32T00:00:00Z"})", ""},
      {R"({"$date":"2026-01-00T00:00:00Z"})", ""},
      {R"({"$date":"2026-01-01T24:00:00Z"})", ""},
      {R"({"$date":"2026-01-01T00:60:00Z"})", ""},
      {R"({"$date":"2026-01-01T00:00:61Z"})", ""},
      {R"({"$date":"2026-01-01T00:00:00Zx"})", ""},
      {R"({"$date":"2026-01-01"})", ""},
      {R"({"$date":true})", ""},
      {R"({"$uid":5})", ""},
      {R"({"$uid":-1})", ""},
      {R"({"$uid":"5"})", ""},
      {R"({"$real":"nan"})", ""},
      {R"({"$real":"inf"})", ""},
      {R"({"$real":"-inf"})", ""},
      {R"({"$real":"x"})", ""},
      {R"({"$real":1})", ""},
      {R"({"$uid":5,"x":1})", ""},
      {R"({"a":null,"b":[null,1]})", R"({"b":[1]})"},
      {"18446744073709551615", ""},
      {"-9223372036854775808", ""},
      {"2.0", ""},
      {"-0.25", ""},
      {"false", ""},
      {R"("\"é\\[[{{")", ""},
  };
  std::string values;
  for (const auto& [value, expected] : cases) values += (values.empty() ? "" : ",") + std::string(value);
  seed(R"({"installed": [{"identifier": "org.a", "storeMetadata": {"values": [)" + values + "]}}]}");
  const Json back =
      dovel({"plist", at("device/var/mobile/Containers/1/TarvoMetadata.plist"), "--to", "json"}).json()["values"];
  ASSERT_EQ(back.size(), std::size(cases));
  for (std::size_t i = 0; i < back.size(); ++i) {
    const auto& [value, expected] = cases[i];
    EXPECT_EQ(back[i].dump(), Json::parse(*expected != 0 ? expected : value).dump());
  }
}

TEST_F(OutputTest, JSONMayNestAsDeepAsAReaderCanFollow) {
  const auto nested = [](std::size_t depth) { return std::string(depth, '[') + std::string(depth, ']'); };
  const std::string shallow = R"({"lastSync": [)";
  std::string beside = R"(")" + std::string(600, '[') + R"(\"[", "\\")";
  for (int i = 0; i < 600; ++i) beside += R"(, "org.x")";
  const std::pair<std::string, bool> cases[] = {
      {shallow + beside + "]}", true}, {shallow + nested(510) + "]}", true}, {shallow + nested(511) + "]}", false}};
  for (const auto& [document, isGood] : cases) {
    write(at("state.json"), " \n\t" + document);
    const Outcome run = dovel({"seed", "--device", at("device"), at("state.json")});
    EXPECT_EQ(run.err.find("512") == std::string::npos, isGood) << run.err.substr(0, 300);
  }
  write(at("state.json"), R"({"lastSync": [})");
  const Outcome run = dovel({"seed", "--device", at("device"), at("state.json")});
  EXPECT_EQ(run.status, 3);
  EXPECT_NE(run.err.find("state.json\" cannot be used: parse error at line 1, column 15"), std::string::npos)
      << run.err;
}

TEST_F(OutputTest, ASeedThatIsRefusedNamesItsFileAndChangesNothing) {
  seed(kState);
  const Json before = status();
  const std::pair<const char*, const char*> cases[] = {
      {"[]", "dictionary"},
      {R"({"uninstalled": ["org.new"], "installed": [{"identifier": "../x"}]})",
       "\"installed\" cannot be put on a device: entry 1"},
      {R"({"syncing": 1})", "syncing"},
      {R"({"coordinators": [{"identifier": "org.x", "kind": "updating", "more": 1}]})", "\"more\""},
      {R"({"nonsense": 1})", "nonsense"}};
  for (const auto& [state, named] : cases) {
    write(at("bad.json"), state);
    const Outcome run = dovel({"seed", "--device", at("device"), at("bad.json"), "--json"});
    EXPECT_EQ(run.status, 3) << state;
    const Json error = run.json()["error"];
    EXPECT_EQ(error["code"], "seed-refused") << run.out;
    EXPECT_EQ(error["message"].get<std::string>().find("\"" + at("bad.json") + "\": "), 0U) << error;
    EXPECT_NE(error["message"].get<std::string>().find(named), std::string::npos) << error;
    EXPECT_EQ(error["hint"] == "mend the entry", named != std::string("nonsense")) << error["hint"];
    EXPECT_EQ(status(), before);
  }
}

TEST_F(OutputTest, AnOutputAppearsWholeInItsPlaceOrNotAtAll) {
  write(at("a.plist"), bytesOf("text"));
  const auto convert = [&](const std::string& out) {
    return dovel({"plist", at("a.plist"), "--to", "json", "-o", out});
  };
  const auto modeOf = [&](const std::string& name) {
    struct stat status {};
    EXPECT_EQ(::stat(at(name).c_str(), &status), 0);
    return status.st_mode & 07777;
  };
  const mode_t mask = ::umask(027);
  EXPECT_EQ(convert(at("new")).status, 0);
  ::umask(mask);
  EXPECT_EQ(modeOf("new"), 0640U);
  write(at("old"), "old");
  ::chmod(at("old").c_str(), 0604);
  fs::create_symlink("old", at("link"));
  EXPECT_EQ(convert(at("link")).status, 0);
  EXPECT_TRUE(fs::is_symlink(at("link")));
  EXPECT_EQ(contentOf(at("old")), "\"text\"\n");
  EXPECT_EQ(modeOf("old"), 0604U);
  EXPECT_EQ(convert("/dev/null").status, 0);
  EXPECT_TRUE(fs::is_character_file("/dev/null"));
  EXPECT_EQ(shell("dovel plist " + at("a.plist") + " --to json -o /dev/stdout | cat").out, "\"text\"\n");
  for (const std::string& bad : {at("none/out"), at(""), std::string("/dev/full")}) {
    const Outcome run = convert(bad);
    EXPECT_EQ(run.status, 3) << bad;
    EXPECT_NE(run.err.find("\" cannot be written: "), std::string::npos) << run.err;
  }
  EXPECT_EQ(treeOf(_root).size(), 4U) << "no temporary file is left";
}

TEST_F(OutputTest, StandardOutputThatCannotBeWrittenIsSaid) {
  write(at("a.plist"), bytesOf("text"));
  seed("{}");
  const std::string commands[] = {"dovel plist " + at("a.plist"), "dovel status --json --device " + at("device"),
                                  "dovel --help"};
  for (const std::string& command : commands) {
    const Outcome full = shell(command + " > /dev/full");
    EXPECT_EQ(full.status, 3) << command;
    EXPECT_NE(full.err.find("standard output cannot be written"), std::string::npos) << full.err;
    EXPECT_EQ(shell("(" + command + "; echo $? >&2) | true").err, "0\n") << "a reader that has gone is no failure";
  }
  EXPECT_EQ(shell("dovel nonsense > /dev/full").status, 2);
}

// A program that is started without standard streams must not take its own files for them.
TEST_F(OutputTest, ClosedStandardStreamsDoNotSpillIntoFiles) {
  const std::string host = sampleHost("host", 1, 1);
  const Outcome run = shell("dovel sync --device " + at("device") + " " + host + " --prioritize org.x --log " +
                            at("log") + " 0<&- 1>&- 2>&-");
  EXPECT_EQ(run.status, 0);
  const std::string log = contentOf(at("log"));
  EXPECT_FALSE(messagesOf(log).empty());  // each line is one of the log's
  EXPECT_EQ(log.find("has no effect"), std::string::npos);
  EXPECT_EQ(entryOf(status()["todo"], "org.sample.notes")["operation"], "INSTALLED");
}

TEST_F(OutputTest, ASignalEndsTheWaitForAReaderOfTheLog) {
  ASSERT_EQ(::mkfifo(at("pipe").c_str(), 0600), 0);
  const Outcome run = runProgram("/usr/bin/timeout", {"--kill-after=5", "0.3", kProgram, "settings", "--device",
                                                      at("device"), "--log", at("pipe")});
  EXPECT_EQ(run.status, 124);  // ended by the first signal
}

TEST_F(OutputTest, QuietSaysOnlyWhatFailed) {
  const std::string host = sampleHost("host", 2, 1);
  EXPECT_EQ(sync(host, {"--quiet"}).out, "");
  const Outcome failed = sync(host, {"--quiet", "--fault", "install=org.sample.maps"});
  EXPECT_EQ(failed.status, 1);
  EXPECT_TRUE(std::regex_search(failed.out, std::regex("^org.sample.maps +failed .*made to fail"))) << failed.out;
  EXPECT_EQ(std::count(failed.out.begin(), failed.out.end(), '\n'), 1) << failed.out;

  seed(R"({"placeholders": [{"identifier": "org.p"}, {"identifier": "org.q"}]})");
  const Outcome stuck = dovel({"clear", "--device", at("device"), "--quiet", "--fault", "uninstallApplication=org.q"});
  EXPECT_EQ(stuck.status, 1);
  EXPECT_EQ(stuck.out, "The placeholder of org.q could not be removed.\n");
  EXPECT_NE(stuck.err.find("not all sync state could be cleared"), std::string::npos);
  const Outcome cleared = dovel({"clear", "--device", at("device")});
  EXPECT_EQ(cleared.status, 0);
  EXPECT_EQ(cleared.out, "The placeholder of org.q is gone.\nAll sync state is forgotten.\n");
  EXPECT_EQ(cleared.err, "");
}

TEST_F(OutputTest, ALogLineIsOneLineWhateverItSays) {
  const Outcome run =
      play(R"({"steps": [{"do": "assetInstallFailed", "asset": {"identifier": "org.a", "isRestore": true},
                                          "error": {"domain": "X", "code": 7, "text": "a\nb\tc\\d"}}]})",
           {"--log", "-", "--trace", at("trace")});
  EXPECT_EQ(run.status, 0);
  const Texts messages = messagesOf(run.err);
  ASSERT_FALSE(messages.empty());
  EXPECT_EQ(messages.back(), R"(org.a install failed but was recoverable: X 7: a\nb\tc\\d)");
  EXPECT_NE(run.err.find("\tdefault\ttransaction\tscenario=Orrin restore step=0 success=0 bundle=org.a "
                         "description=install failed recoverably\n"),
            std::string::npos);
  const Json trace = Json::parse(contentOf(at("trace")));
  const Json& last = trace["traceEvents"].back();
  EXPECT_EQ(last["name"], "Orrin restore: install failed recoverably");
  EXPECT_EQ(last["ph"], "i");
  EXPECT_EQ(last["args"]["success"], false);
  EXPECT_EQ(dovel({"clear", "--device", at("device"), "--log", "/dev/full"}).status, 3);
  EXPECT_EQ(dovel({"clear", "--device", at("device"), "--trace", "/dev/full"}).status, 3);
}

TEST_F(OutputTest, ATraceTellsWhatBecameOfEachApplication) {
  const std::string host = sampleHost("host", 3, 1);
  ASSERT_EQ(sync(host, {"--trace", at("trace"), "--fault", "install=org.sample.maps", "--fault",
                        "transfer=org.sample.camera"})
                .status,
            1);
  const Json trace = Json::parse(contentOf(at("trace")));
  EXPECT_EQ(trace["displayTimeUnit"], "ms");
  std::map<int, std::string> names;
  std::map<std::string, Texts> told;  // by application
  for (const Json& event : trace["traceEvents"]) {
    EXPECT_EQ(event["pid"], 1);
    if (event["name"] == "thread_name") names[event["tid"]] = event["args"]["name"];
    if (event["ph"] == "X") {
      EXPECT_GE(event["dur"], 0);
      EXPECT_FALSE(event["args"].contains("unfinished"));
    }
    if (event["ph"] == "M") continue;
    std::string text = event["name"];
    if (text == "transfer") {
      text += event["args"]["success"] == true ? " of all" : " of half";
      EXPECT_EQ(event["args"]["success"] == true, event["args"]["bytes"] == event["args"]["of"]) << event;
    }
    if (event["args"].contains("error")) text += ": " + event["args"]["error"].get<std::string>().substr(0, 20);
    told[names[event["tid"]]].push_back(text);
  }
  for (const auto& [name, texts] : told) {
    // A step is one span, called as its end is; its beginning is no event of its own.
    EXPECT_EQ(std::count(texts.begin(), texts.end(), "Install app"), 1) << name;
    EXPECT_EQ(std::count(texts.begin(), texts.end(), "Install App"), 0) << name;
  }
  for (const auto& [name, ends] : std::map<std::string, Texts>{
           {"org.sample.notes", {"placeholder installed", "transfer of all", "installed"}},
           {"org.sample.maps", {"placeholder installed", "transfer of all", "install failed: "}},
           {"org.sample.camera", {"placeholder installed", "transfer of half"}}}) {
    for (const std::string& end : ends) {
      EXPECT_EQ(std::count_if(told[name].begin(), told[name].end(), [&](auto& one) { return one.starts_with(end); }), 1)
          << name << " " << end << testing::PrintToString(told[name]);
    }
  }
  EXPECT_EQ(told.count("org.sample.notes") + told.count("org.sample.maps") + told.count("org.sample.camera"), 3U);
}

// --- how a sync goes ------------------------------------------------------------------------------------------------

TEST_F(OutputTest, ElsewhereThanOnATerminalASyncTellsItsSteps) {
  const std::string host = sampleHost("host", 1, 1);
  write(host + "/ApplicationSync/ApplicationsSync.plist",
        bytesOf(PropertyList::array({install("org.sample.notes"), removal("a/../b"), install("org.none")})));
  Outcome run = sync(host, {});
  EXPECT_EQ(run.status, 1);
  run.out = std::regex_replace(run.out, std::regex("in [0-9.]+ s"), "in T");
  const std::string missing = "missing package: the host has no plain file \"Packages/org.none.ipa\"";
  // Where the installs of others stand among these is for their threads to say.
  const std::string installed = "org.sample.notes: installed\n";
  const std::size_t at = run.out.find(installed);
  ASSERT_NE(at, std::string::npos) << run.out;
  run.out.erase(at, installed.size());
  EXPECT_EQ(run.out, "org.sample.notes: transferring\norg.sample.notes: installing\norg.none: failed: " + missing +
                         "\n\na/../b    skipped      invalid-identifier\norg.none  failed       " + missing +
                         "\n\n1 installed, 0 removed, 1 skipped, 1 failed in T\n");
}

TEST_F(OutputTest, ATerminalIsDrawnInItsOwnSize) {
  const std::string host = sampleHost("host", 5, 1);
  const std::string small = sampleHost("small", 1, 1);
  const auto run = [&](const std::string& from, unsigned short columns, unsigned short rows, const char* kind,
                       Arguments more = {}) {
    more.insert(more.begin(), {"sync", "--device", at("device"), from});
    const Outcome outcome = dovelOnTerminal(more, columns, rows, kind);
    EXPECT_EQ(outcome.status, 0);
    return outcome.out;
  };
  // Each picture has no more lines than fit, none of them wider than the terminal, and counts what it leaves out; the
  // last one shows all.
  std::string shown = run(host, 60, 6, "xterm");
  const std::regex control("\x1b\\[[0-9]*[A-Za-z]|\r");
  EXPECT_EQ(shown.find("\x1b[5A"), std::string::npos);
  for (std::size_t at = shown.find("of 5 done"); at != std::string::npos; at = shown.find("of 5 done", at + 1)) {
    EXPECT_TRUE(shown[at - 2] >= '0' && shown[at - 2] <= '5' && shown[at - 3] == 'K') << shown.substr(at - 10, 20);
  }
  // The last picture goes over the one before, if there was time for one.
  const std::size_t before = shown.rfind("\x1b[4A");
  const std::size_t last = before == std::string::npos ? 0 : before;
  const std::string picture = std::regex_replace(shown.substr(last), control, "");
  EXPECT_EQ(picture.find("of 5 done"), std::string::npos);
  std::istringstream lines(picture);
  int count = 0;
  for (std::string line; std::getline(lines, line) && !line.ends_with(" s"); ++count) {
    EXPECT_NE(line.find("#] installed"), std::string::npos) << line;
    const auto isBegun = [](char byte) { return (byte & 0xC0) != 0x80; };
    EXPECT_LE(std::count_if(line.begin(), line.end(), isBegun), 60) << line;
  }
  EXPECT_EQ(count, 5) << picture;
  // Without room for bars there are none; on a simple terminal, and beside the log, nothing is drawn over.
  shown = std::regex_replace(run(small, 24, 24, "xterm"), control, "");
  EXPECT_EQ(shown.find('['), std::string::npos);
  EXPECT_NE(shown.find("Notes installed"), std::string::npos) << shown;
  for (const std::string& plain : {run(small, 80, 24, "dumb"), run(small, 80, 24, "xterm", {"--log", "-"})}) {
    EXPECT_EQ(plain.find('\x1b'), std::string::npos);
    EXPECT_NE(plain.find("org.sample.notes: installed"), std::string::npos);
  }
}

TEST_F(OutputTest, ASampleOfAnySizeCanBeSynced) {
  const std::string host = sampleHost("host", 13, 3);
  const Json result = sync(host).json();
  EXPECT_EQ(result["ok"], true);
  EXPECT_EQ(result["transferred"].size(), 13U);
  const Json installed = status()["installed"];
  EXPECT_EQ(entryOf(installed, "org.sample.notes2")["name"], "Notes 2");
  std::set<std::string> identifiers;
  for (const Json& one : installed) identifiers.insert(one["identifier"]);
  EXPECT_EQ(identifiers.size(), 13U);
  EXPECT_EQ(dovel({"sample", at("host")}).status, 3);
  EXPECT_EQ(dovel({"sample", at("empty"), "--apps", "0"}).status, 0);
  EXPECT_EQ(sync(at("empty")).json()["requested"], Json::array());
  write(at("file"), "");
  EXPECT_EQ(dovel({"sample", at("file/inside")}).status, 3);
  for (const char* count : {"10001", "-1", "x", "1.5", ""}) {
    EXPECT_EQ(dovel({"sample", at("more"), "--apps", count}).status, 2) << count;
  }
}

}  // namespace
}  // namespace appsync
