#include "client/apps_client.h"
#include "client/paths.h"
#include "platform/kiln.h"

namespace appsync {

std::optional<PropertyList> AppsClient::_loadPlist(FileManager& files, const ClientLog& log, const std::string& path,
                                                   ErrorOut error) {
  const std::optional<Bytes> bytes = files.readFile(path, error);
  if (!bytes || bytes->empty()) return std::nullopt;
  std::optional<PropertyList> list = parsePropertyList(*bytes, error);
  if (!list) {
    log.error("couldn't parse todo list");
    return std::nullopt;
  }
  if (!list->isArray()) {
    log.error("todo list is not an array");
    return std::nullopt;
  }
  return list;
}

void AppsClient::changeAssetID(const std::string& bundleID, const std::string& toDo) {
  const MutexLock lock(_todoListLock);
  std::optional<PropertyList> list = _loadPlist(*_platform.files, _log, kTodoListPath, nullptr);
  if (!list) return;
  for (std::size_t index = 0; index < list->count(); ++index) {
    PropertyList entry = list->elements()[index];
    const PropertyList* identifier = entry.find("identifier");
    if (identifier == nullptr || identifier->stringView() != std::string_view(bundleID)) continue;
    const PropertyList* operation = entry.find("operation");
    _log("Changing %{public}@ from %{public}@ to %{public}@", bundleID,
         operation != nullptr ? std::optional(*operation) : std::nullopt, toDo);
    entry.set("operation", toDo);
    list->replace(index, entry);
    if (const auto bytes = serializePropertyList(*list, PropertyListFormat::Binary, nullptr)) {
      _platform.files->writeFile(kTodoListPath, *bytes, nullptr);
    }
    return;
  }
}

void AppsClient::clearSyncData() {
  _log("blasting work area");
  {
    const MutexLock todoListLock(_todoListLock);
    const MutexLock restoreStateLock(_restoreStateLock);
    _platform.files->removeItem(kStateRoot, nullptr);
  }
  _log("Uninstalling all placeholder apps");
  _enumeratePlaceholdersWithBlock([this](const PellumApplicationProxy& placeholder, bool& /*stop*/) {
    const bool removed = _platform.defaultWorkspace->uninstallApplication(placeholder.bundleIdentifier, nullptr);
    _log("Uninstall %{public}@ = %c", placeholder.bundleIdentifier, yesOrNo(removed));
  });
  const std::optional<PropertyList> uninstalled = _platform.installer->KilnLookupUninstalled();
  if (!uninstalled) {
    _log.error("Failed to fetch uninstalled apps list to clear it");
    return;
  }
  std::vector<std::string> bundleIDs;
  for (const auto& [bundleID, value] : uninstalled->members()) bundleIDs.emplace_back(bundleID);
  if (_platform.installer->KilnClearUninstalled(bundleIDs) != 0) _log.error("Failed to clear uninstalled apps list");
}

}  // namespace appsync
