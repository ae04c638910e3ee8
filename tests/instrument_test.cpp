#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "embedded/coordination.h"
#include "embedded/device.h"
#include "instrument/faults.h"
#include "instrument/instruments.h"
#include "platform/brelm.h"
#include "platform/device_policy.h"
#include "platform/install_transaction_log.h"
#include "platform/notifications.h"
#include "platform/vaultry.h"
#include "tests/ostrel_contract.h"

namespace appsync {

namespace {

using Lines = std::vector<std::string>;

class QuickDisk : public Disk {
 public:
  int fsync(int /*file*/) override { return 0; }
};

// An embedded device behind instruments, which stand behind a second row of instruments: what the first row does to
// the bare services shows in the second's record.
class InstrumentedDevice : public ContractDevice {
 public:
  InstrumentedDevice() {
    DeviceOptions options;
    options.directory = _directory;
    options.timeRunsFast = true;
    options.disk = &_disk;
    options.executor = [this] {
      auto made = makeThreadExecutor(2);
      _executor = made.get();
      return made;
    };
    _device = Device::open(options, nullptr);
    behind = std::make_unique<Instruments>(_device->platform(),
                                           InstrumentOptions{.recording = true, .reachedTextsFile = {}});
    instruments = std::make_unique<Instruments>(
        behind->platform(), InstrumentOptions{.recording = true, .reachedTextsFile = _directory + "/texts"});
    _device->startWork();
  }
  ~InstrumentedDevice() override {
    instruments->dropHeldEvents();
    _device->drain();
    instruments.reset();
    behind.reset();
    _device.reset();
    std::filesystem::remove_all(_directory);
  }

  Platform platform() override { return instruments->platform(); }
  void settle() override { _executor->drain(); }
  std::string reachedTexts() {
    std::ifstream file(_directory + "/texts");
    return {std::istreambuf_iterator<char>(file), {}};
  }

  std::unique_ptr<Instruments> behind;
  std::unique_ptr<Instruments> instruments;

 private:
  static std::string freshDirectory() {
    std::string name = testing::TempDir() + "instrument-XXXXXX";
    return ::mkdtemp(name.data());
  }

  const std::string _directory = freshDirectory();
  QuickDisk _disk;
  std::unique_ptr<Device> _device;
  Executor* _executor = nullptr;
};

INSTANTIATE_TEST_SUITE_P(Instrumented, OstrelContract,
                         testing::Values(MakeContractDevice([] { return std::make_unique<InstrumentedDevice>(); })));

class ReportObserver : public PellumApplicationWorkspaceObserver {
 public:
  void applicationInstallsArePrioritized(const PellumApplicationProxies& /*prioritized*/,
                                         const PellumApplicationProxies& /*arePaused*/) override {
    ++reports;
  }
  std::atomic<int> reports = 0;
};

// Every operation that can fail at least once, and what stands around them.
void callEverything(InstrumentedDevice& device) {
  const Platform platform = device.platform();
  FileManager& files = *platform.files;
  files.createDirectory("/var/mobile/org.a", true, {"mobile", std::nullopt}, nullptr);
  files.createFile("/var/mobile/org.a/x", Bytes(3), {});
  files.writeFile("/var/mobile/org.a/x", Bytes(5), nullptr);
  files.readFile("/var/mobile/org.a/x", nullptr);
  files.copyItem("/var/mobile/org.a/x", "/var/mobile/org.a/y", nullptr);
  files.moveItem("/var/mobile/org.a/y", "/var/mobile/org.a/z", nullptr);
  files.attributesOfItem("/var/mobile/org.a/z", nullptr);
  files.utimes("/var/mobile/org.a/z");
  files.removeItem("/var/mobile/org.a/z", nullptr);
  platform.log->DovelGetLogCategory(8)->write(LogLevel::Error, "Error %d", "AppSync: Error 1");
  platform.transactionLog->logStep(3, 1, 2, true, "org.a", "Create coordinator");

  OstrelService& service = *platform.coordination;
  const auto coordinator = OstrelRestoringAppInstallCoordinator::coordinatorForAppWithBundleID(
      service, "org.a", OstrelClientDovel, true, nullptr, nullptr);
  const auto promise = OstrelPromisedTransferToPath::initWithName(service, "org.a-Asset", OstrelClientDovel, {}, 0);
  const auto placeholder =
      OstrelPlaceholder::initAppPlaceholderWithBundleName(service, "Name", "org.a", 2, OstrelClientDovel);
  if (coordinator && placeholder && promise) {
    coordinator.setInstallOptions({}, nullptr);
    coordinator.setInitialVeylAssetPromises({}, nullptr);
    coordinator.setAppAssetPromise(promise, nullptr);
    coordinator.appAssetPromiseWithError(nullptr);
    coordinator.setAppAssetPromiseResponsibleClient(OstrelClientMerc, nullptr);
    coordinator.appAssetPromiseResponsibleClientWithError(nullptr);
    coordinator.setUserDataPromise(
        OstrelPromisedOutOfBandTransfer::initWithName(service, "org.a-UserData", OstrelClientDovel, 0), nullptr);
    placeholder.setIconPromise(
        OstrelPromisedTransferToPath::initWithName(service, "org.a-Icon", OstrelClientDovel, {}, 9), nullptr);
    placeholder.setPlaceholderAttributes({}, nullptr);
    placeholder.setMetadata(std::nullopt, nullptr);
    placeholder.setConfigurationCompleteWithError(nullptr);
    coordinator.setPlaceholderPromise(placeholder, nullptr);
    coordinator.hasUserDataPromise();
    coordinator.cancelForReason(Error("E", 7), OstrelClientDovel, nullptr);
  }
  service.uninstallApp("org.b", false, {});
  platform.sharedInstance->prioritizeAsset(DovelAsset::downloadAssetWithIdentifier("org.b", "Application", {}), {});

  platform.defaultWorkspace->uninstallApplication("org.b", nullptr);
  platform.installer->KilnLookupUninstalled();
  platform.installer->KilnClearUninstalled({"org.a", "org.b"});
  platform.backup->makeVaultryManager()->dovelShouldCreateAppPlaceholdersWithError(nullptr);
  platform.sharedConnection->effectiveBoolValueForSetting(TessaFeatureAppRemovalAllowed);
  platform.shell->BrelmSetIconState({}, nullptr, 0);
  platform.shell->BrelmGetFlattenedIconState({}, kBrelmIconStateFlattened);
  if (const auto bundle = platform.icons->bundleWithURL(*FileURL::fileURLWithPath("/var/mobile/org.a", true))) {
    platform.icons->GlintCreateDeviceAppropriateHomeScreenIconImageFromBundle(*bundle);
  }
  Bytes buffer;
  if (const auto destination = platform.icons->makePNGDestination(buffer)) {
    destination->addImage({1, 1, Bytes(4)});
    destination->finalize();
  }
  int token = 0;
  platform.notifications->registerCheck("org.note", token);
}

TEST(InstrumentTest, TheRecordNamesEveryCallItsObjectsAndItsResult) {
  InstrumentedDevice device;
  ASSERT_TRUE(device.instruments->addFault("uninstallApplication", nullptr));
  callEverything(device);
  device.settle();
  Recorder::Selection own;
  own.thread = std::this_thread::get_id();
  EXPECT_EQ(device.instruments->recorder().transcript(own),
            R"(createDirectory /var/mobile/org.a intermediate=1 as mobile:- -> ok
createFile /var/mobile/org.a/x 3 bytes as -:- -> ok
writeFile /var/mobile/org.a/x 5 bytes -> ok
readFile /var/mobile/org.a/x -> 5 bytes
copyItem /var/mobile/org.a/x to /var/mobile/org.a/y -> ok
moveItem /var/mobile/org.a/y to /var/mobile/org.a/z -> ok
attributesOfItem /var/mobile/org.a/z -> 5 bytes
utimes /var/mobile/org.a/z -> 0
removeItem /var/mobile/org.a/z -> ok
log 8 error: AppSync: Error 1
transaction step=3 party=1 phase=2 success=1 bundle=org.a description=Create coordinator
coordinatorForAppWithBundleID restoring org.a client=3 create=1 -> coordinator(org.a)
initWithName to-path org.a-Asset client=3 path=none space=0 -> promise(org.a-Asset)
initAppPlaceholderWithBundleName Name org.a installType=2 client=3 -> placeholder(org.a)
setInstallOptions coordinator(org.a) installType=0 target=0 metadata=none -> ok
setInitialVeylAssetPromises coordinator(org.a) count=0 -> ok
setAppAssetPromise coordinator(org.a) promise(org.a-Asset) -> ok
appAssetPromiseWithError coordinator(org.a) -> promise(org.a-Asset)
release promise(org.a-Asset)
setAppAssetPromiseResponsibleClient coordinator(org.a) client=1 -> ok
appAssetPromiseResponsibleClientWithError coordinator(org.a) -> 1
initWithName out-of-band org.a-UserData client=3 path=none space=0 -> promise(org.a-UserData)
setUserDataPromise coordinator(org.a) promise(org.a-UserData) -> ok
release promise(org.a-UserData)
initWithName to-path org.a-Icon client=3 path=none space=9 -> promise(org.a-Icon)
setIconPromise placeholder(org.a) promise(org.a-Icon) -> ok
release promise(org.a-Icon)
setPlaceholderAttributes placeholder(org.a) version=none launchProhibited=0 info=none -> ok
setMetadata placeholder(org.a) none -> ok
setConfigurationCompleteWithError placeholder(org.a) -> ok
setPlaceholderPromise coordinator(org.a) placeholder(org.a) -> ok
hasUserDataPromise coordinator(org.a) -> yes
cancelForReason coordinator(org.a) client=3 E 7 -> ok
uninstallAppWithBundleID org.b confirm=0
prioritizeAsset org.b
uninstallApplication org.b -> failed: FaultError 1: uninstallApplication was made to fail
KilnLookupUninstalled -> {}
KilnClearUninstalled [org.a, org.b] -> 0
makeVaultryManager -> ok
dovelShouldCreateAppPlaceholdersWithError -> ok
effectiveBoolValueForSetting AppRemovalAllowed -> not set
BrelmSetIconState 0 bytes -> 1
BrelmGetFlattenedIconState format=1 -> 42 bytes
bundleWithURL /var/mobile/org.a -> /var/mobile/org.a
GlintCreateDeviceAppropriateHomeScreenIconImageFromBundle /var/mobile/org.a -> none
makePNGDestination -> ok
addImage 1x1
finalize -> ok
registerCheck org.note -> 0
release placeholder(org.a)
release promise(org.a-Asset)
release coordinator(org.a)
)");
  EXPECT_EQ(device.reachedTexts(), "8\terror\tError %d\n");
  EXPECT_EQ(device.instruments->recorder().setOfFormats(),
            (std::set<Recorder::Format>{{"8", LogLevel::Error, "Error %d"}}));
  own.services = {InstrumentedService::TransactionLog};
  EXPECT_EQ(device.instruments->recorder().lines(own).size(), 1U);
}

// A wrapper that asks for another operation's fault, or that fails without a sign, is found here.
TEST(InstrumentTest, EveryOperationOfTheTableFailsWhenMadeToAndDoesNotReachTheService) {
  InstrumentedDevice device;
  for (const OperationInfo& operation : Instruments::operations()) {
    if (operation.service == InstrumentedService::Host || operation.name == "reportInstalls") continue;
    const std::string name(operation.name);
    device.instruments->clearFaults();
    for (auto& each : {device.instruments.get(), device.behind.get()}) each->recorder().clear();
    ASSERT_TRUE(device.instruments->addFault(name, nullptr));
    callEverything(device);
    device.settle();
    std::size_t failures = 0;
    for (const std::string& line : device.instruments->recorder().lines()) {
      if (!line.starts_with(name + " ") && !line.starts_with("<- " + name + " ")) continue;
      if (line.ends_with(": FaultError 1: " + name + " was made to fail") || line.ends_with("-> 5")) ++failures;
    }
    EXPECT_GT(failures, 0U) << name;
    for (const std::string& line : device.behind->recorder().lines()) {
      EXPECT_FALSE(line.starts_with(name + " ") || line == name) << line;
    }
  }
}

TEST(InstrumentTest, TheTableHasEveryFaultThatIsPromised) {
  const char* promised[] = {"setInstallOptions",
                            "setPlaceholderPromise",
                            "setConfigurationCompleteWithError",
                            "coordinatorForAppWithBundleID",
                            "initAppPlaceholderWithBundleName",
                            "initWithName",
                            "uninstallAppWithBundleID",
                            "KilnLookupUninstalled",
                            "BrelmGetFlattenedIconState",
                            "uninstallApplication",
                            "registerCheck",
                            "reportInstalls",
                            "createDirectory",
                            "removeItem",
                            "moveItem",
                            "copyItem",
                            "readFile",
                            "writeFile",
                            "createFile",
                            "attributesOfItem",
                            "utimes",
                            "install",
                            "transfer",
                            "stall"};
  for (const char* name : promised) {
    EXPECT_TRUE(std::ranges::any_of(Instruments::operations(), [&](auto& each) { return each.name == name; })) << name;
  }
  std::set<std::string_view> names;
  for (const OperationInfo& operation : kOperations) EXPECT_TRUE(names.insert(operation.name).second) << operation.name;
  EXPECT_TRUE(std::ranges::is_partitioned(kOperations, &OperationInfo::canFail));
}

TEST(FaultsTest, AFaultHitsTheCallsThatItNames) {
  const std::vector<std::string> both{"org.a", "org.b"};
  const std::vector<Subject> calls{
      Subject::none(),
      Subject::application("org.a"),
      Subject::application("org.ab"),
      Subject::applications(both),
      Subject::path("/x/org.a"),
      Subject::path("/x/org.a.png"),
      Subject::paths("/y", "/x/org.a.ipa/z"),
      Subject::path("/x/org.a.plist"),
      Subject::path("/x/zorg.a/"),
      Subject::application("org.a"),
  };
  const std::pair<const char*, const char*> cases[] = {
      {"moveItem", "xxxxxxxxxx"},    {"moveItem=org.a", ".x.xxxx..x"}, {"moveItem=org.a@2", "...x......"},
      {"moveItem@10", ".........x"}, {"moveItem@11", ".........."},    {"moveItem=org.b", "...x......"},
      {"copyItem", ".........."},
  };
  for (const auto& [spec, expected] : cases) {
    Faults faults;
    ASSERT_TRUE(faults.add(spec, false, std::nullopt, nullptr));
    std::string hits;
    for (const Subject& call : calls) hits += faults.strike("moveItem", call) ? 'x' : '.';
    EXPECT_EQ(hits, expected) << spec;
  }
}

TEST(FaultsTest, ASpecThatMeansNothingIsRefusedWithWhatWouldMendIt) {
  const std::pair<const char*, const char*> cases[] = {
      {"moveitem", "`dovel faults`"}, {"", "`dovel faults`"},       {"=org.a", "`dovel faults`"},
      {"moveItem=", "identifier"},    {"moveItem@", "from 1 on"},   {"moveItem@0", "from 1 on"},
      {"moveItem@1x", "from 1 on"},   {"moveItem@-1", "from 1 on"}, {"moveItem@99999999999999999999", "from 1 on"},
      {"moveItem=org.a@", "from 1"},  {"fileExists", "can fail"},   {"registerCheck=org.a", "no single application"},
  };
  for (const auto& [spec, hint] : cases) {
    Faults faults;
    std::optional<Error> error;
    EXPECT_FALSE(faults.add(spec, false, std::nullopt, &error)) << spec;
    ASSERT_TRUE(error) << spec;
    EXPECT_NE(error->text().find(hint), std::string::npos) << error->text();
  }
}

// How often the bare service has given a coordinator away, and how often it got it back.
std::pair<std::ptrdiff_t, std::ptrdiff_t> holdsOnCoordinators(Instruments& behind) {
  const Lines lines = behind.recorder().lines();
  const auto given = std::ranges::count_if(lines, [](const std::string& line) {
    return line.ends_with("-> coordinator(org.a)") ||
           (line.starts_with("<- ") && line.find(" coordinator(org.a)") != std::string::npos);
  });
  return {given, std::ranges::count(lines, "release coordinator(org.a)")};
}

TEST(InstrumentTest, EventsComeOnceTwiceLateOrNeverAndNoHoldIsLost) {
  const std::pair<EventFate, Lines> cases[] = {
      {EventFate::Deliver, {"begins 2", "placeholder org.a", "begins 1", "installed org.a"}},
      {EventFate::Double, {"begins 2", "placeholder org.a", "placeholder org.a", "begins 1", "installed org.a"}},
      {EventFate::Hold, {"begins 2", "placeholder org.a", "begins 1", "installed org.a"}},
      {EventFate::Lose, {"begins 2", "begins 1", "installed org.a"}},
  };
  for (const auto& [fate, expected] : cases) {
    InstrumentedDevice device;
    ScriptedAnswers answers;
    answers.event = [fate = fate](const std::string& event, const std::string& bundleID) {
      return event == "coordinatorDidInstallPlaceholder" && bundleID == "org.a" ? fate : EventFate::Deliver;
    };
    device.instruments->setAnswers(std::move(answers));
    const auto heard = std::make_shared<HearingObserver>();
    heard->whenHeard = [](const OstrelAppInstallCoordinator& coordinator) { coordinator.creatorIdentifier(); };
    ContractClient client(device.platform());
    {
      const OstrelAppInstallObserver registration = OstrelAppInstallObserver::initWithMachServiceName(
          *device.platform().coordination, "service", {OstrelClientDovel}, heard);
      ASSERT_TRUE(client.prepare(OstrelCoordinatorKind::Initiating, "org.a"));
      device.settle();
      const std::size_t before = heard->lines().size();
      EXPECT_EQ(device.instruments->releaseHeldEvents(), fate == EventFate::Hold ? 1U : 0U);
      EXPECT_EQ(heard->lines().size(), before + (fate == EventFate::Hold ? 1U : 0U));
      ASSERT_TRUE(client.deliver("org.a", client.putPackage("org.a", "1")));
      device.settle();
      EXPECT_EQ(heard->lines(), expected);
    }
    const auto [given, released] = holdsOnCoordinators(*device.behind);
    EXPECT_GT(given, 2);
    EXPECT_EQ(given, released);
    const Lines asked = device.instruments->recorder().lines();
    EXPECT_EQ(std::ranges::count(asked, "creatorIdentifier coordinator(org.a) -> 3"),
              std::ranges::count_if(expected, [](auto& line) { return line.ends_with("org.a"); }))
        << "calls on the handle of an event must pass the instruments";
  }
}

TEST(InstrumentTest, ALateEventDoesNotReachAnObserverThatHasGone) {
  InstrumentedDevice device;
  ScriptedAnswers answers;
  answers.event = [](const std::string&, const std::string&) { return EventFate::Hold; };
  device.instruments->setAnswers(std::move(answers));
  const Platform platform = device.platform();
  const auto heard = std::make_shared<HearingObserver>();
  const auto reports = std::make_shared<ReportObserver>();
  int notified = 0;
  const auto word = std::shared_ptr<void>(&notified, [](void*) {});
  platform.notificationCenter->addObserver(
      word, [](NotificationCenter*, void* count, auto&, auto*, auto*) { ++*static_cast<int*>(count); }, "org.note",
      NotificationSuspension::Drop);
  platform.defaultWorkspace->addObserver(reports);
  ContractClient client(platform);
  auto registration =
      OstrelAppInstallObserver::initWithMachServiceName(*platform.coordination, "service", {OstrelClientDovel}, heard);
  ASSERT_TRUE(client.prepare(OstrelCoordinatorKind::Initiating, "org.a"));
  platform.notifications->post("org.note");
  device.settle();
  registration = {};
  platform.defaultWorkspace->removeObserver(reports);
  platform.notificationCenter->removeObserver(word, "org.note");
  EXPECT_EQ(device.instruments->releaseHeldEvents(), 0U);
  EXPECT_EQ(heard->lines(), Lines{});
  EXPECT_EQ(reports->reports + notified, 0);
}

TEST(InstrumentTest, TheReportOfInstallsCanBeWithheldFromOneObserver) {
  InstrumentedDevice device;
  ASSERT_TRUE(device.instruments->addFault("reportInstalls@2", nullptr));
  const auto first = std::make_shared<ReportObserver>();
  const auto second = std::make_shared<ReportObserver>();
  for (const auto& observer : {first, second}) device.platform().defaultWorkspace->addObserver(observer);
  device.settle();
  EXPECT_EQ(first->reports, 1);
  EXPECT_EQ(second->reports, 0);
  for (const auto& observer : {first, second}) device.platform().defaultWorkspace->removeObserver(observer);
}

TEST(InstrumentTest, APhantomAnswersForItselfAndNeverReachesTheService) {
  InstrumentedDevice device;
  {
    const auto phantom = device.instruments->makePhantomCoordinator("org.p", Error("E", 7));
    EXPECT_EQ(phantom.bundleID(), "org.p");
    EXPECT_EQ(phantom.error(), Error("E", 7));
    EXPECT_FALSE(device.instruments->makePhantomCoordinator(std::nullopt, std::nullopt).bundleID());
    std::optional<Error> error;
    EXPECT_FALSE(phantom.hasPlaceholderPromise());
    EXPECT_FALSE(phantom.cancelForReason(Error("E", 1), OstrelClientDovel, &error));
    EXPECT_EQ(error->code(), kFaultPhantom);
    EXPECT_FALSE(phantom.appAssetPromiseWithError(nullptr));
    phantom.setObserver(nullptr);
  }
  EXPECT_EQ(device.behind->recorder().lines(), Lines{});
}

TEST(InstrumentTest, AScriptAnswersInTheServicesPlace) {
  InstrumentedDevice device;
  std::string around;
  ScriptedAnswers answers;
  answers.creatorIdentifier = [](const std::string& bundleID) {
    return bundleID == "org.a" ? std::optional<OstrelClientID>(9) : std::nullopt;
  };
  answers.enumerateBundlesOfType = [](std::uint64_t, PellumApplicationProxies& records) {
    records.resize(2);
    records.front().applicationIdentifier = "org.strange";
  };
  answers.afterCall = [&](const std::string& operation, const std::string& subject) {
    if (operation == "moveItem") around += subject;
  };
  device.instruments->setAnswers(std::move(answers));
  device.instruments->setLacking(DovelDeviceService::Operation::PrioritizeAsset, true);
  std::optional<Error> unchanged = Error("E", 1);
  ASSERT_TRUE(device.instruments->addFaultWithError("copyItem", std::nullopt, nullptr));

  const Platform platform = device.platform();
  ContractClient client(platform);
  for (const char* id : {"org.a", "org.b"}) {
    EXPECT_EQ(client.coordinator(OstrelCoordinatorKind::Initiating, id, true).creatorIdentifier(),
              id == std::string("org.a") ? 9U : OstrelClientDovel);
  }
  std::string walked;
  platform.defaultWorkspace->enumerateBundlesOfType(kPellumBundleTypeAll, [&](const auto& record, bool& stop) {
    walked += record.applicationIdentifier;
    stop = true;
  });
  EXPECT_EQ(walked, "org.strange");
  platform.files->moveItem("/no", "/where", nullptr);
  EXPECT_EQ(around, "/no");
  EXPECT_FALSE(platform.sharedInstance->offers(DovelDeviceService::Operation::PrioritizeAsset));
  EXPECT_TRUE(platform.sharedInstance->offers(DovelDeviceService::Operation::CancelAssetTransferForFailedAsset));
  EXPECT_FALSE(platform.files->copyItem("/no", "/where", &unchanged));
  EXPECT_EQ(unchanged, std::nullopt) << "a failure that brings no error leaves none of an earlier one";
}

}  // namespace

}  // namespace appsync
