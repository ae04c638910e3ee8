// What a sync takes from its host directory, what it tells the client of each package, and what it reports.
#include <dlfcn.h>
#include <sys/stat.h>

#include "tests/support/program.h"

namespace appsync {
namespace {

using namespace test;

constexpr char kTodo[] = "/ApplicationSync/ApplicationsSync.plist";

class SyncTest : public ProgramTest {
 protected:
  // A host with nothing but this todo list.
  std::string hostWith(const std::vector<PropertyList>& todo, const std::string& name = "host") {
    write(at(name) + kTodo, bytesOf(PropertyList::array(todo)));
    return at(name);
  }
  Texts messages() { return messagesOf(contentOf(at("log"))); }
  static bool has(const Texts& messages, const std::string& message) {
    return std::find(messages.begin(), messages.end(), message) != messages.end();
  }
};

TEST_F(SyncTest, EachPieceAndEndOfATransferIsOnTheRecord) {
  const std::string host = sampleHost("host", 1, 1);
  ASSERT_EQ(sync(host, {"--log", at("log"), "--report-installs"}).status, 0);
  const std::string id = "org.sample.notes";
  Texts told;
  for (const std::string& message : messages()) {
    for (const char* one :
         {"finished transferring", "Updating download", "transfer for", "Received", "asset transfer"}) {
      if (message.starts_with(one)) told.push_back(message);
    }
  }
  ASSERT_EQ(told.size(), 8U) << testing::PrintToString(told);
  EXPECT_EQ(told[0], "finished transferring 0.500000 for " + id);
  EXPECT_EQ(told[1], "Updating download progress: 0.500000 install progress:0.000000 for " + id);
  EXPECT_EQ(told[2], "finished transferring 1.000000 for " + id);
  EXPECT_EQ(told[3], "Updating download progress: 1.000000 install progress:0.000000 for " + id);
  EXPECT_TRUE(told[4].ends_with(" at Packages/" + id + ".ipa> ended with success y error (null) existingApp:0"));
  EXPECT_EQ(told[6], "Received file at /var/mobile/Media/PublicStaging/Packages/" + id + ".ipa");
  EXPECT_EQ(told[7], "asset transfer ended withsuccess: y");
  EXPECT_TRUE(has(messages(), id + " install succeeded"));

  Outcome run = sync(host, {"--json", "--log", at("log"), "--fault", "stall=" + id});
  EXPECT_EQ(run.json()["applications"][0]["error"], "its transfer never ended");
  EXPECT_TRUE(has(messages(), "finished transferring 0.000000 for " + id));
  EXPECT_TRUE(has(messages(), "asset transfer ended withsuccess: n"));
  EXPECT_TRUE(has(messages(), "sync ended with success: n"));
  run = sync(host, {"--json", "--log", at("log"), "--fault", "transfer=" + id});
  EXPECT_TRUE(has(messages(), "asset transfer ended withsuccess: y")) << "what broke off has been reported by itself";
  EXPECT_FALSE(has(messages(), id + " install succeeded"));
  EXPECT_GT(run.json()["seconds"], 0);
  // An empty package has no half, and is one all the same.
  write(host + "/Packages/" + id + ".ipa", "");
  run = sync(host, {"--json", "--log", at("log"), "--rate", "100"});
  EXPECT_TRUE(has(messages(), "finished transferring 1.000000 for " + id));
  EXPECT_EQ(run.json()["transferred"], Json({id}));
  EXPECT_EQ(run.json()["applications"][0]["operation"], "FAILED");
}

TEST_F(SyncTest, WhatIsNoPlainFileOrDirectoryIsLeftOutAndNamed) {
  const std::string host = sampleHost("host", 1, 1);
  ::mkfifo((host + "/ApplicationSync/pipe").c_str(), 0600);
  std::string deep = host + "/ApplicationSync/deep";
  for (int i = 2; i <= 33; ++i) deep += "/" + std::to_string(i);
  write(deep + "/file", "beyond");
  fs::create_directories(host + "/LastSyncAppState.plist");
  const Outcome run = sync(host);
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(run.json()["transferred"].size(), 1U);
  EXPECT_NE(run.err.find("dovel: \"ApplicationSync/pipe\" is neither a plain file nor a directory"), std::string::npos);
  EXPECT_NE(run.err.find("/31/32\" lies deeper than 32 directories and is left out"), std::string::npos) << run.err;
  EXPECT_NE(run.err.find("\"LastSyncAppState.plist\" of the host directory is no plain file"), std::string::npos);
  EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 3) << run.err;
  const std::string area = at("device/var/mobile/Library/ApplicationSync/TarvoStuff");
  const std::string inside = deep.substr((host + "/ApplicationSync").size());
  EXPECT_TRUE(fs::is_directory(area + inside.substr(0, inside.find("/32"))));
  EXPECT_FALSE(fs::exists(area + "/pipe"));

  fs::remove_all(host + "/ApplicationSync");
  write(host + "/ApplicationSync", "no directory");
  const Outcome none = sync(host);
  EXPECT_EQ(none.status, 0);
  EXPECT_NE(none.err.find("\"ApplicationSync\" of the host directory is no plain directory"), std::string::npos);
  fs::remove_all(host + "/Packages");
  write(host + "/Packages", "no directory");
  fs::remove(host + "/ApplicationSync");
  hostWith({install("org.a")});
  EXPECT_NE(sync(host).json()["applications"][0]["error"].dump().find("missing package"), std::string::npos);
}

// A package that a coordinator still waits to install is the service's; all else below the staging area is left over.
TEST_F(SyncTest, OnlyPackagesInUseOutliveTheNextSync) {
  seed(R"({"coordinators": [{"identifier": "org.a", "kind": "initiating", "creator": 3, "assetPromise": "open"}]})");
  write(at("a.ipa"), "a package");
  const std::string staging = "/var/mobile/Media/PublicStaging/";
  const Outcome played = play(R"({"steps": [{"do": "push", "file": "a.ipa", "to": ")" + staging + R"(Packages/a.ipa"},
      {"do": "push", "file": "a.ipa", "to": ")" +
                              staging + R"(Packages/other.ipa"},
      {"do": "push", "file": "a.ipa", "to": ")" +
                              staging + R"(ApplicationSync/ApplicationsSync.plist"},
      {"do": "push", "file": "a.ipa", "to": ")" +
                              staging + R"(.ApplicationSync.incoming/x"},
      {"do": "assetTransferSucceeded", "asset": {"identifier": "org.a", "path": "Packages/a.ipa"}}]})");
  ASSERT_EQ(played.status, 0) << played.err;
  fs::create_directories(at("host"));
  EXPECT_EQ(sync(at("host")).status, 0) << "the list that an earlier push left must not be taken for the host's";
  EXPECT_EQ(treeOf(at("device") + staging),
            (std::map<std::string, std::string>{{"Packages", ""}, {"Packages/a.ipa", "a package"}}));
}

TEST_F(SyncTest, EveryListedAndRequestedApplicationIsReportedOnce) {
  seed(R"({"installed": [{"identifier": "org.x", "size": 500}, {"identifier": "org.z", "size": 500}],
           "placeholders": [{"identifier": "org.p", "installType": 4}], "uninstalled": ["org.before"]})");
  const PropertyList sent = PropertyList::dictionary({{"identifier", "org.y"}, {"operation", "SENT"}});
  const std::string host = hostWith({removal("org.x"), removal("org.z"), sent, install("../odd")});
  const Outcome run = sync(host, {"--json", "--fault", "uninstallAppWithBundleID=org.x"});
  EXPECT_EQ(run.status, 1);
  Json result = run.json();
  EXPECT_GE(result["metrics"]["physicalSize"], 1000);
  result.erase("seconds");
  result.erase("metrics");
  const char* missing = R"("missing package: the host has no plain file \"Packages/org.p.ipa\"")";
  EXPECT_EQ(result, Json::parse(std::string(R"({"schema": 1, "ok": false, "reconciled": true, "deleted": ["org.before"],
      "requested": ["org.p"], "transferred": [], "skipped": [{"identifier": "../odd", "reason": "refused"}],
      "applications": [{"identifier": "org.x", "operation": "remove", "error": null},
                       {"identifier": "org.z", "operation": "remove", "error": null},
                       {"identifier": "org.y", "operation": "SENT", "error": null},
                       {"identifier": "../odd", "operation": "FAILED",
                        "error": "OstrelError 3: \"../odd\" cannot be the identifier of an application"},
                       {"identifier": "org.p", "operation": null, "error": )") +
                                missing + R"(}],
      "removals": [{"identifier": "org.x", "error": "FaultError 1: uninstallAppWithBundleID was made to fail"},
                   {"identifier": "org.z", "error": null}], "uninstalled": ["org.z"]})"))
      << result.dump(1);
}

TEST_F(SyncTest, ARemovalThatFailsIsToldAndCounted) {
  seed(R"({"installed": [{"identifier": "org.x"}, {"identifier": "org.z"}]})");
  const Outcome run =
      sync(hostWith({removal("org.x"), removal("org.z")}), {"--fault", "uninstallAppWithBundleID=org.x"});
  EXPECT_EQ(run.status, 1);
  EXPECT_EQ(run.out.substr(0, run.out.rfind(" in ")),
            "\norg.x  not removed  FaultError 1: uninstallAppWithBundleID was made to fail\n\n"
            "0 installed, 1 removed, 0 skipped, 1 failed");
}

TEST_F(SyncTest, AListOrADeviceThatCannotBeUsedIsNoSuccess) {
  struct Case {
    const char* list;
    const char* fault;
    bool reconciled;
    const char* said;
  };
  const Case cases[] = {
      {"rubbish", "copyItem@99", true, "ApplicationsSync.plist cannot be used: the document is neither XML"},
      {"<plist><dict/></plist>", "copyItem@99", true, "cannot be used: it is no property list of an array"},
      {"<plist><array/></plist>", "moveItem@1", false, "could not take over the host's files: "},
      {"<plist><array/></plist>", "createDirectory@1", false, "could not take over the host's files: "}};
  for (const Case& one : cases) {
    SCOPED_TRACE(one.list);
    fs::remove_all(at("device"));
    write(at("host") + kTodo, one.list);
    const Outcome run = sync(at("host"), {"--json", "--fault", one.fault, "--log", at("log")});
    EXPECT_EQ(run.status, 1);
    EXPECT_EQ(run.json()["ok"], false);
    EXPECT_EQ(run.json()["reconciled"], one.reconciled);
    EXPECT_NE(run.err.find(one.said), std::string::npos) << run.err;
    EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1);
    EXPECT_EQ(has(messages(), "sync ended with success: n"), !one.reconciled);
    EXPECT_EQ(has(messages(), "asset transfer ended withsuccess: y"), one.reconciled);
  }
}

TEST_F(SyncTest, ClearTellsOfWhatOnlyTheLogSays) {
  seed(R"({"uninstalled": ["org.u"], "todo": []})");
  const Arguments clear{"clear", "--device", at("device"), "--json", "--fault", "KilnClearUninstalled"};
  EXPECT_EQ(dovel(clear).status, 1);
  EXPECT_EQ(dovel(clear).json()["ok"], false);
  EXPECT_EQ(dovel({"clear", "--device", at("device"), "--json"}).json(),
            Json::parse(R"({"schema": 1, "ok": true, "uninstalled": []})"));
}

TEST_F(SyncTest, APlugInIsCheckedBeforeItIsTrusted) {
  const std::string whole = contentOf(std::string(APPSYNC_BIN_DIR) + "/AppSync.so");
  // Of an ELF file: its class at 4, the size of a segment's entry at 54, the table of segments from 64 on, 56 bytes each.
  const auto changed = [&](std::size_t at, const std::string& bytes) {
    return std::string(whole).replace(at, bytes.size(), bytes);
  };
  const std::pair<const char*, std::pair<std::string, const char*>> cases[] = {
      {"text", {"no module at all", "it is no module of this machine"}},
      {"empty", {"", "it is no module of this machine"}},
      {"mark", {changed(1, "X"), "it is no module of this machine"}},
      {"32 bits", {changed(4, "\1"), "it is no module of this machine"}},
      {"entries", {changed(54, "\x20"), "it is no module of this machine"}},
      {"no table", {whole.substr(0, 64), "it is cut off"}},
      {"cut", {whole.substr(0, 5000), "it is cut off"}},
      {"far", {changed(64 + 15, "\x7f"), "it is cut off"}},
      {"large", {changed(64 + 39, "\x7f"), "it is cut off"}}};
  for (const auto& [name, content] : cases) {
    write(at(name), content.first);
    const Outcome run = dovel({"clear", "--device", at("device"), "--plugin", at(name)});
    EXPECT_EQ(run.status, 3) << name;
    EXPECT_NE(run.err.find(content.second), std::string::npos) << name << ": " << run.err;
  }
  Dl_info other{};  // a module of another kind
  ASSERT_NE(::dladdr(::dlsym(RTLD_DEFAULT, "archive_version_number"), &other), 0);
  for (const auto& [path, why] : {std::pair(at(""), "it is no plain file"), std::pair(at("none"), "No such file"),
                                  std::pair(std::string(other.dli_fname), "it has no symbol DovelClientPlugin")}) {
    const Outcome run = dovel({"clear", "--device", at("device"), "--plugin", path});
    EXPECT_EQ(run.status, 3);
    EXPECT_NE(run.err.find(why), std::string::npos) << run.err;
  }
  EXPECT_FALSE(fs::exists(at("device"))) << "it is looked at before the device is";
}

TEST_F(SyncTest, NamesAreMeasuredAsTheyAreShown) {
  const std::pair<const char*, const char*> names[] = {
      {"e\u0301\u200d", "e\u0301\u200d "},  // combining marks take no column
      {"\u30ab", "\u30ab"},                 // a wide one
      {"\U0001F388", "\U0001F388"},
      {"\x7f", "\ufffd "},
      {"\u0085\u009b", "\ufffd\ufffd"},
      {"\u200e\u202e", "\ufffd\ufffd"},
      {"\u2066\ufff9", "\ufffd\ufffd"},
      {"\u00e4", "\u00e4 "},
  };
  Json installed = Json::array();
  for (std::size_t i = 0; i < std::size(names); ++i) {
    installed.push_back({{"identifier", "org." + std::to_string(i)}, {"name", names[i].first}});
  }
  seed(Json{{"installed", installed}}.dump());
  const std::string shown = dovel({"status", "--device", at("device")}).out;
  for (std::size_t i = 0; i < std::size(names); ++i) {
    const std::string row = "  org." + std::to_string(i) + "      -       " + names[i].second + "   User ";
    EXPECT_NE(shown.find(row), std::string::npos) << row << "\n" << shown;
  }
}

}  // namespace
}  // namespace appsync
