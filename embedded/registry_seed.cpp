// What the registry shows in a device's status, and what a seed can put into it.
#include <algorithm>
#include <array>
#include <string_view>
#include <utility>

#include "embedded/device.h"
#include "embedded/file_manager.h"
#include "embedded/fresh_container.h"
#include "embedded/record_fields.h"
#include "embedded/registry.h"

namespace appsync {

namespace {

constexpr std::uint64_t kLargestFile = 1ULL << 40;

// --- checks ---------------------------------------------------------------------------------------------------------

enum class Wanted : std::uint8_t { Text, Number, Size, Flag, Dictionary, ApplicationType, FileSizes };

enum class Entry : std::uint8_t { Any, Application, Placeholder };

// What an entry can have beside its identifier: what a device's status shows of it, and what only a seed can say.
struct Field {
  std::string_view key;
  Wanted wanted;
  Entry entry = Entry::Any;
};

constexpr std::array kFields = {Field{"version", Wanted::Text},
                                Field{"name", Wanted::Text},
                                Field{"type", Wanted::ApplicationType},
                                Field{"size", Wanted::Size, Entry::Application},
                                Field{"container", Wanted::Text, Entry::Application},  // a new one is made
                                Field{"files", Wanted::FileSizes, Entry::Application},
                                Field{"storeMetadata", Wanted::Dictionary, Entry::Application},
                                Field{"installType", Wanted::Number, Entry::Placeholder},
                                Field{"launchProhibited", Wanted::Flag, Entry::Placeholder},
                                Field{"installState", Wanted::Number},
                                Field{"installPhase", Wanted::Number},
                                Field{"prioritized", Wanted::Flag},
                                Field{"progress", Wanted::Flag}};

// A place below the bundle at which a seed may put a file.
bool isInnerPath(std::string_view path) {
  while (true) {
    const std::size_t slash = path.find('/');
    if (!isSinglePathComponent(std::string(path.substr(0, slash)))) return false;
    if (slash == std::string_view::npos) return true;
    path.remove_prefix(slash + 1);
  }
}

bool areFileSizes(const PropertyList& files) {
  for (const PropertyList::Member& file : files.members()) {
    if (!isInnerPath(file.key) || file.key == "Info.plist") return false;
    if (file.value.unsignedInteger().value_or(UINT64_MAX) > kLargestFile) return false;
    // No file can stand where another one needs a directory.
    for (std::size_t slash = file.key.find('/'); slash != std::string_view::npos;
         slash = file.key.find('/', slash + 1)) {
      const std::string_view parent = file.key.substr(0, slash);
      if (parent == "Info.plist" || files.find(parent) != nullptr) return false;
    }
  }
  return files.isDictionary();
}

// What is wrong with the value; empty: nothing.
std::string_view complaint(const PropertyList& value, Wanted wanted) {
  switch (wanted) {
    case Wanted::Text:
      return value.isString() ? "" : "must be a string";
    case Wanted::Number:
      return value.unsignedInteger() ? "" : "must be a whole number that is not negative";
    case Wanted::Size:
      return value.unsignedInteger().value_or(UINT64_MAX) <= kLargestFile ? "" : "must be a size of at most 1 TiB";
    case Wanted::Flag:
      return value.boolean() ? "" : "must be true or false";
    case Wanted::Dictionary:
      return value.isDictionary() ? "" : "must be a dictionary";
    case Wanted::ApplicationType:
      return value.string() == "User" || value.string() == "System" ? "" : "must be \"User\" or \"System\"";
    case Wanted::FileSizes:
      return areFileSizes(value) ? ""
                                 : "must be a dictionary of sizes (at most 1 TiB) by the files' names in the bundle, "
                                   "without Info.plist";
  }
  return "";
}

bool canHave(Entry entry, const Field& field) {
  return field.entry == Entry::Any || field.entry == entry;
}

std::string unknownKey(Entry entry) {
  std::string known = "identifier";
  for (const Field& field : kFields) known += canHave(entry, field) ? ", " + std::string(field.key) : "";
  return "is nothing that an entry has; there are " + known;
}

// What is wrong with the value under a key; empty: nothing.
std::string complaint(const PropertyList::Member& member, Entry entry) {
  if (member.key == "identifier") return "";
  const auto* const field =
      std::ranges::find_if(kFields, [&](const Field& each) { return each.key == member.key && canHave(entry, each); });
  return field == kFields.end() ? unknownKey(entry) : std::string(complaint(member.value, field->wanted));
}

bool checkEntries(const std::string& list, const PropertyList& entries, Entry kind, ErrorOut error) {
  const auto refuse = [&](const std::string& text) {
    setError(error, Error(std::string(kDeviceErrorDomain), kDeviceBadSeed, text));
    return false;
  };
  if (!entries.isArray()) return refuse(list + " must be an array of dictionaries");
  std::size_t number = 0;
  for (const PropertyList& entry : entries.elements()) {
    const std::string where = "entry " + std::to_string(++number);
    const std::string identifier = textIn(entry, "identifier").value_or("");
    if (!isSinglePathComponent(identifier)) {
      return refuse(where + " must be a dictionary whose \"identifier\" is a bundle identifier");
    }
    for (const PropertyList::Member& member : entry.members()) {
      const std::string wrong = complaint(member, kind);
      if (wrong.empty()) continue;
      return refuse(where + " (" + identifier + "): \"" + std::string(member.key) + "\" " + wrong);
    }
  }
  return true;
}

// --- entries --------------------------------------------------------------------------------------------------------

bool addParents(FreshContainer& container, std::set<std::string>& made, std::string_view path, ErrorOut error) {
  for (std::size_t slash = path.find('/'); slash != std::string_view::npos; slash = path.find('/', slash + 1)) {
    const std::string parent(path.substr(0, slash));
    if (made.insert(parent).second && !container.directory(parent, error)) return false;
  }
  return true;
}

bool addFiles(FreshContainer& container, const PropertyList& entry, ErrorOut error) {
  const PropertyList* files = entry.find("files");
  if (files == nullptr) {
    // One file makes up for what the property lists do not weigh.
    const std::uint64_t wanted = numberIn(entry, "size").value_or(0);
    const std::uint64_t there = container.size();
    return wanted <= there || container.emptyFile("content", wanted - there, error);
  }
  std::set<std::string> made;
  for (const PropertyList::Member& file : files->members()) {
    if (!addParents(container, made, file.key, error) ||
        !container.emptyFile(std::string(file.key), *file.value.unsignedInteger(), error)) {
      return false;
    }
  }
  return true;
}

bool fillContainer(FreshContainer& container, const InstalledApplication& application, const PropertyList& entry,
                   ErrorOut error) {
  PropertyList info = PropertyList::dictionary({{"TefBundleIdentifier", application.bundleID}});
  setIfPresent(info, "TefBundleVersion", application.bundleVersion);
  if (!application.name.empty()) info.set("TefBundleDisplayName", application.name);
  const PropertyList* metadata = entry.find("storeMetadata");
  return container.bundle(application.bundleID + ".app", error) && container.propertyList("Info.plist", info, error) &&
         (metadata == nullptr || container.propertyListBeside("TarvoMetadata.plist", *metadata, error)) &&
         addFiles(container, entry, error) && container.keep(error);
}

}  // namespace

PropertyList registryInstalledStatus(const StateStore& store) {
  PropertyList entries = PropertyList::array();
  for (const auto& [bundleID, record] : loadApplicationRecords(store, nullptr)) {
    const InstalledApplication& application = record.application;
    PropertyList entry = PropertyList::dictionary({{"identifier", bundleID}});
    setIfPresent(entry, "version", application.bundleVersion);
    entry.set("name", application.name.empty() ? bundleID : application.name);
    entry.set("type", application.applicationType);
    entry.set("size", PropertyList::unsignedInteger(application.size));
    entry.set("container", application.containerPath.substr(1));
    setSeededInstall(entry, application.seeded);
    entries.append(std::move(entry));
  }
  return entries;
}

PropertyList registryPlaceholdersStatus(const StateStore& store) {
  PropertyList entries = PropertyList::array();
  for (const auto& [bundleID, record] : loadPlaceholderRecords(store, nullptr)) {
    PropertyList entry = PropertyList::dictionary({{"identifier", bundleID}, {"name", record.name}});
    entry.set("installType", PropertyList::unsignedInteger(record.installType));
    setIfPresent(entry, "version", record.bundleVersion);
    entry.set("launchProhibited", record.launchProhibited);
    entry.set("type", record.applicationType);
    setSeededInstall(entry, record.seeded);
    entries.append(std::move(entry));
  }
  return entries;
}

bool checkInstalledSeed(const PropertyList& entries, ErrorOut error) {
  return checkEntries("installed", entries, Entry::Application, error);
}

bool checkPlaceholdersSeed(const PropertyList& entries, ErrorOut error) {
  return checkEntries("placeholders", entries, Entry::Placeholder, error);
}

bool seedInstalled(EmbeddedRegistry& registry, EmbeddedFileManager& files, const PropertyList& entries,
                   ErrorOut error) {
  for (const PropertyList& entry : entries.elements()) {
    InstalledApplication application;
    application.bundleID = textIn(entry, "identifier").value_or("");
    application.name = textIn(entry, "name").value_or("");
    application.bundleVersion = textIn(entry, "version");
    application.applicationType = textIn(entry, "type").value_or("User");
    application.seeded = seededInstallIn(entry);
    FreshContainer container(files, kContainersDirectory, registry.newContainerName(),
                             "The application \"" + application.bundleID + "\"");
    if (!fillContainer(container, application, entry, error)) return false;
    application.containerPath = container.path();
    application.bundlePath = container.bundlePath();
    application.size = container.size();
    if (registry.seedApplication(application, error)) continue;
    files.removeItem(container.path(), nullptr);
    return false;
  }
  return true;
}

bool seedPlaceholders(EmbeddedRegistry& registry, const PropertyList& entries, ErrorOut error) {
  for (const PropertyList& entry : entries.elements()) {
    PlaceholderDescription description;
    description.bundleID = textIn(entry, "identifier").value_or("");
    description.name = textIn(entry, "name").value_or(description.bundleID);
    description.installType = numberIn(entry, "installType").value_or(0);
    description.applicationType = textIn(entry, "type").value_or("User");
    description.bundleVersion = textIn(entry, "version");
    description.launchProhibited = isTrueIn(entry, "launchProhibited");
    description.seeded = seededInstallIn(entry);
    if (!registry.installPlaceholder(description, error)) return false;
  }
  return true;
}

}  // namespace appsync
