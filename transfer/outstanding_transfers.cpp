#include <algorithm>

#include "client/apps_client.h"
#include "client/paths.h"
#include "transfer/asset_parts.h"
#include "transfer/in_progress_asset_query.h"

namespace appsync {

namespace {

constexpr char kPathKey[] = "Path";
constexpr char kContainerKey[] = "Container";
constexpr char kNameFromTarvoKey[] = "NameFromTarvo";
constexpr char kIsRestoreKey[] = "IsRestore";
constexpr char kIntentionalDemotedKey[] = "intentional_demoted_app";
constexpr char kAutoDemotedKey[] = "auto_demoted_app";
constexpr char kSystemAppKey[] = "system_app";

void setIfPresent(PropertyList& dictionary, const char* key, const std::optional<std::string>& value) {
  if (value) dictionary.set(key, *value);
}

std::optional<std::string> pathOf(const std::optional<FileURL>& url) {
  return url ? std::optional(url->path()) : std::nullopt;
}

std::optional<std::string> stringUnder(const PropertyList& dictionary, const char* key) {
  const PropertyList* value = dictionary.find(key);
  return value != nullptr ? value->string() : std::nullopt;
}

bool flagUnder(const PropertyList& dictionary, const char* key) {
  const PropertyList* value = dictionary.find(key);
  return value != nullptr && value->flag().value_or(false);
}

// What is wanted for an application whose placeholder stands in the registry.
PropertyList entryForPlaceholder(const PellumApplicationProxy& placeholder) {
  PropertyList entry = PropertyList::dictionary({{kBundleIdentifierKey, placeholder.applicationIdentifier}});
  setIfPresent(entry, kBundleVersionKey, placeholder.bundleVersion);
  setIfPresent(entry, kPathKey, pathOf(placeholder.bundleURL));
  setIfPresent(entry, kContainerKey, pathOf(placeholder.bundleContainerURL));
  entry.set(kIsRestoreKey, placeholder.installType == kPellumInstallTypeRestore);
  entry.set(kIntentionalDemotedKey, placeholder.installType == kPellumInstallTypeIntentionalDowngrade);
  entry.set(kAutoDemotedKey, placeholder.installType == kPellumInstallTypeDowngrade);
  entry.set(kSystemAppKey, placeholder.applicationType == "System");
  return entry;
}

// What is wanted for an application that only the todo list names.
PropertyList entryForTodo(const std::string& identifier, const PropertyList& todo) {
  PropertyList entry = PropertyList::dictionary({{kBundleIdentifierKey, identifier}});
  setIfPresent(entry, kBundleVersionKey, stringUnder(todo, "version"));
  const std::string directory = makeText("%s/%@", kWorkArea, identifier);
  entry.set(kPathKey, directory);
  entry.set(kContainerKey, directory);
  setIfPresent(entry, kNameFromTarvoKey, stringUnder(todo, "name"));
  return entry;
}

}  // namespace

// A wanted entry, read.
struct AppsClient::WantedApp {
  explicit WantedApp(const PropertyList& entry)
      : id(stringUnder(entry, kBundleIdentifierKey).value_or("")),
        version(stringUnder(entry, kBundleVersionKey)),
        bundlePath(stringUnder(entry, kPathKey)),
        container(stringUnder(entry, kContainerKey)),
        nameFromTarvo(stringUnder(entry, kNameFromTarvoKey)),
        isRestore(flagUnder(entry, kIsRestoreKey)),
        autoDemoted(flagUnder(entry, kAutoDemotedKey)),
        intentionallyDemoted(flagUnder(entry, kIntentionalDemotedKey)),
        isSystemApp(flagUnder(entry, kSystemAppKey)) {}

  std::string id;
  std::optional<std::string> version;
  std::optional<std::string> bundlePath;
  std::optional<std::string> container;
  std::optional<std::string> nameFromTarvo;
  bool isRestore;
  bool autoDemoted;
  bool intentionallyDemoted;
  bool isSystemApp;
};

std::vector<DovelAssetRef> AppsClient::outstandingAssetTransfers() {
  std::vector<DovelAssetRef> answer;
  answer.reserve(16);
  const bool installationAllowed = _appInstallationAllowed();
  const std::optional<PropertyList> todoList = _loadPlist(*_platform.files, _log, kTodoListPath, nullptr);
  std::set<std::string> requested;
  _log.summary("outstandingAssetTransfers starting with todoList %{public}@", todoList);

  const std::set<std::string> systemAppPlaceholders = _getSystemAppPlaceholders();
  PropertyList preExistingPlaceHolders = PropertyList::dictionary();
  _enumeratePlaceholdersWithBlock([&](const PellumApplicationProxy& placeholder, bool& /*stop*/) {
    preExistingPlaceHolders.set(placeholder.applicationIdentifier, entryForPlaceholder(placeholder));
  });
  PropertyList idsWeWant = preExistingPlaceHolders;
  _log.summary("outstandingAssetTransfers preExistingPlaceHolders %{public}@, idsWeWant %{public}@",
               preExistingPlaceHolders, idsWeWant);

  if (todoList) addTodoEntries(*todoList, idsWeWant, requested);
  dropAppsInProgress(idsWeWant);
  const std::vector<PropertyList> ordered = _orderTheItems(*_platform.shell, *_platform.files, _log, idsWeWant);
  recreateIconScratchDirectory();
  for (const PropertyList& entry : ordered) {
    const WantedApp app(entry);
    if (isRuledOut(app, installationAllowed, requested.contains(app.id), systemAppPlaceholders)) continue;
    const DovelAssetRef asset = assetForApp(app);
    if (requestApp(asset)) answer.push_back(asset);
  }
  return answer;
}

// A placeholder's entry stays as it is, with its own version, paths and flags: the todo list only adds that the
// application is asked for.
void AppsClient::addTodoEntries(const PropertyList& todoList, PropertyList& idsWeWant,
                                std::set<std::string>& requested) {
  for (const PropertyList& todo : todoList.elements()) {
    const PropertyList* operation = todo.find("operation");
    if (operation == nullptr || operation->stringView() != std::string_view(kTodoInstall)) continue;
    const PropertyList* identifier = todo.find("identifier");
    if (!isValidPath(identifier)) {
      _log("Ignoring invalid path: %{public}@", identifier != nullptr ? std::optional(*identifier) : std::nullopt);
      continue;
    }
    const std::string id = *identifier->string();
    requested.insert(id);
    if (idsWeWant.find(id) == nullptr) {
      idsWeWant.set(id, entryForTodo(id, todo));
    } else {
      _log("%{public}@ already has a placeholder - skipping", id);
    }
  }
}

void AppsClient::dropAppsInProgress(PropertyList& idsWeWant) {
  std::optional<InProgressAssetQuery::Identifiers> inProgress;
  std::optional<InProgressAssetQuery::Identifiers> restoring;
  InProgressAssetQuery::currentInProgressAssetIDs(*_platform.defaultWorkspace, *_platform.waiting, _log, inProgress,
                                                  restoring);
  if (inProgress) {
    _log("Assets already in progress (not returning these): %{public}@", *inProgress);
    for (const std::string& id : *inProgress) idsWeWant.remove(id);
  } else {
    _log.error("Failed to get list of assets already in progress!");
  }
  if (restoring) {
    _log("Assets currently restoring: %{public}@", *restoring);
  } else {
    _log.error("Failed to get list of assets currently restoring!");
  }
}

void AppsClient::recreateIconScratchDirectory() {
  _platform.files->removeItem(kIconScratchDirectory, nullptr);
  std::optional<Error> error;
  if (!_platform.files->createDirectory(kIconScratchDirectory, false, {}, &error)) {
    _log.error("Can't create icon scratch dir! %{public}@", error);
  }
}

// The policy comes first: a restore passes it, and then falls to the store download daemon.
bool AppsClient::isRuledOut(const WantedApp& app, bool installationAllowed, bool requested,
                            const std::set<std::string>& systemAppPlaceholders) {
  if (!installationAllowed && !app.isRestore) {
    _log("skipping %{public}@ - its not a restore and app installation is disabled", app.id);
    return true;
  }
  if (app.isRestore) {
    _log("%{public}@ is currenlty marked to be restored and will be handled by mercd - skipping", app.id);
    return true;
  }
  if (app.isSystemApp) {
    _log("%{public}@ is auto demoted: %d, manual demoted: %d, system app:%d - skipping", app.id, app.autoDemoted,
         app.intentionallyDemoted, 1);
    return true;
  }
  if (systemAppPlaceholders.contains(app.id)) {
    _log("%{public}@ is system app placeholder - skipping", app.id);
    return true;
  }
  if (!app.autoDemoted && !app.intentionallyDemoted) return false;
  if (!requested) {
    _log("%{public}@ is currenlty demoted (manual:%d, auto:%d) - skipping", app.id, app.intentionallyDemoted,
         app.autoDemoted);
    return true;
  }
  _log("%{public}@ is currenlty demoted (manual:%d, auto:%d) - but will be installed as it's requested by client",
       app.id, app.intentionallyDemoted, app.autoDemoted);
  return false;
}

DovelAssetRef AppsClient::assetForApp(const WantedApp& app) {
  std::optional<Bundle> bundle;
  if (app.bundlePath) {
    if (const auto url = FileURL::fileURLWithPath(*app.bundlePath, true)) bundle = _platform.icons->bundleWithURL(*url);
  }
  const std::optional<std::string> displayName =
      bundle ? stringUnder(bundle->infoDictionary, kBundleDisplayNameKey) : std::nullopt;
  const std::string prettyName = displayName ? *displayName : app.nameFromTarvo.value_or(app.id);

  std::string iconPath = makeText("%s/%@.png", kIconScratchDirectory, app.id);
  if (!_makeIconFromBundlePath(*_platform.icons, *_platform.files, _log, app.bundlePath, iconPath)) {
    iconPath = makeText("%@/TarvoArtwork", app.container);
  }
  DovelAssetRef asset = DovelAsset::downloadAssetWithIdentifier(app.id, kDataclass, prettyName);
  asset->setIcon(FileURL::fileURLWithPath(iconPath, false));
  asset->setIsRestore(app.isRestore);

  logRestorePath(app);
  PropertyList options = PropertyList::dictionary(
      {{"AssetParts", PropertyList::integer(static_cast<std::int64_t>(kDovelAssetPartApplication))}});
  setIfPresent(options, "Version", app.version);
  asset->setVariantOptions(std::move(options));
  asset->setStorePlist(makeText("%@/TarvoMetadata.plist", app.container));
  asset->setInfoPlist(makeText("%@/Info.plist", app.bundlePath));
  asset->setAssetType(kDataclass);
  _log(
      "Asset %{public}@ (pretty=%{public}@, version=%{public}@) prepped with icon %{public}@, at %{public}@, meta at "
      "%{public}@, info at %{public}@, storePid=%lld, isRestore=%c",
      app.id, prettyName, app.version, asset->icon(), app.bundlePath, asset->storePlist(), asset->infoPlist(),
      asset->storePID(), yesOrNo(asset->isRestore()));
  return asset;
}

// A package that an earlier sync has received does not change what is asked for; that it is there is worth a line.
void AppsClient::logRestorePath(const WantedApp& app) {
  const std::optional<PropertyList> recorded = _restoreStatePropertyForKey("path", app.id, app.version);
  const std::optional<std::string> path = recorded ? recorded->string() : std::nullopt;
  if (!path) return;
  if (_platform.files->fileExists(*path)) {
    _log("Recovered download path for %{public}@ at %{public}@", app.id, *path);
  } else {
    _log("Download path recovered for %{public}@ but the file is missing: %{public}@", app.id, *path);
  }
}

bool AppsClient::requestApp(const DovelAssetRef& asset) {
  const std::string& id = asset->identifier();
  const auto installed = _platform.defaultWorkspace->applicationProxyForIdentifier(id, false);
  const bool existingApp = installed && installed->isInstalled() && !installed->isPlaceholder();
  if (existingApp) _log("App %{public}@ is already installed and will be updated.", id);
  if (!prepareAppForInstallUsingCoordination(asset, existingApp)) {
    _log.error("Not requesting app asset for %{public}@", id);
    changeAssetID(id, kTodoFailed);
    return false;
  }
  if (existingApp) {
    const OnQueue on(_accessQueue);
    _updatingApps.insert(id);
  }
  return true;
}

}  // namespace appsync
