#include "client/apps_client.h"
#include "client/observer_relay.h"
#include "client/paths.h"
#include "coordination/cancellation_reasons.h"
#include "coordination/transaction_steps.h"

namespace appsync {

// One application on its way to a coordinator that waits for its package.
struct AppsClient::InstallPreparation {
  std::string bundleID;
  std::optional<std::string> displayName;
  std::optional<std::string> version;
  std::optional<PropertyList> infoPlist;
  std::optional<PropertyList> storePlist;
  std::optional<FileURL> iconSource;
  bool existingApp = false;

  OstrelAppInstallCoordinator coordinator;
  OstrelPlaceholder placeholder;
  std::optional<KilnStoreMetadata> storeMetadata;  // absent too when the coordinator had its options already
  std::string iconPath;
  std::uint64_t iconSize = 0;      // bytes; 0: no icon
  std::optional<Error> lastError;  // of whatever step reported one, fatal or not
};

bool AppsClient::prepareAppForInstallUsingCoordination(const DovelAssetRef& asset, bool existingApp) {
  InstallPreparation install;
  install.bundleID = asset->identifier();
  install.displayName = asset->prettyName();
  install.infoPlist = dictionaryAtPath(asset->infoPlist());
  install.storePlist = dictionaryAtPath(asset->storePlist());
  install.iconSource = asset->icon();
  install.existingApp = existingApp;
  if (const PropertyList* version = asset->variantOptions().find("Version")) install.version = version->string();
  _log.summary(
      "processing app install for bundle '%{public}@', title %{public}@ assetplist %{public}@, version %{public}@ with "
      "install coordination",
      install.bundleID, install.displayName, install.infoPlist, install.version);
  stepBegins(*_platform.transactionLog, TransactionStep::InstallApp, install.bundleID,
             existingApp ? "Update app" : "Install App");
  const bool ready = setUpCoordinator(install);
  _log("processing app install for bundle %{public}@ finished with status %d error %{public}@", install.bundleID, ready,
       install.lastError);
  stepEnds(*_platform.transactionLog, TransactionStep::InstallApp, ready, install.bundleID, "Install app");
  if (!ready) cancelPreparation(install);
  return ready;
}

bool AppsClient::setUpCoordinator(InstallPreparation& install) {
  const std::string& bundleID = install.bundleID;
  if (install.displayName.value_or("").empty() && bundleID.empty()) return false;
  install.coordinator = _initiatingOrUpdatingAppInstallCoordinatorForBundleIdentifier(bundleID, install.existingApp,
                                                                                      true, &install.lastError);
  if (!install.coordinator) return false;
  install.coordinator.setObserver(_relay);
  if (!setInstallOptions(install) || !setVeylAssetPromises(install)) return false;
  if (install.coordinator.hasAppAssetPromise()) {
    _log("coordinator for %{public}@ has an app asset promise", bundleID);
  } else if (!_createAppAssetPromiseForBundleIdentifier(bundleID, std::nullopt, install.coordinator)) {
    return false;
  }
  if (install.coordinator.hasPlaceholderPromise()) {
    _log("coordinator for %{public}@ has a placeholder promise", bundleID);
    return true;
  }
  copyIcon(install);
  makePlaceholder(install);
  if (!install.coordinator.setPlaceholderPromise(install.placeholder, &install.lastError)) {
    _log.error("Error %{public}@ adding placeholder promise to coordinator for '%{public}@'", install.lastError,
               bundleID);
    return false;
  }
  _log("added placeholder promise to coordinator for %{public}@", bundleID);
  return true;
}

bool AppsClient::setInstallOptions(InstallPreparation& install) {
  if (install.coordinator.hasInstallOptions()) {
    _log("coordinator for %{public}@ has install options", install.bundleID);
    return true;
  }
  install.storeMetadata = KilnStoreMetadata::initWithDictionary(install.storePlist);
  KilnInstallOptions options;
  options.setTarvoMetadata(install.storeMetadata);
  options.setPellumInstallType(kPellumInstallTypeSync);
  options.setInstallTargetType(1);
  if (!install.coordinator.setInstallOptions(options, &install.lastError)) {
    _log.error("Error %{public}@ setting install options on coordinator for '%{public}@'", install.lastError,
               install.bundleID);
    return false;
  }
  _log("set install options on coordinator for %{public}@", install.bundleID);
  return true;
}

bool AppsClient::setVeylAssetPromises(InstallPreparation& install) {
  if (install.coordinator.hasInitialVeylAssetPromises()) {
    _log("coordinator for %{public}@ has an Veyl app asset promise", install.bundleID);
    return true;
  }
  if (!install.coordinator.setInitialVeylAssetPromises({}, &install.lastError)) {
    _log.error("Error %{public}@ setting Veyl asset promise for '%{public}@'", install.lastError, install.bundleID);
    return false;
  }
  _log("set Veyl asset promise to install coordinator for %{public}@", install.bundleID);
  return true;
}

void AppsClient::copyIcon(InstallPreparation& install) {
  const std::string& bundleID = install.bundleID;
  const std::string directory = placeholderAppPathForBundleIdentifier(bundleID);
  if (!createPlaceHolderPath(directory, bundleID, mobileAttributes()) || !install.iconSource) return;
  install.iconPath = directory + "/Icon.png";
  stepBegins(*_platform.transactionLog, TransactionStep::CopyIcon, bundleID, "Copying icon");
  if (_platform.files->copyItem(install.iconSource->path(), install.iconPath, &install.lastError)) {
    if (const auto information = _platform.files->attributesOfItem(install.iconPath, &install.lastError)) {
      install.iconSize = information->size;
    }
    _log("icon for %{public}@ at %{public}@ has a size of %llu", bundleID, install.iconPath, install.iconSize);
  }
  _log("Copied icon from %{public}@ to %{public}@ with error %{public}@ for '%{public}@', sizeOnDisk:%llu",
       install.iconSource->path(), install.iconPath, install.lastError, bundleID, install.iconSize);
  stepEnds(*_platform.transactionLog, TransactionStep::CopyIcon, true, bundleID, "Copying icon");
}

// A placeholder whose icon cannot be promised is handed over bare: the install goes on without it.
void AppsClient::makePlaceholder(InstallPreparation& install) {
  install.placeholder = _placeHolderForBundleIdentifierName(
      install.bundleID, install.displayName.value_or(install.bundleID), kPellumInstallTypeSync);
  if (!install.placeholder) return;
  if (install.iconSize > 0 && !_createIconPromiseForBundleIdentifier(install.bundleID, install.iconPath,
                                                                     install.iconSize, install.placeholder, true)) {
    return;
  }
  configurePlaceholder(install);
}

void AppsClient::configurePlaceholder(InstallPreparation& install) {
  const std::string& bundleID = install.bundleID;
  auto attributes = OstrelPlaceholderAttributes::initWithInfoPlistDictionary(install.infoPlist);
  const PropertyList* prohibited = install.infoPlist ? install.infoPlist->find(kLaunchProhibitedKey) : nullptr;
  attributes.setLaunchProhibited(prohibited != nullptr && prohibited->flag().value_or(false));
  attributes.setBundleVersion(install.version);
  if (!install.placeholder.setPlaceholderAttributes(attributes, &install.lastError)) {
    _log.error("Error %{public}@ setting attributes on placeholder for '%{public}@'", install.lastError, bundleID);
    return;
  }
  _log("set %{public}@ attributes on placeholder for %{public}@", attributes, bundleID);
  if (!install.placeholder.setMetadata(install.storeMetadata, &install.lastError)) {
    _log.error("Error %{public}@ setting store metadata on placeholder for '%{public}@'", install.lastError, bundleID);
    return;
  }
  _log("set store metadata on placeholder for %{public}@", bundleID);
  if (install.placeholder.setConfigurationCompleteWithError(&install.lastError)) {
    _log("set placeholder configuration as complete for %{public}@", bundleID);
  } else {
    _log.error("Error %{public}@ setting placeholder configuration as complete for '%{public}@'", install.lastError,
               bundleID);
  }
}

void AppsClient::cancelPreparation(const InstallPreparation& install) {
  const Error reason = cancellationReason(kReasonInstallNotSetUp);
  if (install.placeholder) {
    _log("Cancelling placeholder for appBundleIdentifier:%{public}@", install.bundleID);
    install.placeholder.cancelForReason(reason, OstrelClientDovel, nullptr);
  }
  if (install.coordinator) {
    _log("Cancelling coordinator for appBundleIdentifier:%{public}@", install.bundleID);
    install.coordinator.cancelForReason(reason, OstrelClientDovel, nullptr);
  }
}

// A file that is missing, cannot be parsed or holds something else gives none.
std::optional<PropertyList> AppsClient::dictionaryAtPath(const std::optional<std::string>& path) {
  const std::optional<Bytes> bytes = path ? _platform.files->readFile(*path, nullptr) : std::nullopt;
  return bytes ? parseDictionary(*bytes, nullptr) : std::nullopt;
}

void AppsClient::uninstallAppUsingCoordination(const std::string& bundleID) {
  stepBegins(*_platform.transactionLog, TransactionStep::UninstallApp, bundleID, "Uninstall app");
  // The completion may come when the client is gone.
  OstrelAppInstallCoordinator::uninstallAppWithBundleID(
      *_platform.coordination, bundleID, false,
      [log = _log, transactionLog = _platform.transactionLog, bundleID](const std::optional<Error>& error) {
        log("Uninstall of %{public}@ with install coordinator succeeded wiht error %{public}@.", bundleID, error);
        stepEnds(*transactionLog, TransactionStep::UninstallApp, !error, bundleID, "Uninstall app");
      });
}

}  // namespace appsync
