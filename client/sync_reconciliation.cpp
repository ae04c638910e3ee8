#include "client/apps_client.h"
#include "client/paths.h"
#include "platform/kiln.h"

namespace appsync {

bool AppsClient::reconcileSync(std::uint32_t /*type*/, const std::string& newAnchor,
                               const ProgressCallback& /*progressCallback*/, ErrorOut error) {
  _log("starting to reconcile sync with new anchor %{public}@", newAnchor);
  bool nothingToDo = false;
  const bool takenOver = takeOverStagedFiles(error, nothingToDo);
  if (takenOver && !nothingToDo) {
    const bool removalAllowed = _appRemovalAllowed();
    const std::optional<PropertyList> todoList = _loadPlist(*_platform.files, _log, kTodoListPath, error);
    if (!todoList) {
      _log("Nothing to do from Tarvo");
    } else if (!removalAllowed) {
      _log("Not processing deletes because app removal is restricted");
    } else {
      removeUnwantedApps(*todoList);
    }
    _notifyBrelm(*_platform.notifications, *_platform.shell, _log, true);
    sendIconLayout();
    if (todoList) {
      if (const auto bytes = serializePropertyList(*todoList, PropertyListFormat::Binary, nullptr)) {
        _platform.files->writeFile(kTodoListDebugPath, *bytes, nullptr);
      }
    }
  }
  _log("finished reconcile sync");
  return takenOver;
}

// Moves what the host has staged into the work area, in the place of the previous sync's.
bool AppsClient::takeOverStagedFiles(ErrorOut error, bool& nothingToDo) {
  const MutexLock lock(_todoListLock);
  _platform.files->removeItem(kWorkArea, nullptr);
  if (!_platform.files->createDirectory(kStateRoot, true, {}, error)) {
    _log("can't create work area");
    return false;
  }
  if (!_platform.files->fileExists(kStagingDirectory)) {
    _log("Nothing to do");
    nothingToDo = true;
    return true;
  }
  if (!_platform.files->moveItem(kStagingDirectory, kWorkArea, error)) {
    _log("Can't move staging area");
    return false;
  }
  return true;
}

void AppsClient::removeUnwantedApps(const PropertyList& todoList) {
  std::vector<std::string> unwanted;
  unwanted.reserve(8);
  for (const PropertyList& entry : todoList.elements()) {
    const PropertyList* identifier = entry.find("identifier");
    const PropertyList* operation = entry.find("operation");
    if (!isValidPath(identifier) || operation == nullptr) continue;
    if (operation->stringView() != std::string_view(kTodoRemove)) continue;
    _log("%{public}@ targeted for termination", *identifier);
    unwanted.push_back(*identifier->string());
  }
  if (unwanted.empty()) return;
  _log("performing %llu deletions", unwanted.size());
  for (const std::string& bundleID : unwanted) uninstallAppUsingCoordination(bundleID);
}

// Hands the host's layout to the shell as it is; what the shell makes of it does not matter here.
void AppsClient::sendIconLayout() {
  const std::optional<Bytes> layout =
      _platform.files->readFile(makeText("%@/BrelmIconState.plist", kWorkArea), nullptr);
  if (!layout || layout->empty()) return;
  _log("Sending iconlayout to Brelm");
  const BrelmPort port = _platform.shell->BrelmBlockableServerPort();
  _platform.shell->BrelmSetIconState(port, layout->data(), layout->size());
}

void AppsClient::syncEndedWithSuccess(bool success) {
  _log("sync ended with success: %c", yesOrNo(success));
  if (!success) return;
  if (const int errorNumber = _platform.files->utimes(kStateRoot); errorNumber != 0) {
    _log.error("Failed to update utimes of \"%s\": %s", kStateRoot, _platform.files->strerror(errorNumber));
  }
  std::optional<std::vector<std::string>> uninstalledApps;
  {
    const MutexLock lock(_memberLock);
    uninstalledApps = _uninstalledApps;
  }
  if (uninstalledApps) {
    _log("clearing uninstalled apps: %{public}@", *uninstalledApps);
    if (_platform.installer->KilnClearUninstalled(*uninstalledApps) != 0) {
      _log.error("Failed to clear uninstalled apps from Kiln.");
    } else {
      const MutexLock lock(_memberLock);
      _uninstalledApps.reset();
    }
  }
  _platform.files->removeItem(kLastSyncListPath, nullptr);
}

bool AppsClient::isValidPath(const PropertyList* value) {
  const auto text = value != nullptr ? value->stringView() : std::nullopt;
  return text && text->find("/..") == std::string_view::npos;
}

bool AppsClient::isValidPath(const std::optional<std::string>& path) {
  return path && path->find("/..") == std::string::npos;
}

}  // namespace appsync
