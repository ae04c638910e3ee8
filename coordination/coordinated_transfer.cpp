#include "client/apps_client.h"
#include "coordination/cancellation_reasons.h"

namespace appsync {

// The coordinator that waits for the application's package: made by this client, and neither failed nor cancelled.
OstrelAppInstallCoordinator AppsClient::liveCoordinator(const std::string& bundleID, bool existingApp) {
  auto coordinator =
      _initiatingOrUpdatingAppInstallCoordinatorForBundleIdentifier(bundleID, existingApp, false, nullptr);
  return coordinator && !coordinator.error() ? coordinator : OstrelAppInstallCoordinator{};
}

bool AppsClient::updateTransferProgressForApp(const DovelAssetRef& asset, bool existingApp) {
  const std::string& bundleID = asset->identifier();
  const auto coordinator = liveCoordinator(bundleID, existingApp);
  if (!coordinator) return false;
  auto promise = coordinator.appAssetPromiseWithError(nullptr);
  if (promise.isComplete()) {
    _log("Asset promise is already satisfied for %{public}@", bundleID);
    return false;
  }
  if (!promise) promise = _createAppAssetPromiseForBundleIdentifier(bundleID, asset->path(), coordinator);
  _log("Updating download progress: %f install progress:%f for %{public}@", asset->downloadProgress(),
       asset->installProgress(), bundleID);
  promise.setPercentComplete(static_cast<double>(asset->downloadProgress()));
  return true;
}

void AppsClient::transferCompleteForApp(const DovelAssetRef& asset, const std::optional<Error>& error,
                                        bool isExistingApp) {
  const std::string& bundleID = asset->identifier();
  const auto coordinator = liveCoordinator(bundleID, isExistingApp);
  if (!coordinator) return;
  if (error) {
    const Error reason = OstrelCreateUserPresentableError(*_platform.coordination, 1, 0, *error);
    coordinator.cancelForReason(reason, OstrelClientDovel, nullptr);
    return;
  }
  auto promise = coordinator.appAssetPromiseWithError(nullptr);
  if (promise.isComplete()) {
    _log("Asset promise is already satisfied for %{public}@", bundleID);
    return;
  }
  if (promise) {
    promise.setTransferPath(asset->path() ? FileURL::fileURLWithPath(*asset->path(), false) : std::nullopt);
  } else {
    promise = _createAppAssetPromiseForBundleIdentifier(bundleID, asset->path(), coordinator);
  }
  _log("Satisfying asset promise for %{public}@", bundleID);
  promise.setPercentComplete(1.0);
  promise.setComplete(true);
}

// Whoever made a coordinator, and whatever became of it: what never arrived is cancelled.
void AppsClient::assetSyncFinishedWithStatus(bool status, const std::set<std::string>& outstandingItems) {
  if (status) return;
  for (const std::string& bundleID : outstandingItems) {
    const auto coordinator = OstrelAppInstallCoordinator::coordinatorForAppWithBundleID(
        *_platform.coordination, bundleID, OstrelClientDovel, false, nullptr, nullptr);
    if (!coordinator) continue;
    const Error reason = cancellationReason(kReasonNeverTransferred);
    _log("Cancelling coordinator with error %{public}@ for %{public}@", reason, bundleID);
    coordinator.cancelForReason(reason, OstrelClientDovel, nullptr);
  }
}

}  // namespace appsync
