// How callbacks of the services reach the client, and what a phase of transfers leaves behind.
#include <thread>

#include "tests/support/world.h"
#include "transfer/in_progress_asset_query.h"

namespace appsync::test {
namespace {

constexpr char kPrefix[] = "com.zelk.kest.Dovel.AppSync|";
constexpr char kWorkArea[] = "/var/mobile/Library/ApplicationSync/TarvoStuff";
constexpr char kStaging[] = "/var/mobile/Media/PublicStaging/ApplicationSync";

// The messages in a text of log lines, one a line.
std::string messagesIn(const std::string& lines) {
  std::string messages;
  for (std::size_t at = lines.find(kPrefix); at != std::string::npos; at = lines.find(kPrefix, at)) {
    at += std::string(kPrefix).size();
    messages += lines.substr(at, lines.find('\n', at) + 1 - at);
  }
  return messages;
}

TEST(Relay, PassesEveryCallbackToItsOperation) {
  World world("com.zelk.datamigrator");
  const auto delegate = world.client().installObserverDelegate();
  const auto coordinator = world.instruments().makePhantomCoordinator("org.a", Error("X", 7));
  const std::pair<std::function<void()>, const char*> cases[] = {
      {[&] { delegate->coordinatorDidInstallPlaceholder(coordinator); },
       "coordinatorDidInstallPlaceholder for org.a with error X 7\n"
       "Ignoring notification from Ostrel about installing placeholder for org.a\n"},
      {[&] { delegate->coordinatorDidCompleteSuccessfully(coordinator); },
       "coordinatorDidCompleteSuccessfully for org.a with error X 7\n"},
      {[&] { delegate->coordinatorShouldPrioritize(coordinator); }, "Prioritize org.a\n"},
      {[&] { delegate->coordinatorCanceledWithReason(coordinator, Error("X", 1), 3); },
       "Cancelling asset sync for org.a\n"},
      {[&] { delegate->promiseDidBeginFulfillmentWithIdentifier(4); }, "promiseDidBeginFulfillmentWithIdentifier 4\n"}};
  for (const auto& [callback, expected] : cases) EXPECT_EQ(messagesIn(world.logLines(callback)), expected);
}

// Destruction waits for a callback that is on its way through the client, and hears of its end.
TEST(Relay, TheClientStaysUntilARunningCallbackHasLeft) {
  World world;
  std::atomic<bool> inside{false};
  std::atomic<bool> mayLeave{false};
  std::atomic<bool> left{false};
  ScriptedAnswers answers;
  answers.beforeCall = [&](const std::string& operation, const std::string&) {
    if (operation != "prioritizeAsset") return;
    inside = true;
    while (!mayLeave) std::this_thread::yield();
  };
  world.instruments().setAnswers(std::move(answers));
  const auto delegate = world.client().installObserverDelegate();
  std::thread callback([&] {
    delegate->coordinatorShouldPrioritize(world.instruments().makePhantomCoordinator("org.a", std::nullopt));
    left = true;
  });
  while (!inside) std::this_thread::yield();
  std::atomic<bool> destroyed{false};
  std::thread destroyer([&] {
    world.destroyClient();
    destroyed = true;
  });
  for (int i = 0; i < 2000; ++i) {
    EXPECT_FALSE(destroyed);
    std::this_thread::yield();
  }
  mayLeave = true;
  callback.join();
  destroyer.join();
  EXPECT_TRUE(left && destroyed);
}

TEST(TransferPhaseEnd, WhatWasHandedOverIsForgotten) {
  World world;
  world.seed(R"({"installed": [{"identifier": "org.up", "version": "1", "files": {"a": 1}}],
                 "todo": [{"identifier": "org.up", "operation": "install", "version": "2"}]})");
  ASSERT_EQ(world.client().outstandingAssetTransfers().size(), 1U);
  world.settle();
  const auto progress = [&] {
    return world.transcript([&] { world.client().assetTransferUpdatedProgress(world.asset("org.up"), 0.5); });
  };
  EXPECT_NE(progress().find("updating org.up"), std::string::npos);
  EXPECT_NE(messagesIn(world.logLines([&] {
              world.client().assetTransferEndedWithSuccess(false);
            })).find("Cancelling coordinator"),
            std::string::npos);
  world.settle();
  EXPECT_EQ(messagesIn(world.logLines([&] { world.client().assetTransferEndedWithSuccess(true); })),
            "asset transfer ended withsuccess: y\nNotifying Brelm we are done syncing\n");
  EXPECT_NE(progress().find("initiating org.up"), std::string::npos) << "an update of the phase before";
  world.client().assetTransferEndedWithSuccess(true);
  EXPECT_EQ(world.logLines([&] { world.destroyClient(); }).find("outstanding"), std::string::npos);
}

TEST(Reconcile, AListWithoutRemovalsPerformsNone) {
  World world;
  world.put(std::string(kStaging) + "/ApplicationsSync.plist",
            plist(R"([{"identifier": "org.a", "operation": "install"}, {"identifier": "org.b"}, {}])"));
  const std::string lines =
      world.logLines([&] { EXPECT_TRUE(world.client().reconcileSync(1, "a", nullptr, nullptr)); });
  EXPECT_EQ(lines.find("performing"), std::string::npos) << lines;
  EXPECT_TRUE(world.exists(std::string(kWorkArea) + "/ApplicationsSync.plist"));
}

// What an earlier query has answered must not pass for this one's answer.
TEST(InProgress, WithoutAReportNothingIsAnswered) {
  World world;
  world.fault("reportInstalls");
  const Platform platform = world.instruments().platform();
  std::optional<InProgressAssetQuery::Identifiers> inProgress{{"org.old"}};
  std::optional<InProgressAssetQuery::Identifiers> restoring{{"org.old"}};
  InProgressAssetQuery::currentInProgressAssetIDs(*platform.defaultWorkspace, *platform.waiting,
                                                  ClientLog(*platform.log), inProgress, restoring);
  EXPECT_FALSE(inProgress || restoring);
}

}  // namespace
}  // namespace appsync::test
