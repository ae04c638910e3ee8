#include "client/apps_client.h"
#include "client/paths.h"
#include "transfer/asset_parts.h"

namespace appsync {

namespace {

std::optional<std::string> versionOf(const DovelAsset& asset) {
  const PropertyList* version = asset.variantOptions().find("Version");
  return version != nullptr ? version->string() : std::nullopt;
}

}  // namespace

// The fraction is the daemon's and only logged: the promise gets what the record says.
void AppsClient::assetTransferUpdatedProgress(const DovelAssetRef& asset, double progress) {
  const std::string& id = asset->identifier();
  _log("finished transferring %lf for %{public}@", progress, id);
  bool existingApp = false;
  {
    const OnQueue on(_accessQueue);
    existingApp = _updatingApps.contains(id);
  }
  updateTransferProgressForApp(asset, existingApp);
  const MutexLock lock(_memberLock);
  _outstandingWispTransfers.insert(id);
}

void AppsClient::assetTransferSucceeded(const DovelAssetRef& asset, bool succeeded, const std::optional<Error>& error) {
  const std::string& id = asset->identifier();
  bool existingApp = false;
  bool userCancelled = false;
  {
    const OnQueue on(_accessQueue);
    existingApp = _updatingApps.erase(id) > 0;
    userCancelled = _userCancelledApps.erase(id) > 0;
  }
  {
    const MutexLock lock(_memberLock);
    _outstandingWispTransfers.erase(id);
  }
  _log("transfer for asset %{public}@ ended with success %c error %{public}@ existingApp:%d", asset, yesOrNo(succeeded),
       error, existingApp);
  if (succeeded) {
    receiveAsset(asset, existingApp);
    return;
  }
  const bool recoverable = _isRecoverableError(error);
  _log("failed to transfer asset %{public}@. err=%{public}@, recoverable=%d", id, error, recoverable);
  if (!_platform.defaultWorkspace->applicationIsInstalled(id) || asset->isRestore()) return;
  _log("Uninstalling placeholder %{public}@", id);
  if (!userCancelled) transferCompleteForApp(asset, error, existingApp);
}

void AppsClient::receiveAsset(const DovelAssetRef& asset, bool existingApp) {
  const std::string& id = asset->identifier();
  _log("asset transfer succeeded for %{public}@", id);
  settlePath(*asset);
  if (!isValidPath(asset->path())) {
    _log("Ignoring invalid path: %{public}@", asset->path());
    return;
  }
  if (!asset->isDownload()) {
    changeAssetID(id, kTodoSent);
    return;
  }
  _log("Received file at %{public}@", asset->path());
  changeAssetID(id, kTodoDownloaded);
  if (!asset->isRestore()) {
    _log("Installing synced asset %{public}@", asset);
    transferCompleteForApp(asset, std::nullopt, existingApp);
  } else if (asset->completedAssetParts() == kDovelAssetPartApplicationData) {
    _log("Not processing kDovelAssetPartApplicationData for restore asset %{public}@ as coordination is enabled",
         asset);
  } else {
    _log("Not processing restore asset %{public}@ as coordination is enabled", asset);
  }
}

// Makes the path of the received file absolute; without one, takes what an earlier transfer has left on record.
void AppsClient::settlePath(DovelAsset& asset) {
  if (!asset.path()) {
    const auto recorded = _restoreStatePropertyForKey("path", asset.identifier(), versionOf(asset));
    asset.setPath(recorded ? recorded->string() : std::nullopt);
  } else if (!asset.path()->starts_with('/')) {
    asset.setPath(makeText("%s/%@", kStagingRoot, asset.path()));
  }
}

}  // namespace appsync
