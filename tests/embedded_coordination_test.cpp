#include <gtest/gtest.h>

#include <filesystem>
#include <mutex>
#include <thread>

#include "client/apps_client.h"
#include "embedded/coordination.h"
#include "embedded/device.h"
#include "embedded/registry.h"
#include "embedded/waiting.h"
#include "tests/ostrel_contract.h"
#include "tests/support/registry_device.h"

namespace appsync {

namespace {

using Kind = OstrelCoordinatorKind;
using Lines = std::vector<std::string>;

class BareDevice : public ContractDevice {
 public:
  explicit BareDevice(std::optional<std::uint64_t> seed = {}) : _seed(seed) { start(); }
  ~BareDevice() override {
    device.reset();
    std::filesystem::remove_all(directory);
  }

  Platform platform() override { return device->platform(); }
  void settle() override { executor->drain(); }

  // A new process on the same directory. The disk fails from the given change on; 0: never.
  void start(int failingChange = 0) {
    device.reset();
    disk.failingCall = failingChange;
    disk.forGood = true;
    DeviceOptions options;
    options.directory = directory;
    options.disk = &disk;
    options.executor = [this] {
      auto made = _seed ? makeSeededExecutor(*_seed) : makeThreadExecutor(3);
      executor = made.get();
      return made;
    };
    device = Device::open(options, nullptr);
    if (device) device->startWork();
  }
  PropertyList coordinators() { return *Device::status(directory, nullptr)->find("coordinators"); }
  EmbeddedCoordination& coordination() { return device->coordination(); }
  bool settles() { return coordination().waitUntilSettled(device->waiting(), std::chrono::hours(1)); }

  const std::string directory = freshDirectory();
  test::FailingDisk disk;
  std::unique_ptr<Device> device;
  Executor* executor = nullptr;

 private:
  static std::string freshDirectory() {
    std::string name = testing::TempDir() + "coordination-XXXXXX";
    return ::mkdtemp(name.data());
  }

  const std::optional<std::uint64_t> _seed;
};

INSTANTIATE_TEST_SUITE_P(Threads, OstrelContract,
                         testing::Values(MakeContractDevice([] { return std::make_unique<BareDevice>(); })));
INSTANTIATE_TEST_SUITE_P(Seeded, OstrelContract,
                         testing::Values(MakeContractDevice([] { return std::make_unique<BareDevice>(7); })));

class EmbeddedCoordinationTest : public testing::Test {
 protected:
  bool isShown(const std::string& bundleID, std::uint64_t state, std::uint64_t phase) {
    const auto progress = client().registry().applicationProxyForIdentifier(bundleID, true)->installProgressSync;
    return progress && progress->installState == state && progress->installPhase == phase;
  }
  ContractClient client() { return ContractClient(bare.platform()); }

  BareDevice bare;
  std::shared_ptr<HearingObserver> heard = std::make_shared<HearingObserver>();
};

// Power is lost at each change of the disk in turn, while an update is installed or cancelled; what is left fits
// together, and the next sync ends well all the same.
TEST_F(EmbeddedCoordinationTest, ACrashAtAnyInstantLeavesWhatTheNextSyncCanFinish) {
  int unbroken = 0;
  for (int turn = 2; unbroken < 2; ++turn) {
    SCOPED_TRACE((turn % 2 == 0 ? "installing, change " : "cancelling, change ") + std::to_string(turn / 2));
    BareDevice device;
    ContractClient before(device.platform());
    ASSERT_TRUE(before.prepare(Kind::Initiating, "org.a") && before.deliver("org.a", before.putPackage("org.a", "1")));
    device.settle();
    const std::string package = before.putPackage("org.a", "2");
    device.start(turn / 2);
    if (device.device) {
      ContractClient crashing(device.platform());
      const bool prepared = crashing.prepare(Kind::Updating, "org.a");
      if (turn % 2 != 0) device.settle();
      if (prepared && turn % 2 == 0) crashing.deliver("org.a", package);
      if (turn % 2 != 0) device.coordination().personCancels("org.a", Error("Shell", 2));
      device.settle();
    }
    unbroken = device.disk.failingCall == 1 ? 0 : unbroken + 1;

    device.start();
    device.settle();
    ContractClient next(device.platform());
    ASSERT_TRUE(next.installedVersion("org.a") == "1" || next.installedVersion("org.a") == "2");
    auto found = next.coordinator(Kind::Any, "org.a", false);
    EXPECT_EQ(next.hasPlaceholder("org.a"), found && !found.error());
    found = next.coordinator(Kind::Updating, "org.a", true);
    ASSERT_TRUE(found && (found.hasPlaceholderPromise() || next.configure(found, "org.a")));
    next.deliver("org.a", next.putPackage("org.a", "3"));
    found = {};
    device.settle();
    EXPECT_EQ(next.installedVersion("org.a"), "3");
    EXPECT_FALSE(next.hasPlaceholder("org.a"));
    EXPECT_EQ(device.coordinators().count(), 0U);
  }
}

TEST_F(EmbeddedCoordinationTest, ALaterProcessGoesOnWhereAnEarlierOneEnded) {
  const auto container = [&] { return client().registry().applicationProxyForIdentifier("org.a", true)->bundleURL; };
  ASSERT_TRUE(client().prepare(Kind::Initiating, "org.a") && client().prepare(Kind::Restoring, "org.b"));
  bare.coordination().personCancels("org.b", Error("Shell", 2));
  bare.settle();
  const auto shown = container();
  bare.start();
  bare.settle();
  EXPECT_EQ(container(), shown) << "a placeholder is installed once";
  EXPECT_EQ(client().coordinator(Kind::Any, "org.b", false).error(), Error("Shell", 2));
  bare.coordination().placeholderUninstalled("org.b");
  ASSERT_TRUE(client().deliver("org.a", client().putPackage("org.a", "1")));
  bare.settle();
  EXPECT_EQ(client().installedVersion("org.a"), "1");
  EXPECT_EQ(bare.coordinators().count(), 0U);
}

// The person, the daemon and the client meet on one application, in as many orders as there are seeds.
TEST_F(EmbeddedCoordinationTest, WhoeverComesFirstEveryInstallEndsOnce) {
  for (std::uint64_t seed = 0; seed < 60; ++seed) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    BareDevice device(seed);
    ContractClient shared(device.platform());
    const std::string package = shared.putPackage("org.a", "1");
    const auto events = std::make_shared<HearingObserver>();
    const auto observer = OstrelAppInstallObserver::initWithMachServiceName(shared.service(), "all", {3}, events);
    bool madeAnother = false;
    std::atomic<int> completions{0};
    ASSERT_TRUE(shared.prepare(Kind::Initiating, "org.a"));
    std::vector<std::thread> threads;
    threads.emplace_back([&] { shared.deliver("org.a", package); });
    threads.emplace_back([&] { device.coordination().personCancels("org.a", Error("Test", 1)); });
    threads.emplace_back([&] { shared.service().uninstallApp("org.a", false, [&](const auto&) { ++completions; }); });
    threads.emplace_back([&] { shared.registry().uninstallApplication("org.a", nullptr); });
    threads.emplace_back([&] {
      const OstrelAppInstallCoordinator another(
          shared.service(),
          shared.service().coordinatorForApp(Kind::Initiating, "org.a", 3, true, &madeAnother, nullptr));
      shared.configure(another, "org.a");
    });
    for (std::thread& thread : threads) thread.join();
    EXPECT_TRUE(device.settles());
    EXPECT_EQ(completions, 1);
    const auto last = shared.coordinator(Kind::Any, "org.a", false);
    const bool lives = last && !last.error();
    EXPECT_EQ(shared.hasPlaceholder("org.a"), lives && last.hasPlaceholderPromise());
    int ends = lives ? 1 : 0;
    for (const std::string& line : events->lines()) ends += !line.starts_with("begins") && !line.starts_with("place");
    EXPECT_EQ(ends, madeAnother ? 2 : 1) << testing::PrintToString(events->lines());
    EXPECT_EQ(device.coordinators().count(), last ? 1U : 0U);
  }
}

TEST_F(EmbeddedCoordinationTest, TellsThePersonAndTheHostWhatItDoes) {
  std::mutex guard;  // events of different applications come at the same time
  Lines events;
  bare.coordination().setEventListener([&](const CoordinatorEvent& event) {
    const std::lock_guard lock(guard);
    events.push_back(event.bundleID + std::to_string(static_cast<int>(event.kind)) + (event.error ? " failed" : ""));
  });
  bare.coordination().setInstallGate([&](const std::string& bundleID) {
    EXPECT_TRUE(isShown(bundleID, kPellumInstallStateActive, kPellumInstallPhaseInstalling));
    if (bundleID == "org.c") bare.coordination().personCancels("org.c", Error("Shell", 2));
    return bundleID == "org.b" ? std::optional(Error("Test", 9)) : std::nullopt;
  });
  for (const char* id : {"org.a", "org.b", "org.c"}) ASSERT_TRUE(client().prepare(Kind::Initiating, id, heard));
  bare.settle();
  EXPECT_TRUE(isShown("org.a", kPellumInstallStateWaiting, kPellumInstallPhaseLoading));
  client().coordinator(Kind::Any, "org.a", false).appAssetPromiseWithError(nullptr).setPercentComplete(0.5);
  bare.settle();
  EXPECT_TRUE(isShown("org.a", kPellumInstallStateActive, kPellumInstallPhaseLoading));
  bare.coordination().personPrioritizes("org.c");
  bare.coordination().personPrioritizes("org.unknown");
  bare.settle();
  EXPECT_EQ(heard->lines().back(), "prioritize org.c");
  events.clear();
  for (const char* id : {"org.a", "org.b", "org.c"}) {
    ASSERT_TRUE(client().deliver(id, client().putPackage(id, "1")));
    bare.settle();
  }
  EXPECT_EQ(events, (Lines{"org.a1", "org.b1 failed", "org.c2 failed"}));
  EXPECT_EQ(heard->lines().back(), "cancelled by 0 (Shell 2) org.c");
  EXPECT_FALSE(client().installedVersion("org.b") || client().installedVersion("org.c"));
}

TEST_F(EmbeddedCoordinationTest, KeepsTheIconThatWasHandedOver) {
  const std::string path = client().files().temporaryDirectory() + "/Icon.png";
  auto held = client().coordinator(Kind::Initiating, "org.a", true);
  const auto icon = OstrelPromisedTransferToPath::initWithName(client().service(), "org.a-Icon", 3,
                                                               FileURL::fileURLWithPath(path, false), 2);
  const auto placeholder = client().placeholder("org.a");
  client().files().createFile(path, Bytes{1, 2}, {});
  icon.setComplete(true);
  ASSERT_TRUE(placeholder.setIconPromise(icon, nullptr) && held.setPlaceholderPromise(placeholder, nullptr));
  client().files().createFile(path, Bytes{3}, {});
  held = {};
  bare.settle();
  const auto shown = client().registry().applicationProxyForIdentifier("org.a", true);
  EXPECT_EQ(client().files().readFile(shown->bundleURL->path() + "/Icon.png", nullptr), (Bytes{1, 2}));
}

// All that was handed over is the service's from then on, whoever asked for it having long gone.
TEST_F(EmbeddedCoordinationTest, WhatWasHandedOverOutlivesTheProcess) {
  const auto metadata = [](const char* title) {
    return KilnStoreMetadata::initWithDictionary(PropertyList::dictionary({{"title", title}}));
  };
  {
    const auto held = client().coordinator(Kind::Restoring, "org.a", true);
    KilnInstallOptions options;
    options.setTarvoMetadata(metadata("application"));
    options.setPellumInstallType(2);
    options.setInstallTargetType(1);
    const std::string path = client().files().temporaryDirectory() + "/Icon.png";
    client().files().createFile(path, Bytes{1, 2}, {});
    const auto icon = OstrelPromisedTransferToPath::initWithName(client().service(), "org.a-Icon", 3,
                                                                 FileURL::fileURLWithPath(path, false), 2);
    icon.setComplete(true);
    const auto placeholder = client().placeholder("org.a", kPellumInstallTypeRestore);
    auto attributes = OstrelPlaceholderAttributes::initWithInfoPlistDictionary(PropertyList::dictionary({{"k", "v"}}));
    attributes.setBundleVersion("7");
    attributes.setLaunchProhibited(true);
    ASSERT_TRUE(placeholder.setIconPromise(icon, nullptr) && placeholder.setMetadata(metadata("shown"), nullptr));
    ASSERT_TRUE(placeholder.setPlaceholderAttributes(attributes, nullptr) && held.setInstallOptions(options, nullptr));
    ASSERT_TRUE(held.setAppAssetPromise(client().promise("org.a-Asset"), nullptr));
    ASSERT_TRUE(held.setUserDataPromise(client().promise("org.a-UserData"), nullptr));
    ASSERT_TRUE(client().service().setAppAssetPromiseResponsibleClient(held.ref(), OstrelClientMerc, nullptr));
    ASSERT_TRUE(held.setPlaceholderPromise(placeholder, nullptr));
  }
  bare.settle();
  const auto shown = [&] {
    const auto record = client().registry().applicationProxyForIdentifier("org.a", true);
    if (!record) return std::string("(none)");
    std::string all = record->localizedName.value_or("") + std::to_string(record->installType);
    for (const std::string& path : {record->bundleURL->path() + "/Info.plist", record->bundleURL->path() + "/Icon.png",
                                    record->bundleContainerURL->path() + "/TarvoMetadata.plist"}) {
      const auto bytes = client().files().readFile(path, nullptr);
      all += bytes ? std::string(bytes->begin(), bytes->end()) : "(no " + path + ")";
    }
    return all;
  };
  const std::string before = shown();
  const PropertyList status = bare.coordinators();
  EXPECT_EQ(before.find("(no"), std::string::npos) << before;
  // As after a crash that came before the registry's record was safe.
  ASSERT_TRUE(std::filesystem::remove(bare.directory + "/state/placeholders/org.a.plist"));
  bare.start();
  bare.settle();
  EXPECT_EQ(shown(), before);
  EXPECT_EQ(bare.coordinators(), status);
  EXPECT_EQ(client().service().description(
                client().coordinator(Kind::Any, "org.a", false).appAssetPromiseWithError(nullptr).ref()),
            "<promise org.a-Asset>");
  {
    const auto held = client().coordinator(Kind::Restoring, "org.a", false);
    EXPECT_FALSE(held.setUserDataPromise(client().promise("again"), nullptr));
    held.appAssetPromiseWithError(nullptr).setTransferPath(
        FileURL::fileURLWithPath(client().putPackage("org.a", "8"), false));
    held.appAssetPromiseWithError(nullptr).setComplete(true);
  }
  bare.settle();
  EXPECT_EQ(client().installedVersion("org.a"), std::nullopt) << "the user's data have not come";
}

TEST_F(EmbeddedCoordinationTest, WhatIsDeadOrGoneUsesNoPackage) {
  for (const char* bundleID : {"org.a", "org.b"}) {
    const auto held = client().coordinator(Kind::Initiating, bundleID, true);
    const auto promise = client().promise(bundleID);
    promise.setTransferPath(FileURL::fileURLWithPath("/var/mobile/" + std::string(bundleID), false));
    promise.setComplete(true);
    ASSERT_TRUE(held.setAppAssetPromise(promise, nullptr));
  }
  EXPECT_EQ(bare.coordination().packagePathsInUse(), (Lines{"/var/mobile/org.a", "/var/mobile/org.b"}));
  bare.coordination().personCancels("org.a", Error("Shell", 2));
  bare.coordination().personCancels("org.none", Error("Shell", 2));
  EXPECT_EQ(bare.coordination().packagePathsInUse(), Lines{"/var/mobile/org.b"});
  bare.settle();
  bare.start();
  EXPECT_EQ(bare.coordination().packagePathsInUse(), Lines{"/var/mobile/org.b"});
  EXPECT_EQ(client().coordinator(Kind::Initiating, "org.a", false).error(), Error("Shell", 2));
}

// The icon is somebody else's file: what is no small file is left out, and the placeholder comes without.
TEST_F(EmbeddedCoordinationTest, AnIconThatCannotBeReadIsLeftOut) {
  const std::string directory = client().files().temporaryDirectory();
  const std::tuple<const char*, std::string, bool> cases[] = {{"org.unfinished", "Icon.png", false},
                                                              {"org.missing", "none.png", true},
                                                              {"org.directory", "", true},
                                                              {"org.large", "large.png", true},
                                                              {"org.good", "Icon.png", true}};
  client().files().createFile(directory + "/Icon.png", Bytes{1, 2}, {});
  client().files().createFile(directory + "/large.png", Bytes((8U << 20) + 1), {});
  for (const auto& [bundleID, name, isComplete] : cases) {
    {
      const auto held = client().coordinator(Kind::Initiating, bundleID, true);
      const auto icon = OstrelPromisedTransferToPath::initWithName(
          client().service(), "icon", 3, FileURL::fileURLWithPath(directory + "/" + name, false), 2);
      icon.setComplete(isComplete);
      const auto placeholder = client().placeholder(bundleID);
      ASSERT_TRUE(placeholder.setIconPromise(icon, nullptr) && held.setPlaceholderPromise(placeholder, nullptr));
    }
    bare.settle();
    const auto record = client().registry().applicationProxyForIdentifier(bundleID, true);
    ASSERT_TRUE(record) << bundleID;
    EXPECT_EQ(client().files().fileExists(record->bundleURL->path() + "/Icon.png"), bundleID == std::string("org.good"))
        << bundleID;
  }
}

TEST_F(EmbeddedCoordinationTest, SettlesWhenNothingCanGoOn) {
  auto held = client().coordinator(Kind::Initiating, "org.a", true);
  ASSERT_TRUE(client().configure(held, "org.a"));
  bare.device->waiting().runFast(*bare.executor);
  EXPECT_TRUE(bare.settles()) << "nothing has been delivered";
  const std::string package = client().putPackage("org.a", "1");
  ASSERT_TRUE(client().deliver("org.a", package));
  EXPECT_EQ(bare.coordination().packagePathsInUse(), Lines{package});
  EXPECT_FALSE(bare.settles()) << "somebody holds it back";
  held = {};
  EXPECT_TRUE(bare.settles());
  EXPECT_TRUE(bare.coordination().packagePathsInUse().empty());
}

TEST_F(EmbeddedCoordinationTest, ASeedIsWhatStatusShows) {
  const auto entry = [](const char* bundleID, const char* kind) {
    return PropertyList::dictionary({{"identifier", bundleID}, {"kind", kind}});
  };
  PropertyList full = entry("org.full", "restoring");
  for (const char* key : {"creator", "responsibleClient"}) full.set(key, PropertyList::integer(1));
  full.set("error", "It went wrong");
  for (const char* key : {"installOptions", "initialAssetPromises", "userDataPromise", "placeholderPromise"}) {
    full.set(key, true);
  }
  full.set("assetPromise", "complete");
  PropertyList waiting = entry("org.waiting", "initiating");
  waiting.set("assetPromise", "complete");
  waiting.set("placeholderPromise", true);
  ASSERT_TRUE(bare.coordination().seed(PropertyList::array({full, waiting}), nullptr));
  EXPECT_EQ(bare.coordinators().elements()[0], full);
  const PropertyList shown = bare.coordinators();
  ASSERT_TRUE(bare.coordination().seed(shown, nullptr));
  bare.start();
  bare.settle();
  EXPECT_EQ(bare.coordinators(), shown);
  EXPECT_TRUE(client().hasPlaceholder("org.waiting"));
  const auto found = client().coordinator(Kind::Initiating, "org.waiting", false);
  EXPECT_TRUE(found.appAssetPromiseWithError(nullptr).isComplete()) << "complete, but nowhere: nothing to install";

  PropertyList misspelt = entry("org.a", "initiating");
  misspelt.set("placeholder", true);
  PropertyList negative = entry("org.a", "initiating");
  negative.set("creator", PropertyList::integer(-1));
  for (const PropertyList& bad : {entry("a/b", "initiating"), entry("org.a", "any"), misspelt, negative,
                                  PropertyList("org.a"), PropertyList::dictionary({{"kind", "updating"}})}) {
    std::optional<Error> error;
    EXPECT_FALSE(checkCoordinationSeed(PropertyList::array({waiting, bad}), &error)) << bad.description();
    EXPECT_TRUE(error && error->text().find("entry 2") == 0);
  }
}

TEST_F(EmbeddedCoordinationTest, StrangeRecordsAreNeitherLostNorBelieved) {
  const auto put = [&](const char* bundleID, const PropertyList& record) {
    EXPECT_TRUE(
        makeFileStateStore(bare.device->files())->save(std::string("coordinators/") + bundleID, record, nullptr));
  };
  const PropertyList sound =
      PropertyList::dictionary({{"Kind", "updating"}, {"Creator", PropertyList::unsignedInteger(3)}});
  PropertyList deep = sound;
  PropertyList odd = sound;
  deep.set("Error", PropertyList::array(std::vector<PropertyList>(300'000, PropertyList::dictionary({{"Text", "t"}}))));
  odd.set("Error", PropertyList::dictionary({{"Text", "t"}}));
  put("org.deep", deep);
  put("org.odd", odd);
  put("org.kindless", PropertyList::dictionary({{"Creator", PropertyList::unsignedInteger(3)}}));
  EXPECT_EQ(bare.coordinators().count(), 2U);
  bare.start();
  EXPECT_EQ(bare.coordinators().count(), 2U);
  EXPECT_TRUE(client().coordinator(Kind::Any, "org.deep", false).error());
  ASSERT_EQ(bare.device->repairs().size(), 1U);
  EXPECT_NE(bare.device->repairs()[0].find("org.kindless.plist.damaged"), std::string::npos);
  EXPECT_TRUE(std::filesystem::exists(bare.directory + "/state/coordinators/org.kindless.plist.damaged"));
}

// Power is lost at each change of the disk in turn while the applications of a backup come back, one of them demoted. No
// placeholder is left without a coordinator that answers for it, and restoring once more ends with all of them.
TEST_F(EmbeddedCoordinationTest, ARestoreThatWasCutShortIsDoneByTheNext) {
  const auto bytes = [](const PropertyList& value) {
    return *serializePropertyList(value, PropertyListFormat::Binary, nullptr);
  };
  const PropertyList entry =
      PropertyList::dictionary({{"TarvoMetadata", PropertyList::data(bytes(PropertyList::dictionary()))},
                                {"PlaceholderIcon", PropertyList::data(Bytes{1, 2})}});
  const auto restore = [&](BareDevice& device) {
    device.device->waiting().runFast(*device.executor);
    AppsClient client(device.platform());
    return client._processTarvoRestoreInfo();
  };
  const auto putBackup = [&](BareDevice& device) {
    FileManager& files = *device.platform().files;
    files.writeFile("/var/mobile/Media/TarvoRestore/RestoreApplications.plist",
                    bytes(PropertyList::dictionary({{"org.a", entry}, {"org.b", entry}})), nullptr);
    files.writeFile("/var/mobile/Library/Preferences/com.zelk.Vaultry.DemotedApps.plist",
                    bytes(PropertyList::dictionary({{"AutomaticDowngrades", PropertyList::array({"org.b"})}})),
                    nullptr);
  };
  bool cutShort = true;
  for (int at = 1; cutShort; ++at) {
    SCOPED_TRACE("change " + std::to_string(at));
    BareDevice device(static_cast<std::uint64_t>(at));
    putBackup(device);
    device.start(at);
    if (device.device) restore(device);
    if (device.device) device.settle();
    cutShort = device.disk.failingCall == 1;

    device.start();
    ASSERT_TRUE(device.device && device.device->repairs().empty());
    device.settle();
    ContractClient next(device.platform());
    for (const char* id : {"org.a", "org.b"}) {
      const auto found = next.coordinator(Kind::Any, id, false);
      EXPECT_EQ(next.hasPlaceholder(id), found && !found.error()) << id;
    }
    putBackup(device);
    EXPECT_TRUE(restore(device));
    device.settle();
    for (const auto& [id, type] :
         {std::pair("org.a", kPellumInstallTypeRestore), std::pair("org.b", kPellumInstallTypeDowngrade)}) {
      const auto shown = next.registry().applicationProxyForIdentifier(id, true);
      ASSERT_TRUE(shown) << id;
      EXPECT_EQ(shown->installType, type) << id;
      EXPECT_EQ(next.files().readFile(shown->bundleURL->path() + "/Icon.png", nullptr), (Bytes{1, 2})) << id;
    }
    EXPECT_EQ(device.coordinators().count(), 2U);
    ASSERT_LT(at, 500);
  }
}

}  // namespace

}  // namespace appsync
