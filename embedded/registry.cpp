#include "embedded/registry.h"

#include <algorithm>
#include <charconv>
#include <utility>

#include "embedded/file_manager.h"
#include "embedded/fresh_container.h"

namespace appsync {

namespace {

Error registryError(std::int64_t code, std::string text) {
  return Error(std::string(kRegistryErrorDomain), code, std::move(text));
}

bool diskFailure(const std::string& bundleID, const std::optional<Error>& cause, ErrorOut error) {
  const std::string text = "The registry cannot change its record of \"" + bundleID + "\"";
  setError(error, cause ? Error(std::string(kRegistryErrorDomain), kRegistryDisk, text, *cause)
                        : registryError(kRegistryDisk, text));
  return false;
}

bool isUsable(const std::string& bundleID, ErrorOut error) {
  if (isSinglePathComponent(bundleID)) return true;
  setError(error, registryError(kRegistryBadIdentifier, "A bundle identifier must be able to name a file"));
  return false;
}

std::string lastComponent(const std::string& path) {
  return path.substr(path.rfind('/') + 1);
}

// The number at the end of a container's path; 0 for a container of another name.
std::uint64_t serialOf(const std::string& path) {
  const std::string name = lastComponent(path);
  std::uint64_t serial = 0;
  const auto [end, problem] = std::from_chars(name.data(), name.data() + name.size(), serial);
  return problem == std::errc() && end == name.data() + name.size() && serial < kSerialLimit ? serial : 0;
}

// What a placeholder's bundle says of itself: what the application's would, as far as it is known, and of the files
// that it names only those that are there.
PropertyList placeholderInfo(const PlaceholderDescription& description) {
  PropertyList info = description.infoPlist && description.infoPlist->isDictionary() ? *description.infoPlist
                                                                                     : PropertyList::dictionary();
  info.set("TefBundleIdentifier", description.bundleID);
  info.set("TefBundleDisplayName", description.name);
  info.remove("TefBundleVersion");
  if (description.bundleVersion) info.set("TefBundleVersion", *description.bundleVersion);
  info.remove("TefBundleIconFiles");
  if (description.icon) info.set("TefBundleIconFiles", PropertyList::array({"Icon.png"}));
  info.set("PellumApplicationLaunchProhibited", description.launchProhibited);
  return info;
}

bool isRestored(const PellumApplicationProxy& record) {
  return record.installType == kPellumInstallTypeRestore || record.installType == kPellumInstallTypeDowngrade ||
         record.installType == kPellumInstallTypeIntentionalDowngrade;
}

// `isAlone`: the application has no other record.
bool belongsTo(std::uint64_t bundleType, const PellumApplicationProxy& record, bool isAlone) {
  switch (bundleType) {
    case kPellumBundleTypeAll:
      return true;
    case kPellumBundleTypeApplication:
      return record.isInstalled() || (isAlone && isRestored(record));
    case kPellumBundleTypeSystem:
      return record.applicationType == "System";
    default:
      return false;
  }
}

}  // namespace

EmbeddedRegistry::EmbeddedRegistry(StateStore& store, EmbeddedFileManager& files, Executor& executor)
    : _store(store), _files(files), _observers(executor, [this] { return installs(); }) {
  bool unreadable = false;
  {
    const MutexLock lock(_mutex);
    _applications = loadApplicationRecords(store, &unreadable);
    _placeholders = loadPlaceholderRecords(store, &unreadable);
    std::uint64_t last = 0;
    for (const auto& [bundleID, record] : _applications) {
      last = std::max(
          {last, record.arrival, serialOf(record.application.containerPath), serialOf(record.replacedPlaceholder)});
    }
    for (const auto& [bundleID, record] : _placeholders) {
      last = std::max({last, record.arrival, serialOf(record.containerPath)});
    }
    _nextSerial = last + 1;
  }
  finishInterruptedInstalls();
  sweepContainers(unreadable || store.hasSetAside("applications") || store.hasSetAside("placeholders"));
}

// --- looking --------------------------------------------------------------------------------------------------------

bool EmbeddedRegistry::applicationIsInstalled(const std::string& bundleID) {
  const MutexLock lock(_mutex);
  return _applications.contains(bundleID);
}

std::optional<PellumApplicationProxy> EmbeddedRegistry::applicationProxyForIdentifier(const std::string& bundleID,
                                                                                      bool placeholder) {
  const MutexLock lock(_mutex);
  if (placeholder) {
    const auto found = _placeholders.find(bundleID);
    return found == _placeholders.end() ? std::nullopt : std::optional(proxy(found->second));
  }
  const auto found = _applications.find(bundleID);
  return found == _applications.end() ? std::nullopt : std::optional(found->second.proxy());
}

void EmbeddedRegistry::enumerateBundlesOfType(std::uint64_t type, const Block& block) {
  PellumApplicationProxies records;
  {
    const MutexLock lock(_mutex);
    const auto add = [&](const PellumApplicationProxy& record, bool isAlone) {
      if (belongsTo(type, record, isAlone)) records.push_back(record);
    };
    for (const auto& [bundleID, record] : _applications) add(record.proxy(), !_placeholders.contains(bundleID));
    for (const auto& [bundleID, record] : _placeholders) add(proxy(record), !_applications.contains(bundleID));
  }
  std::stable_sort(records.begin(), records.end(),
                   [](const auto& a, const auto& b) { return a.bundleIdentifier < b.bundleIdentifier; });
  bool stop = false;
  for (const PellumApplicationProxy& record : records) {
    block(record, stop);
    if (stop) return;
  }
}

std::vector<std::string> EmbeddedRegistry::identifiersByArrival() {
  const MutexLock lock(_mutex);
  return appsync::identifiersByArrival(_applications, _placeholders);
}

// --- changing -------------------------------------------------------------------------------------------------------

bool EmbeddedRegistry::installPlaceholder(const PlaceholderDescription& description, ErrorOut error) {
  const std::string& bundleID = description.bundleID;
  if (!isUsable(bundleID, error)) return false;
  PlaceholderRecord record;
  record.bundleID = bundleID;
  record.name = description.name;
  record.installType = description.installType;
  record.applicationType = description.applicationType;
  record.bundleVersion = description.bundleVersion;
  record.launchProhibited = description.launchProhibited;
  record.seeded = description.seeded;
  if (!makePlaceholderContainer(description, record.containerPath, error)) return false;

  std::string old;
  {
    const MutexLock changing(_changes);
    record.arrival = arrivalOf(bundleID);
    const Saved saved = save(placeholderRecordName(bundleID), record.propertyList(), bundleID, error);
    if (saved == Saved::No) {
      removeContainer(record.containerPath);
      return false;
    }
    change(bundleID, [&]() APPSYNC_NO_THREAD_ANALYSIS {
      PlaceholderRecord& place = _placeholders[bundleID];
      if (saved == Saved::Durably) old = place.containerPath;
      place = record;
    });
  }
  removeContainer(old);
  return true;
}

bool EmbeddedRegistry::removePlaceholder(const std::string& bundleID, ErrorOut error) {
  std::string container;
  {
    const MutexLock changing(_changes);
    if (!dropPlaceholder(bundleID, container, error)) return false;
  }
  removeContainer(container);
  return true;
}

bool EmbeddedRegistry::commitInstall(const InstalledApplication& application, ErrorOut error) {
  return putApplication(application, true, error);
}

bool EmbeddedRegistry::seedApplication(const InstalledApplication& application, ErrorOut error) {
  return putApplication(application, false, error);
}

bool EmbeddedRegistry::putApplication(const InstalledApplication& application, bool endsPlaceholder, ErrorOut error) {
  const std::string& bundleID = application.bundleID;
  if (!isUsable(bundleID, error)) return false;
  std::string oldContainer;
  std::string oldPlaceholder;
  {
    const MutexLock changing(_changes);
    ApplicationRecord record{application, arrivalOf(bundleID), ""};
    {
      const MutexLock lock(_mutex);
      const auto placeholder = _placeholders.find(bundleID);
      if (endsPlaceholder && placeholder != _placeholders.end()) {
        record.replacedPlaceholder = placeholder->second.containerPath;
      }
    }
    const Saved saved = save(applicationRecordName(bundleID), record.propertyList(), bundleID, error);
    if (saved == Saved::No) return false;
    change(bundleID, [&]() APPSYNC_NO_THREAD_ANALYSIS {
      ApplicationRecord& place = _applications[bundleID];
      if (saved == Saved::Durably) oldContainer = place.application.containerPath;
      place = record;
    });
    // The install is done; a placeholder whose record cannot be removed goes at the next start.
    if (endsPlaceholder) dropPlaceholder(bundleID, oldPlaceholder, nullptr);
  }
  removeContainer(oldContainer);
  removeContainer(oldPlaceholder);
  return true;
}

bool EmbeddedRegistry::removeApplication(const std::string& bundleID, ErrorOut error) {
  std::string placeholder;
  std::string application;
  bool removed = false;
  {
    const MutexLock changing(_changes);
    removed = dropPlaceholder(bundleID, placeholder, error) && dropApplication(bundleID, application, error);
  }
  removeContainer(placeholder);
  removeContainer(application);
  return removed;
}

bool EmbeddedRegistry::uninstallApplication(const std::string& bundleID, ErrorOut error) {
  std::string placeholder;
  std::string application;
  {
    const MutexLock changing(_changes);
    if (!dropPlaceholder(bundleID, placeholder, error)) return false;
    if (placeholder.empty() && !dropApplication(bundleID, application, error)) return false;
  }
  removeContainer(placeholder);
  removeContainer(application);
  if (!placeholder.empty() && placeholderUninstalled) placeholderUninstalled(bundleID);
  if (!placeholder.empty() || !application.empty()) return true;
  setError(error, registryError(kRegistryUnknown,
                                "Neither an application nor a placeholder stands under \"" + bundleID + "\""));
  return false;
}

EmbeddedRegistry::Saved EmbeddedRegistry::save(const std::string& name, const PropertyList& record,
                                               const std::string& bundleID, ErrorOut error) {
  std::optional<Error> cause;
  if (_store.save(name, record, &cause)) return Saved::Durably;
  if (_store.load(name, nullptr) == record) return Saved::NotFlushed;
  diskFailure(bundleID, cause, error);
  return Saved::No;
}

// `container` is the one that must be removed when the locks are free; untouched when there is none.
bool EmbeddedRegistry::dropPlaceholder(const std::string& bundleID, std::string& container, ErrorOut error) {
  {
    const MutexLock lock(_mutex);
    const auto found = _placeholders.find(bundleID);
    if (found == _placeholders.end()) return true;
    container = found->second.containerPath;
  }
  std::optional<Error> cause;
  const bool removed = _store.remove(placeholderRecordName(bundleID), &cause);
  if (!removed) container.clear();
  if (!removed) return diskFailure(bundleID, cause, error);
  change(bundleID, [&]() APPSYNC_NO_THREAD_ANALYSIS {
    _placeholders.erase(bundleID);
    _displays.erase(bundleID);
  });
  return true;
}

bool EmbeddedRegistry::dropApplication(const std::string& bundleID, std::string& container, ErrorOut error) {
  {
    const MutexLock lock(_mutex);
    const auto found = _applications.find(bundleID);
    if (found == _applications.end()) return true;
    container = found->second.application.containerPath;
  }
  std::optional<Error> cause;
  const bool removed = _store.remove(applicationRecordName(bundleID), &cause);
  if (!removed) container.clear();
  if (!removed) return diskFailure(bundleID, cause, error);
  change(bundleID, [&]() APPSYNC_NO_THREAD_ANALYSIS { _applications.erase(bundleID); });
  return true;
}

std::uint64_t EmbeddedRegistry::arrivalOf(const std::string& bundleID) {
  const MutexLock lock(_mutex);
  if (const auto found = _applications.find(bundleID); found != _applications.end()) return found->second.arrival;
  if (const auto found = _placeholders.find(bundleID); found != _placeholders.end()) return found->second.arrival;
  return _nextSerial.fetch_add(1);
}

// --- containers -----------------------------------------------------------------------------------------------------

std::string EmbeddedRegistry::newContainerName() {
  while (true) {
    std::string name = std::to_string(_nextSerial.fetch_add(1));
    const bool isTaken = _files.fileExists(std::string(kContainersDirectory).append("/").append(name)) ||
                         _files.fileExists(std::string(kPlaceholdersDirectory).append("/").append(name));
    if (!isTaken) return name;
  }
}

bool EmbeddedRegistry::makePlaceholderContainer(const PlaceholderDescription& description, std::string& path,
                                                ErrorOut error) {
  const std::string& bundleID = description.bundleID;
  FreshContainer container(_files, kPlaceholdersDirectory, newContainerName(),
                           "The placeholder of \"" + bundleID + "\"");
  std::optional<Error> cause;
  const bool made =
      container.bundle(bundleID + ".app", &cause) &&
      container.propertyList("Info.plist", placeholderInfo(description), &cause) &&
      (!description.icon || container.file("Icon.png", *description.icon, &cause)) &&
      (!description.metadata || container.propertyListBeside("TarvoMetadata.plist", *description.metadata, &cause)) &&
      container.keep(&cause);
  path = container.path();
  return made || diskFailure(bundleID, cause, error);
}

void EmbeddedRegistry::removeContainer(const std::string& path) {
  // What stays behind here is swept away at the next start.
  if (!path.empty()) _files.removeItem(path, nullptr);
}

void EmbeddedRegistry::finishInterruptedInstalls() {
  std::vector<std::string> ended;
  {
    const MutexLock lock(_mutex);
    for (const auto& [bundleID, placeholder] : _placeholders) {
      const auto application = _applications.find(bundleID);
      if (application != _applications.end() && application->second.replacedPlaceholder == placeholder.containerPath) {
        ended.push_back(bundleID);
      }
    }
  }
  for (const std::string& bundleID : ended) removePlaceholder(bundleID, nullptr);
}

// With `keepWhole` only what was never finished goes: a container that no record names can be that of an application
// whose record has been damaged.
void EmbeddedRegistry::sweepContainers(bool keepWhole) {
  std::set<std::string> applications{lastComponent(kPlaceholdersDirectory)};
  std::set<std::string> placeholders;
  {
    const MutexLock lock(_mutex);
    for (const auto& [bundleID, record] : _applications) {
      applications.insert(lastComponent(record.application.containerPath));
    }
    for (const auto& [bundleID, record] : _placeholders) placeholders.insert(lastComponent(record.containerPath));
  }
  sweepDirectory(kContainersDirectory, applications, keepWhole);
  sweepDirectory(kPlaceholdersDirectory, placeholders, keepWhole);
}

void EmbeddedRegistry::sweepDirectory(const std::string& directory, const std::set<std::string>& named,
                                      bool keepWhole) {
  for (const std::string& name : _files.contentsOfDirectory(directory, nullptr).value_or(std::vector<std::string>())) {
    if (named.contains(name)) continue;
    if (!keepWhole || name.starts_with('.')) removeContainer(std::string(directory).append("/").append(name));
    _nextSerial = std::max(_nextSerial.load(), serialOf(name) + 1);  // in case it is still there
  }
}

// --- installs under way ---------------------------------------------------------------------------------------------

void EmbeddedRegistry::addObserver(const Observer& observer) {
  _observers.add(observer);
}

void EmbeddedRegistry::removeObserver(const Observer& observer) {
  _observers.remove(observer);
}

void EmbeddedRegistry::setInstallDisplay(const std::string& bundleID, std::optional<InstallDisplay> display) {
  change(bundleID, [&]() APPSYNC_NO_THREAD_ANALYSIS {
    _displays.erase(bundleID);
    if (display) _displays.emplace(bundleID, *display);
  });
}

void EmbeddedRegistry::installsDidCancel(const std::string& bundleID) {
  PellumApplicationProxy record;
  record.applicationIdentifier = bundleID;
  record.bundleIdentifier = bundleID;
  if (const auto known = applicationProxyForIdentifier(bundleID, true)) record = *known;
  _observers.didCancel(record);
}

void EmbeddedRegistry::change(const std::string& bundleID, const std::function<void()>& apply) {
  bool changed = false;
  {
    const MutexLock lock(_mutex);
    const LiveInstall before = liveInstall(bundleID);
    apply();
    changed = before != liveInstall(bundleID);
  }
  if (changed) _observers.installsChanged();
}

InstallObservers::Installs EmbeddedRegistry::installs() {
  InstallObservers::Installs installs;
  const MutexLock lock(_mutex);
  for (const auto& [bundleID, placeholder] : _placeholders) {
    const LiveInstall install = liveInstall(placeholder);
    if (install.isLive) (install.isPaused ? installs.paused : installs.prioritized).push_back(proxy(placeholder));
  }
  for (const auto& [bundleID, record] : _applications) {
    const std::optional<SeededInstall>& seeded = record.application.seeded;
    if (!seeded || !seeded->prioritized) continue;
    (*seeded->prioritized ? installs.prioritized : installs.paused).push_back(record.proxy());
  }
  return installs;
}

PellumApplicationProxy EmbeddedRegistry::proxy(const PlaceholderRecord& placeholder) const {
  PellumApplicationProxy proxy = placeholder.proxy();
  const auto display = _displays.find(placeholder.bundleID);
  if (display != _displays.end()) proxy.installProgressSync = display->second.progress;
  return proxy;
}

EmbeddedRegistry::LiveInstall EmbeddedRegistry::liveInstall(const PlaceholderRecord& placeholder) const {
  const auto display = _displays.find(placeholder.bundleID);
  if (display == _displays.end() && !placeholder.seeded) return {};
  const bool isDisplayed = display != _displays.end();
  const PellumInstallProgress progress = isDisplayed ? display->second.progress : placeholder.seeded->shown();
  const bool isPrioritized = isDisplayed ? display->second.prioritized : placeholder.seeded->prioritized.value_or(true);
  return {true, !isPrioritized || progress.installState == kPellumInstallStatePaused, progress.installState};
}

EmbeddedRegistry::LiveInstall EmbeddedRegistry::liveInstall(const std::string& bundleID) const {
  const auto placeholder = _placeholders.find(bundleID);
  return placeholder == _placeholders.end() ? LiveInstall{} : liveInstall(placeholder->second);
}

}  // namespace appsync
