// Which packages are asked for, how each is prepared, received and installed, and what the callbacks do.
#include <algorithm>

#include "embedded/registry.h"
#include "tests/support/world.h"
#include "transfer/in_progress_asset_query.h"
#include "transfer/install_names.h"

namespace appsync::test {
namespace {

constexpr char kWorkArea[] = "/var/mobile/Library/ApplicationSync/TarvoStuff";

std::string ids(const std::vector<DovelAssetRef>& assets) {
  std::string text;
  for (const auto& asset : assets) text += (text.empty() ? "" : " ") + asset->identifier();
  return text;
}

PellumApplicationProxy placeholder(const std::string& id) {
  PellumApplicationProxy record;
  record.applicationIdentifier = record.bundleIdentifier = id;
  record.appState.isPlaceholder = true;
  return record;
}

// --- which packages are asked for -----------------------------------------------------------------------------------

TEST(Outstanding, OneNewApplicationFromEndToEnd) {
  World world;
  world.putTodo(R"([{"identifier": "org.a", "operation": "install", "version": "1.2", "name": "From host"}])");
  world.putApp("org.a", R"({"TefBundleDisplayName": "App A", "PellumApplicationLaunchProhibited": true})");
  std::vector<DovelAssetRef> assets;
  std::string all = world.transcript([&] { assets = world.client().outstandingAssetTransfers(); });
  ASSERT_EQ(ids(assets), "org.a");
  const DovelAsset& asset = *assets[0];
  EXPECT_EQ(asset.prettyName(), "App A");
  EXPECT_EQ(asset.variantOptions().description(), "{AssetParts = 1, Version = 1.2}");
  EXPECT_EQ(describe(asset.icon()), "file:///var/mobile/Library/ApplicationSync/Icons/org.a.png");
  EXPECT_EQ(asset.assetType(), "Application");
  world.settle();
  all += "# asked again, while the coordinator waits\n" +
         world.transcript([&] { EXPECT_EQ(ids(world.client().outstandingAssetTransfers()), "org.a"); });
  expectTranscript("outstanding_new_application", all);
}

// Every rule that keeps an application from being asked for, in the order in which the rules are tried.
TEST(Outstanding, RulesAndTheirOrder) {
  World world;
  world.seed(R"({"placeholders": [
      {"identifier": "org.restore", "name": "R", "installType": 2},
      {"identifier": "org.system", "name": "S", "installType": 4, "type": "System"},
      {"identifier": "org.auto", "name": "A", "installType": 7}, {"identifier": "org.manual", "name": "M", "installType": 8},
      {"identifier": "org.wanted", "name": "W", "installType": 8, "version": "9"},
      {"identifier": "org.plain", "name": "P", "installType": 4},
      {"identifier": "org.running", "name": "P", "installType": 4, "installState": 1, "installPhase": 1}],
    "installed": [{"identifier": "org.update", "version": "1", "files": {"a": 1}}],
    "coordinators": [{"identifier": "org.foreign", "kind": "initiating", "creator": 1}],
    "homeScreen": ["org.update", "org.nobody", "org.new"],
    "restoreState": {"org.new": {"2": {"path": "/var/mobile/there"}}, "org.update": {"3": {"path": "/gone"}}}})");
  world.putTodo(R"([{"identifier": "org.new", "operation": "install", "version": "2"},
      {"identifier": "org.wanted", "operation": "install", "version": "10"},
      {"identifier": "org.update", "operation": "install", "version": "3"},
      {"identifier": "org.foreign", "operation": "install"}, {"identifier": "org.new", "operation": "install"},
      {"identifier": "../up", "operation": "install"}, {"identifier": "a/b", "operation": "install"},
      {"identifier": "..", "operation": "install"}, {"identifier": "", "operation": "install"},
      {"identifier": "x/../y", "operation": "install"}, {"identifier": 7, "operation": "install"},
      {"operation": "install"}, {"identifier": "org.done", "operation": "INSTALLED"}, [], "odd"])");
  world.putText("/var/mobile/there", "x");
  std::vector<DovelAssetRef> assets;
  std::string all = world.logLines([&] { assets = world.client().outstandingAssetTransfers(); });
  ASSERT_EQ(ids(assets), "org.update org.new org.wanted org.plain");
  EXPECT_EQ(assets[2]->variantOptions().find("Version")->string(), "9");  // the placeholder's own
  EXPECT_EQ(assets[3]->prettyName(), "P");
  EXPECT_EQ(assets[1]->prettyName(), "org.new");
  EXPECT_NE(world.todo().find("org.foreign=FAILED"), std::string::npos);
  world.settle();
  world.seed(R"({"settings": {"AppInstallationAllowed": 2}})");
  all += "# installing is forbidden\n" +
         world.logLines([&] { EXPECT_EQ(ids(world.client().outstandingAssetTransfers()), ""); });
  expectTranscript("outstanding_rules", all);
}

TEST(Outstanding, GoesOnWithoutShellScratchDirectoryOrReport) {
  World world;
  world.putTodo(R"([{"identifier": "org.a", "operation": "install", "name": "Host's name"}])");
  for (const char* fault : {"reportInstalls", "createDirectory=Icons", "BrelmGetFlattenedIconState"})
    world.fault(fault);
  std::vector<DovelAssetRef> assets;
  const std::string lines = world.logLines([&] { assets = world.client().outstandingAssetTransfers(); });
  ASSERT_EQ(ids(assets), "org.a");
  EXPECT_EQ(assets[0]->prettyName(), "Host's name");
  EXPECT_EQ(assets[0]->icon()->path(), std::string(kWorkArea) + "/org.a/TarvoArtwork");
  for (const char* expected : {"error: com.zelk.kest.Dovel.AppSync|Query for in progress assets timed out",
                               "error: com.zelk.kest.Dovel.AppSync|Failed to get list of assets already in progress!",
                               "error: com.zelk.kest.Dovel.AppSync|Failed to get list of assets currently restoring!",
                               "error: com.zelk.kest.Dovel.AppSync|Can't create icon scratch dir! FaultError",
                               "log 8: com.zelk.kest.Dovel.AppSync|got no icon sort order from Brelm"}) {
    EXPECT_NE(lines.find(expected), std::string::npos) << expected;
  }
}

// A placeholder without directories of its own, or an application that is a placeholder through and through.
TEST(Outstanding, StrangeRecordsOfTheRegistry) {
  World world;
  world.seed(R"({"placeholders": [{"identifier": "org.bare", "name": "B", "installType": 4}]})");
  ScriptedAnswers answers;
  answers.enumerateBundlesOfType = [](std::uint64_t type, PellumApplicationProxies& records) {
    for (auto& record : records) record.bundleURL.reset();
    for (auto& record : records) record.bundleContainerURL.reset();
    if (type == kPellumBundleTypeSystem || type == kPellumBundleTypeAll) records.push_back(placeholder("org.sys"));
  };
  answers.applicationProxyForIdentifier = [](const std::string& id, bool) {
    PellumApplicationProxy record = placeholder(id);
    record.appState.isInstalled = true;
    return std::optional(std::optional(record));
  };
  world.instruments().setAnswers(answers);
  const std::string lines =
      world.logLines([&] { EXPECT_EQ(ids(world.client().outstandingAssetTransfers()), "org.bare"); });
  EXPECT_NE(lines.find("missing bundlePath"), std::string::npos);
  EXPECT_NE(lines.find("org.sys is system app placeholder - skipping"), std::string::npos);
  EXPECT_EQ(lines.find("already installed and will be updated"), std::string::npos);
}

// --- what is in progress --------------------------------------------------------------------------------------------

TEST(InProgress, SortsTheFirstReport) {
  World world;
  struct Case {
    std::uint64_t type, state, phase;
    const char* list;
  };
  const Case cases[] = {{4, 1, 1, "progress"},  {4, 1, 0, ""},          {1, 1, 0, "progress"}, {1, 1, 1, "progress"},
                        {2, 1, 0, "restoring"}, {2, 1, 1, "restoring"}, {2, 1, 2, ""},         {4, 2, 1, ""},
                        {4, 1, 3, ""},          {8, 1, 1, "progress"},  {2, 2, 0, ""},         {7, 0, 1, ""}};
  ScriptedAnswers answers;
  PellumApplicationProxies report;
  std::string expectedProgress;
  std::string expectedRestoring;
  for (const Case& each : cases) {
    PellumApplicationProxy record = placeholder("org." + std::to_string(report.size()));
    record.installType = each.type;
    record.installProgressSync = PellumInstallProgress{each.state, each.phase};
    report.push_back(record);
    if (std::string(each.list) == "progress") expectedProgress += record.applicationIdentifier + " ";
    if (std::string(each.list) == "restoring") expectedRestoring += record.applicationIdentifier + " ";
  }
  report.push_back(placeholder("org.app"));
  report.back().appState = {.isInstalled = true, .isPlaceholder = false};
  report.push_back(placeholder("org.noprogress"));
  answers.applicationInstallsArePrioritized = [&](PellumApplicationProxies& prioritized,
                                                  PellumApplicationProxies& paused) {
    prioritized = report;
    paused = {report[0]};
  };
  std::string all;
  const auto query = [&](const char* title) {
    std::optional<InProgressAssetQuery::Identifiers> progress;
    std::optional<InProgressAssetQuery::Identifiers> restoring;
    all += "# " + std::string(title) + "\n" +
           world.logLines(
               [&] {
                 const Platform platform = world.instruments().platform();
                 InProgressAssetQuery::currentInProgressAssetIDs(*platform.defaultWorkspace, *platform.waiting,
                                                                 ClientLog(*platform.log), progress, restoring);
               },
               true);
    std::string text;
    for (const auto& list : {progress, restoring}) {
      for (const auto& id : list.value_or(std::vector<std::string>{"none"})) text += id + " ";
      text += "| ";
    }
    return text;
  };
  EXPECT_EQ(query("nothing is under way"), "| | ");
  world.instruments().setAnswers(answers);
  EXPECT_EQ(query("every kind of install"), expectedProgress + "| " + expectedRestoring + "| ");
  answers.event = [](const std::string& event, const std::string&) {
    return event == "applicationInstallsArePrioritized" ? EventFate::Lose : EventFate::Deliver;
  };
  world.instruments().setAnswers(answers);
  EXPECT_EQ(query("no report comes"), "none | none | ");
  expectTranscript("in_progress", all);

  InProgressAssetQuery twice(ClientLog(*world.instruments().platform().log));
  const std::string lines = world.logLines([&] {
    twice.applicationInstallsArePrioritized({}, {});
    twice.applicationInstallsArePrioritized(report, {});
  });
  EXPECT_EQ(lines.find("Got install type"), std::string::npos);
  EXPECT_EQ(lines.find("signaling semaphore"), lines.rfind("signaling semaphore"));
}

TEST(InProgress, NamesOfTypesStatesAndPhases) {
  std::string all;
  for (std::uint64_t value = 0; value < 9; ++value) {
    all += installTypeName(value) + " " + installStateName(value) + " " + installPhaseName(value) + "\n";
  }
  expectTranscript("install_names", all);
}

// --- preparing an install -------------------------------------------------------------------------------------------

TEST(Prepare, EachStepFailingAlone) {
  std::string all;
  for (const char* fault :
       {"coordinatorForAppWithBundleID", "setInstallOptions", "setInitialVeylAssetPromises", "initWithName=org.a@1",
        "setAppAssetPromise", "createDirectory=org.a", "copyItem", "attributesOfItem",
        "initAppPlaceholderWithBundleName", "initWithName=org.a@2", "setIconPromise", "setPlaceholderAttributes",
        "setMetadata", "setConfigurationCompleteWithError", "setPlaceholderPromise"}) {
    World world;
    world.putApp("org.a", "{}");
    const DovelAssetRef asset = world.asset("org.a");
    asset->setInfoPlist(std::string(kWorkArea) + "/org.a/Info.plist");
    asset->setStorePlist(std::string(kWorkArea) + "/org.a/TarvoMetadata.plist");
    asset->setIcon(FileURL::fileURLWithPath(std::string(kWorkArea) + "/org.a/Icon.png", false));
    world.fault(fault);
    all += "# " + std::string(fault) + "\n" +
           world.transcript([&] { world.client().prepareAppForInstallUsingCoordination(asset, false); });
  }
  expectTranscript("prepare_each_step_failing", all);
}

TEST(Prepare, AnIconPromiseThatCannotBeAdded) {
  World world;
  AppsClient& client = world.client();
  world.fault("setIconPromise");
  const std::string all = world.transcript([&] {
    const auto placeholder = client._placeHolderForBundleIdentifierName("org.a", "A", 2);
    EXPECT_FALSE(client._createIconPromiseForBundleIdentifier("org.a", "/icon.png", 5, placeholder, false));
    EXPECT_FALSE(client._createIconPromiseForBundleIdentifier("org.a", "/icon.png", 5, {}, true));
    EXPECT_FALSE(client._createAppAssetPromiseForBundleIdentifier("org.a", "/a.ipa", {}));
  });
  expectTranscript("prepare_icon_promise", all);
}

TEST(Prepare, OddInputs) {
  World world;
  world.seed(R"({"coordinators": [{"identifier": "org.set", "kind": "initiating", "creator": 3, "installOptions": true,
                                   "initialAssetPromises": true, "assetPromise": "open", "placeholderPromise": true},
                                  {"identifier": "org.half", "kind": "initiating", "creator": 3, "installOptions": true},
                                  {"identifier": "org.store", "kind": "initiating", "creator": 1},
                                  {"identifier": "org.dead", "kind": "updating", "creator": 3, "error": "gone"}]})");
  world.put("/var/mobile/array.plist", plist("[1]"));
  world.putText("/var/mobile/icon.png", "");
  std::string all;
  const auto prepare = [&](const DovelAssetRef& asset) {
    all += "# " + asset->identifier() + "\n" +
           world.transcript([&] { world.client().prepareAppForInstallUsingCoordination(asset, false); });
  };
  for (const char* id : {"org.set", "org.half", "org.store", "org.dead", "", ".."}) prepare(world.asset(id));
  const DovelAssetRef odd = world.asset("org.odd");
  odd->setInfoPlist("/var/mobile/array.plist");
  odd->setStorePlist("/var/mobile/missing.plist");
  odd->setIcon(FileURL::fileURLWithPath("/var/mobile/icon.png", false));
  odd->setVariantOptions(plist(R"({"Version": 7})"));
  prepare(odd);
  odd->setIcon(FileURL::fileURLWithPath("/var/mobile", true));
  const DovelAssetRef named = DovelAsset::downloadAssetWithIdentifier("org.named", "Application", "");
  named->setIcon(FileURL::fileURLWithPath("/var/mobile", true));
  prepare(named);
  expectTranscript("prepare_odd_inputs", all);
}

TEST(Uninstall, LogsTheSameWordsWhetherOrNotItFails) {
  World world;
  world.fault("uninstallAppWithBundleID=org.bad");
  std::string lines = world.logLines(
      [&] {
        world.client().uninstallAppUsingCoordination("org.a");
        world.settle();
        world.client().uninstallAppUsingCoordination("org.bad");
        world.settle();
        world.client().uninstallAppUsingCoordination("a/b");
        world.destroyClient();  // the completion comes all the same
        world.settle();
      },
      true);
  expectTranscript("uninstall", lines);
}

// --- transfers ------------------------------------------------------------------------------------------------------

constexpr char kOpenCoordinator[] =
    R"({"coordinators": [{"identifier": "org.a", "kind": "initiating", "creator": 3, "assetPromise": "open"},
    {"identifier": "org.bare", "kind": "initiating", "creator": 3}, {"identifier": "org.full", "kind": "initiating", "creator": 3, "assetPromise": "complete"},
    {"identifier": "org.dead", "kind": "initiating", "creator": 3, "error": "gone"}, {"identifier": "org.store", "kind": "initiating", "creator": 1},
    {"identifier": "org.up", "kind": "updating", "creator": 3, "assetPromise": "open"}]})";

TEST(Transfer, ProgressAndCompletionFindTheLiveCoordinator) {
  World world;
  world.seed(kOpenCoordinator);
  std::string all;
  for (const char* id : {"org.a", "org.bare", "org.full", "org.dead", "org.store", "org.none", "org.up"}) {
    const DovelAssetRef asset = world.asset(id, "/var/mobile/" + std::string(id) + ".ipa");
    asset->setDownloadProgress(0.25F);
    asset->setInstallProgress(0.5F);
    all += "# progress " + std::string(id) + "\n" +
           world.transcript([&] { world.client().updateTransferProgressForApp(asset, false); });
    all += "# complete " + std::string(id) + "\n" +
           world.transcript([&] { world.client().transferCompleteForApp(asset, std::nullopt, false); });
  }
  world.seed(R"({"coordinators": [{"identifier": "org.fails", "kind": "updating", "creator": 3, "assetPromise": "open"},
                                  {"identifier": "org.later", "kind": "initiating", "creator": 3}]})");
  all += "# failed\n" + world.transcript([&] {
    world.client().transferCompleteForApp(world.asset("org.fails"), Error("X", 7), true);
  });
  world.fault("initWithName");
  all += "# no promise can be made\n" + world.transcript([&] {
    world.client().updateTransferProgressForApp(world.asset("org.later"), false);
    world.client().transferCompleteForApp(world.asset("org.later", "/p"), std::nullopt, false);
  });
  expectTranscript("transfer_coordinators", all);
}

TEST(Transfer, EveryEndOfATransfer) {
  World world;
  world.seed(R"({"installed": [{"identifier": "org.here", "version": "1", "files": {"a": 1}}],
                 "restoreState": {"org.kept": {"2": {"path": "/var/mobile/kept.ipa"}}}})");
  std::string all;
  const auto end = [&](const char* title, const DovelAssetRef& asset, bool succeeded) {
    world.putTodo(
        R"([{"identifier": "org.a", "operation": "install"}, {"identifier": "org.kept", "operation": "install"}])");
    all += "# " + std::string(title) + "\n" + world.transcript([&] {
      world.client().assetTransferSucceeded(asset, succeeded, succeeded ? std::nullopt : std::optional(Error("X", 7)));
    });
    all += "todo: " + world.todo() + "\n";
  };
  end("relative path", world.asset("org.a", "incoming.ipa"), true);
  end("climbing path", world.asset("org.a", "in/../../x"), true);
  end("no path", world.asset("org.a"), true);
  DovelAssetRef asset = world.asset("org.kept");
  asset->setVariantOptions(plist(R"({"Version": "2"})"));
  end("recorded path", asset, true);
  asset = world.asset("org.a", "/up.ipa");
  asset->setIsDownload(false);
  end("an upload", asset, true);
  for (const std::uint64_t parts : {1U, 2U}) {
    asset = world.asset("org.a", "/r.ipa");
    asset->setIsRestore(true);
    asset->setCompletedAssetParts(parts);
    end("a restore", asset, true);
  }
  end("failed, not installed", world.asset("org.a"), false);
  end("failed, installed", world.asset("org.here"), false);
  asset = world.asset("org.here");
  asset->setIsRestore(true);
  end("failed, a restore", asset, false);
  world.client().coordinatorCanceledWithReason(world.instruments().makePhantomCoordinator("org.here", std::nullopt),
                                               Error("X", 1), 0);
  end("failed, cancelled by the person", world.asset("org.here"), false);
  end("failed, once more", world.asset("org.here"), false);
  expectTranscript("transfer_ends", all);
}

// The flag that picks the kind of coordinator lasts from the request to the end of the transfer, and no longer.
TEST(Transfer, AnUpdateIsRememberedUntilItsEnd) {
  World world;
  world.seed(R"({"installed": [{"identifier": "org.here", "version": "1", "files": {"a": 1}}],
                 "todo": [{"identifier": "org.here", "operation": "install", "version": "2"}]})");
  const auto assets = world.client().outstandingAssetTransfers();
  ASSERT_EQ(ids(assets), "org.here");
  world.settle();
  assets[0]->setPath("missing.ipa");
  std::string all = world.transcript([&] { world.client().assetTransferUpdatedProgress(assets[0], 0.5); });
  all += world.logLines(
      [&] {
        world.client().assetTransferSucceeded(assets[0], true, std::nullopt);
        world.settle();
      },
      true);
  all += world.transcript([&] { world.client().assetTransferUpdatedProgress(assets[0], 0.7); });
  EXPECT_TRUE(world.device().registry().applicationIsInstalled("org.here"));
  EXPECT_EQ(world.todo(), "org.here=FAILED");
  expectTranscript("transfer_of_an_update", all);
}

TEST(InstallResults, MarkAndClean) {
  World world;
  world.putTodo(R"([{"identifier": "org.a", "operation": "SENT"}, {"identifier": "org.r", "operation": "SENT"}])");
  const DovelAssetRef restore = world.asset("org.r");
  restore->setIsRestore(true);
  const std::string lines = world.transcript([&] {
    world.client().assetInstallSucceeded(world.asset("org.a"));
    world.client().assetInstallFailed(world.asset("org.a"), std::nullopt);
    world.client().assetInstallFailed(restore, Error("X", 7));
  });
  EXPECT_EQ(world.todo(), "org.a=FAILED org.r=SENT");
  expectTranscript("install_results", lines);
}

// --- callbacks ------------------------------------------------------------------------------------------------------

TEST(Callbacks, WhatEachDoes) {
  World world;
  world.putTodo(R"([{"identifier": "org.a", "operation": "DOWNLOADED"}])");
  world.put("/var/mobile/Library/ApplicationSync/RestoreState.plist",
            plist(R"({"org.a": {"1": {}}, "org.b": {"1": {}}})"));
  const auto coordinator = [&](std::optional<std::string> id, std::optional<Error> error = std::nullopt) {
    return world.instruments().makePhantomCoordinator(std::move(id), std::move(error));
  };
  AppsClient& client = world.client();
  std::string all = world.transcript([&] {
    client.promiseDidBeginFulfillmentWithIdentifier(2);
    client.coordinatorDidInstallPlaceholder(coordinator("org.a", Error("X", 7)));
    client.coordinatorDidCompleteSuccessfully(coordinator("org.a"));
    client.coordinatorDidCompleteSuccessfully(coordinator("org.b", Error("X", 7)));
    client.coordinatorDidCompleteSuccessfully(coordinator(std::nullopt));
    client.applicationInstallsDidCancel({});
    client.coordinatorShouldPrioritize(coordinator(std::nullopt));
    client.coordinatorCanceledWithReason(coordinator(std::nullopt), Error("X", 1), 3);
    client.coordinatorCanceledWithReason(coordinator("org.a"), Error("X", 1), 3);
    client.coordinatorCanceledWithReason(coordinator("org.a"), Error("X", 1), 0);
    client.coordinatorShouldPrioritize(coordinator("org.a"));
  });
  EXPECT_EQ(world.todo(), "org.a=INSTALLED");
  EXPECT_FALSE(world.exists("/var/mobile/Library/ApplicationSync/RestoreState.plist"));
  using enum DovelDeviceService::Operation;
  world.instruments().setLacking(PrioritizeAsset, true);
  world.instruments().setLacking(CancelAssetTransferForFailedAsset, true);
  all += "# the daemon's service lacks both operations\n" + world.transcript([&] {
    client.coordinatorShouldPrioritize(coordinator("org.a"));
    client.coordinatorCanceledWithReason(coordinator("org.c"), Error("X", 1), 3);
  });
  world.settle();
  expectTranscript("callbacks", all);
}

// A person cancels; the set that remembers it lives until the transfers end, and then starts anew.
TEST(Callbacks, ACancellationIsPassedOnOnceASync) {
  World world;
  const auto cancel = [&] {
    return world.logLines([&] {
      world.client().coordinatorCanceledWithReason(world.instruments().makePhantomCoordinator("org.a", std::nullopt),
                                                   Error("X", 1), 0);
    });
  };
  EXPECT_NE(cancel().find("Cancelling asset sync for org.a"), std::string::npos);
  EXPECT_NE(cancel().find("already cancelled 1"), std::string::npos);
  world.client().assetTransferEndedWithSuccess(true);  // nothing outstanding: the set stays
  EXPECT_NE(cancel().find("already cancelled 1"), std::string::npos);
  world.client().assetTransferUpdatedProgress(world.asset("org.z"), 0.1);
  world.client().assetTransferEndedWithSuccess(true);
  EXPECT_NE(cancel().find("Cancelling asset sync for org.a"), std::string::npos);
}

// --- placeholders on disk, icons, order -----------------------------------------------------------------------------

TEST(PlaceholderApplications, DirectoriesAndIcons) {
  World world;
  AppsClient& client = world.client();
  const std::string path = client.placeholderAppPathForBundleIdentifier("org.a");
  EXPECT_TRUE(path.ends_with("/com.zelk.dovel.Apps/org.a.app")) << path;
  const FileAttributes mobile{.ownerAccountName = "mobile", .groupOwnerAccountName = "mobile"};
  std::uint64_t size = 99;
  const std::string all = world.transcript([&] {
    EXPECT_TRUE(client.createPlaceHolderPath(path, "org.a", mobile));
    EXPECT_TRUE(client.createPlaceHolderPath(path, "org.a", mobile));
    EXPECT_FALSE(client.writeIconData(std::nullopt, path + "/Icon.png", &size, "org.a", mobile));
    EXPECT_EQ(size, 99U);
    EXPECT_TRUE(client.writeIconData(Bytes{1, 2, 3}, path + "/Icon.png", &size, "org.a", mobile));
    EXPECT_EQ(size, 3U);
    EXPECT_TRUE(client.writeIconData(Bytes{}, path + "/Icon.png", &size, "org.a", mobile));
    EXPECT_EQ(size, 0U);
    EXPECT_FALSE(client.writeIconData(Bytes{1}, "/var/nowhere/Icon.png", nullptr, "org.a", mobile));
    EXPECT_FALSE(client.createPlaceHolderPath(path + "/Icon.png/x", "org.a", mobile));
  });
  world.seed(
      R"({"placeholders": [{"identifier": "org.p", "name": "P", "installType": 4}, {"identifier": "org.q", "name": "Q", "installType": 4}]})");
  int calls = 0;
  client._enumeratePlaceholdersWithBlock([&](const PellumApplicationProxy&, bool& stop) { stop = ++calls == 1; });
  EXPECT_EQ(calls, 1);
  expectTranscript("placeholder_applications", all);
}

TEST(HomeScreen, EachStepOfAnIconFailing) {
  World world;
  world.putApp("org.a", "{}");
  const std::string saveTo = "/var/mobile/icon.png";
  const Platform platform = world.instruments().platform();
  const auto make = [&](const std::optional<std::string>& path, const std::string& destination) {
    return AppsClient::_makeIconFromBundlePath(*platform.icons, *platform.files, ClientLog(*platform.log), path,
                                               destination);
  };
  const std::string bundle = std::string(kWorkArea) + "/org.a";
  std::string all = world.logLines([&] {
    EXPECT_FALSE(make(std::nullopt, saveTo));
    EXPECT_FALSE(make("", saveTo));
    EXPECT_FALSE(make("/var/mobile/none", saveTo));
    EXPECT_FALSE(make("/var/mobile", saveTo));  // a directory without an icon
    EXPECT_FALSE(make(bundle, "/var/nowhere/icon.png"));
    for (const char* fault : {"makePNGDestination", "finalize"}) {
      world.fault(std::string(fault) + "@1");
      EXPECT_FALSE(make(bundle, saveTo)) << fault;
    }
    EXPECT_FALSE(world.exists(saveTo));
    EXPECT_TRUE(make(bundle, saveTo));
  });
  EXPECT_TRUE(world.exists(saveTo));
  expectTranscript("icon_failures", all);
}

TEST(HomeScreen, OrdersByTheLayout) {
  World world;
  const Platform platform = world.instruments().platform();
  struct Case {
    const char* layout;
    const char* order;
  };
  const Case cases[] = {{R"(["org.c", "org.x", "org.a", "org.c"])", "c a b"},
                        {R"([])", "a b c"},
                        {R"({"odd": 1})", "a b c"},
                        {R"([7, "org.b"])", "b a c"}};
  for (const Case& each : cases) {
    ScriptedAnswers answers;
    answers.BrelmGetFlattenedIconState = [&] {
      return std::optional(serializePropertyList(plist(each.layout), PropertyListFormat::Binary, nullptr));
    };
    world.instruments().setAnswers(answers);
    PropertyList items = plist(R"({"org.a": {"n": "a"}, "org.b": {"n": "b"}, "org.c": {"n": "c"}})");
    std::string order;
    for (const auto& item :
         AppsClient::_orderTheItems(*platform.shell, *platform.files, ClientLog(*platform.log), items)) {
      order += (order.empty() ? "" : " ") + *item.find("n")->string();
    }
    EXPECT_EQ(order, each.order) << each.layout;
    EXPECT_EQ(items.count(), std::string(each.order) == "a b c" ? 3U : std::string(each.order) == "c a b" ? 1U : 2U);
  }
}

}  // namespace
}  // namespace appsync::test
