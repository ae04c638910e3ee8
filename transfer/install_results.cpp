#include "client/apps_client.h"
#include "client/paths.h"

namespace appsync {

void AppsClient::assetInstallSucceeded(const DovelAssetRef& asset) {
  const std::string& id = asset->identifier();
  _log("%{public}@ install succeeded", id);
  changeAssetID(id, kTodoInstalled);
  cleanRestoreStateForIdentifier(id);
}

void AppsClient::assetInstallFailed(const DovelAssetRef& asset, const std::optional<Error>& error) {
  const std::string& id = asset->identifier();
  const bool recoverable = _isRecoverableError(error);
  if (asset->isRestore() || recoverable) {
    _log("%{public}@ install failed but was recoverable: %{public}@", id, error);
    _platform.transactionLog->logScenario("Orrin restore", 0, false, id, "install failed recoverably");
  } else {
    _log("%{public}@ install failed unrecoverably: %{public}@", id, error);
    changeAssetID(id, kTodoFailed);
    uninstallAppUsingCoordination(id);
  }
  cleanRestoreStateForIdentifier(id);
}

bool AppsClient::_isRecoverableError(const std::optional<Error>& error) {
  _log("Ostrel is enabled - treating error %{public}@ as non recoverable", error);
  return false;
}

}  // namespace appsync
