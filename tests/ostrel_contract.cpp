#include "tests/ostrel_contract.h"

#include <archive.h>
#include <archive_entry.h>

#include <tuple>

namespace appsync {

namespace {

using Kind = OstrelCoordinatorKind;
using Lines = std::vector<std::string>;

const Error kReason("Test", 1);

Bytes packageOf(const std::string& identifier, const std::string& version) {
  const PropertyList info = PropertyList::dictionary(
      {{"TefBundleIdentifier", identifier}, {"TefBundleVersion", version}, {"TefBundleDisplayName", "Name"}});
  const Bytes text = *serializePropertyList(info, PropertyListFormat::XML, nullptr);
  Bytes bytes(8192);
  std::size_t used = 0;
  archive* writer = archive_write_new();
  archive_write_set_format_zip(writer);
  archive_write_open_memory(writer, bytes.data(), bytes.size(), &used);
  archive_entry* entry = archive_entry_new();
  archive_entry_set_pathname(entry, "Payload/Some.app/Info.plist");
  archive_entry_set_filetype(entry, AE_IFREG);
  archive_entry_set_perm(entry, 0644);
  archive_entry_set_size(entry, static_cast<la_int64_t>(text.size()));
  archive_write_header(writer, entry);
  archive_write_data(writer, text.data(), text.size());
  archive_entry_free(entry);
  archive_write_close(writer);
  archive_write_free(writer);
  bytes.resize(used);
  return bytes;
}

}  // namespace

std::string ContractClient::putPackage(const std::string& bundleID, const std::string& version,
                                       const std::string& identifier) {
  const std::string path = files().temporaryDirectory() + "/" + bundleID + ".ipa";
  EXPECT_TRUE(files().createFile(path, packageOf(identifier.empty() ? bundleID : identifier, version), {}));
  return path;
}

bool ContractClient::configure(const OstrelAppInstallCoordinator& coordinator, const std::string& bundleID) {
  const OstrelPlaceholder shown = placeholder(bundleID);
  OstrelPlaceholderAttributes attributes;
  attributes.setBundleVersion("1");
  return coordinator.setInstallOptions({}, nullptr) && coordinator.setInitialVeylAssetPromises({}, nullptr) &&
         coordinator.setAppAssetPromise(promise(bundleID + "-Asset"), nullptr) &&
         shown.setPlaceholderAttributes(attributes, nullptr) && shown.setMetadata(std::nullopt, nullptr) &&
         shown.setConfigurationCompleteWithError(nullptr) && coordinator.setPlaceholderPromise(shown, nullptr);
}

bool ContractClient::prepare(Kind kind, const std::string& bundleID, const OstrelService::Observer& observer) {
  const auto made = coordinator(kind, bundleID, true);
  if (made && observer) made.setObserver(observer);
  return made && configure(made, bundleID);
}

bool ContractClient::deliver(const std::string& bundleID, const std::string& package) {
  const auto found = coordinator(Kind::Any, bundleID, false);
  const auto open = found && !found.error() ? found.appAssetPromiseWithError(nullptr) : OstrelPromisedTransferToPath();
  if (!open || open.isComplete()) return false;
  open.setTransferPath(FileURL::fileURLWithPath(package, false));
  open.setPercentComplete(1.0);
  open.setComplete(true);
  return true;
}

std::optional<std::string> ContractClient::installedVersion(const std::string& bundleID) {
  const auto record = registry().applicationProxyForIdentifier(bundleID, false);
  return record ? record->bundleVersion : std::nullopt;
}

TEST_P(OstrelContract, InstallsOnceEveryHandleIsGoneAndReportsInOrder) {
  const std::string package = client.putPackage("org.a", "1");
  auto held = client.coordinator(Kind::Initiating, "org.a", true);
  held.setObserver(heard);
  ASSERT_TRUE(client.configure(held, "org.a") && client.deliver("org.a", package));
  EXPECT_FALSE(client.deliver("org.a", "/twice")) << "a promise is fulfilled once";
  device->settle();
  EXPECT_EQ(heard->lines(), Lines{}) << "it must not work while it is being configured";
  OstrelAppInstallCoordinator kept;
  heard->whenHeard = [&](const auto& coordinator) { kept = coordinator; };
  held = {};
  device->settle();
  EXPECT_TRUE(client.hasPlaceholder("org.a") && !client.registry().applicationIsInstalled("org.a"))
      << "somebody holds the coordinator of the first event";
  kept = {};
  device->settle();
  EXPECT_EQ(heard->lines(), (Lines{"begins 2", "placeholder org.a", "begins 1", "installed org.a"}));
  EXPECT_EQ(client.installedVersion("org.a"), "1");
  EXPECT_FALSE(client.hasPlaceholder("org.a"));
  EXPECT_FALSE(client.files().fileExists(package)) << "the service deletes what it has installed";
  EXPECT_FALSE(client.coordinator(Kind::Any, "org.a", false)) << "an install that succeeded is over";
  EXPECT_TRUE(kept.bundleID() == "org.a" && !kept.error()) << "what is over still answers";
}

TEST_P(OstrelContract, AFailedInstallSetsItsErrorFirstAndLeavesTheOldVersion) {
  ASSERT_TRUE(client.prepare(Kind::Initiating, "org.a") && client.deliver("org.a", client.putPackage("org.a", "1")));
  device->settle();
  const std::string foreign = client.putPackage("org.a", "2", "org.other");
  ASSERT_TRUE(client.prepare(Kind::Updating, "org.a", heard) && client.deliver("org.a", foreign));
  device->settle();
  EXPECT_EQ(heard->lines(), (Lines{"begins 2", "placeholder org.a", "begins 1", "failed org.a"}));
  EXPECT_EQ(client.installedVersion("org.a"), "1");
  EXPECT_FALSE(client.hasPlaceholder("org.a"));
  EXPECT_FALSE(client.files().fileExists(foreign)) << "the service deletes what it has given up";
  const auto dead = client.coordinator(Kind::Updating, "org.a", false);
  ASSERT_TRUE(dead && dead.error()) << "a look-up may find a dead one";
  EXPECT_FALSE(dead.cancelForReason(kReason, 3, nullptr) || dead.setInstallOptions({}, nullptr));
  ASSERT_TRUE(client.prepare(Kind::Updating, "org.a")) << "a dead one is replaced";
  ASSERT_TRUE(client.deliver("org.a", client.putPackage("org.a", "3")));
  device->settle();
  EXPECT_EQ(client.installedVersion("org.a"), "3");
}

TEST_P(OstrelContract, ACancellationIsReportedToWhoeverCancelledToo) {
  ASSERT_TRUE(client.prepare(Kind::Initiating, "org.a", heard));
  device->settle();
  const auto live = client.coordinator(Kind::Any, "org.a", false);
  std::optional<Error> error;
  ASSERT_TRUE(live.cancelForReason(kReason, OstrelClientDovel, &error));
  EXPECT_FALSE(error);
  EXPECT_EQ(live.error(), kReason);
  EXPECT_FALSE(live.cancelForReason(Error("Other", 1), OstrelClientDovel, &error));
  EXPECT_TRUE(error && error->domain() == kOstrelErrorDomain);
  EXPECT_FALSE(client.deliver("org.a", client.putPackage("org.a", "1")));
  device->settle();
  EXPECT_EQ(heard->lines(), (Lines{"begins 2", "placeholder org.a", "cancelled by 3 (Test 1) org.a"}));
  EXPECT_FALSE(client.hasPlaceholder("org.a") || client.registry().applicationIsInstalled("org.a"));
}

TEST_P(OstrelContract, FindsMakesAndRefusesCoordinators) {
  ASSERT_TRUE(client.prepare(Kind::Initiating, "org.first") && client.prepare(Kind::RestoringDemoted, "org.demoted"));
  const auto store = client.coordinator(Kind::Restoring, "org.store", true);
  ASSERT_TRUE(client.service().setAppAssetPromiseResponsibleClient(store.ref(), OstrelClientMerc, nullptr));
  ASSERT_TRUE(client.prepare(Kind::Initiating, "org.dead"));
  client.coordinator(Kind::Any, "org.dead", false).cancelForReason(kReason, 3, nullptr);
  device->settle();
  enum Answer { Nothing, Found, Made };
  const std::tuple<const char*, Kind, bool, Answer> cases[] = {
      {"org.none", Kind::Any, false, Nothing},        {"org.none", Kind::Any, true, Nothing},
      {"org.none", Kind::Initiating, false, Nothing}, {"org.none", Kind::Initiating, true, Made},
      {"org.none", Kind::Initiating, true, Found},    {"org.none2", Kind::Updating, true, Nothing},
      {"org.first", Kind::Any, false, Found},         {"org.first", Kind::Updating, false, Nothing},
      {"org.first", Kind::Restoring, true, Nothing},  {"org.dead", Kind::Initiating, false, Found},
      {"org.dead", Kind::Restoring, true, Made},      {"org.store", Kind::Initiating, true, Nothing},
      {"org.store", Kind::Restoring, true, Found},    {"org.demoted", Kind::RestoringDemoted, true, Found},
      {"org.demoted", Kind::Any, false, Found},       {"org.demoted", Kind::Initiating, true, Made},
      {"", Kind::Initiating, true, Nothing},          {"..", Kind::Initiating, true, Nothing},
      {"a/b", Kind::Initiating, true, Nothing}};
  for (const auto& [bundleID, kind, create, answer] : cases) {
    SCOPED_TRACE(std::string(bundleID) + " kind " + std::to_string(static_cast<int>(kind)) + (create ? " create" : ""));
    bool created = answer != Made;
    std::optional<Error> error;
    const OstrelAppInstallCoordinator found(
        client.service(), client.service().coordinatorForApp(kind, bundleID, 3, create, &created, &error));
    EXPECT_EQ(static_cast<bool>(found), answer != Nothing);
    EXPECT_EQ(created, answer == Made);
    EXPECT_EQ(error.has_value(), answer == Nothing);
  }
  device->settle();
  EXPECT_TRUE(client.hasPlaceholder("org.demoted")) << "it stays until another takes its place";
}

TEST_P(OstrelContract, TakesEverythingOnceAndNothingThatDoesNotFit) {
  const auto coordinator = client.coordinator(Kind::Initiating, "org.a", true);
  const OstrelPromise package = client.promise("package");
  const OstrelPromise cancelled = client.promise("cancelled");
  const OstrelPlaceholder withdrawn = client.placeholder("org.a");
  ASSERT_TRUE(cancelled.cancelForReason(kReason, 3, nullptr) && withdrawn.cancelForReason(kReason, 3, nullptr));
  std::optional<Error> error;
  EXPECT_FALSE(coordinator.appAssetPromiseWithError(&error));
  EXPECT_TRUE(std::exchange(error, std::nullopt));
  EXPECT_FALSE(coordinator.setPlaceholderPromise(OstrelPlaceholder(), &error)) << "no placeholder is refused";
  EXPECT_TRUE(std::exchange(error, std::nullopt));
  EXPECT_FALSE(coordinator.setPlaceholderPromise(withdrawn, nullptr));
  EXPECT_FALSE(coordinator.setPlaceholderPromise(client.placeholder("org.b"), nullptr));
  EXPECT_FALSE(coordinator.setAppAssetPromise(OstrelPromise(), nullptr));
  EXPECT_FALSE(coordinator.setAppAssetPromise(cancelled, nullptr));
  EXPECT_FALSE(client.service().setAppAssetPromiseResponsibleClient(coordinator.ref(), 1, nullptr));
  EXPECT_FALSE(coordinator.hasAppAssetPromise() || coordinator.hasPlaceholderPromise());
  ASSERT_TRUE(coordinator.setAppAssetPromise(package, nullptr));
  EXPECT_FALSE(client.coordinator(Kind::Initiating, "org.b", true).setAppAssetPromise(package, nullptr));
  EXPECT_FALSE(coordinator.setAppAssetPromise(client.promise("second"), &error));
  EXPECT_TRUE(error);
  EXPECT_EQ(coordinator.appAssetPromiseWithError(nullptr).ref(), package.ref()) << "an object has one reference";
  EXPECT_FALSE(client.placeholder("../org.a"));
}

TEST_P(OstrelContract, AnswersForReferencesThatNameNothing) {
  OstrelService& service = client.service();
  const OstrelRef gone = client.placeholder("org.a").ref();
  for (const OstrelRef ref : {OstrelRef{}, OstrelRef{~0ULL}, gone}) {
    std::optional<Error> error;
    EXPECT_FALSE(service.bundleID(ref) || service.error(ref) || service.isComplete(ref));
    EXPECT_FALSE(service.hasInstallOptions(ref) || service.setInstallOptions(ref, {}, &error));
    EXPECT_TRUE(std::exchange(error, std::nullopt));
    EXPECT_FALSE(service.cancel(ref, kReason, 3, &error) || service.setConfigurationComplete(ref, nullptr));
    EXPECT_TRUE(error);
    service.setObserver(ref, heard);
    service.setComplete(ref, true);
    service.release(ref);
  }
}

TEST_P(OstrelContract, AnEventGoesToTheCoordinatorsObserverOrElseToItsCreators) {
  const auto forDovel = std::make_shared<HearingObserver>();
  const auto forStore = std::make_shared<HearingObserver>();
  auto dovels = OstrelAppInstallObserver::initWithMachServiceName(client.service(), "dovel", {3}, forDovel);
  const auto stores = OstrelAppInstallObserver::initWithMachServiceName(client.service(), "store", {1, 2}, forStore);
  ASSERT_TRUE(client.prepare(Kind::Initiating, "org.own", heard) && client.prepare(Kind::Initiating, "org.registered"));
  device->settle();
  EXPECT_EQ(heard->lines(), (Lines{"begins 2", "placeholder org.own"}));
  EXPECT_EQ(forDovel->lines(), (Lines{"begins 2", "placeholder org.registered"}));
  EXPECT_EQ(forStore->lines(), Lines{});
  forDovel->whenHeard = [&](const auto&) { dovels = {}; };  // from its own callback: it must not wait for itself
  for (const char* bundleID : {"org.more", "org.most"}) {
    ASSERT_TRUE(client.prepare(Kind::Initiating, bundleID));
    device->settle();
  }
  EXPECT_EQ(forDovel->lines().size(), 4U) << "what is released hears no more";
}

TEST_P(OstrelContract, RemovesWhateverStandsThere) {
  ASSERT_TRUE(client.prepare(Kind::Initiating, "org.there") && client.prepare(Kind::Initiating, "org.live", heard));
  ASSERT_TRUE(client.deliver("org.there", client.putPackage("org.there", "1")));
  device->settle();
  const std::tuple<const char*, bool, bool> cases[] = {{"org.there", true, false}, {"org.there", false, true},
                                                       {"org.live", false, true},  {"org.nothing", false, true},
                                                       {"..", false, false},       {"a/b", false, false}};
  for (const auto& [bundleID, confirm, succeeds] : cases) {
    SCOPED_TRACE(bundleID);
    Lines answers;
    const auto completion = [&](const auto& error) { answers.emplace_back(error ? "refused" : "removed"); };
    OstrelAppInstallCoordinator::uninstallAppWithBundleID(client.service(), bundleID, confirm, completion);
    device->settle();
    EXPECT_EQ(answers, Lines{succeeds ? "removed" : "refused"});
    EXPECT_EQ(client.installedVersion("org.there").has_value(), confirm);
  }
  EXPECT_FALSE(client.hasPlaceholder("org.live"));
  EXPECT_TRUE(heard->lines().size() == 3U && heard->lines().back().starts_with("cancelled by 0"));
  EXPECT_FALSE(client.coordinator(Kind::Any, "org.live", false)) << "removal forgets what is dead";
}

}  // namespace appsync
