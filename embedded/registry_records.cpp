#include "embedded/registry_records.h"

#include <algorithm>
#include <string_view>
#include <utility>

#include "embedded/record_fields.h"

namespace appsync {

namespace {

constexpr char kApplications[] = "applications";
constexpr char kPlaceholders[] = "placeholders";

std::uint64_t arrivalIn(const PropertyList& stored) {
  const std::uint64_t arrival = numberIn(stored, "arrival").value_or(0);
  return arrival < kSerialLimit ? arrival : 0;
}

// Whether this is the path of a container in that directory, and of nothing else: what a record names is removed with
// it.
bool isContainerIn(std::string_view directory, const std::string& path) {
  return path.size() > directory.size() + 1 && path.starts_with(directory) && path[directory.size()] == '/' &&
         isSinglePathComponent(path.substr(directory.size() + 1));
}

// The common part of both proxies.
PellumApplicationProxy proxyOf(const std::string& bundleID, const std::string& name, const std::string& type,
                               const std::optional<std::string>& version, const std::string& bundlePath,
                               const std::string& containerPath) {
  PellumApplicationProxy proxy;
  proxy.applicationIdentifier = bundleID;
  proxy.bundleIdentifier = bundleID;
  proxy.bundleVersion = version;
  if (!name.empty()) proxy.localizedName = name;
  proxy.applicationType = type;
  proxy.bundleURL = FileURL::fileURLWithPath(bundlePath, true);
  proxy.bundleContainerURL = FileURL::fileURLWithPath(containerPath, true);
  return proxy;
}

std::string recordName(const std::string& collection, const std::string& bundleID) {
  return collection + "/" + bundleID;
}

template <class Record>
std::map<std::string, Record> loadRecords(const StateStore& store, const std::string& collection, bool* unreadable,
                                          std::optional<Record> (*read)(const std::string&, const PropertyList&)) {
  std::map<std::string, Record> records;
  for (const std::string& bundleID : store.keys(collection)) {
    std::optional<Error> failure;
    const std::optional<PropertyList> stored = store.load(recordName(collection, bundleID), &failure);
    if (!stored && !failure) continue;  // it has gone since the keys were read
    if (std::optional<Record> record = stored ? read(bundleID, *stored) : std::nullopt) {
      records.emplace(bundleID, *std::move(record));
    } else if (unreadable != nullptr) {
      *unreadable = true;
    }
  }
  return records;
}

}  // namespace

std::optional<SeededInstall> seededInstallIn(const PropertyList& record) {
  SeededInstall seeded;
  seeded.installState = numberIn(record, "installState");
  seeded.installPhase = numberIn(record, "installPhase");
  seeded.prioritized = flagIn(record, "prioritized");
  seeded.progress = flagIn(record, "progress").value_or(true);
  const bool isSeeded = seeded.installState || seeded.installPhase || seeded.prioritized || !seeded.progress;
  return isSeeded ? std::optional(seeded) : std::nullopt;
}

void setSeededInstall(PropertyList& record, const std::optional<SeededInstall>& seeded) {
  if (!seeded) return;
  if (seeded->installState) record.set("installState", PropertyList::unsignedInteger(*seeded->installState));
  if (seeded->installPhase) record.set("installPhase", PropertyList::unsignedInteger(*seeded->installPhase));
  if (seeded->prioritized) record.set("prioritized", *seeded->prioritized);
  if (!seeded->progress) record.set("progress", false);
}

PropertyList ApplicationRecord::propertyList() const {
  PropertyList record = PropertyList::dictionary();
  setIfPresent(record, "version", application.bundleVersion);
  record.set("name", application.name);
  record.set("type", application.applicationType);
  record.set("size", PropertyList::unsignedInteger(application.size));
  record.set("container", application.containerPath);
  record.set("bundle", application.bundlePath);
  record.set("arrival", PropertyList::unsignedInteger(arrival));
  if (!replacedPlaceholder.empty()) record.set("replacedPlaceholder", replacedPlaceholder);
  setSeededInstall(record, application.seeded);
  return record;
}

std::optional<ApplicationRecord> applicationRecord(const std::string& bundleID, const PropertyList& stored) {
  ApplicationRecord record;
  record.application.bundleID = bundleID;
  record.application.name = textIn(stored, "name").value_or("");
  record.application.bundleVersion = textIn(stored, "version");
  record.application.applicationType = textIn(stored, "type").value_or("");
  record.application.containerPath = textIn(stored, "container").value_or("");
  record.application.bundlePath = textIn(stored, "bundle").value_or("");
  record.application.size = numberIn(stored, "size").value_or(0);
  record.application.seeded = seededInstallIn(stored);
  record.arrival = arrivalIn(stored);
  record.replacedPlaceholder = textIn(stored, "replacedPlaceholder").value_or("");
  if (!isContainerIn(kContainersDirectory, record.application.containerPath)) return std::nullopt;
  return record;
}

PellumApplicationProxy ApplicationRecord::proxy() const {
  PellumApplicationProxy proxy = proxyOf(application.bundleID, application.name, application.applicationType,
                                         application.bundleVersion, application.bundlePath, application.containerPath);
  proxy.appState.isInstalled = true;
  proxy.diskUsage.staticUsage = application.size;
  const std::optional<SeededInstall>& seeded = application.seeded;
  if (seeded && seeded->progress && (seeded->installState || seeded->installPhase)) {
    proxy.installProgressSync = seeded->shown();
  }
  return proxy;
}

PropertyList PlaceholderRecord::propertyList() const {
  PropertyList record = PropertyList::dictionary();
  record.set("name", name);
  record.set("installType", PropertyList::unsignedInteger(installType));
  record.set("type", applicationType);
  setIfPresent(record, "version", bundleVersion);
  record.set("launchProhibited", launchProhibited);
  record.set("container", containerPath);
  record.set("arrival", PropertyList::unsignedInteger(arrival));
  setSeededInstall(record, seeded);
  return record;
}

std::optional<PlaceholderRecord> placeholderRecord(const std::string& bundleID, const PropertyList& stored) {
  PlaceholderRecord record;
  record.bundleID = bundleID;
  record.name = textIn(stored, "name").value_or("");
  record.installType = numberIn(stored, "installType").value_or(0);
  record.applicationType = textIn(stored, "type").value_or("");
  record.bundleVersion = textIn(stored, "version");
  record.launchProhibited = isTrueIn(stored, "launchProhibited");
  record.containerPath = textIn(stored, "container").value_or("");
  record.arrival = arrivalIn(stored);
  record.seeded = seededInstallIn(stored);
  if (!isContainerIn(kPlaceholdersDirectory, record.containerPath)) return std::nullopt;
  return record;
}

PellumApplicationProxy PlaceholderRecord::proxy() const {
  PellumApplicationProxy proxy =
      proxyOf(bundleID, name, applicationType, bundleVersion, containerPath + "/" + bundleID + ".app", containerPath);
  proxy.appState.isPlaceholder = true;
  proxy.installType = installType;
  if (!seeded) proxy.installProgressSync = PellumInstallProgress{};
  if (seeded && seeded->progress) proxy.installProgressSync = seeded->shown();
  return proxy;
}

std::string applicationRecordName(const std::string& bundleID) {
  return recordName(kApplications, bundleID);
}

std::string placeholderRecordName(const std::string& bundleID) {
  return recordName(kPlaceholders, bundleID);
}

std::map<std::string, ApplicationRecord> loadApplicationRecords(const StateStore& store, bool* unreadable) {
  return loadRecords<ApplicationRecord>(store, kApplications, unreadable, applicationRecord);
}

std::map<std::string, PlaceholderRecord> loadPlaceholderRecords(const StateStore& store, bool* unreadable) {
  return loadRecords<PlaceholderRecord>(store, kPlaceholders, unreadable, placeholderRecord);
}

std::vector<std::string> identifiersByArrival(const std::map<std::string, ApplicationRecord>& applications,
                                              const std::map<std::string, PlaceholderRecord>& placeholders) {
  std::vector<std::pair<std::uint64_t, std::string>> arrivals;
  arrivals.reserve(applications.size() + placeholders.size());
  for (const auto& [bundleID, record] : applications) arrivals.emplace_back(record.arrival, bundleID);
  for (const auto& [bundleID, record] : placeholders) {
    if (!applications.contains(bundleID)) arrivals.emplace_back(record.arrival, bundleID);
  }
  std::sort(arrivals.begin(), arrivals.end());
  std::vector<std::string> identifiers;
  identifiers.reserve(arrivals.size());
  for (auto& [arrival, bundleID] : arrivals) identifiers.push_back(std::move(bundleID));
  return identifiers;
}

}  // namespace appsync
