#include "client/apps_client.h"
#include "client/paths.h"

namespace appsync {

// --- the file: application, version, property -----------------------------------------------------------------------

std::optional<PropertyList> AppsClient::readRestoreState(bool& fileIsReadable) {
  const std::optional<Bytes> bytes = _platform.files->readFile(kRestoreStatePath, nullptr);
  fileIsReadable = bytes.has_value();
  return bytes ? parseDictionary(*bytes, nullptr) : std::nullopt;
}

std::optional<PropertyList> AppsClient::_restoreStatePropertyForKey(const std::string& key,
                                                                    const std::string& identifier,
                                                                    const std::optional<std::string>& version) {
  bool fileIsReadable = false;
  const std::optional<PropertyList> root = readRestoreState(fileIsReadable);
  if (!root || !version) return std::nullopt;
  const PropertyList* versions = root->find(identifier);
  const PropertyList* properties = versions != nullptr ? versions->find(*version) : nullptr;
  const PropertyList* value = properties != nullptr ? properties->find(key) : nullptr;
  return value != nullptr ? std::optional(*value) : std::nullopt;
}

void AppsClient::cleanRestoreStateForIdentifier(const std::string& identifier) {
  const MutexLock lock(_restoreStateLock);
  bool fileIsReadable = false;
  std::optional<PropertyList> root = readRestoreState(fileIsReadable);
  if (!fileIsReadable) return;
  if (root) root->remove(identifier);
  if (!root || root->count() == 0) {
    _platform.files->removeItem(kRestoreStatePath, nullptr);
    return;
  }
  if (const auto bytes = serializePropertyList(*root, PropertyListFormat::XML, nullptr)) {
    _platform.files->writeFile(kRestoreStatePath, *bytes, nullptr);
  }
}

// --- the placeholders that a restore waits for ----------------------------------------------------------------------

void AppsClient::dataMigratorSetPlaceHolderPromiseForRestoreAppBundle(const std::string& bundleID) {
  const OnQueue on(_restoreQueue);
  if (_placeholdersForRestoringApps.contains(bundleID)) return;
  _restorePlaceHoldersWaitGroup.enter();
  const std::int64_t count = ++_restoringPlaceholderCount;
  _placeholdersForRestoringApps.insert(bundleID);
  _log("DataMigrator will wait for Ostrel to install placeholder for %{public}@, _restoringPlaceholderCount %lld",
       bundleID, count);
}

void AppsClient::dataMigratorCancelledCoordinatorForRestoreAppBundle(const std::string& bundleID) {
  const OnQueue on(_restoreQueue);
  if (!_placeholdersForRestoringApps.contains(bundleID)) return;
  _restorePlaceHoldersWaitGroup.leave();
  const std::int64_t count = --_restoringPlaceholderCount;
  _placeholdersForRestoringApps.erase(bundleID);
  _log("DataMigrator cancelled coordinator for restoring app bundle %{public}@ _restoringPlaceholderCount %lld",
       bundleID, count);
}

void AppsClient::ostrelDidInstallPlaceHolderForAppBundle(const std::optional<std::string>& bundleID) {
  const OnQueue on(_restoreQueue);
  if (_finishedWaitingForPlaceHolderInstalls) return;
  if (!bundleID || !_placeholdersForRestoringApps.contains(*bundleID)) {
    _log.error("Ignoring notification from Ostrel about installing placeholder for %{public}@", bundleID);
    return;
  }
  _restorePlaceHoldersWaitGroup.leave();
  const std::int64_t count = --_restoringPlaceholderCount;
  _placeholdersForRestoringApps.erase(*bundleID);
  _log("Ostrel finished installing placeholder for %{public}@, _restoringPlaceholderCount %lld", *bundleID, count);
}

}  // namespace appsync
