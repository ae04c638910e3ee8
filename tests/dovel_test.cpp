// Whole runs of the program through its command line, each in a directory of its own.
#include <elf.h>
#include <gtest/gtest.h>

#include <csignal>
#include <filesystem>
#include <map>
#include <regex>
#include <stdexcept>
#include <string>
#include <vector>

#include "embedded/device_service.h"
#include "platform/plugin.h"
#include "platform/property_list.h"
#include "tests/support/program.h"

namespace appsync {
namespace {

using namespace test;

using DovelTest = ProgramTest;

TEST_F(DovelTest, TwoSyncsInstallUpdateAndRemoveInTheDaemonsOrder) {
  const std::string first = sampleHost("first", 5, 1);
  const std::string second = sampleHost("second", 6, 2);
  EXPECT_EQ(treeOf(first), treeOf(sampleHost("again", 5, 1)));
  EXPECT_EQ(dovel({"sample", first}).status, 3) << "a directory with something in it is left alone";
  write(second + "/ApplicationSync/ApplicationsSync.plist",
        bytesOf(PropertyList::array({install("org.sample.weather"), install("org.sample.notes"),
                                     removal("org.sample.chess"), removal("org.sample.unknown")})));
  write(second + "/LastSyncAppState.plist", bytesOf(PropertyList::array({"org.sample.notes", "org.sample.gone"})));
  const auto before = treeOf(second);

  const Json made = sync(first).json();
  EXPECT_EQ(made["ok"], true) << made.dump(1);
  // The layout has the folder's applications in third place.
  const Texts order{"org.sample.notes", "org.sample.maps", "org.sample.camera", "org.sample.chess",
                    "org.sample.reader"};
  EXPECT_EQ(made["requested"], Json(order));
  EXPECT_EQ(column(made["applications"], "operation"), Texts(5, "INSTALLED"));

  const Outcome run = sync(second, {"--json", "--log", at("log"), "--trace", at("trace")});
  const Json changed = run.json();
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(changed["schema"], 1);
  EXPECT_EQ(changed["deleted"], Json({"org.sample.gone"}));
  EXPECT_EQ(changed["metrics"]["count"], 5);
  EXPECT_EQ(changed["transferred"], Json({"org.sample.notes", "org.sample.weather"}));
  EXPECT_EQ(column(changed["removals"], "error"), Texts(2, "null"));
  EXPECT_EQ(changed["uninstalled"], Json({"org.sample.chess"}));
  EXPECT_EQ(treeOf(second), before);

  const Json now = status();
  EXPECT_EQ(column(now["installed"], "identifier"), (Texts{"org.sample.camera", "org.sample.maps", "org.sample.notes",
                                                           "org.sample.reader", "org.sample.weather"}));
  EXPECT_EQ(now["placeholders"].size() + now["coordinators"].size(), 0U);
  EXPECT_EQ(now["syncing"], false);
  EXPECT_TRUE(fs::is_empty(at("device/var/mobile/Media/PublicStaging/Packages")));

  const Texts calls{"getting installed assets",
                    "found ",
                    "starting to reconcile",
                    "finished reconcile sync",
                    "outstandingAssetTransfers starting",
                    "finished transferring",
                    "transfer for asset",
                    "asset transfer ended withsuccess: y",
                    "sync ended with success: y"};
  auto call = calls.begin();
  for (const std::string& message : messagesOf(contentOf(at("log")))) {
    if (call != calls.end() && message.starts_with(*call)) ++call;
  }
  EXPECT_EQ(call, calls.end()) << "not in order: " << (call == calls.end() ? "" : *call);

  const Json trace = Json::parse(contentOf(at("trace")));
  std::map<std::string, int> tracks;
  std::map<int, int> transfers;
  for (const Json& event : trace["traceEvents"]) {
    if (event["name"] == "thread_name") tracks[event["args"]["name"]] = event["tid"];
    if (event["name"] == "transfer") ++transfers[event["tid"]];
  }
  EXPECT_EQ(transfers, (std::map<int, int>{{tracks["org.sample.notes"], 1}, {tracks["org.sample.weather"], 1}}));
}

TEST_F(DovelTest, ABadPackageOrLinkLeavesTheOldVersionAndTheOthers) {
  const std::string host = sampleHost("host", 6, 1);
  ASSERT_EQ(sync(host).status, 0);
  const Json before = status()["installed"];
  const std::string packages = host + "/Packages/org.sample.";
  const std::string whole = contentOf(packages + "notes.ipa");
  write(packages + "notes.ipa", whole.substr(0, whole.size() / 2));
  write(packages + "maps.ipa", "no package");
  write(packages + "chess.ipa", contentOf(packages + "camera.ipa"));
  fs::remove(packages + "reader.ipa");
  fs::rename(packages + "weather.ipa", at("elsewhere.ipa"));
  fs::create_symlink(at("elsewhere.ipa"), packages + "weather.ipa");
  fs::create_symlink("/etc", host + "/ApplicationSync/org.sample.maps/inside");

  const Outcome run = sync(host);
  const Json result = run.json();
  EXPECT_EQ(run.status, 1);
  EXPECT_NE(run.err.find("org.sample.maps/inside"), std::string::npos) << run.err;
  const std::map<std::string, std::pair<std::string, std::string>> expected{
      {"org.sample.notes", {"FAILED", "could not be installed"}},
      {"org.sample.maps", {"FAILED", "could not be installed"}},
      {"org.sample.chess", {"FAILED", "could not be installed"}},
      {"org.sample.camera", {"INSTALLED", "null"}},
      {"org.sample.reader", {"install", "missing package"}},
      {"org.sample.weather", {"install", "missing package"}},
  };
  for (const auto& [identifier, outcome] : expected) {
    const Json entry = entryOf(result["applications"], identifier);
    EXPECT_EQ(entry["operation"], outcome.first) << identifier;
    EXPECT_NE(entry["error"].dump().find(outcome.second), std::string::npos) << entry;
  }
  const Json after = status()["installed"];
  EXPECT_EQ(column(after, "version"), column(before, "version"));
  EXPECT_EQ(column(after, "size"), column(before, "size"));
  EXPECT_TRUE(fs::is_empty(at("device/var/mobile/Media/PublicStaging/Packages")));
}

TEST_F(DovelTest, WhatHappensOnTheWayIsReported) {
  struct Case {
    Arguments options;
    int status;
    std::size_t transferred;
    std::string firstTransferred;
    std::string chessOperation;
    std::string chessError;  // a part of it
    bool chessStays;         // its old version
  };
  const std::vector<Case> cases{
      {{}, 0, 3, "org.sample.notes", "INSTALLED", "null", true},
      {{"--prioritize", "org.sample.chess"}, 0, 3, "org.sample.chess", "INSTALLED", "null", true},
      {{"--fail-phase", "--prioritize", "org.x"}, 0, 3, "org.sample.notes", "INSTALLED", "null", true},
      {{"--cancel", "org.sample.chess"}, 1, 2, "org.sample.notes", "install", "cancelled by the person", true},
      {{"--fault", "transfer=org.sample.chess"}, 1, 2, "org.sample.notes", "install", "made to fail", true},
      {{"--fault", "stall=org.sample.chess"}, 1, 2, "org.sample.notes", "install", "never ended", true},
      {{"--fault", "install=org.sample.chess"}, 1, 3, "org.sample.notes", "FAILED", "made to fail", true},
      {{"--fault", "install=org.sample.chess", "--report-installs"},
       1,
       3,
       "org.sample.notes",
       "FAILED",
       "made to fail",
       false},
      {{"--fault", "setInstallOptions=org.sample.chess"}, 1, 2, "org.sample.notes", "FAILED", "made to fail", true},
  };
  const std::string host = sampleHost("host", 3, 1);
  const std::string again = sampleHost("again", 4, 2);
  write(again + "/ApplicationSync/ApplicationsSync.plist",
        bytesOf(PropertyList::array(
            {install("org.sample.chess"), install("org.sample.notes"), install("org.sample.maps")})));
  for (const Case& one : cases) {
    SCOPED_TRACE(testing::PrintToString(one.options));
    fs::remove_all(at("device"));
    ASSERT_EQ(sync(sampleHost("all" + std::to_string(&one - cases.data()), 4, 1)).status, 0);
    Arguments options = one.options;
    options.push_back("--json");
    const Outcome run = sync(again, options);
    const Json result = run.json();
    EXPECT_EQ(run.status, one.status) << run.out;
    EXPECT_EQ(result["ok"], one.status == 0);
    ASSERT_EQ(result["transferred"].size(), one.transferred);
    EXPECT_EQ(result["transferred"][0], one.firstTransferred);
    const Json chess = entryOf(result["applications"], "org.sample.chess");
    EXPECT_EQ(chess["operation"], one.chessOperation);
    EXPECT_NE(chess["error"].dump().find(one.chessError), std::string::npos) << chess;
    const Json now = status();
    EXPECT_EQ(!entryOf(now["installed"], "org.sample.chess").is_null(), one.chessStays);
    EXPECT_TRUE(fs::is_empty(at("device/var/mobile/Media/PublicStaging/Packages")));
    const bool hasNote = run.err.find("--prioritize org.x has no effect") != std::string::npos;
    EXPECT_EQ(hasNote, one.options.size() > 1 && one.options.back() == "org.x");
  }
}

TEST_F(DovelTest, EveryRuleThatLeavesSomethingOutIsNamed) {
  const auto placeholder = [](const char* identifier, int type, bool isActive, const char* kind = "User") {
    return Json{{"identifier", identifier},
                {"name", "X"},
                {"installType", type},
                {"type", kind},
                {"installState", isActive ? 1 : 0},
                {"installPhase", isActive ? 1 : 0},
                {"prioritized", true}};
  };
  const Json seed = {{"placeholders",
                      {placeholder("org.restored", 2, false), placeholder("org.demoted", 7, false),
                       placeholder("org.wanted", 8, false), placeholder("org.busy", 4, true),
                       placeholder("org.system", 4, false, "System")}},
                     {"coordinators", {{{"identifier", "org.foreign"}, {"kind", "initiating"}, {"creator", 1}}}}};
  write(at("seed.json"), seed.dump());
  ASSERT_EQ(dovel({"seed", "--device", at("device"), at("seed.json")}).status, 0);
  const std::string todo = at("host/ApplicationSync/ApplicationsSync.plist");
  write(todo, bytesOf(PropertyList::array(
                  {install("org.bad/../../up"),
                   PropertyList::dictionary({{"identifier", PropertyList::integer(7)}, {"operation", "remove"}}),
                   PropertyList("no entry"), install("org.busy"), install("org.wanted"), install("org.foreign"),
                   install("a/b"), removal("org.never")})));
  const Outcome run = sync(at("host"));
  const Json result = run.json();
  EXPECT_EQ(run.status, 1) << run.err;  // a package is missing, and two installs could not be prepared
  std::map<std::string, std::string> reasons;
  for (const Json& one : result["skipped"]) {
    reasons[one["identifier"].is_null() ? "null" : one["identifier"].get<std::string>()] = one["reason"];
  }
  EXPECT_EQ(reasons, (std::map<std::string, std::string>{{"org.bad/../../up", "invalid-identifier"},
                                                         {"null", "invalid-identifier"},
                                                         {"org.restored", "restore"},
                                                         {"org.demoted", "demoted"},
                                                         {"org.system", "system"},
                                                         {"org.busy", "in-progress"},
                                                         {"org.foreign", "refused"},
                                                         {"a/b", "refused"}}));
  EXPECT_EQ(result["requested"], Json({"org.wanted"}));
  EXPECT_EQ(column(result["applications"], "identifier"),
            (Texts{"org.bad/../../up", "null", "null", "org.busy", "org.wanted", "org.foreign", "a/b", "org.never"}));

  // What the device's policy forbids.
  for (const char* key : {"AppInstallationAllowed", "AppRemovalAllowed"}) {
    ASSERT_EQ(dovel({"settings", "--device", at("other"), key, "2"}).status, 0);
  }
  write(todo, bytesOf(PropertyList::array({install("org.a"), removal("org.b")}), PropertyListFormat::Binary));
  const Outcome forbidden = dovel({"sync", "--device", at("other"), at("host"), "--json"});
  EXPECT_EQ(forbidden.status, 0) << forbidden.err;
  EXPECT_EQ(forbidden.json()["skipped"], Json::parse(R"([{"identifier": "org.b", "reason": "policy"},
                                                         {"identifier": "org.a", "reason": "policy"}])"));
  // A todo list that is there but cannot be used; a host without anything.
  for (const char* content : {"", "rubbish", "<plist><dict/></plist>"}) {
    write(todo, content);
    EXPECT_EQ(sync(at("host")).status, 1) << content;
  }
  fs::remove_all(at("host/ApplicationSync"));
  EXPECT_EQ(dovel({"sync", "--device", at("new"), at("host"), "--json"}).json()["applications"], Json::array());
}

TEST_F(DovelTest, AnInterruptEndsTheSyncInOrderAndTheNextOneSucceeds) {
  const std::string host = sampleHost("host", 3, 1);
  for (const auto& [number, expected] : {std::pair(SIGINT, 130), std::pair(SIGTERM, 143)}) {
    bool sent = false;
    const Outcome run = dovel({"sync", "--device", at("device"), host, "--rate", "2000", "--log", at("log")},
                              [&, number = number](pid_t process, const std::string& out) {
                                if (sent || out.find("transferring") == std::string::npos) return;
                                sent = true;
                                ::kill(process, number);
                              });
    EXPECT_EQ(run.status, expected) << run.out << run.err;
    const Texts messages = messagesOf(contentOf(at("log")));
    EXPECT_EQ(std::count(messages.begin(), messages.end(), "asset transfer ended withsuccess: n"), 1);
    EXPECT_EQ(std::count(messages.begin(), messages.end(), "sync ended with success: n"), 1);
    EXPECT_TRUE(fs::is_empty(at("device/var/mobile/Media/PublicStaging/Packages")));
  }
  EXPECT_EQ(sync(host).status, 0);
  // One process at a time; a second one says so while the first is busy.
  bool asked = false;
  dovel({"sync", "--device", at("device"), sampleHost("next", 3, 2), "--rate", "2000"},
        [&](pid_t process, const std::string& out) {
          if (asked || out.find("transferring") == std::string::npos) return;
          asked = true;
          EXPECT_EQ(sync(host).json()["error"]["code"], "device-in-use");
          EXPECT_EQ(status()["ok"], true);
          ::kill(process, SIGINT);
          ::kill(process, SIGINT);
        });
  EXPECT_TRUE(asked);
  EXPECT_EQ(sync(host).status, 0);
}

// Where a module's file holds what this symbol names.
std::size_t placeOfSymbol(const std::string& module, const std::string& name) {
  const auto* header = reinterpret_cast<const Elf64_Ehdr*>(module.data());
  const auto* sections = reinterpret_cast<const Elf64_Shdr*>(module.data() + header->e_shoff);
  const auto* segments = reinterpret_cast<const Elf64_Phdr*>(module.data() + header->e_phoff);
  for (int i = 0; i < header->e_shnum; ++i) {
    if (sections[i].sh_type != SHT_DYNSYM) continue;
    const auto* symbols = reinterpret_cast<const Elf64_Sym*>(module.data() + sections[i].sh_offset);
    const char* names = module.data() + sections[sections[i].sh_link].sh_offset;
    for (std::size_t k = 0; k < sections[i].sh_size / sizeof(Elf64_Sym); ++k) {
      if (name != names + symbols[k].st_name) continue;
      for (int j = 0; j < header->e_phnum; ++j) {
        const std::size_t inside = symbols[k].st_value - segments[j].p_vaddr;
        if (segments[j].p_type == PT_LOAD && inside < segments[j].p_filesz) return segments[j].p_offset + inside;
      }
    }
  }
  throw std::runtime_error("the module does not export " + name);
}

// A plug-in like the built one, but for its ABI number.
void writePluginOfAnotherABI(const std::string& path) {
  std::string bytes = contentOf(std::string(APPSYNC_BIN_DIR) + "/AppSync.so");
  bytes[placeOfSymbol(bytes, kDovelPluginSymbol) + offsetof(DovelPluginDescriptor, abi)] = 99;
  write(path, bytes);
}

TEST_F(DovelTest, WhatCannotBeDoneIsSaidInOneLineWithAStableCode) {
  const std::string host = sampleHost("host", 1, 1);
  ASSERT_EQ(sync(host).status, 0);
  writePluginOfAnotherABI(at("other.so"));
  write(at("cut.so"), contentOf(std::string(APPSYNC_BIN_DIR) + "/AppSync.so").substr(0, 3000));
  write(at("bad.plist"), "bplist00");
  write(at("file"), "");
  const std::string device = at("device");
  struct Case {
    Arguments arguments;
    int status;
    std::string code;
    std::string named;  // in the message
  };
  const std::vector<Case> cases{
      {{"sync", "--device", device}, 2, "command-line", "HOST"},
      {{"sync", "--device", "", host}, 2, "command-line", "--device"},
      {{"sync", "--device", device, host, "--nonsense"}, 2, "command-line", "--nonsense"},
      {{"sync", "--device", device, host, "--rate", "-1"}, 2, "command-line", "--rate"},
      {{"sync", "--device", device, host, "--fault", "moveItem@0"}, 2, "unknown-fault", "moveItem@0"},
      {{"frobnicate"}, 2, "command-line", "frobnicate"},
      {{}, 2, "command-line", "command"},
      {{"settings", "--device", device, "Nonsense"}, 2, "unknown-setting", "Nonsense"},
      {{"settings", "--device", device, "AppRemovalAllowed", "3"}, 2, "bad-value", "AppRemovalAllowed"},
      {{"sync", "--device", device, at("none")}, 3, "host-unusable", at("none")},
      {{"sync", "--device", at("file"), host}, 3, "device-unusable", at("file")},
      {{"status", "--device", at("none")}, 3, "device-missing", at("none")},
      {{"sync", "--device", device, host, "--log", at("none/log")}, 3, "output-unwritable", at("none/log")},
      {{"sync", "--device", device, host, "--trace", at("")}, 3, "output-unwritable", at("")},
      {{"sync", "--device", device, host, "--plugin", at("other.so")}, 3, "plugin-abi", "99"},
      {{"sync", "--device", device, host, "--plugin", at("cut.so")}, 3, "plugin-unusable", at("cut.so")},
      {{"seed", "--device", device, at("bad.plist")}, 3, "input-unusable", at("bad.plist")},
      {{"play", "--device", device, at("none")}, 3, "input-unusable", at("none")},
  };
  for (const Case& one : cases) {
    SCOPED_TRACE(testing::PrintToString(one.arguments));
    const Outcome plain = dovel(one.arguments);
    EXPECT_EQ(plain.status, one.status);
    EXPECT_EQ(plain.out, "");
    EXPECT_EQ(std::count(plain.err.begin(), plain.err.end(), '\n'), 1) << plain.err;
    EXPECT_NE(plain.err.find(one.named), std::string::npos) << plain.err;
    Arguments arguments = one.arguments;
    arguments.push_back("--json");
    const Json document = dovel(arguments).json();
    EXPECT_EQ(document["schema"], 1);
    EXPECT_EQ(document["ok"], false);
    EXPECT_EQ(document["error"]["code"], one.code);
    EXPECT_NE(document["error"]["hint"], "");
  }
  EXPECT_EQ(dovel({"plist", at("bad.plist")}).status, 3);
  EXPECT_EQ(dovel({"--version"}).status, 0);
  EXPECT_NE(dovel({"sync", "--help"}).out.find("--report-installs"), std::string::npos);
  EXPECT_NE(dovel({"faults"}).out.find("\nmoveItem\n"), std::string::npos);
}

TEST_F(DovelTest, PropertyListsGoFromFormToForm) {
  const std::string xml = R"(<plist version="1.0"><dict>
    <key>data</key><data>AAEC/w==</data><key>date</key><date>2026-01-31T12:00:00Z</date>
    <key>list</key><array><integer>-3</integer><real>2</real><real>nan</real><true/><string>&#27;[31mé</string></array>
    <key>large</key><integer>18446744073709551615</integer><key>empty</key><dict/></dict></plist>)";
  const std::string text =
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>" + std::regex_replace(xml, std::regex("&#27;"), "");
  write(at("a.plist"), text);
  ASSERT_EQ(dovel({"plist", at("a.plist"), "--to", "binary", "-o", at("b.plist")}).status, 0);
  ASSERT_EQ(dovel({"plist", at("b.plist"), "--to", "xml", "-o", at("c.plist")}).status, 0);
  const Outcome json = dovel({"plist", at("c.plist"), "--to", "json"});
  EXPECT_EQ(json.json(), Json::parse(R"({"data": {"$data": "AAEC/w=="}, "date": {"$date": "2026-01-31T12:00:00Z"},
                                         "list": [-3, 2.0, {"$real": "nan"}, true, "[31mé"],
                                         "large": 18446744073709551615, "empty": {}})"));
  EXPECT_NE(json.out.find("2.0"), std::string::npos) << "a real number can be told from an integer";
  EXPECT_NE(dovel({"plist", at("b.plist")}).out.find("\n  list: array, 5 elements\n    0: -3\n"), std::string::npos);

  Bytes uid =
      serializePropertyList(PropertyList::array({PropertyList::uid(5)}), PropertyListFormat::Binary, nullptr).value();
  write(at("uid.plist"), {uid.begin(), uid.end()});
  EXPECT_EQ(dovel({"plist", at("uid.plist"), "--to", "json"}).json(), Json::parse(R"([{"$uid": 5}])"));
  // An output that cannot be made leaves what was there.
  write(at("kept"), "old");
  EXPECT_EQ(dovel({"plist", at("kept"), "--to", "xml", "-o", at("kept")}).status, 3);
  EXPECT_EQ(contentOf(at("kept")), "old");
}

TEST_F(DovelTest, WhatOneDeviceShowsSeedsAnother) {
  const Json seed = Json::parse(R"({
    "installed": [{"identifier": "org.a", "version": "1", "name": "Ä 🎈", "storeMetadata": {"itemId": 5}, "files": {"x": 10}}],
    "placeholders": [{"identifier": "org.p", "name": "P", "installType": 2, "version": "3", "launchProhibited": true}],
    "coordinators": [{"identifier": "org.p", "kind": "restoring", "creator": 3, "responsibleClient": 1, "error": null,
                      "installOptions": true, "assetPromise": "open"},
                     {"identifier": "org.d", "kind": "initiating", "creator": 1, "error": "gone"}],
    "todo": [{"identifier": "org.a", "operation": "install"}], "homeScreen": ["org.p", "org.a"],
    "uninstalled": ["org.u"], "syncing": true, "settings": {"AppRemovalAllowed": 2, "CreateAppPlaceholders": false},
    "lastSync": ["org.a"]})");
  write(at("seed.json"), seed.dump());
  ASSERT_EQ(dovel({"seed", "--device", at("device"), at("seed.json"), "--json"}).json()["ok"], true);
  const Json shown = status();
  EXPECT_EQ(column(shown["coordinators"], "identifier"), (Texts{"org.d", "org.p"}));
  EXPECT_EQ(shown["installed"][0]["name"], "Ä 🎈");
  EXPECT_EQ(shown["placeholders"][0]["launchProhibited"], true);
  EXPECT_EQ(shown["settings"]["CreateAppPlaceholders"], false);
  write(at("shown.json"), shown.dump());
  ASSERT_EQ(dovel({"seed", "--device", at("copy"), at("shown.json")}).status, 0);
  const auto withoutPlaces = [](Json document) {
    for (Json& one : document["installed"]) one.erase("container"), one.erase("size");
    return document;
  };
  EXPECT_EQ(withoutPlaces(status("copy")), withoutPlaces(shown));

  const Outcome cleared = dovel({"clear", "--device", at("device"), "--json"});
  EXPECT_EQ(cleared.json()["uninstalled"], Json({"org.p"})) << cleared.err;
  EXPECT_EQ(dovel({"clear", "--device", at("copy"), "--fault", "removeItem@1"}).status, 1);
  EXPECT_EQ(status()["todo"].size() + status()["placeholders"].size() + status()["uninstalled"].size(), 0U);
}

TEST_F(DovelTest, AScriptMakesSingleCalls) {
  sampleHost("host", 2, 1);
  const Outcome run = play(R"({"steps": [
    {"do": "startupComplete"}, {"do": "stage", "host": "host"}, {"do": "fault", "spec": "moveItem@1"},
    {"do": "reconcileSync", "type": 1, "newAnchor": "x", "noErrorOut": true},
    {"do": "reconcileSync", "newAnchor": "y", "givenError": {"domain": "Given", "code": 7}},
    {"do": "currentSyncAnchor"}, {"do": "outstandingAssetTransfers"}, {"do": "disabledAssetTypes"},
    {"do": "push", "file": "host/Packages/org.sample.maps.ipa", "to": "/var/mobile/Media/PublicStaging/in/m.ipa"},
    {"do": "assetTransferUpdatedProgress", "asset": {"identifier": "org.sample.maps", "downloadProgress": 0.5}, "progress": 1},
    {"do": "assetTransferSucceeded", "asset": {"identifier": "org.sample.maps", "path": "in/m.ipa"}, "succeeded": true},
    {"do": "settle"}, {"do": "coordinatorShouldPrioritize", "identifier": "org.sample.notes"}, {"do": "settle"},
    {"do": "lack", "operation": "prioritizeAsset"}, {"do": "coordinatorShouldPrioritize", "identifier": "org.sample.notes"},
    {"do": "coordinatorShouldPrioritize", "identifier": null}, {"do": "applicationInstallsDidCancel"},
    {"do": "assetInstallFailed", "asset": {"identifier": "org.x", "isRestore": true}, "error": {"domain": "X", "code": 7}},
    {"do": "coordinatorDidCompleteSuccessfully", "identifier": "org.y", "error": {"domain": "Y", "code": 8}},
    {"do": "promiseDidBeginFulfillmentWithIdentifier", "number": 4}]})",
                           {"--json", "--log", at("log")});
  const Json steps = run.json()["steps"];
  EXPECT_EQ(run.status, 1) << run.err;  // the client answered NO once
  ASSERT_EQ(steps.size(), 21U);
  EXPECT_EQ(steps[3].dump(), R"({"do":"reconcileSync","result":false,"error":null})");
  EXPECT_EQ(steps[4].dump(), R"({"do":"reconcileSync","result":true,"error":{"domain":"Given","code":7}})");
  EXPECT_EQ(steps[5]["result"], "NO_APP_SYNC_ANCHOR");
  const Json asset = steps[6]["result"][0];
  EXPECT_EQ(asset["identifier"], "org.sample.notes");
  EXPECT_EQ(asset["variantOptions"]["AssetParts"], 1);
  EXPECT_EQ(asset["path"], nullptr);
  EXPECT_EQ(asset.size(), 15U);
  EXPECT_EQ(steps[7]["result"], nullptr);
  const Texts messages = messagesOf(contentOf(at("log")));
  for (const char* expected :
       {"finished transferring 1.000000 for org.sample.maps", "Satisfying asset promise for org.sample.maps",
        "coordinatorDidCompleteSuccessfully for org.sample.maps with error (null)",
        "Prioritize org.sample.notes finished with error (null)",
        "Cannot prioritize org.sample.notes as it's not supported", "org.x install failed but was recoverable: X 7",
        "not handling applicationInstallsDidCancel because install coordination is enabled.",
        "coordinatorDidCompleteSuccessfully for org.y with error Y 8", "promiseDidBeginFulfillmentWithIdentifier 4"}) {
    EXPECT_NE(std::find(messages.begin(), messages.end(), expected), messages.end()) << expected;
  }
  EXPECT_EQ(column(status()["installed"], "identifier"), (Texts{"org.sample.maps"}));
}

TEST_F(DovelTest, AScriptIsCheckedBeforeAnythingIsDone) {
  const Texts scripts{
      "",
      "[]",
      "{\"steps\": 1}",
      R"({"steps": [], "more": 1})",
      R"({"steps": [{"do": "nothing"}]})",
      R"({"steps": [{"do": "reconcileSync", "type": 4294967296}]})",
      R"({"steps": [{"do": "clearSyncData"}, {"do": "reconcileSync", "anchor": "x"}]})",
      R"({"steps": [{"do": "assetInstallSucceeded"}]})",
      R"({"steps": [{"do": "assetInstallSucceeded", "asset": {}}]})",
      R"({"steps": [{"do": "assetInstallSucceeded", "asset": {"identifier": "a", "path": 1}}]})",
      R"({"steps": [{"do": "assetInstallFailed", "asset": {"identifier": "a"}, "error": {"domain": "X"}}]})",
      R"({"steps": [{"do": "fault", "spec": "nothing"}]})",
      R"({"steps": [{"do": "lack", "operation": "offers"}]})",
      std::string(5000, '[')};
  for (const std::string& script : scripts) {
    const Outcome run = play(script, {});
    EXPECT_EQ(run.status, 3) << script.substr(0, 80);
    EXPECT_EQ(run.out, "");
    EXPECT_FALSE(fs::exists(at("device"))) << script.substr(0, 80);
  }
  EXPECT_EQ(play(R"({"steps": [{"do": "push", "file": "none", "to": "/x"}]})", {}).status, 3);
  EXPECT_EQ(play(R"({"steps": [{"do": "push", "file": "script.json", "to": "/../../x"}]})", {}).status, 3);
}

TEST_F(DovelTest, ForeignNamesDoNotCommandTheTerminal) {
  const std::string host = sampleHost("host", 2, 1);
  write(host + "/ApplicationSync/org.sample.maps/Info.plist",
        bytesOf(PropertyList::dictionary(
                    {{"TefBundleDisplayName", "カメラ\x1b]0;evil\x07\xe2\x80\xae name that is very long"}}),
                PropertyListFormat::Binary));
  const Outcome run = dovelOnTerminal({"sync", "--device", at("device"), host}, 60, 20);
  const std::string& shown = run.out;
  EXPECT_EQ(run.status, 0) << shown;
  EXPECT_EQ(shown.find("\x1b]"), std::string::npos);
  EXPECT_EQ(shown.find('\x07'), std::string::npos);
  EXPECT_EQ(shown.find("\xe2\x80\xae"), std::string::npos);
  EXPECT_NE(shown.find("] installed"), std::string::npos) << shown;
  EXPECT_NE(shown.find("2 installed, 0 removed, 0 skipped, 0 failed"), std::string::npos) << shown;
  // A bar is full only beside the word that the work is done.
  for (std::size_t at = shown.find("#]"); at != std::string::npos; at = shown.find("#]", at + 1)) {
    EXPECT_EQ(shown.substr(at + 3, 9), "installed");
  }
}

TEST(EmbeddedDeviceServiceTest, TheQueueIsReorderedAndTransfersAreDropped) {
  const auto executor = makeThreadExecutor(1);
  EmbeddedDeviceService service(*executor);
  const auto asset = [](const char* identifier) {
    return DovelAsset::downloadAssetWithIdentifier(identifier, "Application", std::nullopt);
  };
  std::vector<std::optional<Error>> answers;
  const auto keep = [&](const std::optional<Error>& error) { answers.push_back(error); };
  service.setQueue({"a", "b", "c", "d"});
  EXPECT_EQ(service.takeNext()->identifier, "a");
  service.prioritizeAsset(asset("c"), keep);
  service.prioritizeAsset(asset("a"), keep);  // in flight: ahead already
  service.prioritizeAsset(asset("x"), keep);
  service.cancelAssetTransferForFailedAsset(asset("d"));
  service.cancelAssetTransferForFailedAsset(asset("a"));
  service.cancelAssetTransferForFailedAsset(asset("x"));
  EXPECT_TRUE(service.isDropped("a"));
  EXPECT_FALSE(service.isDropped("x"));
  std::string order;
  while (const auto turn = service.takeNext()) order += turn->identifier + (turn->dropped ? "-" : "+");
  EXPECT_EQ(order, "d-c+b+");
  service.prioritizeAsset(asset("b"), keep);  // over
  executor->drain();
  ASSERT_EQ(answers.size(), 4U);
  EXPECT_EQ(answers[0], std::nullopt);
  EXPECT_EQ(answers[1], std::nullopt);
  EXPECT_EQ(answers[2]->code(), kTransferUnknown);
  EXPECT_EQ(answers[3]->code(), kTransferUnknown);
}

}  // namespace
}  // namespace appsync
