// `dovel restore` and `dovel backup`, as whole runs.
#include <csignal>
#include <regex>
#include <set>

#include "tests/support/program.h"

namespace appsync::test {
namespace {

constexpr char kPlacedList[] = "device/var/mobile/Media/TarvoRestore/RestoreApplications.plist";
constexpr char kProcessedList[] = "device/var/mobile/Library/Logs/MediaServices/RestoreApplications.plist";

PropertyList data(const std::string& text) {
  return PropertyList::data(Bytes(text.begin(), text.end()));
}

PropertyList entry(const PropertyList& metadata) {
  return PropertyList::dictionary({{"TarvoMetadata", data(bytesOf(metadata, PropertyListFormat::Binary))}});
}

PropertyList named(const std::string& name) {
  return PropertyList::dictionary({{"title", name}, {"bundleVersion", "1.0"}});
}

class RestoreRunTest : public ProgramTest {
 protected:
  // org.kept as it was, two demoted ones, one without store metadata and one that is wanted by the host later.
  std::string sampleBackup(const std::string& name = "backup") {
    PropertyList kept = named("Kept");
    kept.set("zelkId", "me@example.org");
    kept.set("is-auto-download", true);
    PropertyList list = PropertyList::dictionary({{"org.kept", entry(kept)},
                                                  {"org.gone", entry(named("Gone"))},
                                                  {"org.nometa", PropertyList::dictionary()},
                                                  {"org.sample.notes", entry(named("Notes"))}});
    write(at(name) + "/RestoreApplications.plist", bytesOf(list));
    write(at(name) + "/com.zelk.Vaultry.DemotedApps.plist",
          bytesOf(PropertyList::dictionary({{"AutomaticDowngrades", PropertyList::array({"org.sample.notes"})},
                                            {"IntentionalDowngrades", PropertyList::array({"org.gone"})}}),
                  PropertyListFormat::Binary));
    return at(name);
  }

  Outcome restore(const std::string& backup, Arguments more = {"--json"},
                  const std::function<void(pid_t, const std::string&)>& watch = {}) {
    more.insert(more.begin(), {"restore", "--device", at("device"), backup});
    return dovel(more, watch);
  }

  Outcome backUp(Arguments more = {"--json"}) {
    more.insert(more.begin(), {"backup", "--device", at("device")});
    return dovel(more);
  }
};

TEST_F(RestoreRunTest, ABackupComesBackAndLaterSyncsLeaveItAloneUnlessAsked) {
  const std::string backup = sampleBackup();
  const auto before = treeOf(backup);
  EXPECT_EQ(dovel({"settings", "--device", at("device")}).status, 0);
  write(at(kProcessedList), "an older one");
  const Outcome run = restore(backup, {"--json", "--log", at("log"), "--trace", at("trace")});
  EXPECT_EQ(run.status, 0) << run.err;
  const Json made = run.json();
  EXPECT_EQ(made["ok"], true);
  EXPECT_EQ(made["error"], nullptr);
  EXPECT_EQ(column(made["applications"], "identifier"),
            (Texts{"org.kept", "org.gone", "org.nometa", "org.sample.notes"}));
  EXPECT_EQ(column(made["applications"], "placeholder"), (Texts{"true", "true", "false", "true"}));
  EXPECT_EQ(column(made["applications"], "installType"), (Texts{"2", "8", "null", "7"}));
  EXPECT_EQ(column(made["applications"], "error"),
            (Texts{"null", "null", "its entry in the list has no TarvoMetadata", "null"}));
  EXPECT_LT(made["waited"].get<double>(), 15.0);
  EXPECT_EQ(treeOf(backup), before);
  EXPECT_FALSE(fs::exists(at(kPlacedList)));
  EXPECT_EQ(contentOf(at(kProcessedList)), contentOf(backup + "/RestoreApplications.plist"));
  EXPECT_NE(contentOf(at("trace")).find("placeholder installed"), std::string::npos);

  const Json now = status();
  EXPECT_EQ(column(now["placeholders"], "name"), (Texts{"Gone", "Kept", "Notes"}));
  EXPECT_EQ(column(now["coordinators"], "kind"), (Texts{"restoring-demoted", "restoring", "restoring-demoted"}));
  EXPECT_EQ(column(now["coordinators"], "responsibleClient"), (Texts{"null", "1", "null"}));
  std::set<std::string> homeScreen;
  for (const Json& identifier : now["homeScreen"]) homeScreen.insert(identifier);
  EXPECT_EQ(homeScreen, (std::set<std::string>{"org.gone", "org.kept", "org.sample.notes"}));
  const std::string shown = dovel({"status", "--device", at("device")}).out;
  for (const char* type : {"restore (2)", "downgrade (7)", "intentional downgrade (8)"}) {
    EXPECT_NE(shown.find(type), std::string::npos) << shown;
  }

  // Everything is set up already: nothing is announced, and nothing is waited for.
  const Outcome again = restore(backup, {"--json", "--log", at("log2")});
  EXPECT_EQ(column(again.json()["applications"], "placeholder"), (Texts{"true", "true", "false", "true"}));
  EXPECT_EQ(again.json()["waited"], 0.0);
  const Texts messages = messagesOf(contentOf(at("log2")));
  EXPECT_EQ(std::count(messages.begin(), messages.end(), "Will wait for 0 seconds for 0 placeholders to install"), 1);

  // The host asks for one of the demoted ones, and for a system application that stands there as a placeholder.
  const std::string host = sampleHost("host", 2, 1);
  seed(R"({"placeholders": [{"identifier": "org.system", "name": "S", "installType": 7, "type": "System"}]})");
  write(host + "/ApplicationSync/ApplicationsSync.plist",
        bytesOf(PropertyList::array({install("org.sample.notes"), install("org.system"), install("org.sample.maps")})));
  const Outcome synced = sync(host);
  EXPECT_EQ(synced.json()["requested"], Json({"org.sample.notes", "org.sample.maps"})) << synced.out;
  EXPECT_EQ(column(status()["installed"], "identifier"), (Texts{"org.sample.maps", "org.sample.notes"}));
  EXPECT_EQ(column(status()["placeholders"], "identifier"), (Texts{"org.gone", "org.kept", "org.system"}));
  std::map<std::string, std::string> skipped;
  const Json result = synced.json();
  for (const Json& one : result["skipped"]) skipped[one["identifier"]] = one["reason"];
  EXPECT_EQ(skipped, (std::map<std::string, std::string>{
                         {"org.kept", "restore"}, {"org.gone", "demoted"}, {"org.system", "system"}}));
}

TEST_F(RestoreRunTest, WhatComesOfIt) {
  struct Case {
    const char* what;
    std::function<void()> prepare;
    Arguments more;
    int status;
    std::string said;  // on standard error, or in the document's "error"
    std::size_t applications;
  };
  const auto backupFile = [this](const char* name) { return at("backup") + "/" + name; };
  const auto withList = [&](const std::string& content) {
    return [=] { write(backupFile("RestoreApplications.plist"), content); };
  };
  const Case cases[] = {
      {"no list", [&] { fs::remove(backupFile("RestoreApplications.plist")); }, {}, 0, "", 0},
      {"another type", [] {}, {"--type", "-4"}, 0, "", 0},
      {"type 3", [] {}, {"--type", "3"}, 0, "", 4},
      {"garbage", withList("garbage"), {}, 1, "backup/RestoreApplications.plist\" cannot be used", 0},
      {"an array", withList(bytesOf(PropertyList::array())), {}, 1, "must be a dictionary", 0},
      {"empty", withList(bytesOf(PropertyList::dictionary())), {}, 0, "", 0},
      {"declined", [&] { dovel({"settings", "--device", at("device"), "CreateAppPlaceholders", "no"}); }, {}, 1,
       "CreateAppPlaceholders is no", 0},
      {"an application fails", [] {}, {"--fault", "setMetadata=org.gone"}, 1, "setMetadata was made to fail", 4},
      {"no reason is given", [] {}, {"--fault", "initAppPlaceholderWithBundleName=org.gone"}, 1,
       "its placeholder could not be made", 4},
      {"nor borrowed from the one before", [] {},
       {"--fault", "setMetadata=org.gone", "--fault", "initAppPlaceholderWithBundleName=org.sample.notes"}, 1,
       "its placeholder could not be made", 4},
      {"its directory cannot be made", [] {}, {"--fault", "createDirectory=org.gone"}, 1, "createDirectory was made", 4},
      {"its metadata is garbage",
       withList(bytesOf(PropertyList::dictionary(
           {{"org.gone", PropertyList::dictionary({{"TarvoMetadata", data("garbage")}})}}))),
       {}, 1, "neither XML nor a binary property list", 1},
      {"the identifier looks like a line",
       withList(bytesOf(PropertyList::dictionary({{"org.c finished with status 0 error Evil",
                                                   PropertyList::dictionary({{"TarvoMetadata", data("garbage")}})}}))),
       {},
       1,
       "\"error\": \"PropertyListError 1: the document is neither",
       1},
      {"the identifier climbs", withList(bytesOf(PropertyList::dictionary({{"../up", entry(named("Up"))}}))), {}, 1,
       "cannot be the identifier of an application", 1},
      {"the list of demoted ones is garbage",
       [&] { write(backupFile("com.zelk.Vaultry.DemotedApps.plist"), "garbage"); }, {}, 0, "none counts as demoted", 4},
      {"the list cannot be moved", [] {}, {"--fault", "moveItem=RestoreApplications.plist"}, 0, "could not be moved", 4},
      {"the list is a link",
       [&] {
         fs::rename(backupFile("RestoreApplications.plist"), at("elsewhere"));
         fs::create_symlink(at("elsewhere"), backupFile("RestoreApplications.plist"));
       },
       {}, 3, "backup/RestoreApplications.plist\" cannot be read", 0},
      {"the list is a directory",
       [&] {
         fs::remove(backupFile("RestoreApplications.plist"));
         fs::create_directory(backupFile("RestoreApplications.plist"));
       },
       {}, 3, "Is a directory", 0},
      {"no backup", [&] { fs::remove_all(at("backup")); }, {}, 3, "name a directory that holds RestoreApp", 0},
      {"type is no number", [] {}, {"--type", "two"}, 2, "--type", 0},
      {"type is too large", [] {}, {"--type", "3000000000"}, 2, "--type", 0},
  };
  for (const Case& one : cases) {
    fs::remove_all(at("device"));
    fs::remove_all(at("backup"));
    sampleBackup();
    one.prepare();
    Arguments more{"--json"};
    more.insert(more.end(), one.more.begin(), one.more.end());
    const Outcome run = restore(at("backup"), more);
    EXPECT_EQ(run.status, one.status) << one.what << run.out << run.err;
    EXPECT_EQ(run.json()["ok"], one.status == 0) << one.what;
    EXPECT_NE((run.err + run.out).find(one.said), std::string::npos) << one.what << run.out << run.err;
    if (one.status < 2) {
      EXPECT_EQ(run.json()["applications"].size(), one.applications) << one.what;
    }
    // Everything that did not fail has been restored.
    if (one.applications < 4) continue;
    EXPECT_EQ(entryOf(run.json()["applications"], "org.kept")["installType"], 2) << one.what;
  }
  // A backup without lists takes those of an earlier one away.
  sampleBackup();
  restore(at("backup"), {"--type", "1"});
  EXPECT_TRUE(fs::exists(at(kPlacedList)));
  fs::create_directory(at("nothing"));
  write(fs::path(at(kPlacedList)).parent_path() / ".RestoreApplications.plist.incoming", "left by a killed run");
  EXPECT_EQ(restore(at("nothing")).status, 0);
  EXPECT_FALSE(fs::exists(at(kPlacedList)));
  // Of one that cannot be read as a whole nothing is put in place.
  fs::remove(at("backup/com.zelk.Vaultry.DemotedApps.plist"));
  fs::create_directory(at("backup/com.zelk.Vaultry.DemotedApps.plist"));
  EXPECT_EQ(restore(at("backup")).status, 3);
  EXPECT_TRUE(fs::is_empty(fs::path(at(kPlacedList)).parent_path()));
}

// A later run would take its placeholder for one that nobody answers for.
TEST_F(RestoreRunTest, AnApplicationWhoseCoordinatorCannotBeWrittenDownFails) {
  dovel({"settings", "--device", at("device")});
  write(at("device/state/coordinators"), "in the way");
  const Outcome run = restore(sampleBackup());
  EXPECT_EQ(run.status, 1) << run.out;
  EXPECT_NE(run.err.find("the coordinators of 3 applications could not be written down"), std::string::npos) << run.err;
  const Json kept = entryOf(run.json()["applications"], "org.kept");
  EXPECT_EQ(kept["placeholder"], true);
  EXPECT_EQ(kept["error"], "its coordinator could not be written down, so that later runs do not know it");
}

TEST_F(RestoreRunTest, WhatIsTheStoresAlreadyIsLeftToIt) {
  seed(R"({"coordinators": [{"identifier": "org.kept", "kind": "restoring", "creator": 3, "responsibleClient": 1}]})");
  const Outcome run = restore(sampleBackup());
  EXPECT_EQ(run.status, 0);
  EXPECT_EQ(
      entryOf(run.json()["applications"], "org.kept").dump(),
      R"({"identifier":"org.kept","placeholder":false,"installType":null,"error":"the store is responsible for it"})");
}

// A client that the daemon hosts is deaf to what the service reports, so its wait goes to the bound; a signal ends it.
TEST_F(RestoreRunTest, ASignalEndsTheWait) {
  for (const auto& [number, expected] : {std::pair(SIGINT, 130), std::pair(SIGTERM, 143)}) {
    fs::remove_all(at("device"));
    bool sent = false;
    const Outcome run = restore(sampleBackup(), {"--host-process", "com.zelk.dovel", "--log", at("log")},
                                [&, number = number](pid_t process, const std::string& out) {
                                  if (sent || out.find("at most 15 s: ") == std::string::npos) return;
                                  sent = true;
                                  ::kill(process, number);
                                });
    EXPECT_EQ(run.status, expected) << run.out << run.err;
    std::smatch waited;
    ASSERT_TRUE(std::regex_search(run.out, waited, std::regex(R"(1 skipped, .*; waited (\S+) s)"))) << run.out;
    EXPECT_LT(std::stod(waited[1]), 10.0);
    const Texts messages = messagesOf(contentOf(at("log")));
    EXPECT_EQ(std::count(messages.begin(), messages.end(), "Finished waiting for placeholder installs"), 1);
    EXPECT_FALSE(fs::exists(at(kPlacedList)));
  }
  EXPECT_EQ(restore(sampleBackup()).status, 0);
}

// What the program says of a damaged record is its first output, well before a large list has been copied.
TEST_F(RestoreRunTest, ASignalEndsTheCopyOfAList) {
  dovel({"settings", "--device", at("device"), "CreateAppPlaceholders", "yes"});
  write(at("device/state/settings.plist"), "garbage");
  write(at("backup/RestoreApplications.plist"), "");
  fs::resize_file(at("backup/RestoreApplications.plist"), std::uintmax_t{1} << 30);
  bool sent = false;
  const Outcome run = restore(at("backup"), {}, [&](pid_t process, const std::string& /*out*/) {
    if (!std::exchange(sent, true)) ::kill(process, SIGINT);
  });
  EXPECT_EQ(run.status, 130) << run.err;
  EXPECT_EQ(run.out.find("Interrupted before the restore began.\n"), 0U) << run.out;
  EXPECT_TRUE(fs::is_empty(fs::path(at(kPlacedList)).parent_path()));
}

// A client that is deaf waits on when every placeholder is there; the wait stands in place below what has come.
TEST_F(RestoreRunTest, ATerminalShowsTheWaitInPlace) {
  bool sent = false;
  const auto interrupt = [&](pid_t process, const std::string& out) {
    if (sent || out.find("\r\x1b[Kwaiting at most 14 s: the client") == std::string::npos) return;
    sent = true;
    ::kill(process, SIGINT);
  };
  const Outcome run =
      dovelOnTerminal({"restore", "--device", at("device"), sampleBackup(), "--host-process", "com.zelk.dovel"}, 44, 10,
                      "xterm", interrupt);
  EXPECT_EQ(run.status, 130);
  EXPECT_EQ(run.out.find("heard"), std::string::npos) << run.out;  // cut to the terminal's width
  EXPECT_LT(run.out.rfind("  placed   "), run.out.find("waiting at most")) << run.out;
  EXPECT_NE(run.out.find("\r\x1b[K\r\n3 placed, 0 present, 1 skipped, 0 failed"), std::string::npos) << run.out;
}

TEST_F(RestoreRunTest, APlaceholderThatTheServiceCannotInstallFails) {
  dovel({"settings", "--device", at("device")});
  const fs::path placeholders = at("device/var/mobile/Containers/Placeholders");
  fs::remove_all(placeholders);
  write(placeholders, "in the way");
  bool sent = false;
  const Outcome run = restore(sampleBackup(), {}, [&](pid_t process, const std::string& out) {
    const auto failed = [&](const char* identifier) { return out.find(identifier) != std::string::npos; };
    if (!failed("org.kept ") || !failed("org.gone ") || !failed("org.sample.notes ") || std::exchange(sent, true))
      return;
    ::kill(process, SIGINT);
  });
  EXPECT_EQ(run.status, 130);
  EXPECT_TRUE(std::regex_search(run.out, std::regex("org.kept +failed +The placeholder of \"org.kept\" could not be")));
  EXPECT_NE(run.out.find("0 placed, 0 present, 1 skipped, 3 failed"), std::string::npos) << run.out;
}

TEST_F(RestoreRunTest, BeforeABackupTheFlagGoesAndAccountsAreTold) {
  restore(sampleBackup());
  seed(R"({"installed": [
    {"identifier": "org.a", "version": "1", "files": {"a": 1}, "storeMetadata": {"is-auto-download": true,
      "com.zelk.TarvoStore.downloadInfo": {"accountInfo": {"ZelkID": "z", "QenPersonID": 7, "AltQenID": "alt"}}}},
    {"identifier": "org.b", "version": "1", "files": {"a": 1}, "storeMetadata": {"zelkId": "a", "is-auto-download": false}}],
    "settings": {"AppInstallationAllowed": 2, "AppRemovalAllowed": 2}})");
  // The client does not tell when a file cannot be written; the program looks.
  const Outcome failed = backUp({"--json", "--fault", "writeFile=TarvoMetadata.plist"});
  EXPECT_EQ(failed.status, 1);
  EXPECT_EQ(failed.json()["cleared"], Json::array());
  for (const char* identifier : {"org.a", "org.kept"}) {
    const std::string said = "the store metadata of \"" + std::string(identifier) + "\" could not be tidied";
    EXPECT_NE(failed.err.find(said), std::string::npos) << failed.err;
  }

  const Outcome run = backUp();
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(
      run.json().dump(),
      R"({"schema":1,"ok":true,"zelkIDs":["a","me@example.org","z"],"accounts":[)"
      R"({"zelkID":"a","qenID":null,"altQenID":null},{"zelkID":"me@example.org","qenID":null,"altQenID":null},)"
      R"({"zelkID":"z","qenID":7,"altQenID":"alt"}],"disabledAssetTypes":["Application"],"cleared":["org.a","org.kept"]})");
  seed(R"({"settings": {"AppRemovalAllowed": 1}})");
  const Json once = backUp().json();
  EXPECT_EQ(once["disabledAssetTypes"], nullptr);
  EXPECT_EQ(once["cleared"], Json::array());
  const std::string text = backUp({}).out;
  EXPECT_NE(text.find("accounts (3)\n"), std::string::npos) << text;
}

TEST_F(RestoreRunTest, ASampleBackupHasEveryKindAndIsTheSameEachTime) {
  for (const char* name : {"one", "other"}) {
    ASSERT_EQ(dovel({"sample", "--backup", at(name), "--apps", "5", "--seed", "7"}).status, 0);
  }
  EXPECT_EQ(treeOf(at("one")), treeOf(at("other")));
  EXPECT_EQ(column(restore(at("one")).json()["applications"], "installType"), (Texts{"2", "7", "8", "2", "7"}));
  const Json shown = dovel({"plist", at("one/RestoreApplications.plist"), "--to", "json"}).json();
  EXPECT_FALSE(shown["org.sample.maps"].contains("PlaceholderIcon"));
  const Json told = backUp().json();
  EXPECT_EQ(told["cleared"].size(), 5U);
  EXPECT_EQ(told["zelkIDs"], Json({"first@example.org", "second@example.org"}));
  EXPECT_EQ(restore(at("nothing-there")).status, 3);
  fs::remove_all(at("device"));
  const Outcome quiet = restore(at("one"), {"--quiet", "--fault", "setMetadata=org.sample.maps"});
  EXPECT_TRUE(std::regex_match(quiet.out, std::regex("org.sample.maps +failed .*made to fail\\n"))) << quiet.out;
  EXPECT_NE(
      dovel({"restore", "--device", at("device"), "--type", "9", at("one")}).out.find("A restore of type 9 brings"),
      std::string::npos);
}

TEST_F(RestoreRunTest, AScriptRestoresAndAsks) {
  sampleBackup();
  const Outcome run = play(R"({"host": "com.zelk.datamigrator", "steps": [
    {"do": "push", "file": "backup/RestoreApplications.plist", "to": "/var/mobile/Media/TarvoRestore/RestoreApplications.plist"},
    {"do": "reconcileRestoreOfType", "type": 5, "givenError": {"domain": "Given", "code": 7}},
    {"do": "fault", "spec": "dovelShouldCreateAppPlaceholdersWithError@1"},
    {"do": "reconcileRestoreOfType", "type": 2},
    {"do": "reconcileRestoreOfType", "type": 3, "givenError": {"domain": "Given", "code": 7}},
    {"do": "settle"}, {"do": "coordinatorDidInstallPlaceholder", "identifier": "org.kept"},
    {"do": "prepareForBackup"}, {"do": "zelkIDsForAssets"}, {"do": "accountsForAssets"}]})",
                           {"--json", "--log", at("log")});
  EXPECT_EQ(run.status, 0) << run.out << run.err;
  Texts results;
  const Json document = run.json();
  for (const Json& step : document["steps"]) results.push_back(step["result"].dump() + " " + step["error"].dump());
  EXPECT_EQ(results, (Texts{"null null", "true null", "null null", R"(true {"domain":"FaultError","code":1})",
                            "true null", "null null", "null null", "null null", R"(["me@example.org"] null)",
                            R"([{"zelkID":"me@example.org","qenID":null,"altQenID":null}] null)"}));
  EXPECT_EQ(column(status()["placeholders"], "installType"), (Texts{"2", "2", "2"}));  // no list of demoted ones
  const Texts messages = messagesOf(contentOf(at("log")));
  EXPECT_EQ(std::count(messages.begin(), messages.end(), "clearing is-auto-download value for org.kept"), 1);
}

}  // namespace
}  // namespace appsync::test
