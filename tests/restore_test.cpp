// The applications of a backup come back: the list, each application's coordinator and placeholder, the wait; then store
// accounts and what happens before a backup.
#include "embedded/registry.h"
#include "embedded/waiting.h"
#include "tests/support/world.h"

namespace appsync::test {
namespace {

constexpr char kList[] = "/var/mobile/Media/TarvoRestore/RestoreApplications.plist";
constexpr char kProcessed[] = "/var/mobile/Library/Logs/MediaServices/RestoreApplications.plist";
constexpr char kDemoted[] = "/var/mobile/Library/Preferences/com.zelk.Vaultry.DemotedApps.plist";
constexpr char kMigrator[] = "com.zelk.datamigrator";

PropertyList bytes(const std::string& text) {
  return PropertyList::data(Bytes(text.begin(), text.end()));
}

PropertyList binary(const PropertyList& value) {
  return PropertyList::data(*serializePropertyList(value, PropertyListFormat::Binary, nullptr));
}

// An entry of the restore list; without an icon when there are no bytes for one.
PropertyList entry(const std::string& metadata, const std::string& icon = "") {
  PropertyList made = PropertyList::dictionary({{"TarvoMetadata", binary(plist(metadata))}});
  if (!icon.empty()) made.set("PlaceholderIcon", bytes(icon));
  return made;
}

PropertyList listOf(const std::vector<std::string>& ids) {
  PropertyList list = PropertyList::dictionary();
  for (const std::string& id : ids) list.set(id, entry("{}"));
  return list;
}

std::string placeholderText(World& world, const std::string& id) {
  const auto record = world.device().registry().applicationProxyForIdentifier(id, true);
  if (!record) return "none";
  const auto info = world.get(record->bundleURL->path() + "/Info.plist");
  const auto icon = world.device().files().readFile(record->bundleURL->path() + "/Icon.png", nullptr);
  return std::to_string(record->installType) + " " + describe(record->localizedName) + " " +
         describe(record->bundleVersion) +
         " prohibited=" + info->find("PellumApplicationLaunchProhibited")->description() +
         " icon=" + (icon ? std::string(icon->begin(), icon->end()) : "none");
}

// How far the clock of the device goes while `work` runs.
std::chrono::seconds took(World& world, const std::function<void()>& work) {
  const auto begin = world.device().waiting().now();
  work();
  return std::chrono::duration_cast<std::chrono::seconds>(world.device().waiting().now() - begin);
}

// --- the way in -----------------------------------------------------------------------------------------------------

TEST(Restore, TheErrorIsTheBackupServicesOrNone) {
  World world(kMigrator);
  ScriptedAnswers answers;
  std::pair<bool, std::optional<Error>> answer{true, std::nullopt};
  answers.dovelShouldCreateAppPlaceholders = [&] { return std::optional(answer); };
  world.instruments().setAnswers(answers);
  world.put(kList, PropertyList::dictionary());
  world.fault("createDirectory=ApplicationSync");
  std::string all;
  struct Case {
    std::int32_t type;
    std::pair<bool, std::optional<Error>> answer;
    std::string error;
    bool isProcessed;
  };
  for (const Case& one : {Case{0, {false, Error("No", 1)}, "(null)", false}, Case{4, {true, {}}, "(null)", false},
                          Case{-1, {true, {}}, "(null)", false}, Case{2, {false, Error("No", 1)}, "No 1", false},
                          Case{3, {false, std::nullopt}, "(null)", false},
                          Case{3, {true, Error("Odd", 2)}, "Odd 2", true}, Case{2, {true, {}}, "(null)", false}}) {
    answer = one.answer;
    std::optional<Error> error = Error("Given", 7);
    all += "# type " + std::to_string(one.type) + "\n" +
           world.transcript([&] { EXPECT_TRUE(world.client().reconcileRestoreOfType(one.type, &error)); });
    EXPECT_EQ(describe(error), one.error) << one.type;
    EXPECT_EQ(world.exists(kProcessed), one.isProcessed) << one.type;
    if (one.isProcessed) world.device().files().removeItem(kProcessed, nullptr);
  }
  EXPECT_TRUE(world.client().reconcileRestoreOfType(2, nullptr));
  expectTranscript("restore_way_in", all);
}

TEST(Restore, EveryWayOutOfTheList) {
  struct Case {
    const char* what;
    std::function<void(World&)> prepare;
    bool result;
    bool isMoved;
  };
  const auto text = [](const char* content) { return [content](World& world) { world.putText(kList, content); }; };
  const auto list = [](PropertyList value) { return [value](World& world) { world.put(kList, value); }; };
  const Case cases[] = {
      {"no list", [](World&) {}, true, false},
      {"cannot be read",
       [&](World& world) {
         list(listOf({"org.a"}))(world);
         world.fault("readFile=RestoreApplications.plist");
       },
       false, true},
      {"is empty", text(""), false, true},
      {"is no property list", text("nonsense"), false, true},
      {"is no dictionary", list(PropertyList::array({"org.a"})), false, true},
      {"has nothing in it", list(PropertyList::dictionary()), false, true},
      {"cannot be moved",
       [&](World& world) {
         list(PropertyList::dictionary())(world);
         world.fault("moveItem");
       },
       false, false},
      {"replaces an older one",
       [&](World& world) {
         world.putText(kProcessed, "older");
         list(PropertyList::dictionary())(world);
       },
       false, true},
      {"the older one stays",
       [&](World& world) {
         world.putText(kProcessed, "older");
         list(PropertyList::dictionary())(world);
         world.fault("removeItem=RestoreApplications.plist");
       },
       false, false},
  };
  std::string all;
  for (const Case& one : cases) {
    World world(kMigrator);
    one.prepare(world);
    const bool wasThere = world.exists(kList);
    all += "# " + std::string(one.what) + "\n" +
           world.transcript([&] { EXPECT_EQ(world.client()._processTarvoRestoreInfo(), one.result) << one.what; });
    EXPECT_EQ(world.exists(kList), wasThere && !one.isMoved) << one.what;
    // After a list that could be parsed no placeholder is waited for any more.
    const bool isDeaf =
        world.logLines([&] { world.client().ostrelDidInstallPlaceHolderForAppBundle("org.x"); }).empty();
    EXPECT_EQ(isDeaf, one.what == std::string("has nothing in it") || one.what == std::string("cannot be moved") ||
                          one.what == std::string("replaces an older one") ||
                          one.what == std::string("the older one stays"))
        << one.what;
  }
  expectTranscript("restore_ways_out", all);
}

TEST(Restore, TheListOfDemotedApplicationsIsOptional) {
  struct Case {
    const char* content;
    const char* types;  // of the placeholders of org.a, org.b and org.c
    const char* line;
  };
  const std::string head = R"(<?xml version="1.0"?><plist version="1.0">)";
  for (const Case& one : {
           Case{"", "2 2 2", ""},
           Case{"nonsense", "2 2 2", "log 8 error: com.zelk.kest.Dovel.AppSync|couldn't parse demoted apps list\n"},
           Case{"<array><string>org.a</string></array>", "2 2 2",
                "log 8 error: com.zelk.kest.Dovel.AppSync|demoted apps list is not a dictionary\n"},
           Case{"<dict><key>AutomaticDowngrades</key><string>org.a</string><key>IntentionalDowngrades</key><array>"
                "<integer>7</integer><string>org.b</string><dict/></array></dict>",
                "2 8 2", ""},
           Case{"<dict><key>AutomaticDowngrades</key><array><string>org.a</string><string>org.b</string></array>"
                "<key>IntentionalDowngrades</key><array><string>org.b</string><string>org.c</string></array></dict>",
                "7 7 8", ""},
       }) {
    World world;
    const std::string content = one.content;
    world.putText(kDemoted, content.starts_with('<') ? head + content + "</plist>" : content);
    world.put(kList, listOf({"org.a", "org.b", "org.c"}));
    const std::string lines = world.logLines([&] { EXPECT_TRUE(world.client()._processTarvoRestoreInfo()); });
    world.settle();
    std::string types;
    for (const char* id : {"org.a", "org.b", "org.c"}) {
      types += (types.empty() ? "" : " ") + placeholderText(world, id).substr(0, 1);
    }
    EXPECT_EQ(types, one.types) << content;
    EXPECT_EQ(lines.find("demoted apps list") != std::string::npos, *one.line != 0) << content << "\n" << lines;
    EXPECT_NE(lines.find(one.line), std::string::npos) << content << "\n" << lines;
    EXPECT_NE(lines.find("log 15: com.zelk.kest.Dovel.AppSync|Demoted Apps: "), std::string::npos);
  }
  // Whoever asks hears what was wrong; of an empty file and of another root there is nothing to hear.
  World world;
  for (const auto& [content, code] : {std::pair("", 7), std::pair("x", 1), std::pair("<plist><array/></plist>", 7)}) {
    std::optional<Error> error = Error("Given", 7);
    world.putText("/var/list", content);
    const ClientLog log(*world.instruments().platform().log);
    EXPECT_FALSE(AppsClient::_loadDemotedAppsPlist(world.device().files(), log, "/var/list", &error));
    EXPECT_EQ(error->code(), code) << content;
  }
}

// --- the applications -----------------------------------------------------------------------------------------------

// One that was not demoted and one that was, from the list to the placeholder; then the same list again.
TEST(Restore, EachKindFromEndToEndAndOnceMore) {
  World world;
  PropertyList list = PropertyList::dictionary();
  list.set("org.plain",
           entry(R"({"title": "Plain", "itemName": "no", "bundleVersion": "1.2", "zelkId": "me"})", "ICON"));
  list.set("org.demoted", entry(R"({"itemName": "Gone", "launchProhibited": true})"));
  world.put(kList, list);
  world.put(kDemoted, plist(R"({"IntentionalDowngrades": ["org.demoted"]})"));
  std::string all = world.transcript([&] { EXPECT_TRUE(world.client().reconcileRestoreOfType(3, nullptr)); });
  world.settle();
  EXPECT_EQ(placeholderText(world, "org.plain"), "2 Plain 1.2 prohibited=false icon=ICON");
  EXPECT_EQ(placeholderText(world, "org.demoted"), "8 Gone (null) prohibited=true icon=none");
  EXPECT_EQ(world.get(kProcessed), list);
  const auto record = world.device().registry().applicationProxyForIdentifier("org.plain", true);
  EXPECT_EQ(world.get(record->bundleContainerURL->path() + "/TarvoMetadata.plist")->find("zelkId")->description(),
            "me");

  World migrator(kMigrator);
  for (const char* time : {"", "# once more\n"}) {
    migrator.put(kList, list);
    migrator.put(kDemoted, plist(R"({"IntentionalDowngrades": ["org.demoted"]})"));
    std::string again;
    const auto waited = took(migrator, [&] {
      again = migrator.transcript([&] { EXPECT_TRUE(migrator.client().reconcileRestoreOfType(2, nullptr)); });
    });
    EXPECT_LT(waited.count(), 5);
    migrator.settle();
    if (*time != 0) all += time + again;
  }
  expectTranscript("restore_each_kind", all);
}

TEST(Restore, WhatThePlaceholderShows) {
  struct Case {
    const char* metadata;
    std::string icon;
    std::uint64_t demotionStatus;
    const char* placeholder;
  };
  const Case cases[] = {
      {"{}", "", 0, "2 org.0 (null) prohibited=false icon=none"},
      {R"({"title": 5, "itemName": "Item", "bundleVersion": 2, "launchProhibited": 1})", "", 1,
       "8 Item (null) prohibited=true icon=none"},
      {R"({"title": "", "PellumApplicationLaunchProhibited": false, "launchProhibited": true})", "P", 2,
       "7 (null) (null) prohibited=false icon=P"},
      {R"({"PellumApplicationLaunchProhibited": [], "launchProhibited": "YES"})", "", 9,
       "2 org.3 (null) prohibited=true icon=none"},
  };
  World world;
  int number = 0;
  for (const Case& one : cases) {
    const std::string id = "org." + std::to_string(number++);
    const PropertyList metadata = binary(plist(one.metadata));
    const Bytes icon(one.icon.begin(), one.icon.end());
    // Empty bytes are as good as none.
    EXPECT_TRUE(world.client().prepareAppForRestoreUsingCoordination(id, *metadata.data(), icon, one.demotionStatus));
    world.settle();
    EXPECT_EQ(placeholderText(world, id), one.placeholder);
  }
}

// Whatever an entry of the list holds, the others are restored; the one that is reached last decides.
TEST(Restore, OddEntriesAreLeftOut) {
  World world;
  PropertyList list = PropertyList::dictionary();
  list.set("org.first", entry("{}"));
  list.set("org.text", PropertyList("text"));
  list.set("org.none", PropertyList::dictionary({{"PlaceholderIcon", bytes("I")}}));
  list.set("org.string", PropertyList::dictionary({{"TarvoMetadata", "text"}}));
  list.set("org.garbage", PropertyList::dictionary({{"TarvoMetadata", bytes("garbage")}}));
  list.set("org.array", PropertyList::dictionary({{"TarvoMetadata", binary(plist("[]"))}}));
  PropertyList badIcon = entry("{}");
  badIcon.set("PlaceholderIcon", "text");
  list.set("org.icon", badIcon);
  list.set("../up", entry("{}"));
  list.set("", entry("{}"));
  list.set("org.late", PropertyList("skipped, so it decides nothing"));
  world.put(kList, list);
  std::string all = world.logLines([&] { EXPECT_FALSE(world.client()._processTarvoRestoreInfo()); });
  world.settle();
  for (const char* id : {"org.first", "org.icon"}) EXPECT_EQ(placeholderText(world, id).substr(0, 1), "2") << id;
  list.set("org.last", entry("{}"));
  world.put(kList, list);
  EXPECT_TRUE(world.client()._processTarvoRestoreInfo());
  expectTranscript("restore_odd_entries", all);
}

// Every operation of a service that a restore asks, failing alone, demoted and not: what is logged, cancelled and told,
// while the application behind it comes back.
TEST(Restore, EachStepFailingAlone) {
  std::string all;
  for (const bool isDemoted : {false, true}) {
    for (const char* fault :
         {"coordinatorForAppWithBundleID=org.a", "initWithName=org.a@1", "setUserDataPromise=org.a",
          "createDirectory=org.a", "createFile=org.a", "attributesOfItem=org.a",
          "initAppPlaceholderWithBundleName=org.a", "initWithName=org.a@2", "setIconPromise=org.a",
          "setPlaceholderAttributes=org.a", "setMetadata=org.a", "setConfigurationCompleteWithError=org.a",
          "setPlaceholderPromise=org.a", "appAssetPromiseResponsibleClientWithError=org.a",
          "setAppAssetPromiseResponsibleClient=org.a", "cancelForReason=org.a"}) {
      World world;
      PropertyList list = PropertyList::dictionary({{"org.a", entry("{}", "I")}, {"org.b", entry("{}")}});
      world.put(kList, list);
      if (isDemoted) world.put(kDemoted, plist(R"({"AutomaticDowngrades": ["org.a"]})"));
      world.fault(fault);
      if (std::string_view(fault).starts_with("cancel")) world.fault("setPlaceholderPromise=org.a");
      std::string lines =
          world.transcript([&] { EXPECT_TRUE(world.client()._processTarvoRestoreInfo()) << "org.b is the last"; });
      const std::size_t begin =
          lines.find("log 8: com.zelk.kest.Dovel.AppSync|processing tarvo restore info for 'org.a'");
      const std::size_t end =
          lines.find("log 8: com.zelk.kest.Dovel.AppSync|processing tarvo restore info for 'org.b'");
      all += std::string("# ") + (isDemoted ? "demoted: " : "") + fault + "\n" + lines.substr(begin, end - begin);
      world.settle();
      EXPECT_EQ(placeholderText(world, "org.b"), "2 org.b (null) prohibited=false icon=none") << fault;
    }
  }
  expectTranscript("restore_each_step_failing", all);
}

TEST(Restore, WhatTheServiceHasAlreadyIsKept) {
  std::string all;
  for (const char* kind : {"restoring", "restoring-demoted"}) {
    World world;
    world.seed(R"({"coordinators": [
      {"identifier": "org.user", "kind": ")" +
               std::string(kind) + R"(", "creator": 3, "userDataPromise": true},
      {"identifier": "org.both", "kind": ")" +
               kind + R"(", "creator": 3, "userDataPromise": true, "placeholderPromise": true},
      {"identifier": "org.dead", "kind": ")" +
               kind + R"(", "creator": 3, "error": "dead"},
      {"identifier": "org.other", "kind": "updating", "creator": 3}]})");
    world.settle();
    const PropertyList metadata = binary(plist("{}"));
    const std::uint64_t status = std::string_view(kind) == "restoring" ? 0 : 1;
    for (const auto& [id, result] : {std::pair("org.user", true), std::pair("org.both", true),
                                     std::pair("org.dead", true), std::pair("org.other", false)}) {
      all += std::string("# ") + kind + ": " + id + "\n" + world.logLines([&, id = id, result = result] {
        EXPECT_EQ(world.client().prepareAppForRestoreUsingCoordination(id, *metadata.data(), std::nullopt, status),
                  result)
            << kind << " " << id;
      });
    }
  }
  expectTranscript("restore_set_up_already", all);
}

// --- the wait -------------------------------------------------------------------------------------------------------

TEST(Restore, TheWaitIsBoundedByTheAnnouncedPlaceholders) {
  {
    World world;  // the daemon's own client hears of no placeholder
    world.put(kList, listOf({"org.a", "org.b", "org.c"}));
    std::string lines;
    const auto waited =
        took(world, [&] { lines = world.logLines([&] { EXPECT_TRUE(world.client()._processTarvoRestoreInfo()); }); });
    EXPECT_GE(waited.count(), 15);
    EXPECT_LT(waited.count(), 20);
    EXPECT_NE(lines.find("|Will wait for 15 seconds for 3 placeholders to install\n"), std::string::npos) << lines;
  }
  {
    World world(kMigrator);  // another one's wait ends with the last placeholder
    world.put(kList, listOf({"org.a", "org.b", "org.c"}));
    EXPECT_LT(took(world, [&] { EXPECT_TRUE(world.client()._processTarvoRestoreInfo()); }).count(), 5);
    for (const char* id : {"org.a", "org.b", "org.c"}) EXPECT_NE(placeholderText(world, id), "none");
  }
  {
    World world(kMigrator);  // one is never reported
    ScriptedAnswers answers;
    answers.event = [](const std::string& event, const std::string& bundleID) {
      return event == "coordinatorDidInstallPlaceholder" && bundleID == "org.b" ? EventFate::Lose : EventFate::Deliver;
    };
    world.instruments().setAnswers(answers);
    world.put(kList, listOf({"org.a", "org.b"}));
    const auto waited = took(world, [&] { EXPECT_TRUE(world.client()._processTarvoRestoreInfo()); });
    EXPECT_GE(waited.count(), 5);
    EXPECT_LT(waited.count(), 15);
    const std::string lines = world.logLines([&] { world.destroyClient(); });
    EXPECT_NE(lines.find("getting dealloc'd with [org.b]pending placeholder install"), std::string::npos) << lines;
  }
  {
    World world(kMigrator);  // each is reported twice
    ScriptedAnswers answers;
    answers.event = [](const std::string& event, const std::string&) {
      return event == "coordinatorDidInstallPlaceholder" ? EventFate::Double : EventFate::Deliver;
    };
    world.instruments().setAnswers(answers);
    world.put(kList, listOf({"org.a"}));
    EXPECT_LT(took(world, [&] { EXPECT_TRUE(world.client()._processTarvoRestoreInfo()); }).count(), 5);
  }
}

// A report that comes before the announcement is not counted, so the wait goes to its bound.
TEST(Restore, AnEarlyReportIsIgnored) {
  World world(kMigrator);
  ScriptedAnswers answers;
  bool isEarly = true;
  answers.event = [](const std::string& event, const std::string&) {
    return event == "coordinatorDidInstallPlaceholder" ? EventFate::Lose : EventFate::Deliver;
  };
  answers.beforeCall = [&](const std::string& operation, const std::string&) {
    if (operation != "setPlaceholderPromise" || !std::exchange(isEarly, false)) return;
    world.client().ostrelDidInstallPlaceHolderForAppBundle("org.a");
  };
  world.instruments().setAnswers(answers);
  world.put(kList, listOf({"org.a"}));
  std::string lines;
  const auto waited =
      took(world, [&] { lines = world.logLines([&] { EXPECT_TRUE(world.client()._processTarvoRestoreInfo()); }); });
  EXPECT_GE(waited.count(), 5);
  EXPECT_NE(lines.find("error: com.zelk.kest.Dovel.AppSync|Ignoring notification from Ostrel about installing "
                       "placeholder for org.a"),
            std::string::npos);
}

// --- accounts and backups -------------------------------------------------------------------------------------------

constexpr char kInfo[] = "com.zelk.TarvoStore.downloadInfo";

std::string installed(const std::string& id, const std::string& storeMetadata) {
  return R"({"identifier": ")" + id + R"(", "version": "1", "files": {"a": 1}, "storeMetadata": )" + storeMetadata +
         "}";
}

std::string nested(const std::string& accountInfo) {
  return std::string("\"") + kInfo + R"(": {"accountInfo": )" + accountInfo + "}";
}

TEST(StoreAccounts, WhatTheMetadataSay) {
  World world;
  const std::string apps[] = {
      installed("org.a", R"({"zelkId": "a", )" + nested(R"({"ZelkID": "b", "QenPersonID": 5, "AltQenID": "x"})") + "}"),
      installed("org.b", R"({"zelkId": "c"})"),
      installed("org.c", R"({"zelkId": "b"})"),
      installed("org.d", "{" + nested(R"({"ZelkID": "d", "QenPersonID": 2.5})") + "}"),
      installed("org.e", R"({"zelkId": "d", )" + nested(R"({"ZelkID": "d", "AltQenID": "later"})") + "}"),
      installed("org.f", R"({"zelkId": 7, ")" + std::string(kInfo) + R"(": "text"})"),
      installed("org.g", R"({"zelkId": "g", ")" + std::string(kInfo) + R"(": {"accountInfo": []}})"),
      installed("org.h", R"({"zelkId": [], )" + nested(R"({"ZelkID": 1, "QenPersonID": "h", "AltQenID": 3})") + "}"),
      installed("org.i", "{" + nested(R"({"ZelkID": "i", "QenPersonID": true, "AltQenID": 3})") + "}"),
      R"({"identifier": "org.j", "version": "1", "files": {"a": 1}})",
      R"({"identifier": "org.k", "version": "1"})"};
  std::string json;
  for (const std::string& app : apps) json += (json.empty() ? "" : ", ") + app;
  world.seed(R"({"installed": [)" + json + "]}");
  world.device().registry().enumerateBundlesOfType(
      kPellumBundleTypeApplication, [&](const PellumApplicationProxy& app, bool&) {
        if (app.bundleIdentifier == "org.k")
          world.put(app.bundleContainerURL->path() + "/TarvoMetadata.plist", plist("[]"));
      });
  const auto withoutNumbers = [](std::string text) {
    for (std::size_t at = 0; (at = text.find("/Containers/", at)) != std::string::npos;) {
      const std::size_t from = at += 12;
      while (at < text.size() && std::isdigit(static_cast<unsigned char>(text[at])) != 0) ++at;
      text.replace(from, at - from, "N");
      at = from;
    }
    return text;
  };
  std::set<std::string> ids;
  std::vector<DovelMutableAccountInfo> accounts;
  const std::string all = world.logLines([&] { ids = world.client().zelkIDsForAssets(); }) +
                          world.logLines([&] { accounts = world.client().accountsForAssets(); });
  EXPECT_EQ(ids, (std::set<std::string>{"a", "b", "c", "d", "g", "i"}));
  std::string text;
  for (const auto& account : accounts) {
    text += describe(account.zelkID()) + " " + describe(account.qenID()) + " " + describe(account.altQenID()) + ", ";
  }
  EXPECT_EQ(text, "b 5 x, c (null) (null), d 2.5 (null), g (null) (null), i (null) (null), ");
  expectTranscript("store_accounts", withoutNumbers(all));
}

// What a restore has brought back belongs to an account too, until the application itself is there and says so.
TEST(StoreAccounts, RestoredApplicationsCount) {
  World world(kMigrator);
  PropertyList list =
      PropertyList::dictionary({{"org.back", entry(R"({"zelkId": "back", "is-auto-download": true})")}});
  world.put(kList, list);
  EXPECT_TRUE(world.client()._processTarvoRestoreInfo());
  world.seed(R"({"placeholders": [{"identifier": "org.waiting", "name": "W", "installType": 4}]})");
  EXPECT_EQ(world.client().zelkIDsForAssets(), std::set<std::string>{"back"});
  EXPECT_EQ(world.client().installedAssetMetrics().find("_Count")->integer(), 1);
  world.client().prepareForBackup();
  const auto record = world.device().registry().applicationProxyForIdentifier("org.back", true);
  EXPECT_EQ(describe(world.get(record->bundleContainerURL->path() + "/TarvoMetadata.plist")), "{zelkId = back}");
  world.seed(R"({"installed": [)" + installed("org.back", R"({"zelkId": "mine"})") + "]}");
  EXPECT_EQ(world.client().zelkIDsForAssets(), std::set<std::string>{"mine"});
}

TEST(Backup, ClearsTheFlagAndNothingElse) {
  World world;
  struct Case {
    const char* id;
    std::optional<PropertyList> flag;
    bool isCleared;
  };
  const Case cases[] = {{"org.true", PropertyList(true), true},      {"org.false", PropertyList(false), false},
                        {"org.one", PropertyList::integer(1), true}, {"org.text", PropertyList("yes"), true},
                        {"org.array", PropertyList::array(), false}, {"org.absent", std::nullopt, false},
                        {"org.unwritten", PropertyList(true), true}, {"org.unreadable", std::nullopt, false}};
  std::map<std::string, std::string> paths;
  std::string json;
  for (const Case& one : cases) json += (json.empty() ? "" : ", ") + installed(one.id, "{}");
  world.seed(R"({"installed": [)" + json + "]}");
  std::map<std::string, PropertyList> wanted;
  std::map<std::string, Bytes> before;
  PropertyListFormat format = PropertyListFormat::XML;
  for (const Case& one : cases) {
    const auto record = world.device().registry().applicationProxyForIdentifier(one.id, false);
    paths[one.id] = record->bundleContainerURL->path() + "/TarvoMetadata.plist";
    // A fraction of a second and a UID are what one of the formats would lose.
    PropertyList metadata = PropertyList::dictionary({{"date", PropertyList::date(1.25)}, {"title", "T"}});
    if (format == PropertyListFormat::Binary) metadata.set("uid", PropertyList::uid(5));
    if (one.flag) metadata.set("is-auto-download", *one.flag);
    before[one.id] = *serializePropertyList(metadata, format, nullptr);
    metadata = *parsePropertyList(before[one.id], nullptr);
    metadata.remove("is-auto-download");
    wanted.emplace(one.id, metadata);
    if (std::string_view(one.id) == "org.unreadable") before[one.id] = {'x'};
    world.putText(paths[one.id], std::string(before[one.id].begin(), before[one.id].end()));
    format = format == PropertyListFormat::XML ? PropertyListFormat::Binary : PropertyListFormat::XML;
  }
  world.fault("writeFile=TarvoMetadata.plist@4");
  world.fault("readFile=TarvoMetadata.plist@2");
  const std::string lines = world.logLines([&] { world.client().prepareForBackup(); });
  std::string expected = "log 8: com.zelk.kest.Dovel.AppSync|preparing for backup\n";
  for (const char* id : {"org.one", "org.text", "org.true", "org.unwritten"}) {
    expected += "log 8: com.zelk.kest.Dovel.AppSync|clearing is-auto-download value for " + std::string(id) + "\n";
  }
  EXPECT_EQ(lines, expected + "log 8: com.zelk.kest.Dovel.AppSync|finished preparing for backup\n");
  for (const Case& one : cases) {
    const auto after = world.device().files().readFile(paths[one.id], nullptr);
    const bool isRewritten = one.isCleared && std::string_view(one.id) != "org.unwritten";
    EXPECT_EQ(*after != before[one.id], isRewritten) << one.id;
    PropertyListFormat kept = PropertyListFormat::XML;
    const auto metadata = parsePropertyList(after->data(), after->size(), nullptr, {}, &kept);
    if (!isRewritten) continue;
    EXPECT_EQ(metadata, wanted.at(one.id)) << one.id;
    EXPECT_EQ(kept == PropertyListFormat::Binary, metadata->find("uid") != nullptr) << one.id;
  }
}

TEST(Backup, OnlyForbiddingBothDisablesApplications) {
  World world;
  for (int installation : {0, 1, 2}) {
    for (int removal : {0, 1, 2}) {
      world.seed(R"({"settings": {"AppInstallationAllowed": )" + std::to_string(installation) +
                 R"(, "AppRemovalAllowed": )" + std::to_string(removal) + "}}");
      EXPECT_EQ(describe(world.client().disabledAssetTypes()),
                installation == 2 && removal == 2 ? "[Application]" : "(null)");
    }
  }
}

}  // namespace
}  // namespace appsync::test
