#include <algorithm>
#include <array>
#include <utility>

#include "embedded/coordination.h"
#include "embedded/coordination_objects.h"
#include "embedded/record_fields.h"
#include "embedded/registry.h"
#include "embedded/state_store.h"

namespace appsync {

namespace {

using Life = InstallCoordinator::Life;
using Shown = InstallCoordinator::Shown;

constexpr std::string_view kCollection = "coordinators";
constexpr std::size_t kLongestErrorChain = 16;

constexpr std::array<std::pair<OstrelCoordinatorKind, std::string_view>, 4> kKindNames = {{
    {OstrelCoordinatorKind::Initiating, "initiating"},
    {OstrelCoordinatorKind::Updating, "updating"},
    {OstrelCoordinatorKind::Restoring, "restoring"},
    {OstrelCoordinatorKind::RestoringDemoted, "restoring-demoted"},
}};

std::optional<OstrelCoordinatorKind> kindNamed(std::string_view name) {
  for (const auto& [kind, kindName] : kKindNames) {
    if (kindName == name) return kind;
  }
  return std::nullopt;
}

std::optional<PropertyList> part(const PropertyList& dictionary, std::string_view key) {
  const PropertyList* value = dictionary.find(key);
  return value != nullptr && value->isDictionary() ? std::optional(*value) : std::nullopt;
}

// --- the parts of a record ------------------------------------------------------------------------------------------

// From the error itself down to the one that caused all.
PropertyList recordOf(const Error& error) {
  PropertyList chain = PropertyList::array();
  for (std::optional<Error> link = error; link && chain.count() < kLongestErrorChain; link = link->underlyingError()) {
    chain.append(PropertyList::dictionary(
        {{"Domain", link->domain()}, {"Code", PropertyList::integer(link->code())}, {"Text", link->text()}}));
  }
  return chain;
}

std::optional<Error> errorFrom(const PropertyList* chain) {
  if (chain == nullptr) return std::nullopt;
  std::optional<Error> error;
  const auto links = chain->elements();
  for (std::size_t i = std::min(links.size(), kLongestErrorChain); i-- > 0;) {
    const PropertyList& link = links[i];
    const PropertyList* code = link.find("Code");
    const std::string domain = textIn(link, "Domain").value_or(std::string(kOstrelErrorDomain));
    const std::int64_t value = code != nullptr ? code->integer().value_or(0) : 0;
    const std::string words = textIn(link, "Text").value_or("");
    error = error ? Error(domain, value, words, *error) : Error(domain, value, words);
  }
  return error;
}

PropertyList recordOf(const KilnInstallOptions& options) {
  PropertyList record =
      PropertyList::dictionary({{"PellumInstallType", PropertyList::unsignedInteger(options.pellumInstallType())},
                                {"InstallTargetType", PropertyList::unsignedInteger(options.installTargetType())}});
  if (options.tarvoMetadata()) record.set("TarvoMetadata", options.tarvoMetadata()->dictionary());
  return record;
}

KilnInstallOptions installOptionsFrom(const PropertyList& record) {
  KilnInstallOptions options;
  options.setPellumInstallType(numberIn(record, "PellumInstallType").value_or(0));
  options.setInstallTargetType(numberIn(record, "InstallTargetType").value_or(0));
  options.setTarvoMetadata(KilnStoreMetadata::initWithDictionary(part(record, "TarvoMetadata")));
  return options;
}

PropertyList recordOf(const CoordinationPromise& promise) {
  PropertyList record = PropertyList::dictionary({{"Name", promise.name}, {"Complete", promise.isComplete}});
  setIfPresent(record, "Path", promise.path);
  return record;
}

std::shared_ptr<CoordinationPromise> promiseFrom(const std::optional<PropertyList>& record,
                                                 const std::shared_ptr<InstallCoordinator>& owner) {
  if (!record) return nullptr;
  auto promise = std::make_shared<CoordinationPromise>();
  promise->name = textIn(*record, "Name").value_or(owner->bundleID);
  promise->path = textIn(*record, "Path");
  promise->isComplete = isTrueIn(*record, "Complete");
  promise->isGiven = true;
  promise->owner = owner;
  return promise;
}

PropertyList recordOf(const PlaceholderDescription& placeholder) {
  PropertyList record =
      PropertyList::dictionary({{"Name", placeholder.name},
                                {"InstallType", PropertyList::unsignedInteger(placeholder.installType)},
                                {"LaunchProhibited", placeholder.launchProhibited}});
  setIfPresent(record, "BundleVersion", placeholder.bundleVersion);
  setIfPresent(record, "InfoPlist", placeholder.infoPlist);
  setIfPresent(record, "Metadata", placeholder.metadata);
  if (placeholder.icon) record.set("Icon", PropertyList::data(*placeholder.icon));
  return record;
}

std::optional<PlaceholderDescription> placeholderFrom(const std::optional<PropertyList>& record,
                                                      const std::string& bundleID) {
  if (!record) return std::nullopt;
  PlaceholderDescription placeholder;
  placeholder.bundleID = bundleID;
  placeholder.name = textIn(*record, "Name").value_or(bundleID);
  placeholder.installType = numberIn(*record, "InstallType").value_or(kPellumInstallTypeSync);
  placeholder.launchProhibited = isTrueIn(*record, "LaunchProhibited");
  placeholder.bundleVersion = textIn(*record, "BundleVersion");
  placeholder.infoPlist = part(*record, "InfoPlist");
  placeholder.metadata = part(*record, "Metadata");
  const PropertyList* icon = record->find("Icon");
  if (const auto bytes = icon != nullptr ? icon->data() : std::nullopt)
    placeholder.icon = Bytes(bytes->begin(), bytes->end());
  return placeholder;
}

}  // namespace

// --- records --------------------------------------------------------------------------------------------------------

std::string_view nameOf(OstrelCoordinatorKind kind) {
  for (const auto& [named, name] : kKindNames) {
    if (named == kind) return name;
  }
  return "any";
}

std::string coordinatorRecordName(const std::string& bundleID) {
  return std::string(kCollection) + "/" + bundleID;
}

PropertyList coordinatorRecord(const InstallCoordinator& coordinator) {
  PropertyList record =
      PropertyList::dictionary({{"Kind", nameOf(coordinator.kind)},
                                {"Creator", PropertyList::unsignedInteger(coordinator.creator)},
                                {"ResponsibleClient", PropertyList::unsignedInteger(coordinator.responsibleClient)},
                                {"InitialAssetPromises", coordinator.hasInitialAssetPromises},
                                {"PlaceholderInstalled", coordinator.isPlaceholderInstalled},
                                {"Seeded", coordinator.isSeeded}});
  if (coordinator.error) record.set("Error", recordOf(*coordinator.error));
  if (coordinator.installOptions) record.set("InstallOptions", recordOf(*coordinator.installOptions));
  if (coordinator.package) record.set("AssetPromise", recordOf(*coordinator.package));
  if (coordinator.userData) record.set("UserDataPromise", recordOf(*coordinator.userData));
  if (coordinator.placeholder) record.set("Placeholder", recordOf(*coordinator.placeholder));
  return record;
}

std::shared_ptr<InstallCoordinator> coordinatorFromRecord(const std::string& bundleID, const PropertyList& record) {
  const auto kind = kindNamed(textIn(record, "Kind").value_or(""));
  const auto creator = numberIn(record, "Creator");
  if (!kind || !creator) return nullptr;
  auto coordinator = std::make_shared<InstallCoordinator>();
  coordinator->kind = *kind;
  coordinator->bundleID = bundleID;
  coordinator->creator = *creator;
  coordinator->responsibleClient = numberIn(record, "ResponsibleClient").value_or(0);
  coordinator->error = errorFrom(record.find("Error"));
  if (const auto options = part(record, "InstallOptions")) coordinator->installOptions = installOptionsFrom(*options);
  coordinator->hasInitialAssetPromises = isTrueIn(record, "InitialAssetPromises");
  coordinator->package = promiseFrom(part(record, "AssetPromise"), coordinator);
  coordinator->userData = promiseFrom(part(record, "UserDataPromise"), coordinator);
  coordinator->placeholder = placeholderFrom(part(record, "Placeholder"), bundleID);
  coordinator->isPlaceholderInstalled = coordinator->placeholder && isTrueIn(record, "PlaceholderInstalled");
  coordinator->life = coordinator->error ? Life::Dead : Life::Live;
  coordinator->isTidy = !coordinator->isLive();
  coordinator->isSeeded = isTrueIn(record, "Seeded");
  // A seed may say of the placeholder how its install is shown; that stands until something happens.
  coordinator->shown = coordinator->isSeeded ? Shown::Waiting : Shown::Nothing;
  return coordinator;
}

namespace {

// Whether the placeholder in the registry is the coordinator's. That of a live one may have been installed after its
// record was written; that of a demoted application, which gives way, stands there until it is replaced.
bool isInstalled(const InstallCoordinator& coordinator, const std::optional<PellumApplicationProxy>& inRegistry) {
  if (!inRegistry || !coordinator.placeholder) return false;
  return coordinator.isPlaceholderInstalled ||
         (coordinator.isLive() && inRegistry->installType == coordinator.placeholder->installType &&
          inRegistry->localizedName.value_or("") == coordinator.placeholder->name);
}

}  // namespace

// A crash can have come between two steps: a placeholder that is not in the registry is installed once more, and that
// of a dead coordinator goes.
void EmbeddedCoordination::loadRecords() {
  for (const std::string& bundleID : _store.keys(std::string(kCollection))) {
    const std::string name = coordinatorRecordName(bundleID);
    const auto record = _store.load(name, nullptr);
    const auto coordinator = record ? coordinatorFromRecord(bundleID, *record) : nullptr;
    if (!coordinator) continue;
    coordinator->isPlaceholderInstalled =
        isInstalled(*coordinator, _registry.applicationProxyForIdentifier(bundleID, true));
    if (!coordinator->isLive() && coordinator->isPlaceholderInstalled) {
      coordinator->isPlaceholderInstalled = !_registry.removePlaceholder(bundleID, nullptr);
      _store.save(name, coordinatorRecord(*coordinator), nullptr);
    }
    if (coordinator->isPlaceholderInstalled) coordinator->placeholder->icon.reset();  // the registry has its own copy
    _coordinators[bundleID] = coordinator;
  }
}

bool isCoordinatorRecord(const std::string& name, const PropertyList& record) {
  const std::string prefix = coordinatorRecordName("");
  return !name.starts_with(prefix) || coordinatorFromRecord(name.substr(prefix.size()), record) != nullptr;
}

// --- status ---------------------------------------------------------------------------------------------------------

namespace {

PropertyList statusOf(const InstallCoordinator& coordinator) {
  PropertyList entry = PropertyList::dictionary({{"identifier", coordinator.bundleID},
                                                 {"kind", nameOf(coordinator.kind)},
                                                 {"creator", PropertyList::unsignedInteger(coordinator.creator)}});
  if (coordinator.error) {
    const std::string& words = coordinator.error->text();
    entry.set("error", words.empty() ? coordinator.error->description() : words);
  }
  if (coordinator.responsibleClient != 0) {
    entry.set("responsibleClient", PropertyList::unsignedInteger(coordinator.responsibleClient));
  }
  entry.set("installOptions", coordinator.installOptions.has_value());
  entry.set("initialAssetPromises", coordinator.hasInitialAssetPromises);
  if (coordinator.package) entry.set("assetPromise", coordinator.package->isComplete ? "complete" : "open");
  entry.set("placeholderPromise", coordinator.placeholder.has_value());
  entry.set("userDataPromise", coordinator.userData != nullptr);
  return entry;
}

}  // namespace

PropertyList coordinationStatus(const StateStore& store) {
  PropertyList entries = PropertyList::array();
  for (const std::string& bundleID : store.keys(std::string(kCollection))) {
    const auto record = store.load(coordinatorRecordName(bundleID), nullptr);
    const auto coordinator = record ? coordinatorFromRecord(bundleID, *record) : nullptr;
    if (coordinator) entries.append(statusOf(*coordinator));
  }
  return entries;
}

// --- seed -----------------------------------------------------------------------------------------------------------

namespace {

constexpr std::int64_t kBadSeed = 1;

bool isNumber(const PropertyList& value) {
  return value.unsignedInteger().has_value();
}
bool isTruth(const PropertyList& value) {
  return value.boolean().has_value();
}
bool isKind(const PropertyList& value) {
  return kindNamed(value.string().value_or("")).has_value();
}
bool isIdentifier(const PropertyList& value) {
  return isSinglePathComponent(value.string().value_or(""));
}
bool isPromiseState(const PropertyList& value) {
  return value == PropertyList("open") || value == PropertyList("complete");
}

struct SeedKey {
  std::string_view key;
  bool (*fits)(const PropertyList& value);
  std::string_view what;
};

constexpr std::array<SeedKey, 10> kSeedKeys = {{
    {"identifier", isIdentifier, "a bundle identifier that can name a directory"},
    {"kind", isKind, "\"initiating\", \"updating\", \"restoring\" or \"restoring-demoted\""},
    {"creator", isNumber, "a client identifier, a number from 0"},
    {"responsibleClient", isNumber, "a client identifier, a number from 0"},
    {"error", [](const PropertyList& value) { return value.isString(); }, "a text"},
    {"installOptions", isTruth, "true or false"},
    {"initialAssetPromises", isTruth, "true or false"},
    {"assetPromise", isPromiseState, "\"open\" or \"complete\""},
    {"placeholderPromise", isTruth, "true or false"},
    {"userDataPromise", isTruth, "true or false"},
}};

bool refuseSeed(ErrorOut error, const std::string& where, const std::string& what) {
  setError(error, Error(std::string(kOstrelErrorDomain), kBadSeed, where + " " + what));
  return false;
}

bool checkEntry(const PropertyList& entry, const std::string& where, ErrorOut error) {
  if (!entry.isDictionary()) return refuseSeed(error, where, "must be a dictionary");
  for (const auto& member : entry.members()) {
    bool isKnown = false;
    for (const SeedKey& known : kSeedKeys) isKnown = isKnown || known.key == member.key;
    if (!isKnown)
      return refuseSeed(error, where, "has a key that no coordinator has: \"" + std::string(member.key) + "\"");
  }
  for (const SeedKey& known : kSeedKeys) {
    const PropertyList* value = entry.find(known.key);
    const bool isNeeded = known.key == "identifier" || known.key == "kind";
    if (value == nullptr ? isNeeded : !known.fits(*value)) {
      return refuseSeed(error, where, "needs as \"" + std::string(known.key) + "\" " + std::string(known.what));
    }
  }
  return true;
}

std::uint64_t installTypeOf(OstrelCoordinatorKind kind) {
  if (kind == OstrelCoordinatorKind::RestoringDemoted) return kPellumInstallTypeDowngrade;
  return kind == OstrelCoordinatorKind::Restoring ? kPellumInstallTypeRestore : kPellumInstallTypeSync;
}

// A seed says what there is; the record that says the same.
PropertyList recordFromSeed(const PropertyList& entry, bool isPlaceholderInstalled) {
  InstallCoordinator coordinator;
  coordinator.isSeeded = true;
  coordinator.bundleID = *textIn(entry, "identifier");
  coordinator.kind = *kindNamed(*textIn(entry, "kind"));
  coordinator.creator = numberIn(entry, "creator").value_or(OstrelClientDovel);
  coordinator.responsibleClient = numberIn(entry, "responsibleClient").value_or(0);
  if (const auto words = textIn(entry, "error")) coordinator.error = ostrelError(kOstrelSeeded, *words);
  if (isTrueIn(entry, "installOptions")) {
    coordinator.installOptions.emplace().setPellumInstallType(kPellumInstallTypeSync);
    coordinator.installOptions->setInstallTargetType(1);
  }
  coordinator.hasInitialAssetPromises = isTrueIn(entry, "initialAssetPromises");
  if (const auto state = textIn(entry, "assetPromise")) {
    coordinator.package = std::make_shared<CoordinationPromise>();
    coordinator.package->name = coordinator.bundleID + "-Asset";
    coordinator.package->isComplete = *state == "complete";
  }
  if (isTrueIn(entry, "userDataPromise")) {
    coordinator.userData = std::make_shared<CoordinationPromise>();
    coordinator.userData->name = coordinator.bundleID + "-UserData";
    coordinator.userData->isComplete = true;
  }
  if (isTrueIn(entry, "placeholderPromise")) {
    coordinator.placeholder.emplace();
    coordinator.placeholder->name = coordinator.bundleID;
    coordinator.placeholder->installType = installTypeOf(coordinator.kind);
    coordinator.isPlaceholderInstalled = isPlaceholderInstalled && !coordinator.error;
  }
  return coordinatorRecord(coordinator);
}

}  // namespace

bool checkCoordinationSeed(const PropertyList& coordinators, ErrorOut error) {
  if (!coordinators.isArray()) return refuseSeed(error, "\"coordinators\"", "must be an array");
  std::size_t number = 0;
  for (const PropertyList& entry : coordinators.elements()) {
    const std::string where = "entry " + std::to_string(++number);
    const auto identifier = textIn(entry, "identifier");
    if (!checkEntry(entry, identifier ? where + " (" + *identifier + ")" : where, error)) return false;
  }
  return true;
}

bool EmbeddedCoordination::seed(const PropertyList& coordinators, ErrorOut error) {
  if (!checkCoordinationSeed(coordinators, error)) return false;
  for (const PropertyList& entry : coordinators.elements()) {
    const std::string bundleID = *textIn(entry, "identifier");
    const PropertyList record =
        recordFromSeed(entry, _registry.applicationProxyForIdentifier(bundleID, true).has_value());
    if (!_store.save(coordinatorRecordName(bundleID), record, error)) return false;
    MutexLock lock(_mutex);
    if (const auto replaced = current(bundleID); replaced && replaced->isLive()) replaced->life = Life::Finished;
    _coordinators[bundleID] = coordinatorFromRecord(bundleID, record);
  }
  return true;
}

bool seedCoordination(EmbeddedCoordination& coordination, const PropertyList& coordinators, ErrorOut error) {
  return coordination.seed(coordinators, error);
}

}  // namespace appsync
