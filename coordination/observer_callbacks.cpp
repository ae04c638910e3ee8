#include "client/apps_client.h"
#include "client/paths.h"

namespace appsync {

namespace {

// A record that only names an application to the daemon.
DovelAssetRef bareAsset(const std::string& bundleID) {
  return DovelAsset::downloadAssetWithIdentifier(bundleID, kDataclass, std::nullopt);
}

}  // namespace

void AppsClient::promiseDidBeginFulfillmentWithIdentifier(std::uint64_t identifier) {
  _log("promiseDidBeginFulfillmentWithIdentifier %lu", identifier);
}

void AppsClient::coordinatorDidInstallPlaceholder(const OstrelAppInstallCoordinator& coordinator) {
  const std::optional<std::string> bundleID = coordinator.bundleID();
  _log("coordinatorDidInstallPlaceholder for %{public}@ with error %{public}@", bundleID, coordinator.error());
  ostrelDidInstallPlaceHolderForAppBundle(bundleID);
}

void AppsClient::coordinatorDidCompleteSuccessfully(const OstrelAppInstallCoordinator& coordinator) {
  const std::optional<std::string> bundleID = coordinator.bundleID();
  const std::optional<Error> error = coordinator.error();
  _log("coordinatorDidCompleteSuccessfully for %{public}@ with error %{public}@", bundleID, error);
  if (!bundleID) return;
  changeAssetID(*bundleID, error ? kTodoFailed : kTodoInstalled);
  cleanRestoreStateForIdentifier(*bundleID);
}

void AppsClient::coordinatorShouldPrioritize(const OstrelAppInstallCoordinator& coordinator) {
  const std::optional<std::string> bundleID = coordinator.bundleID();
  if (!bundleID) return;
  _log("Prioritize %{public}@", *bundleID);
  if (!_platform.sharedInstance->offers(DovelDeviceService::Operation::PrioritizeAsset)) {
    _log.error("Cannot prioritize %{public}@ as it's not supported", *bundleID);
    return;
  }
  // The completion may come when the client is gone.
  _platform.sharedInstance->prioritizeAsset(
      bareAsset(*bundleID), [log = _log, bundleID = *bundleID](const std::optional<Error>& error) {
        log("Prioritize %{public}@ finished with error %{public}@", bundleID, error);
      });
}

// The daemon is asked once for each application and sync to drop its transfer, however often this is reported.
void AppsClient::coordinatorCanceledWithReason(const OstrelAppInstallCoordinator& coordinator, const Error& /*reason*/,
                                               OstrelClientID /*client*/) {
  const std::optional<std::string> bundleID = coordinator.bundleID();
  if (!bundleID) return;
  bool alreadyCancelled = false;
  {
    const OnQueue on(_accessQueue);
    alreadyCancelled = !_userCancelledApps.insert(*bundleID).second;
  }
  if (!alreadyCancelled &&
      _platform.sharedInstance->offers(DovelDeviceService::Operation::CancelAssetTransferForFailedAsset)) {
    _log("Cancelling asset sync for %{public}@", *bundleID);
    _platform.sharedInstance->cancelAssetTransferForFailedAsset(bareAsset(*bundleID));
    return;
  }
  _log.error("Cannot cancel %{public}@ as it's already cancelled %d OR the call is not supported", *bundleID,
             alreadyCancelled);
}

void AppsClient::applicationInstallsDidCancel(const PellumApplicationProxies& /*applications*/) {
  _log("not handling applicationInstallsDidCancel because install coordination is enabled.");
}

}  // namespace appsync
