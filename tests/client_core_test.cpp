// The client's life, its files, the installed-assets report, reconciliation, and the end of the transfers.
#include "embedded/installer.h"
#include "embedded/notifications.h"
#include "embedded/registry.h"
#include "tests/support/world.h"

namespace appsync::test {
namespace {

constexpr char kRoot[] = "/var/mobile/Library/ApplicationSync";
constexpr char kStaging[] = "/var/mobile/Media/PublicStaging/ApplicationSync";
constexpr char kRestoreState[] = "/var/mobile/Library/ApplicationSync/RestoreState.plist";

TEST(Lifecycle, RegistersOnceAndOnlyInTheDaemon) {
  World world;
  const auto startUp = [&] {
    world.device().notificationCenter().post("com.zelk.dovel.DovelStartupCompleteNotification");
    world.settle();
  };
  const auto registrations = [&] {
    std::size_t count = 0;
    for (const auto& line : world.instruments().recorder().lines())
      count += line.starts_with("initWithMachServiceName");
    return count;
  };
  startUp();
  startUp();
  EXPECT_EQ(registrations(), 1U);
  EXPECT_EQ(world.client().supportedDataclasses(), std::vector<std::string>{"Application"});
  EXPECT_EQ(world.client().currentSyncAnchor(), "NO_APP_SYNC_ANCHOR");
  std::optional<Error> error = Error("X", 1);
  EXPECT_TRUE(world.client().prepareForSyncWithHostAnchor("h", nullptr, &error));
  EXPECT_EQ(error, Error("X", 1));

  World elsewhere("com.zelk.datamigrator");
  elsewhere.device().notificationCenter().post("com.zelk.dovel.DovelStartupCompleteNotification");
  elsewhere.settle();
  for (const auto& line : elsewhere.instruments().recorder().lines()) {
    EXPECT_FALSE(line.starts_with("initWithMachServiceName") || line.starts_with("addNotificationObserver")) << line;
  }
}

TEST(Lifecycle, Transcripts) {
  std::string all;
  for (const char* host : {"com.zelk.dovel", "com.zelk.datamigrator"}) {
    World world(host);
    all += "# hosted by " + std::string(host) + "\n" +
           world.instruments().recorder().transcript({.services = {}, .thread = std::this_thread::get_id()});
    world.client().dataMigratorSetPlaceHolderPromiseForRestoreAppBundle("org.a");
    world.client().assetTransferUpdatedProgress(world.asset("org.b"), 0.5);
    all += "# destroyed\n" + world.transcript([&] { world.destroyClient(); });
  }
  expectTranscript("lifecycle", all);
}

// A callback that a service delivers while the client goes, or after, must find it closed.
TEST(Lifecycle, NoCallbackReachesADestroyedClient) {
  World world;
  const auto delegate = world.client().installObserverDelegate();
  world.destroyClient();
  const std::string lines = world.logLines([&] {
    delegate->coordinatorShouldPrioritize(world.instruments().makePhantomCoordinator("org.a", std::nullopt));
    delegate->promiseDidBeginFulfillmentWithIdentifier(1);
  });
  EXPECT_EQ(lines, "");
}

TEST(WorkingFiles, LoadPlistTellsAbsentFromUnusable) {
  World world;
  const std::string path = "/var/mobile/list.plist";
  const auto load = [&](std::optional<Error>& error) {
    return AppsClient::_loadPlist(world.device().files(), ClientLog(*world.instruments().platform().log), path, &error);
  };
  std::optional<Error> error;
  EXPECT_FALSE(load(error));
  EXPECT_TRUE(error && error->domain() == kFileErrorDomain);

  struct Case {
    const char* text;
    bool loads;
    bool setsError;
    const char* logs;
  };
  const Case cases[] = {
      {"", false, false, ""},
      {"garbage", false, true, "log 8 error: com.zelk.kest.Dovel.AppSync|couldn't parse todo list\n"},
      {"<plist><dict/></plist>", false, false, "log 8 error: com.zelk.kest.Dovel.AppSync|todo list is not an array\n"},
      {"<plist><array><integer>1</integer></array></plist>", true, false, ""}};
  for (const Case& each : cases) {
    world.putText(path, each.text);
    error.reset();
    EXPECT_EQ(world.logLines([&] { EXPECT_EQ(load(error).has_value(), each.loads) << each.text; }), each.logs);
    EXPECT_EQ(error.has_value(), each.setsError) << each.text;
  }
}

TEST(WorkingFiles, ChangeTouchesTheFirstEntryAlone) {
  World world;
  world.client().changeAssetID("org.a", "SENT");  // no list, no harm
  world.putTodo(R"([5, {"identifier": 7}, {"identifier": "org.a", "operation": "install", "extra": [1]},
                    {"identifier": "org.a", "operation": "install"}, {"identifier": "org.b"}])");
  expectTranscript("change_asset_id", world.transcript([&] {
    world.client().changeAssetID("org.a", "SENT");
    world.client().changeAssetID("org.b", "FAILED");
    world.client().changeAssetID("org.c", "FAILED");
  }));
  EXPECT_EQ(world.todo(), "?=? 7=? org.a=SENT org.a=install org.b=FAILED");
  const auto list = world.get(std::string(kRoot) + "/TarvoStuff/ApplicationsSync.plist");
  EXPECT_EQ(list->elements()[2].find("extra")->count(), 1U);
}

// Callbacks of many installs at once: every one of them has to be in the list at the end.
TEST(WorkingFiles, ConcurrentChangesAreAllKept) {
  World world;
  std::string json = "[";
  std::string expected;
  for (int i = 0; i < 40; ++i) {
    const std::string id = "org." + std::to_string(i);
    json += (i > 0 ? "," : "") + std::string(R"({"identifier": ")") + id + R"(", "operation": "install"})";
    expected += (i > 0 ? " " : "") + id + "=INSTALLED";
  }
  world.putTodo(json + "]");
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = t; i < 40; i += 4) {
        world.client().coordinatorDidCompleteSuccessfully(
            world.instruments().makePhantomCoordinator("org." + std::to_string(i), std::nullopt));
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(world.todo(), expected);
}

TEST(WorkingFiles, ClearForgetsEverything) {
  World world;
  world.seed(R"({"placeholders": [{"identifier": "org.p", "name": "P", "installType": 4},
                                  {"identifier": "org.q", "name": "Q", "installType": 4}],
                 "uninstalled": ["org.u"], "todo": [], "restoreState": {"org.a": {}}})");
  world.fault("uninstallApplication=org.q");
  std::string all = world.transcript([&] { world.client().clearSyncData(); });
  EXPECT_FALSE(world.exists(kRoot));
  EXPECT_EQ(world.device().installer().KilnLookupUninstalled()->count(), 0U);
  world.instruments().clearFaults();
  for (const char* fault : {"KilnClearUninstalled", "KilnLookupUninstalled"}) {
    world.fault(fault);
    all += "# " + std::string(fault) + " fails\n" + world.transcript([&] { world.client().clearSyncData(); });
  }
  expectTranscript("clear_sync_data", all);
}

TEST(RestoreState, ReadsAndCleans) {
  World world;
  const auto read = [&](const char* id, std::optional<std::string> version) {
    return describe(world.client()._restoreStatePropertyForKey("path", id, version));
  };
  EXPECT_EQ(read("org.a", "1"), "(null)");
  world.client().cleanRestoreStateForIdentifier("org.a");
  world.put(kRestoreState, plist(R"({"org.a": {"1": {"path": "/x"}, "2": {"path": 5}}, "org.b": "odd", "org.c": {}})"));
  EXPECT_EQ(read("org.a", "1"), "/x");
  EXPECT_EQ(read("org.a", "2"), "5");
  EXPECT_EQ(read("org.a", std::nullopt), "(null)");
  EXPECT_EQ(read("org.b", "1"), "(null)");
  world.client().cleanRestoreStateForIdentifier("org.a");
  EXPECT_EQ(world.get(kRestoreState)->description(), "{org.b = odd, org.c = {}}");
  world.client().cleanRestoreStateForIdentifier("org.b");
  world.client().cleanRestoreStateForIdentifier("org.c");
  EXPECT_FALSE(world.exists(kRestoreState));
  for (const char* text : {"garbage", "<plist><array/></plist>", ""}) {
    world.putText(kRestoreState, text);
    EXPECT_EQ(read("org.a", "1"), "(null)");
    world.client().cleanRestoreStateForIdentifier("org.a");
    EXPECT_FALSE(world.exists(kRestoreState)) << text;
  }
}

TEST(RestoreState, CountsAwaitedPlaceholdersOnce) {
  std::string all;
  for (const char* host : {"com.zelk.datamigrator", "com.zelk.dovel"}) {
    World world(host);
    AppsClient& client = world.client();
    all += "# hosted by " + std::string(host) + "\n" + world.logLines([&] {
      client.dataMigratorSetPlaceHolderPromiseForRestoreAppBundle("org.a");
      client.dataMigratorSetPlaceHolderPromiseForRestoreAppBundle("org.a");
      client.dataMigratorSetPlaceHolderPromiseForRestoreAppBundle("org.b");
      client.ostrelDidInstallPlaceHolderForAppBundle("org.a");
      client.ostrelDidInstallPlaceHolderForAppBundle("org.a");
      client.ostrelDidInstallPlaceHolderForAppBundle(std::nullopt);
      client.dataMigratorCancelledCoordinatorForRestoreAppBundle("org.b");
      client.dataMigratorCancelledCoordinatorForRestoreAppBundle("org.b");
    });
  }
  expectTranscript("placeholder_accounting", all);
}

TEST(InstalledAssets, ReportsWhatHasGone) {
  World world;
  world.seed(R"({"installed": [{"identifier": "org.here", "version": "1", "files": {"data": 1000}},
                               {"identifier": "org.system", "type": "System", "files": {"data": 5}}],
                 "uninstalled": ["org.removed", "org.pending"],
                 "lastSync": ["org.here", "org.vanished", "org.removed", "org.failed", "org.done"]})");
  world.putTodo(R"([{"identifier": "org.pending", "operation": "DOWNLOADED"},
                    {"identifier": "org.failed", "operation": "FAILED"},
                    {"identifier": "org.done", "operation": "INSTALLED"},
                    {"identifier": "org.done", "operation": "install"}, {"identifier": 7}, "odd"])");
  PropertyList result("");
  std::string all = world.transcript([&] { result = world.client().installedAssets(); });
  EXPECT_EQ(result.description(),
            "{_Deleted = [{TefBundleIdentifier = org.done}, {TefBundleIdentifier = org.failed}, "
            "{TefBundleIdentifier = org.removed}, {TefBundleIdentifier = org.vanished}]}");
  all += world.transcript([&] { result = world.client().installedAssetMetrics(); });
  EXPECT_EQ(result.find("_Count")->unsignedInteger(), 1U);
  EXPECT_GE(result.find("_PhysicalSize")->unsignedInteger(), 1000U);
  EXPECT_EQ(result.find("_PurgeableSize")->unsignedInteger(), 0U);

  // Without the installer's list the one from before is kept, and handed back at the end.
  world.fault("KilnLookupUninstalled");
  all += "# no installer list\n" + world.transcript([&] { world.client().installedAssets(); });
  all += "# the end of the sync\n" + world.transcript([&] { world.client().syncEndedWithSuccess(true); });
  EXPECT_EQ(world.device().installer().KilnLookupUninstalled()->count(), 0U);
  expectTranscript("installed_assets", all);
}

TEST(Reconcile, EveryWayOut) {
  World world;
  std::string all;
  std::optional<Error> error;
  const auto reconcile = [&](const char* title, bool answer, bool setsError) {
    error.reset();
    all += "# " + std::string(title) + "\n" + world.transcript([&] {
      EXPECT_EQ(world.client().reconcileSync(1, "new", nullptr, &error), answer) << title;
    });
    EXPECT_EQ(error.has_value(), setsError) << title;
    world.settle();
  };
  const auto stage = [&](const std::string& todoText) {
    world.put(std::string(kStaging) + "/org.a/Info.plist", plist("{}"));
    if (!todoText.empty()) world.putText(std::string(kStaging) + "/ApplicationsSync.plist", todoText);
  };
  world.fault("createDirectory@1");
  reconcile("the state root cannot be made", false, true);
  reconcile("nothing is staged", true, false);
  stage("");
  world.fault("moveItem@1");
  reconcile("the staging area cannot be moved", false, true);
  reconcile("no todo list", true, true);
  stage("garbage");
  reconcile("a todo list that cannot be parsed", true, true);
  stage("<plist><dict/></plist>");
  reconcile("a todo list that is no array", true, false);
  expectTranscript("reconcile_ways_out", all);
}

TEST(Reconcile, RemovesTellsTheShellAndKeepsACopy) {
  World world;
  world.seed(R"({"installed": [{"identifier": "org.gone", "version": "1", "files": {"data": 10}}]})");
  const auto stage = [&](const std::string& layout) {
    world.put(
        std::string(kStaging) + "/ApplicationsSync.plist",
        plist(R"([{"identifier": "org.gone", "operation": "remove"}, {"identifier": "org/../x", "operation": "remove"},
                        {"identifier": 7, "operation": "remove"}, {"operation": "remove"}, "odd",
                        {"identifier": "org.keep", "operation": "install"}, {"identifier": "org.keep", "operation": 5},
                        {"identifier": "..", "operation": "remove"}])"));
    world.putText(std::string(kStaging) + "/BrelmIconState.plist", layout);
  };
  stage("<plist><array><string>org.keep</string></array></plist>");
  std::string all = world.transcript([&] { EXPECT_TRUE(world.client().reconcileSync(1, "a", nullptr, nullptr)); });
  world.settle();
  EXPECT_FALSE(world.device().registry().applicationIsInstalled("org.gone"));
  EXPECT_EQ(world.get(std::string(kRoot) + "/TarvoStuff/ApplicationsSync.plist-debug.plist")->count(), 8U);

  world.seed(R"({"settings": {"AppRemovalAllowed": 2}})");
  stage("");
  world.fault("registerCheck");
  all += "# removal is restricted, the layout empty, the shell deaf\n" +
         world.transcript([&] { EXPECT_TRUE(world.client().reconcileSync(1, "a", nullptr, nullptr)); });
  expectTranscript("reconcile", all);
}

TEST(SyncEnd, FailuresAreLoggedAndTriedAgain) {
  World world;
  world.seed(R"({"uninstalled": ["org.u"], "lastSync": ["org.u"]})");
  std::string all = "# without success\n" + world.transcript([&] { world.client().syncEndedWithSuccess(false); });
  EXPECT_TRUE(world.exists(std::string(kRoot) + "/LastSyncAppState.plist"));
  world.client().installedAssets();
  world.fault("utimes@1");
  world.fault("KilnClearUninstalled@1");
  all +=
      "# nothing can be touched or forgotten\n" + world.transcript([&] { world.client().syncEndedWithSuccess(true); });
  all += "# again\n" + world.transcript([&] { world.client().syncEndedWithSuccess(true); });
  all += "# and again\n" + world.transcript([&] { world.client().syncEndedWithSuccess(true); });
  expectTranscript("sync_end", all);
}

TEST(TransferPhaseEnd, HandsOverWhatIsOutstanding) {
  World world;
  world.seed(R"({"coordinators": [{"identifier": "org.b", "kind": "restoring", "creator": 1}]})");
  std::string all =
      "# nothing outstanding\n" + world.transcript([&] { world.client().assetTransferEndedWithSuccess(false); });
  for (const bool success : {true, false}) {
    world.client().assetTransferUpdatedProgress(world.asset("org.a"), 0.1);
    world.client().assetTransferUpdatedProgress(world.asset("org.b"), 0.1);
    all += std::string("# two outstanding, ") + (success ? "success\n" : "no success\n") +
           world.transcript([&] { world.client().assetTransferEndedWithSuccess(success); });
    world.settle();
  }
  expectTranscript("transfer_phase_end", all);
  world.destroyClient();  // nothing is outstanding any more, so nothing is logged
}

}  // namespace
}  // namespace appsync::test
