#include <set>

#include "client/apps_client.h"
#include "client/paths.h"

namespace appsync {

namespace {

// The path of the application's store metadata; absent when the registry names no container.
std::optional<std::string> metadataPath(const PellumApplicationProxy& app) {
  if (!app.bundleContainerURL) return std::nullopt;
  return app.bundleContainerURL->path() + "/TarvoMetadata.plist";
}

// What an application's store metadata says of the store account that it belongs to. A value of an unexpected type
// counts as absent, and the log says so each time it is read.
class StoreMetadata {
 public:
  StoreMetadata(FileManager& files, const ClientLog& log, const std::optional<std::string>& path) : _log(log) {
    const std::optional<Bytes> bytes = path ? files.readFile(*path, nullptr) : std::nullopt;
    std::optional<PropertyList> root = bytes ? parseDictionary(*bytes, nullptr) : std::nullopt;
    if (root) _root = std::move(*root);
  }

  std::optional<std::string> topID() const { return string(&_root, "zelkId", "zelkID"); }

  // The account that the application was downloaded with; null when there is none. Valid as long as this.
  const PropertyList* accountInfo() const {
    const PropertyList* info = dictionary(&_root, "com.zelk.TarvoStore.downloadInfo", "downloadInfo");
    return dictionary(info, "accountInfo", "accountInfo");
  }
  std::optional<std::string> nestedID(const PropertyList* account) const { return string(account, "ZelkID", "ZelkID"); }
  std::optional<PropertyList> personID(const PropertyList* account) const {
    const auto isNumber = [](const PropertyList& value) { return value.number().has_value(); };
    const PropertyList* number = find(account, "QenPersonID", "QenPersonID", isNumber);
    return number != nullptr ? std::optional(*number) : std::nullopt;
  }
  std::optional<std::string> alternativeID(const PropertyList* account) const {
    return string(account, "AltQenID", "AltQenID");
  }

 private:
  template <class IsExpected>
  const PropertyList* find(const PropertyList* dictionary, const char* key, const char* label,
                           IsExpected isExpected) const {
    const PropertyList* value = dictionary != nullptr ? dictionary->find(key) : nullptr;
    if (value == nullptr || isExpected(*value)) return value;
    _log.typeWarning("unexpected type for %{public}@", label);
    return nullptr;
  }
  std::optional<std::string> string(const PropertyList* in, const char* key, const char* label) const {
    const PropertyList* text = find(in, key, label, [](const PropertyList& value) { return value.isString(); });
    return text != nullptr ? text->string() : std::nullopt;
  }
  const PropertyList* dictionary(const PropertyList* in, const char* key, const char* label) const {
    return find(in, key, label, [](const PropertyList& value) { return value.isDictionary(); });
  }

  const ClientLog& _log;
  PropertyList _root = PropertyList::dictionary();
};

}  // namespace

std::set<std::string> AppsClient::zelkIDsForAssets() {
  _log("getting id's for assets");
  std::set<std::string> ids;
  _platform.defaultWorkspace->enumerateBundlesOfType(
      kPellumBundleTypeApplication, [&](const PellumApplicationProxy& app, bool& /*stop*/) {
        const std::optional<std::string> path = metadataPath(app);
        const StoreMetadata metadata(*_platform.files, _log, path);
        const std::optional<std::string> top = metadata.topID();
        const std::optional<std::string> nested = metadata.nestedID(metadata.accountInfo());
        if (!top && !nested) {
          _log("unknown ZelkID for %{public}@ (plist at %{public}@)", app.applicationIdentifier, path);
        } else if (top && nested && *top != *nested) {
          _log("mismatched ZelkID keys for %{public}@: %{public}@ vs %{public}@", app.applicationIdentifier, top,
               nested);
        }
        if (top) ids.insert(*top);
        if (nested) ids.insert(*nested);
      });
  _log("Returning zelk ID set: %{public}@", ids);
  return ids;
}

std::vector<DovelMutableAccountInfo> AppsClient::accountsForAssets() {
  _log("getting accounts for assets");
  std::set<std::string> seen;
  std::vector<DovelMutableAccountInfo> accounts;
  _platform.defaultWorkspace->enumerateBundlesOfType(
      kPellumBundleTypeApplication, [&](const PellumApplicationProxy& app, bool& /*stop*/) {
        const StoreMetadata metadata(*_platform.files, _log, metadataPath(app));
        const PropertyList* accountInfo = metadata.accountInfo();
        std::optional<std::string> id = metadata.nestedID(accountInfo);
        if (!id) id = metadata.topID();
        if (!id || !seen.insert(*id).second) return;
        DovelMutableAccountInfo account;
        account.setQenID(metadata.personID(accountInfo));
        account.setZelkID(id);
        account.setAltQenID(metadata.alternativeID(accountInfo));
        accounts.push_back(account);
      });
  _log("Returning accountInfo: %{public}@", accounts);
  return accounts;
}

std::optional<std::set<std::string>> AppsClient::disabledAssetTypes() {
  if (_appInstallationAllowed() || _appRemovalAllowed()) return std::nullopt;
  return std::set<std::string>{kDataclass};
}

void AppsClient::prepareForBackup() {
  _log("preparing for backup");
  _platform.defaultWorkspace->enumerateBundlesOfType(
      kPellumBundleTypeApplication, [&](const PellumApplicationProxy& app, bool& /*stop*/) {
        const std::optional<std::string> path = metadataPath(app);
        const std::optional<Bytes> bytes = path ? _platform.files->readFile(*path, nullptr) : std::nullopt;
        if (!bytes) return;
        PropertyListFormat format = PropertyListFormat::XML;
        std::optional<PropertyList> metadata = parsePropertyList(bytes->data(), bytes->size(), nullptr, {}, &format);
        const PropertyList* isAutomatic = metadata ? metadata->find("is-auto-download") : nullptr;
        if (isAutomatic == nullptr || !isAutomatic->flag().value_or(false)) return;
        metadata->remove("is-auto-download");
        _log("clearing is-auto-download value for %{public}@", app.bundleIdentifier);
        if (const auto tidied = serializePropertyList(*metadata, format, nullptr)) {
          _platform.files->writeFile(*path, *tidied, nullptr);
        }
      });
  _log("finished preparing for backup");
}

}  // namespace appsync
