// More of the contract of the install coordination service: what coordinators, placeholders and promises take, and
// until when.
#include <tuple>

#include "tests/ostrel_contract.h"

namespace appsync {

namespace {

using Kind = OstrelCoordinatorKind;
using Setter = std::function<bool(ErrorOut)>;

const Error kReason("Test", 1);

// Fails unless each of the setters is refused with an error of the service.
void expectRefused(const std::vector<Setter>& setters) {
  for (std::size_t i = 0; i < setters.size(); ++i) {
    std::optional<Error> error;
    EXPECT_FALSE(setters[i](&error)) << i;
    ASSERT_TRUE(error) << i;
    EXPECT_EQ(error->domain(), kOstrelErrorDomain) << i;
  }
}

}  // namespace

TEST_P(OstrelContract, APlaceholderIsChangedUntilItIsCompleteGivenOrCancelled) {
  const auto coordinator = client.coordinator(Kind::Initiating, "org.a", true);
  enum End { Completed, Given, Cancelled };
  for (const End end : {Completed, Cancelled, Given}) {
    SCOPED_TRACE(end);
    const OstrelPlaceholder placeholder = client.placeholder("org.a");
    const OstrelPromise icon = client.promise("icon");
    ASSERT_TRUE(placeholder.setMetadata(std::nullopt, nullptr) && placeholder.setMetadata(std::nullopt, nullptr));
    ASSERT_TRUE(placeholder.setPlaceholderAttributes({}, nullptr) && placeholder.setIconPromise(icon, nullptr));
    expectRefused({[&](auto error) { return placeholder.setIconPromise(client.promise("another"), error); },
                   [&](auto error) { return client.placeholder("org.b").setIconPromise(icon, error); },
                   [&](auto error) { return client.placeholder("org.b").setIconPromise(OstrelPromise(), error); }});
    if (end == Completed) {
      ASSERT_TRUE(placeholder.setConfigurationCompleteWithError(nullptr));
    } else if (end == Given) {
      ASSERT_TRUE(coordinator.setPlaceholderPromise(placeholder, nullptr));
      expectRefused({[&](auto error) { return placeholder.cancelForReason(kReason, 3, error); }});
    } else {
      ASSERT_TRUE(placeholder.cancelForReason(kReason, 3, nullptr));
      expectRefused({[&](auto error) { return placeholder.cancelForReason(kReason, 3, error); },
                     [&](auto error) { return coordinator.setPlaceholderPromise(placeholder, error); }});
    }
    expectRefused({[&](auto error) { return placeholder.setMetadata(std::nullopt, error); },
                   [&](auto error) { return placeholder.setPlaceholderAttributes({}, error); },
                   [&](auto error) { return placeholder.setIconPromise(client.promise("late"), error); },
                   [&](auto error) { return placeholder.setConfigurationCompleteWithError(error); }});
  }
  EXPECT_TRUE(coordinator.hasPlaceholderPromise());
}

TEST_P(OstrelContract, ACoordinatorTakesEachThingOnceAndNothingWhenItIsDead) {
  const auto coordinator = client.coordinator(Kind::Restoring, "org.a", true);
  const OstrelPromise first = client.promise("first");
  const auto setters = [&](const OstrelAppInstallCoordinator& of) {
    return std::vector<Setter>{
        [&](auto error) { return of.setInstallOptions({}, error); },
        [&](auto error) { return of.setInitialVeylAssetPromises({client.promise("initial")}, error); },
        [&](auto error) { return of.setAppAssetPromise(client.promise("package"), error); },
        [&](auto error) { return of.setUserDataPromise(client.promise("data"), error); },
        [&](auto error) { return of.setPlaceholderPromise(client.placeholder("org.a"), error); }};
  };
  const auto has = [&] {
    return std::vector<bool>{coordinator.hasInstallOptions(), coordinator.hasInitialVeylAssetPromises(),
                             coordinator.hasAppAssetPromise(), coordinator.hasUserDataPromise(),
                             coordinator.hasPlaceholderPromise()};
  };
  EXPECT_EQ(has(), std::vector<bool>(5, false));
  // A promise that cannot be given gives nothing away, and one that was given is given for good.
  expectRefused({[&](auto error) { return coordinator.setInitialVeylAssetPromises({first, OstrelPromise()}, error); }});
  EXPECT_EQ(has(), std::vector<bool>(5, false));
  std::optional<Error> error;
  for (const Setter& setter : setters(coordinator)) EXPECT_TRUE(setter(&error)) << (error ? error->description() : "");
  EXPECT_EQ(has(), std::vector<bool>(5, true));
  expectRefused(setters(coordinator));

  const auto other = client.coordinator(Kind::Restoring, "org.b", true);
  ASSERT_TRUE(other.setInitialVeylAssetPromises({first}, nullptr));
  expectRefused({[&](auto out) { return other.setAppAssetPromise(first, out); }});
  const auto dead = client.coordinator(Kind::Restoring, "org.a", true);
  ASSERT_TRUE(dead.cancelForReason(kReason, 3, nullptr));
  const auto empty = client.coordinator(Kind::Restoring, "org.c", true);
  ASSERT_TRUE(empty.cancelForReason(kReason, 3, nullptr));
  expectRefused(setters(empty));
  expectRefused({[&](auto out) { return client.service().setAppAssetPromiseResponsibleClient(empty.ref(), 1, out); }});
  EXPECT_FALSE(empty.hasInstallOptions() || empty.hasAppAssetPromise() || empty.hasPlaceholderPromise());
}

TEST_P(OstrelContract, OnlyARestoreHasSomebodyResponsible) {
  OstrelService& service = client.service();
  const auto restore = client.coordinator(Kind::Restoring, "org.a", true);
  std::optional<Error> error;
  EXPECT_EQ(service.appAssetPromiseResponsibleClient(restore.ref(), &error), 0U);
  EXPECT_FALSE(error);
  for (const OstrelClientID responsible : {OstrelClientMerc, OstrelClientDovel}) {
    EXPECT_TRUE(service.setAppAssetPromiseResponsibleClient(restore.ref(), responsible, &error));
    EXPECT_EQ(service.appAssetPromiseResponsibleClient(restore.ref(), &error), responsible);
  }
  EXPECT_FALSE(error);
  const auto first = client.coordinator(Kind::Initiating, "org.b", true);
  const auto demoted = client.coordinator(Kind::RestoringDemoted, "org.c", true);
  for (const OstrelRef ref : {first.ref(), demoted.ref(), OstrelRef{}, client.promise("p").ref()}) {
    expectRefused({[&](auto out) { return service.setAppAssetPromiseResponsibleClient(ref, 1, out); },
                   [&](auto out) { return service.appAssetPromiseResponsibleClient(ref, out) != 0; }});
  }
}

TEST_P(OstrelContract, APromiseThatIsCancelledStaysAsItIsAndTakesItsCoordinatorAlong) {
  const auto free = client.promise("free");
  free.setComplete(true);
  ASSERT_TRUE(free.cancelForReason(kReason, 3, nullptr));
  free.setComplete(false);
  EXPECT_TRUE(free.isComplete());
  expectRefused({[&](auto error) { return free.cancelForReason(kReason, 3, error); },
                 [&](auto error) { return client.service().cancel(OstrelRef{~0ULL}, kReason, 3, error); }});
  auto coordinator = client.coordinator(Kind::Initiating, "org.a", true);
  coordinator.setObserver(heard);
  ASSERT_TRUE(client.configure(coordinator, "org.a"));
  const auto given = coordinator.appAssetPromiseWithError(nullptr);
  given.setComplete(true);
  given.setComplete(false);
  EXPECT_FALSE(given.isComplete());
  ASSERT_TRUE(given.cancelForReason(kReason, 3, nullptr));
  EXPECT_EQ(coordinator.error(), kReason);
  given.setComplete(true);
  EXPECT_FALSE(given.isComplete()) << "its coordinator is dead";
  coordinator = client.coordinator(Kind::Initiating, "org.b", true);
  ASSERT_TRUE(client.configure(coordinator, "org.b") && coordinator.cancelForReason(kReason, 3, nullptr));
  const auto late = coordinator.appAssetPromiseWithError(nullptr);
  expectRefused({[&](auto error) { return late.cancelForReason(kReason, 3, error); }});
  coordinator = {};
  device->settle();
  EXPECT_FALSE(client.hasPlaceholder("org.a") || client.hasPlaceholder("org.b"));
}

TEST_P(OstrelContract, WhatGivesWayIsOver) {
  ASSERT_TRUE(client.prepare(Kind::RestoringDemoted, "org.a"));
  device->settle();
  const auto old = client.coordinator(Kind::RestoringDemoted, "org.a", false);
  const auto live = client.coordinator(Kind::Initiating, "org.a", true);
  ASSERT_TRUE(old && live);
  EXPECT_NE(old.ref(), live.ref());
  expectRefused({[&](auto error) { return old.cancelForReason(kReason, 3, error); },
                 [&](auto error) { return old.setUserDataPromise(client.promise("p"), error); }});
  EXPECT_FALSE(live.error());
  EXPECT_TRUE(live.setInstallOptions({}, nullptr)) << "what happens to the old one is not the new one's";
}

TEST_P(OstrelContract, TheRegistryShowsThePlaceholderThatWasHandedOver) {
  auto coordinator = client.coordinator(Kind::RestoringDemoted, "org.a", true);
  const auto placeholder = client.placeholder("org.a", kPellumInstallTypeIntentionalDowngrade);
  const PropertyList info = PropertyList::dictionary({{"Other", "kept"}});
  auto attributes = OstrelPlaceholderAttributes::initWithInfoPlistDictionary(info);
  attributes.setBundleVersion("7");
  attributes.setLaunchProhibited(true);
  const auto metadata = KilnStoreMetadata::initWithDictionary(PropertyList::dictionary({{"title", "t"}}));
  ASSERT_TRUE(placeholder.setPlaceholderAttributes(attributes, nullptr) && placeholder.setMetadata(metadata, nullptr));
  ASSERT_TRUE(coordinator.setPlaceholderPromise(placeholder, nullptr));
  coordinator = {};
  device->settle();
  const auto record = client.registry().applicationProxyForIdentifier("org.a", true);
  ASSERT_TRUE(record);
  EXPECT_EQ(record->installType, kPellumInstallTypeIntentionalDowngrade);
  EXPECT_EQ(record->localizedName, "Name");
  EXPECT_EQ(record->bundleVersion, "7");
  const auto read = [&](const std::string& path) {
    return *parsePropertyList(*client.files().readFile(path, nullptr), nullptr);
  };
  const PropertyList shown = read(record->bundleURL->path() + "/Info.plist");
  EXPECT_EQ(shown.find("Other")->string(), "kept");
  EXPECT_EQ(shown.find("PellumApplicationLaunchProhibited")->boolean(), true);
  EXPECT_EQ(read(record->bundleContainerURL->path() + "/TarvoMetadata.plist"), metadata->dictionary());
}

TEST_P(OstrelContract, NobodyNeedsToListen) {
  EXPECT_FALSE(client.service().addInstallObserver("nobody", {OstrelClientDovel}, nullptr));
  for (const char* bundleID : {"org.a", "../org.a"}) client.service().uninstallApp(bundleID, false, nullptr);
  device->settle();
  ASSERT_TRUE(client.prepare(Kind::Initiating, "org.a") && client.deliver("org.a", client.putPackage("org.a", "1")));
  device->settle();
  EXPECT_EQ(client.installedVersion("org.a"), "1");
  const Error shown = client.service().createUserPresentableError(5, 0, kReason);
  EXPECT_EQ(shown.code(), 5);
  EXPECT_EQ(shown.underlyingError(), kReason);
}

}  // namespace appsync
