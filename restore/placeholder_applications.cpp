#include "client/apps_client.h"
#include "client/paths.h"

namespace appsync {

// --- the placeholder's directory ------------------------------------------------------------------------------------

std::string AppsClient::placeholderAppPathForBundleIdentifier(const std::string& bundleID) {
  std::string path = _platform.files->temporaryDirectory();
  if (!path.ends_with('/')) path += '/';
  return path + "com.zelk.dovel.Apps/" + bundleID + ".app";
}

bool AppsClient::createPlaceHolderPath(const std::string& path, const std::string& forBundleIdentifier,
                                       const FileAttributes& attributes) {
  std::optional<Error> error;
  const bool created = _platform.files->createDirectory(path, true, attributes, &error);
  if (!created || error) {
    _platform.transactionLog->logScenario("Tarvo App Restore", 0, false, forBundleIdentifier,
                                          "Failed to create app directory");
  }
  _log("Created app directory for '%{public}@' at %{public}@ with err=%{public}@", forBundleIdentifier, path, error);
  return created;
}

bool AppsClient::writeIconData(std::optional<BytesView> iconData, const std::string& path,
                               std::uint64_t* returningFileSize, const std::string& forBundleIdentifier,
                               const FileAttributes& attributes) {
  if (!iconData) {
    _log.error("no icon data for '%{public}@'", forBundleIdentifier);
    return false;
  }
  const bool written = _platform.files->createFile(path, *iconData, attributes);
  std::uint64_t size = 0;
  if (written) {
    if (const auto information = _platform.files->attributesOfItem(path, nullptr)) {
      size = information->size;
      if (returningFileSize != nullptr) *returningFileSize = size;
    }
  }
  _log("icon data for '%{public}@' was writen to %{public}@ with status:%d fileSize:%llu", forBundleIdentifier, path,
       written, size);
  return written;
}

// --- the registry's placeholders ------------------------------------------------------------------------------------

void AppsClient::_enumeratePlaceholdersWithBlock(const PellumApplicationWorkspace::Block& block) {
  _platform.defaultWorkspace->enumerateBundlesOfType(kPellumBundleTypeAll,
                                                     [&](const PellumApplicationProxy& application, bool& stop) {
                                                       if (application.appState.isPlaceholder) block(application, stop);
                                                     });
}

std::set<std::string> AppsClient::_getSystemAppPlaceholders() {
  std::set<std::string> placeholders;
  _platform.defaultWorkspace->enumerateBundlesOfType(kPellumBundleTypeSystem,
                                                     [&](const PellumApplicationProxy& application, bool& /*stop*/) {
                                                       if (application.appState.isPlaceholder)
                                                         placeholders.insert(application.bundleIdentifier);
                                                     });
  _log("SystemAppPlaceholders %{public}@", placeholders);
  return placeholders;
}

}  // namespace appsync
