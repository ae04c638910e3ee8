// Scripts of single calls: that each reaches the client with its arguments, and what is refused beforehand.
#include "tests/support/program.h"

namespace appsync {
namespace {

using namespace test;

using PlayTest = ProgramTest;

TEST_F(PlayTest, EveryCallReachesTheClientWithItsArguments) {
  struct Case {
    const char* step;
    const char* result;
    Texts logged;  // first lines of the client
  };
  const std::vector<Case> cases{
      {R"("supportedDataclasses")", R"(["Application"])", {}},
      {R"("currentSyncAnchor")", R"("NO_APP_SYNC_ANCHOR")", {}},
      {R"("prepareForSyncWithHostAnchor", "hostAnchor": "x")", "true", {}},
      {R"("installedAssets")",
       R"({"_Deleted":[{"TefBundleIdentifier":"org.gone"}]})",
       {"getting installed assets", "org.gone not installed, and no todo (found=0 pi=0 failed=0) Marking as deleted"}},
      {R"("installedAssetMetrics")",
       R"({"_Count":1,"_PhysicalSize":90000,"_PurgeableSize":0})",
       {"found 1 apps using 90000 bytes (0 purgeable)"}},
      {R"("disabledAssetTypes")", "null", {}},
      {R"("assetInstallSucceeded", "asset": {"identifier": "org.b"})", "null", {"org.b install succeeded"}},
      {R"("assetInstallFailed", "asset": {"identifier": "org.b", "isRestore": 1}, "error": {"domain": "D", "code": -5})",
       "null",
       {"Ostrel is enabled - treating error D -5 as non recoverable",
        "org.b install failed but was recoverable: D -5"}},
      {R"("assetInstallFailed", "asset": {"identifier": "org.b", "isRestore": 1}, "error": null)",
       "null",
       {"Ostrel is enabled - treating error (null) as non recoverable",
        "org.b install failed but was recoverable: (null)"}},
      {R"("assetTransferUpdatedProgress", "asset": {"identifier": "org.c", "downloadProgress": 0.25,
          "installProgress": 0.75}, "progress": 0.5)",
       "null",
       {"finished transferring 0.500000 for org.c", "Ostrel returned initiating coordinator"}},
      {R"("assetTransferUpdatedProgress", "asset": {"identifier": "org.open", "downloadProgress": 0.25,
          "installProgress": 0.75})",
       "null",
       {"finished transferring 0.000000 for org.open", "Created initiating coordinator",
        "Updating download progress: 0.250000 install progress:0.750000 for org.open"}},
      {R"("assetTransferSucceeded", "asset": {"identifier": "org.d", "path": "a/../b"})",
       "null",
       {"transfer for asset", "asset transfer succeeded for org.d", "Ignoring invalid path:"}},
      {R"("assetTransferSucceeded", "asset": {"identifier": "org.d", "path": "/p", "isDownload": false})",
       "null",
       {"transfer for asset", "asset transfer succeeded for org.d"}},
      {R"("assetTransferSucceeded", "asset": {"identifier": "org.d", "path": "/p", "isRestore": true,
          "completedAssetParts": 2})",
       "null",
       {"transfer for asset", "asset transfer succeeded for org.d", "Received file at /p",
        "Not processing kDovelAssetPartApplicationData for restore asset"}},
      {R"("assetTransferSucceeded", "asset": {"identifier": "org.kept", "version": "2"})",
       "null",
       {"transfer for asset", "asset transfer succeeded for org.kept", "Received file at /var/kept.ipa"}},
      {R"("assetTransferSucceeded", "asset": {"identifier": "org.d", "prettyName": "D"}, "succeeded": false,
          "error": {"domain": "D", "code": 6})",
       "null",
       {"transfer for asset", "Ostrel is enabled - treating error D 6 as non recoverable",
        "failed to transfer asset org.d. err=D 6, recoverable=0"}},
      {R"("coordinatorDidInstallPlaceholder", "identifier": "org.a", "error": {"domain": "D", "code": 1, "text": "why"})",
       "null",
       {"coordinatorDidInstallPlaceholder for org.a with error D 1: why"}},
      {R"("coordinatorDidCompleteSuccessfully", "identifier": null)",
       "null",
       {"coordinatorDidCompleteSuccessfully for (null) with error (null)"}},
      {R"("coordinatorCanceledWithReason", "identifier": "org.a", "reason": {"domain": "D", "code": 3}, "client": 1)",
       "null",
       {"Cancelling asset sync for org.a"}},
      {R"("coordinatorCanceledWithReason", "identifier": "org.a")", "null", {"Cancelling asset sync for org.a"}},
      {R"("applicationInstallsDidCancel", "identifier": "org.a")",
       "null",
       {"not handling applicationInstallsDidCancel because install coordination is enabled."}},
      {R"("promiseDidBeginFulfillmentWithIdentifier", "number": 9)",
       "null",
       {"promiseDidBeginFulfillmentWithIdentifier 9"}},
      {R"("assetTransferEndedWithSuccess", "success": false)", "null", {"asset transfer ended withsuccess: n"}},
      {R"("assetTransferEndedWithSuccess")", "null", {"asset transfer ended withsuccess: y"}},
      {R"("syncEndedWithSuccess", "success": false)", "null", {"sync ended with success: n"}},
      {R"("syncEndedWithSuccess")", "null", {"sync ended with success: y"}},
      {R"("clearSyncData")", "null", {"blasting work area"}},
  };
  std::string state = R"({"installed": [{"identifier": "org.a", "size": 90000}], "lastSync": ["org.gone"], "todo": [],
      "restoreState": {"org.kept": {"2": {"path": "/var/kept.ipa"}}},
      "coordinators": [{"identifier": "org.c", "kind": "initiating", "creator": 1},
                       {"identifier": "org.open", "kind": "initiating", "creator": 3, "assetPromise": "open"}]})";
  for (const Case& one : cases) {
    SCOPED_TRACE(one.step);
    if (!state.empty()) seed(std::exchange(state, ""));
    const Outcome run = play(std::string(R"({"steps": [{"do": )") + one.step + "}]}", {"--json", "--log", at("log")});
    EXPECT_EQ(run.status, 0) << run.err;
    EXPECT_EQ(run.json()["steps"][0]["result"].dump(), one.result);
    const Texts messages = messagesOf(contentOf(at("log")));
    ASSERT_GE(messages.size(), one.logged.size()) << testing::PrintToString(messages);
    std::size_t next = 0;
    for (const std::string& message : messages) {
      if (next < one.logged.size() && message.starts_with(one.logged[next])) ++next;
    }
    EXPECT_EQ(next, one.logged.size()) << testing::PrintToString(messages);
  }
}

// The sync type and the hosting process belong to the script; steps are told as they are done.
TEST_F(PlayTest, AScriptSaysWhoHostsAndShowsWhatItDoes) {
  const Outcome run = play(R"({"host": "com.zelk.datamigrator", "steps": [{"do": "currentSyncAnchor"},
      {"do": "prepareForSyncWithHostAnchor", "givenError": {"domain": "G", "code": 2, "text": "given"}},
      {"do": "coordinatorDidInstallPlaceholder", "identifier": "org.a"}, {"do": "startupComplete"}]})",
                           {"--log", at("log")});
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(run.out,
            "currentSyncAnchor: \"NO_APP_SYNC_ANCHOR\"\nprepareForSyncWithHostAnchor: true, error G 2: given\n"
            "coordinatorDidInstallPlaceholder\nstartupComplete\n");
  const Texts messages = messagesOf(contentOf(at("log")));
  EXPECT_NE(std::find(messages.begin(), messages.end(),
                      "Ignoring notification from Ostrel about installing placeholder for org.a"),
            messages.end())
      << "only in a restore's process does anybody wait for placeholders";
}

TEST_F(PlayTest, WorldsAndCallsGoTogether) {
  const std::string host = sampleHost("host", 1, 1);
  const Outcome run = play(R"({"steps": [{"do": "stage", "host": "host"}, {"do": "reconcileSync", "type": 1},
      {"do": "fault", "spec": "setInstallOptions@1"}, {"do": "outstandingAssetTransfers"},
      {"do": "outstandingAssetTransfers"}]})");
  EXPECT_EQ(run.status, 0) << run.err;
  const Json steps = run.json()["steps"];
  EXPECT_EQ(steps[3]["result"].size(), 0U);
  EXPECT_EQ(steps[4]["result"].size(), 0U) << "what has failed is not asked for again";
  EXPECT_EQ(entryOf(status()["todo"], "org.sample.notes")["operation"], "FAILED");
  const Outcome none = play(R"({"steps": [{"do": "currentSyncAnchor"}, {"do": "stage", "host": "none"}]})");
  EXPECT_EQ(none.status, 3);
  EXPECT_EQ(none.json()["error"]["code"], "host-unusable");
  EXPECT_NE(none.err.find("step 2 of the script: "), std::string::npos) << none.err;
}

TEST_F(PlayTest, WhatAnArgumentMayBe) {
  const std::pair<const char*, const char*> bad[] = {
      {R"({"do": 5})", "\"do\" that must be a text"},
      {R"({"do": "reconcileSync", "type": -2147483649})", "at most 32 bits"},
      {R"({"do": "reconcileSync", "type": 1.5})", "at most 32 bits"},
      {R"({"do": "reconcileSync", "type": -1})", "below 0"},
      {R"({"do": "reconcileRestoreOfType", "type": 2147483648})", "larger than a signed number"},
      {R"({"do": "reconcileSync", "type": 18446744073709551615})", "at most 32 bits"},
      {R"({"do": "reconcileSync", "newAnchor": null})", "\"newAnchor\" that must be a text"},
      {R"({"do": "syncEndedWithSuccess", "success": 1})", "must be true or false"},
      {R"({"do": "reconcileSync", "givenError": 5})", "must be an object with \"domain\" and \"code\", or null"},
      {R"({"do": "reconcileSync", "givenError": {"domain": 1, "code": 1}})", "needs a text \"domain\""},
      {R"({"do": "reconcileSync", "givenError": {"code": 1}})", "needs a text \"domain\""},
      {R"({"do": "reconcileSync", "givenError": {"domain": "D", "code": "1"}})", "needs an integer \"code\""},
      {R"({"do": "reconcileSync", "givenError": {"domain": "D", "code": 9223372036854775808}})", "needs an integer"},
      {R"({"do": "reconcileSync", "givenError": {"domain": "D", "code": 1, "text": 1}})", "a \"text\" that is none"},
      {R"({"do": "reconcileSync", "givenError": {"domain": "D", "code": 1, "x": 1}})", "unknown member \"x\""},
      {R"({"do": "assetInstallSucceeded", "asset": 5})", "\"asset\" that"},
      {R"({"do": "assetInstallSucceeded", "asset": {"identifier": "a", "nonsense": 1}})", "unknown member"},
      {R"({"do": "assetInstallSucceeded", "asset": {"identifier": null}})", "must be a text"},
      {R"({"do": "assetInstallSucceeded", "asset": {"identifier": "a", "variantOptions": []}})", "must be an object"},
      {R"({"do": "assetInstallSucceeded", "asset": {"identifier": "a", "isRestore": "yes"}})", "true or false"},
      {R"({"do": "assetInstallSucceeded", "asset": {"identifier": "a", "storePID": 1.5}})", "at most 64 bits"},
      {R"({"do": "assetInstallSucceeded", "asset": {"identifier": "a", "downloadProgress": "1"}})", "be a number"},
      {R"({"do": "coordinatorShouldPrioritize"})", "needs \"identifier\""},
      {R"({"do": "push", "file": "x"})", "needs \"to\""},
      {R"({"do": "clearSyncData", "success": true})", "does not take \"success\""},
      {R"({"do": "lack", "operation": 5})", "cancelAssetTransferForFailedAsset"},
      {R"({"do": "fault", "spec": 5})", "must be a text"},
      {R"({"identifier": "a"})", "an object with \"do\""},
      {R"("clearSyncData")", "an object with \"do\""},
  };
  for (const auto& [step, expected] : bad) {
    const Outcome run = play(std::string(R"({"steps": [{"do": "settle"}, )") + step + "]}", {"--json"});
    EXPECT_EQ(run.status, 3) << step;
    EXPECT_EQ(run.json()["error"]["code"], "script-refused") << run.out;
    const std::string message = run.json()["error"]["message"];
    EXPECT_NE(message.find("cannot be played: step 2 "), std::string::npos) << message;
    EXPECT_NE(message.find(expected), std::string::npos) << message;
  }
  const std::pair<const char*, const char*> documents[] = {{R"({"host": 5, "steps": []})", "identifier of a process"},
                                                           {R"({"host": "x"})", "an array \"steps\""}};
  for (const auto& [document, expected] : documents) {
    EXPECT_NE(play(document, {}).err.find(expected), std::string::npos) << document;
  }
  // All that an asset may have; and that everything checked before can be done.
  EXPECT_EQ(play(R"({"steps": [{"do": "assetInstallSucceeded", "asset": {"identifier": "a", "dataclass": "X",
      "prettyName": null, "assetType": "t", "icon": "/i", "isRestore": 0, "variantOptions": {"a": {"$uid": 1}},
      "version": 5, "storePlist": "/s", "infoPlist": "/i", "storePID": -9223372036854775808, "path": null,
      "isDownload": true, "completedAssetParts": 4294967295, "downloadProgress": 1, "installProgress": 0.5}},
      {"do": "reconcileSync", "type": 4294967295, "noErrorOut": true, "givenError": null}]})")
                .status,
            0);
}

}  // namespace
}  // namespace appsync
