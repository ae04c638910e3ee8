#include "embedded/installer.h"

#include <algorithm>
#include <string_view>
#include <utility>

#include "embedded/device.h"
#include "embedded/file_manager.h"
#include "embedded/fresh_container.h"
#include "embedded/record_fields.h"
#include "embedded/registry.h"

namespace appsync {

namespace {

constexpr char kUninstalledRecord[] = "uninstalled";

Error installerError(std::int64_t code, std::string text) {
  return Error(std::string(kInstallerErrorDomain), code, std::move(text));
}

// What an unpacked bundle says of itself.
struct BundleInformation {
  std::string name;
  std::optional<std::string> version;
};

std::optional<BundleInformation> readInformation(EmbeddedFileManager& files, const FreshContainer& container,
                                                 const std::string& bundleID, const std::string& subject,
                                                 ErrorOut error) {
  std::optional<Error> cause;
  const std::string where = "Payload/" + container.bundleName() + "/Info.plist";
  const std::optional<Bytes> bytes = files.readFile(container.bundlePath() + "/Info.plist", &cause);
  if (!bytes) {
    setError(error, Error(std::string(kInstallerErrorDomain), kInstallerNotAPackage,
                          subject + " holds no " + where + " that can be read", *cause));
    return std::nullopt;
  }
  const std::optional<PropertyList> info = parsePropertyList(*bytes, &cause);
  if (!info || !info->isDictionary()) {
    const std::string text = subject + " holds a " + where + " that is no property list with a dictionary";
    setError(error, cause ? Error(std::string(kInstallerErrorDomain), kInstallerNotAPackage, text, *cause)
                          : installerError(kInstallerNotAPackage, text));
    return std::nullopt;
  }
  const std::optional<std::string> identifier = textIn(*info, "TefBundleIdentifier");
  if (identifier != bundleID) {
    setError(error, installerError(
                        kInstallerWrongApplication,
                        subject + " holds " +
                            (identifier ? "\"" + *identifier + "\"" : "an application without TefBundleIdentifier") +
                            ", not \"" + bundleID + "\", which was asked for"));
    return std::nullopt;
  }
  return BundleInformation{textIn(*info, "TefBundleDisplayName").value_or(""), textIn(*info, "TefBundleVersion")};
}

// An update keeps what the registry says of the application's type.
std::string applicationType(EmbeddedRegistry& registry, const std::string& bundleID) {
  for (const bool placeholder : {false, true}) {
    if (const auto record = registry.applicationProxyForIdentifier(bundleID, placeholder)) {
      return record->applicationType;
    }
  }
  return "User";
}

}  // namespace

EmbeddedInstaller::EmbeddedInstaller(StateStore& store, EmbeddedFileManager& files, EmbeddedRegistry& registry,
                                     const PackageLimits& limits)
    : _store(store), _files(files), _registry(registry), _limits(limits) {}

bool EmbeddedInstaller::install(const std::string& bundleID, const std::string& packagePath,
                                const KilnInstallOptions& options, const std::function<void(double fraction)>& progress,
                                const std::function<bool()>& cancelled, ErrorOut error) {
  if (!isSinglePathComponent(bundleID)) {
    setError(error, installerError(kInstallerBadIdentifier,
                                   "The package \"" + packagePath +
                                       "\" cannot be installed: the identifier it was asked for cannot name a file"));
    return false;
  }
  const std::string subject = "The package \"" + packagePath + "\"";
  std::optional<Error> cause;
  const OwnedFile package = _files.openFile(packagePath, &cause);
  if (!package) {
    setError(error,
             Error(std::string(kInstallerErrorDomain), kInstallerNoPackage, subject + " cannot be opened", *cause));
    return false;
  }

  FreshContainer container(_files, kContainersDirectory, _registry.newContainerName(), subject);
  if (!readPackage(package.get(), packagePath, _limits, container, progress, cancelled, error)) return false;
  const auto information = readInformation(_files, container, bundleID, subject, error);
  if (!information) return false;
  const std::optional<KilnStoreMetadata>& metadata = options.tarvoMetadata();
  if (metadata && !container.propertyListBeside("TarvoMetadata.plist", metadata->dictionary(), error)) return false;

  InstalledApplication application;
  application.bundleID = bundleID;
  application.name = information->name;
  application.bundleVersion = information->version;
  application.applicationType = applicationType(_registry, bundleID);
  application.size = container.size();
  if (progress) progress(1);
  if (cancelled && cancelled()) {
    setError(error, installerError(kInstallerCancelled, subject + " is not installed: the install was cancelled"));
    return false;
  }
  if (!container.keep(error)) return false;
  application.containerPath = container.path();
  application.bundlePath = container.bundlePath();
  if (!_registry.commitInstall(application, &cause)) {
    _files.removeItem(container.path(), nullptr);
    setError(error,
             Error(std::string(kInstallerErrorDomain), kInstallerDisk, subject + " cannot be registered", *cause));
    return false;
  }
  forget({bundleID}, nullptr);  // a look-up leaves out what is installed, so a failure shows nowhere
  return true;
}

bool EmbeddedInstaller::uninstall(const std::string& bundleID, ErrorOut error) {
  if (!_registry.applicationIsInstalled(bundleID)) return _registry.removeApplication(bundleID, error);
  // Remembered first: a crash in between leaves an application that is installed, which no look-up shows.
  if (!remember({bundleID}, error)) return false;
  if (_registry.removeApplication(bundleID, error)) return true;
  forget({bundleID}, nullptr);
  return false;
}

std::optional<PropertyList> EmbeddedInstaller::KilnLookupUninstalled() {
  std::optional<PropertyList> remembered;
  {
    const MutexLock lock(_mutex);
    remembered = load(nullptr);
  }
  if (!remembered) return std::nullopt;
  PropertyList uninstalled = PropertyList::dictionary();
  for (const PropertyList::Member& member : remembered->members()) {
    if (!_registry.applicationIsInstalled(std::string(member.key))) uninstalled.set(member.key, member.value);
  }
  return uninstalled;
}

int EmbeddedInstaller::KilnClearUninstalled(const std::vector<std::string>& bundleIDs) {
  return forget(bundleIDs, nullptr) ? 0 : 1;
}

bool EmbeddedInstaller::remember(const std::vector<std::string>& bundleIDs, ErrorOut error) {
  const MutexLock lock(_mutex);
  std::optional<PropertyList> uninstalled = load(error);
  if (!uninstalled) return false;
  for (const std::string& bundleID : bundleIDs) uninstalled->set(bundleID, PropertyList::dictionary());
  return _store.save(kUninstalledRecord, *uninstalled, error);
}

bool EmbeddedInstaller::forget(const std::vector<std::string>& bundleIDs, ErrorOut error) {
  const MutexLock lock(_mutex);
  std::optional<PropertyList> uninstalled = load(error);
  if (!uninstalled) return false;
  bool changed = false;
  for (const std::string& bundleID : bundleIDs) changed |= uninstalled->remove(bundleID);
  return !changed || _store.save(kUninstalledRecord, *uninstalled, error);
}

std::optional<PropertyList> EmbeddedInstaller::load(ErrorOut error) {
  std::optional<Error> failure;
  const std::optional<PropertyList> record = _store.load(kUninstalledRecord, &failure);
  if (failure) {
    setError(error, failure);
    return std::nullopt;
  }
  return record && record->isDictionary() ? *record : PropertyList::dictionary();
}

PropertyList uninstalledStatus(const StateStore& store) {
  PropertyList identifiers = PropertyList::array();
  const std::optional<PropertyList> record = store.load(kUninstalledRecord, nullptr);
  if (!record) return identifiers;
  const std::vector<std::string> installed = store.keys("applications");
  for (const PropertyList::Member& member : record->members()) {
    if (!std::binary_search(installed.begin(), installed.end(), member.key)) identifiers.append(member.key);
  }
  return identifiers;
}

bool checkUninstalledSeed(const PropertyList& identifiers, ErrorOut error) {
  const auto refuse = [&](const std::string& text) {
    setError(error, Error(std::string(kDeviceErrorDomain), kDeviceBadSeed, text));
    return false;
  };
  if (!identifiers.isArray()) return refuse("uninstalled must be an array of bundle identifiers");
  std::size_t number = 0;
  for (const PropertyList& identifier : identifiers.elements()) {
    ++number;
    if (isSinglePathComponent(identifier.string().value_or(""))) continue;
    return refuse("entry " + std::to_string(number) + " must be a bundle identifier");
  }
  return true;
}

bool seedUninstalled(EmbeddedInstaller& installer, const PropertyList& identifiers, ErrorOut error) {
  std::vector<std::string> bundleIDs;
  for (const PropertyList& identifier : identifiers.elements()) bundleIDs.push_back(identifier.string().value_or(""));
  return installer.remember(bundleIDs, error);
}

}  // namespace appsync
