#include "client/apps_client.h"
#include "client/observer_relay.h"
#include "client/paths.h"
#include "coordination/cancellation_reasons.h"
#include "coordination/transaction_steps.h"
#include "restore/demotion_status.h"

namespace appsync {

namespace {

std::uint64_t installTypeForDemotionStatus(std::uint64_t demotionStatus) {
  switch (demotionStatus) {
    case kIntentionallyDemoted:
      return kPellumInstallTypeIntentionalDowngrade;
    case kAutomaticallyDemoted:
      return kPellumInstallTypeDowngrade;
    default:
      return kPellumInstallTypeRestore;
  }
}

std::optional<std::string> stringAt(const PropertyList& dictionary, const char* key) {
  const PropertyList* value = dictionary.find(key);
  return value != nullptr ? value->string() : std::nullopt;
}

std::optional<bool> flagAt(const PropertyList& dictionary, const char* key) {
  const PropertyList* value = dictionary.find(key);
  return value != nullptr ? value->flag() : std::nullopt;
}

}  // namespace

// One application on its way to a coordinator that restores it.
struct AppsClient::RestorePreparation {
  const std::string& bundleID;
  BytesView tarvoMetadata;
  std::optional<BytesView> iconData;
  std::uint64_t demotionStatus = kNotDemoted;

  OstrelAppInstallCoordinator coordinator;
  OstrelPlaceholder placeholder;   // until the coordinator has accepted it
  std::optional<Error> lastError;  // of whatever step reported one
  bool isTheStores = false;        // the store answers for the application already
};

bool AppsClient::prepareAppForRestoreUsingCoordination(const std::string& bundleID, BytesView tarvoMetadata,
                                                       std::optional<BytesView> iconData,
                                                       std::uint64_t demotionStatus) {
  return demotionStatus != kNotDemoted
             ? _prepareDemotedAppForRestoreWithBundleId(bundleID, tarvoMetadata, iconData, demotionStatus)
             : _prepareNonDemotedAppForRestoreWithBundleId(bundleID, tarvoMetadata, iconData);
}

bool AppsClient::_prepareDemotedAppForRestoreWithBundleId(const std::string& bundleID, BytesView tarvoMetadata,
                                                          std::optional<BytesView> iconData,
                                                          std::uint64_t demotionStatus) {
  RestorePreparation restore{bundleID, tarvoMetadata, iconData, demotionStatus, {}, {}, {}};
  _log("processing app restore for demoted bundle '%{public}@' with install coordination", bundleID);
  stepBegins(*_platform.transactionLog, TransactionStep::RestoreApp, bundleID, "Restore demoted app");
  const bool ready = setUpDemotedRestore(restore);
  _log("processing app restore for demoted app %{public}@ finished with status %d error %{public}@", bundleID, ready,
       restore.lastError);
  stepEnds(*_platform.transactionLog, TransactionStep::RestoreApp, ready, bundleID, "Restore demoted app");
  if (!ready) giveRestoreUp(restore);
  return ready;
}

bool AppsClient::_prepareNonDemotedAppForRestoreWithBundleId(const std::string& bundleID, BytesView tarvoMetadata,
                                                             std::optional<BytesView> iconData) {
  RestorePreparation restore{bundleID, tarvoMetadata, iconData, kNotDemoted, {}, {}, {}};
  _log("processing app restore for non demoted bundle '%{public}@' with install coordination", bundleID);
  stepBegins(*_platform.transactionLog, TransactionStep::RestoreApp, bundleID, "Restore app");
  const bool ready = setUpRestore(restore);
  if (!restore.isTheStores) {
    _log("processing app restore for %{public}@ finished with status %d error %{public}@", bundleID, ready,
         restore.lastError);
  }
  stepEnds(*_platform.transactionLog, TransactionStep::RestoreApp, ready, bundleID, "Restore app");
  if (!ready) giveRestoreUp(restore);
  return ready;
}

// --- the steps ------------------------------------------------------------------------------------------------------

bool AppsClient::setUpDemotedRestore(RestorePreparation& restore) {
  const std::optional<PropertyList> metadata = parseTarvoMetadata(restore);
  if (!metadata) return false;
  restore.coordinator = OstrelRestoringDemotedAppInstallCoordinator::coordinatorForAppWithBundleID(
      *_platform.coordination, restore.bundleID, OstrelClientDovel, true, nullptr, &restore.lastError);
  if (!restore.coordinator) return failForWantOfCoordinator(restore);
  restore.coordinator.setObserver(_relay);
  return provideUserData(restore) && providePlaceholder(restore, *metadata);
}

bool AppsClient::setUpRestore(RestorePreparation& restore) {
  const std::string& bundleID = restore.bundleID;
  const std::optional<PropertyList> metadata = parseTarvoMetadata(restore);
  if (!metadata) return false;
  const auto coordinator = OstrelRestoringAppInstallCoordinator::coordinatorForAppWithBundleID(
      *_platform.coordination, bundleID, OstrelClientDovel, true, nullptr, &restore.lastError);
  restore.coordinator = coordinator;
  if (!coordinator) return failForWantOfCoordinator(restore);
  const OstrelClientID responsible = coordinator.appAssetPromiseResponsibleClientWithError(nullptr);
  if (responsible == OstrelClientMerc) {
    _log("App asset DRI for %{public}@ is set to %lu - nothing more for dovel to do", bundleID, responsible);
    restore.isTheStores = true;
    return true;
  }
  coordinator.setObserver(_relay);
  if (!provideUserData(restore) || !providePlaceholder(restore, *metadata)) return false;
  if (!coordinator.setAppAssetPromiseResponsibleClient(OstrelClientMerc, &restore.lastError)) {
    _log.error("Error %{public}@ setting OstrelClientMerc to satisfy app data promise for '%{public}@'",
               restore.lastError, bundleID);
    return false;
  }
  _log("set OstrelClientMerc to satisfy app asset promise for %{public}@", bundleID);
  return true;
}

std::optional<PropertyList> AppsClient::parseTarvoMetadata(RestorePreparation& restore) {
  std::optional<PropertyList> metadata = parseDictionary(restore.tarvoMetadata, &restore.lastError);
  if (!metadata) {
    _log.error("failed to parse tarvo metadata for '%{public}@'. err=%{public}@", restore.bundleID, restore.lastError);
  }
  return metadata;
}

bool AppsClient::failForWantOfCoordinator(const RestorePreparation& restore) {
  _log.error("Error %{public}@ creating restore coordinator for %{public}@", restore.lastError, restore.bundleID);
  return false;
}

// The data of a restored application are on the device already, so there is nothing to wait for.
bool AppsClient::provideUserData(RestorePreparation& restore) {
  const std::string& bundleID = restore.bundleID;
  if (restore.coordinator.hasUserDataPromise()) {
    _log("Coordinator for %{public}@ has a valid user data promise", bundleID);
    return true;
  }
  const OstrelPromisedOutOfBandTransfer promise = _userDataPromiseForBundleIdentifier(bundleID);
  if (!promise) return true;
  if (!restore.coordinator.setUserDataPromise(promise, &restore.lastError)) {
    _log.error("Error %{public}@ adding out of band data promise for '%{public}@'", restore.lastError, bundleID);
    return false;
  }
  _log("Added out of band user data promise for for %{public}@", bundleID);
  return true;
}

bool AppsClient::providePlaceholder(RestorePreparation& restore, const PropertyList& metadata) {
  const std::string& bundleID = restore.bundleID;
  if (restore.coordinator.hasPlaceholderPromise()) {
    _log("Coordinator for %{public}@ has a valid placeholder promise", bundleID);
    return true;
  }
  restore.placeholder =
      _placeHolderForBundleIdentifierWithTarvoMetadata(bundleID, metadata, restore.iconData, restore.demotionStatus);
  if (!restore.placeholder) return false;
  if (!restore.coordinator.setPlaceholderPromise(restore.placeholder, &restore.lastError)) {
    _log.error("Error %{public}@ setting placeholder promise for '%{public}@'", restore.lastError, bundleID);
    return false;
  }
  restore.placeholder = {};
  dataMigratorSetPlaceHolderPromiseForRestoreAppBundle(bundleID);
  _log("added placeholder promise for %{public}@", bundleID);
  return true;
}

void AppsClient::giveRestoreUp(const RestorePreparation& restore) {
  const Error reason = cancellationReason(kReasonRestoreNotSetUp);
  if (restore.coordinator) {
    _log("Cancelling coordinator for appBundleIdentifier:%{public}@", restore.bundleID);
    restore.coordinator.cancelForReason(reason, OstrelClientDovel, nullptr);
  }
  if (restore.placeholder) {
    _log("Cancelling placeholder for appBundleIdentifier:%{public}@", restore.bundleID);
    restore.placeholder.cancelForReason(reason, OstrelClientDovel, nullptr);
  }
  dataMigratorCancelledCoordinatorForRestoreAppBundle(restore.bundleID);
}

// --- the placeholder ------------------------------------------------------------------------------------------------

OstrelPlaceholder AppsClient::_placeHolderForBundleIdentifierWithTarvoMetadata(const std::string& bundleID,
                                                                               const PropertyList& tarvoMetadata,
                                                                               std::optional<BytesView> iconData,
                                                                               std::uint64_t demotionStatus) {
  const std::string directory = placeholderAppPathForBundleIdentifier(bundleID);
  if (!createPlaceHolderPath(directory, bundleID, mobileAttributes())) return {};
  const std::string iconPath = directory + "/Icon.png";
  std::uint64_t iconSize = 0;
  writeIconData(iconData, iconPath, &iconSize, bundleID, mobileAttributes());

  std::optional<std::string> name = stringAt(tarvoMetadata, "title");
  if (!name) name = stringAt(tarvoMetadata, "itemName");
  OstrelPlaceholder placeholder = _placeHolderForBundleIdentifierName(bundleID, name.value_or(bundleID),
                                                                      installTypeForDemotionStatus(demotionStatus));
  if (!placeholder) return {};
  const bool hasIcon =
      iconSize == 0 || _createIconPromiseForBundleIdentifier(bundleID, iconPath, iconSize, placeholder, false);
  if (hasIcon && configureRestorePlaceholder(bundleID, placeholder, tarvoMetadata)) return placeholder;
  placeholder.cancelForReason(cancellationReason(kReasonRestoreNotSetUp), OstrelClientDovel, nullptr);
  return {};
}

bool AppsClient::configureRestorePlaceholder(const std::string& bundleID, const OstrelPlaceholder& placeholder,
                                             const PropertyList& tarvoMetadata) {
  std::optional<Error> error;
  OstrelPlaceholderAttributes attributes;
  std::optional<bool> isProhibited = flagAt(tarvoMetadata, kLaunchProhibitedKey);
  if (!isProhibited) isProhibited = flagAt(tarvoMetadata, "launchProhibited");
  attributes.setLaunchProhibited(isProhibited.value_or(false));
  attributes.setBundleVersion(stringAt(tarvoMetadata, "bundleVersion"));
  if (!placeholder.setPlaceholderAttributes(attributes, &error)) {
    _log.error("Error %{public}@ setting placeholder attributes for '%{public}@'", error, bundleID);
    return false;
  }
  _log("set %{public}@ placeholder attributes for %{public}@", attributes, bundleID);
  if (!placeholder.setMetadata(KilnStoreMetadata::initWithDictionary(tarvoMetadata), &error)) {
    _log.error("Error %{public}@ setting store metadata for '%{public}@'", error, bundleID);
    return false;
  }
  _log("set store metadata on placeholder for %{public}@", bundleID);
  if (!placeholder.setConfigurationCompleteWithError(&error)) {
    _log.error("Error %{public}@ setting placeholder configuration as complete for '%{public}@'", error, bundleID);
    return false;
  }
  _log("set placeholder configuration complete for %{public}@", bundleID);
  return true;
}

}  // namespace appsync
