#include "client/apps_client.h"
#include "coordination/cancellation_reasons.h"
#include "coordination/transaction_steps.h"

namespace appsync {

OstrelAppInstallCoordinator AppsClient::_initiatingOrUpdatingAppInstallCoordinatorForBundleIdentifier(
    const std::string& bundleID, bool existingApp, bool createIfNotExisting, ErrorOut error) {
  stepBegins(*_platform.transactionLog, TransactionStep::CreateCoordinator, bundleID, "Create coordinator");
  const char* kind = existingApp ? "updating" : "initiating";
  std::optional<Error> lookUpError;
  auto coordinator =
      existingApp
          ? OstrelUpdatingAppInstallCoordinator::coordinatorForAppWithBundleID(
                *_platform.coordination, bundleID, OstrelClientDovel, createIfNotExisting, nullptr, &lookUpError)
          : OstrelInitiatingAppInstallCoordinator::coordinatorForAppWithBundleID(
                *_platform.coordination, bundleID, OstrelClientDovel, createIfNotExisting, nullptr, &lookUpError);
  if (coordinator) {
    const OstrelClientID creator = coordinator.creatorIdentifier();
    if (creator != OstrelClientDovel) {
      _log(
          "Ostrel returned %s coordinator %{public}@ (createIfNotExisting:%d, existingApp:%d, creatorIdentifier=%lu) "
          "for %{public}@ with error %{public}@ - Will not perform install/update for this bundle",
          kind, coordinator, createIfNotExisting, existingApp, creator, bundleID, lookUpError);
      coordinator = {};
    } else {
      _log(
          "Created %s coordinator %{public}@ (createIfNotExisting:%d, existingApp:%d) for %{public}@ with error "
          "%{public}@",
          kind, coordinator, createIfNotExisting, existingApp, bundleID, lookUpError);
    }
  }
  setError(error, lookUpError);
  stepEnds(*_platform.transactionLog, TransactionStep::CreateCoordinator, static_cast<bool>(coordinator), bundleID,
           "Finished creating coordinator");
  return coordinator;
}

OstrelPlaceholder AppsClient::_placeHolderForBundleIdentifierName(const std::string& bundleID, const std::string& name,
                                                                  std::uint64_t installType) {
  stepBegins(*_platform.transactionLog, TransactionStep::CreatePlaceholder, bundleID, "Create placeholder");
  OstrelPlaceholder placeholder = OstrelPlaceholder::initAppPlaceholderWithBundleName(
      *_platform.coordination, name, bundleID, installType, OstrelClientDovel);
  stepEnds(*_platform.transactionLog, TransactionStep::CreatePlaceholder, static_cast<bool>(placeholder), bundleID,
           "Finished creating placeholder");
  _log("Created placeholder %{public}@ for '%{public}@' of type %lu", placeholder, bundleID, installType);
  return placeholder;
}

OstrelPromisedTransferToPath AppsClient::_createIconPromiseForBundleIdentifier(const std::string& bundleID,
                                                                               const std::string& transferPath,
                                                                               std::uint64_t diskSpaceNeeded,
                                                                               const OstrelPlaceholder& placeHolder,
                                                                               bool forAppInstall) {
  if (!placeHolder) {
    _log.error("Placeholder to add icon promise is nil for '%{public}@'", bundleID);
    return {};
  }
  auto promise =
      OstrelPromisedTransferToPath::initWithName(*_platform.coordination, bundleID + "-Icon", OstrelClientDovel,
                                                 FileURL::fileURLWithPath(transferPath, false), diskSpaceNeeded);
  if (!promise) return {};
  promise.setPercentComplete(1.0);
  promise.setComplete(true);
  std::optional<Error> error;
  if (!placeHolder.setIconPromise(promise, &error)) {
    _log.error("Error %{public}@ adding icon promise to placeholder for '%{public}@'", error, bundleID);
    const auto reason = cancellationReason(forAppInstall ? kReasonPromiseNotAdded : kReasonRestoreNotSetUp);
    promise.cancelForReason(reason, OstrelClientDovel, nullptr);
    return {};
  }
  _log("Added icon promise to placeholder for '%{public}@'", bundleID);
  return promise;
}

OstrelPromisedTransferToPath AppsClient::_createAppAssetPromiseForBundleIdentifier(
    const std::string& bundleID, const std::optional<std::string>& path,
    const OstrelAppInstallCoordinator& coordinatinator) {
  if (!coordinatinator) return {};
  const auto url = path ? FileURL::fileURLWithPath(*path, false) : std::nullopt;
  auto promise = OstrelPromisedTransferToPath::initWithName(*_platform.coordination, bundleID + "-Asset",
                                                            OstrelClientDovel, url, 0);
  if (!promise) {
    _log.error("Error creating asset promise for '%{public}@'", bundleID);
    return {};
  }
  std::optional<Error> error;
  if (!coordinatinator.setAppAssetPromise(promise, &error)) {
    _log.error("Error %{public}@ adding app asset promise at %{public}@ to '%{public}@'", error, path, bundleID);
    _log.error("Cancelling asset promise for '%{public}@'", bundleID);
    promise.cancelForReason(cancellationReason(kReasonPromiseNotAdded), OstrelClientDovel, nullptr);
    return {};
  }
  _log("Added app asset promise to coordinator for '%{public}@'", bundleID);
  return promise;
}

OstrelPromisedOutOfBandTransfer AppsClient::_userDataPromiseForBundleIdentifier(const std::string& bundleID) {
  auto promise = OstrelPromisedOutOfBandTransfer::initWithName(*_platform.coordination, bundleID + "-UserData",
                                                               OstrelClientDovel, 0);
  promise.setPercentComplete(1.0);
  promise.setComplete(true);
  return promise;
}

}  // namespace appsync
