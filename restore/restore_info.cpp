#include <string_view>
#include <unordered_set>

#include "client/apps_client.h"
#include "client/paths.h"
#include "restore/demotion_status.h"

namespace appsync {

namespace {

constexpr char kRestoreListPath[] = "/var/mobile/Media/TarvoRestore/RestoreApplications.plist";
constexpr char kProcessedListPath[] = "/var/mobile/Library/Logs/MediaServices/RestoreApplications.plist";
constexpr char kDemotedAppsPath[] = "/var/mobile/Library/Preferences/com.zelk.Vaultry.DemotedApps.plist";

constexpr std::int64_t kSecondsForEachPlaceholder = 5;

// The applications that the backup service lists as demoted, for look-ups in constant time.
class DemotedApps {
 public:
  explicit DemotedApps(const std::optional<PropertyList>& list)
      : _automatic(identifiers(list, "AutomaticDowngrades")),
        _intentional(identifiers(list, "IntentionalDowngrades")) {}

  std::uint64_t statusOf(const std::string& bundleID) const {
    if (_automatic.contains(bundleID)) return kAutomaticallyDemoted;
    return _intentional.contains(bundleID) ? kIntentionallyDemoted : kNotDemoted;
  }

 private:
  using Identifiers = std::unordered_set<std::string>;

  static Identifiers identifiers(const std::optional<PropertyList>& list, const char* key) {
    Identifiers identifiers;
    const PropertyList* collection = list ? list->find(key) : nullptr;
    if (collection == nullptr) return identifiers;
    for (const PropertyList& element : collection->elements()) {
      if (const auto identifier = element.string()) identifiers.insert(*identifier);
    }
    return identifiers;
  }

  const Identifiers _automatic;
  const Identifiers _intentional;
};

std::optional<BytesView> dataAt(const PropertyList& dictionary, const char* key) {
  const PropertyList* value = dictionary.find(key);
  return value != nullptr ? value->data() : std::nullopt;
}

}  // namespace

bool AppsClient::reconcileRestoreOfType(std::int32_t type, ErrorOut error) {
  _log("reconcileRestoreOfType %d", type);
  _notifyBrelm(*_platform.notifications, *_platform.shell, _log, true);
  _platform.files->createDirectory(kStateRoot, true, {}, nullptr);
  std::optional<Error> backupError;
  if (type == 2 || type == 3) {
    if (_backupManager->dovelShouldCreateAppPlaceholdersWithError(&backupError)) {
      _processTarvoRestoreInfo();
    } else {
      _log("Will not reconcile restore of type %d - error %{public}@", type, backupError);
    }
  }
  if (error != nullptr) *error = backupError;
  return true;
}

bool AppsClient::_processTarvoRestoreInfo() {
  if (!_platform.files->fileExists(kRestoreListPath)) {
    _log("no tarvo restore plist found - skipping processing of tarvo restored apps");
    return true;
  }
  bool result = false;
  if (const std::optional<PropertyList> restoreInfo = readRestoreInfo()) {
    result = restoreApps(*restoreInfo);
    waitForPlaceholderInstalls();
  }
  moveRestoreListAway();
  return result;
}

std::optional<PropertyList> AppsClient::readRestoreInfo() {
  std::optional<Error> error;
  const std::optional<Bytes> bytes = _platform.files->readFile(kRestoreListPath, &error);
  if (!bytes) {
    _log("failed to read tarvo app restore info. err=%{public}@", error);
    return std::nullopt;
  }
  _log("processing tarvo restore info");
  std::optional<PropertyList> restoreInfo = parseDictionary(*bytes, &error);
  if (!restoreInfo) _log("failed to parse tarvo app restore info. err=%{public}@", error);
  return restoreInfo;
}

bool AppsClient::restoreApps(const PropertyList& restoreInfo) {
  const std::optional<PropertyList> demotedList =
      _loadDemotedAppsPlist(*_platform.files, _log, kDemotedAppsPath, nullptr);
  const DemotedApps demotedApps(demotedList);
  _log.summary("Demoted Apps: %{public}@", demotedList);
  bool result = false;
  for (const auto& [key, info] : restoreInfo.members()) {
    const std::string bundleID(key);
    const std::uint64_t demotionStatus = demotedApps.statusOf(bundleID);
    _log("processing tarvo restore info for '%{public}@' demotionStatus :%lu", bundleID, demotionStatus);
    if (!info.isDictionary()) {
      _log("no tarvo restore info for '%{public}@' - skipping", bundleID);
      continue;
    }
    const std::optional<BytesView> tarvoMetadata = dataAt(info, "TarvoMetadata");
    if (!tarvoMetadata) {
      _log("no TarvoMetadata for '%{public}@' - ignoring", bundleID);
      continue;
    }
    result = prepareAppForRestoreUsingCoordination(bundleID, *tarvoMetadata, dataAt(info, "PlaceholderIcon"),
                                                   demotionStatus);
  }
  return result;
}

// On the caller's thread: the restore queue stays free for the placeholders that are reported installed meanwhile.
void AppsClient::waitForPlaceholderInstalls() {
  const std::int64_t count = _restoringPlaceholderCount;
  const std::int64_t seconds = count * kSecondsForEachPlaceholder;
  const Waiting::Time deadline = _platform.waiting->now() + std::chrono::seconds(seconds);
  _log("Will wait for %lld seconds for %lld placeholders to install", seconds, count);
  _restorePlaceHoldersWaitGroup.wait(*_platform.waiting, deadline);
  const OnQueue on(_restoreQueue);
  _log("Finished waiting for placeholder installs");
  _finishedWaitingForPlaceHolderInstalls = true;
}

void AppsClient::moveRestoreListAway() {
  _platform.files->removeItem(kProcessedListPath, nullptr);
  std::optional<Error> error;
  if (!_platform.files->moveItem(kRestoreListPath, kProcessedListPath, &error)) {
    _log("failed to copy tarvo metadata. err=%{public}@", error);
  }
}

std::optional<PropertyList> AppsClient::_loadDemotedAppsPlist(FileManager& files, const ClientLog& log,
                                                              const std::string& path, ErrorOut error) {
  const std::optional<Bytes> bytes = files.readFile(path, error);
  if (!bytes || bytes->empty()) return std::nullopt;
  std::optional<PropertyList> list = parsePropertyList(*bytes, error);
  if (!list) {
    log.error("couldn't parse demoted apps list");
    return std::nullopt;
  }
  if (!list->isDictionary()) {
    log.error("demoted apps list is not a dictionary");
    return std::nullopt;
  }
  return list;
}

}  // namespace appsync
